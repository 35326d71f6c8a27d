#pragma once
// Bounds on everything the file system and the database hand the registry.
// Bundles are input: whoever can write an application directory decides how
// many entries, how long the paths and how large the property lists are, so
// every one of those has its limit here.

#include <chrono>
#include <cstddef>

namespace vantrel::omnidex {

// Longest bundle or directory path handled; longer ones are refused or
// skipped before they reach the file system.
inline constexpr size_t kMaxPathLength = 4096;
// Entries read from one directory (an application directory, a PlugIns
// directory, a plug-in directory); the rest are skipped with a log line.
inline constexpr size_t kMaxDirectoryEntries = 16384;
// Largest Info.plist read from a bundle. Its bytes are kept in the database.
inline constexpr size_t kMaxInfoPlistBytes = 1024 * 1024;
// Largest Entitlements.plist read from a plug-in bundle.
inline constexpr size_t kMaxEntitlementsBytes = 256 * 1024;
// Plug-ins the registry holds at most; further bundles are refused.
inline constexpr size_t kMaxRegisteredPlugIns = 100000;
// inotify watches one registry adds at most (the kernel has its own limit,
// max_user_watches, which is met with the same log line).
inline constexpr size_t kMaxWatches = 200000;
// inotify events read but not yet handled on the watcher's queue; past it
// the watcher rescans everything, as after the kernel's own queue overflows.
inline constexpr size_t kMaxUnhandledEventBytes = 4 * 1024 * 1024;

// Longest application bundle identifier or service identifier in the
// privacy-consent store; a longer one is refused.
inline constexpr size_t kMaxConsentIdentifierLength = 255;
// Services with an answer for one application, and answers in the whole
// store; a new one beyond either is refused (changing an answer is not).
inline constexpr size_t kMaxConsentEntriesPerApplication = 256;
inline constexpr size_t kMaxConsentEntries = 100000;

// The watcher waits for this much quiet after a change before it re-reads
// the bundles, so that a copy in progress is read once, when it is done...
inline constexpr std::chrono::milliseconds kWatchQuietPeriod{200};
// ...but never waits longer than this after the first change, so that a
// change is announced within a second even while a slow copy keeps going.
inline constexpr std::chrono::milliseconds kWatchMaxDelay{700};

}  // namespace vantrel::omnidex
