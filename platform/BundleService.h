#pragma once
// The bundle service: read-only objects for bundles on disk.
//
// Bundles are flat here: a bundle is a directory with "Info.plist" (XML or
// binary) at its top. The Info dictionary's "KBBundleExecutable" names the
// executable as a path relative to the bundle directory, and the bundle's
// support directory is the bundle directory itself, so its plug-ins live in
// <bundle>/PlugIns.
//
// A BundleObject reads everything it answers when it is created and never
// changes afterwards, so it is safe to read from any thread. A bundle edited
// on disk later is seen by a new object, not by an old one.

#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "lmo/Value.h"

namespace vantrel::platform {

// Paths longer than this are refused (null object) before touching disk.
inline constexpr size_t kMaxBundlePathLength = 4096;
// How many enclosing directories a kind-2 creation inspects, at most, on its
// way up from an executable (it also stops at "/").
inline constexpr int kMaxBundleSearchDepth = 64;

// Bundle property numbers for BundleObject::stringProperty.
inline constexpr int kBundlePathProperty = 2;
inline constexpr int kBundleExecutableProperty = 3;
inline constexpr int kBundleSupportDirectoryProperty = 9;

class BundleObject {  // immutable after creation, safe to read from any thread
 public:
  enum class Kind { kBundleDirectory = 1, kExecutable = 2 };

  // Kind 1: path must be an existing directory (else null). Kind 2: path must
  // be a regular file; walks up from it to the nearest enclosing directory
  // whose Info.plist names that executable as its KBBundleExecutable
  // (canonical paths compared); null when none does within
  // kMaxBundleSearchDepth levels. Paths are made absolute and lexically
  // normal (no trailing slash); symbolic links are not resolved for kind 1.
  // An empty path, one with a NUL or one over kMaxBundlePathLength gives null.
  static std::shared_ptr<BundleObject> create(const std::string& path, Kind kind);

  // The running program's bundle: kind 2 from /proc/self/exe, else kind 1 on
  // the executable's directory. Null only when neither works.
  static std::shared_ptr<BundleObject> mainBundle();

  // 2 = the bundle's path, 3 = the executable's path (nullopt when Info.plist
  // names none, names one outside the bundle, or the file is not a regular
  // file); any other number: nullopt.
  std::optional<std::string> stringProperty(int number) const;

  // Property 9, the support directory: a new string the caller owns (the
  // bundle directory itself).
  std::optional<std::string> copySupportDirectory() const;

  // The Info dictionary as read when the object was created; nullopt when
  // Info.plist is missing, not a regular file, unreadable, malformed, or not
  // a dictionary.
  std::optional<lmo::Dictionary> infoDictionary() const;

  // The Info dictionary's string value for key; nullopt when absent or not a
  // string (or when there is no Info dictionary).
  std::optional<std::string> infoString(std::string_view key) const;

  // "<BundleObject /path/to/bundle>", for log lines.
  std::string description() const;

 private:
  BundleObject(std::string path, std::optional<lmo::Dictionary> info);

  // Constant after construction.
  std::string path_;
  std::optional<lmo::Dictionary> info_;
  std::optional<std::string> executablePath_;
};

std::string describe(const BundleObject& b);

}  // namespace vantrel::platform
