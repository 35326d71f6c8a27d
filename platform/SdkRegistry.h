#pragma once
// Registered extension SDK dictionaries: metadata that an extension point
// registers for every plug-in of that point to inherit. An SDK named N is the
// property-list file N.plist in one of the SDK directories
// (platform::sdkDirectories(), searched in order).

#include <optional>
#include <string>

#include "lmo/Value.h"

namespace vantrel::platform {

// Longest SDK name looked up: with ".plist" appended it fills a file name of
// NAME_MAX (255) bytes. Longer names are refused without touching disk.
inline constexpr size_t kMaxSdkNameLength = 249;

// The SDK dictionary registered for an extension point: the first
// <dir>/<name>.plist over platform::sdkDirectories() that reads as a
// dictionary. A file that is missing, unreadable, malformed or not a
// dictionary is passed over in favour of the next directory. nullopt when
// none; a name that is empty, ".", "..", longer than kMaxSdkNameLength, or
// contains '/' or a NUL is never looked up. Does not log: the caller decides
// what "not registered" means.
std::optional<lmo::Dictionary> lookupExtensionSdk(const std::string& name);

}  // namespace vantrel::platform
