#pragma once
// The launch description: what a host process needs to start a plug-in that
// the daemon enabled for it, published by the service manager as
//   <directory>/services/<host pid>/<bundle identifier>.plist
// and read by the client library's launcher. The format (keys, limits,
// codec, paths) lives here alone, with nothing else of the service manager,
// so that a host links only what it reads. docs/launch-descriptions.md
// describes the file.

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Error.h"
#include "base/Result.h"
#include "lmo/Value.h"

namespace vantrel::platform {

inline constexpr int64_t kLaunchDescriptionFormatVersion = 1;
// Largest launch description file written or read.
inline constexpr size_t kMaxLaunchDescriptionBytes = 1024 * 1024;
// Environment variables one launch description may carry.
inline constexpr size_t kMaxLaunchEnvironmentVariables = 1024;
// Longest bundle identifier a launch description is published under: the
// file name "<identifier>.plist" must fit in NAME_MAX (255) bytes.
inline constexpr size_t kMaxPublishedBundleIdentifierLength = 249;
// Entries of one host's directory removed when it is cleared. The host owns
// the directory and may fill it; beyond this the directory stays, with a
// log line.
inline constexpr size_t kMaxLaunchDirectoryEntries = 1024;

// Keys of a launch description file.
inline constexpr const char* kLaunchFormatVersionKey = "formatVersion";
inline constexpr const char* kLaunchBundleIdentifierKey = "bundleIdentifier";
inline constexpr const char* kLaunchVersionKey = "version";
inline constexpr const char* kLaunchExecutableKey = "executable";
inline constexpr const char* kLaunchHostPidKey = "hostPid";
inline constexpr const char* kLaunchWorkingDirectoryKey = "workingDirectory";
inline constexpr const char* kLaunchServiceKey = "LMOService";
inline constexpr const char* kLaunchEnvironmentKey = "EnvironmentVariables";
inline constexpr const char* kLaunchSandboxProfileKey = "_SandboxProfile";
// The profile assumed when a description names none: the confining one.
inline constexpr const char* kDefaultSandboxProfile = "plugin";

struct ExternalServiceRegistration {
  std::string bundleIdentifier;
  std::string version;  // may be empty: a bundle need not declare one
  pid_t hostPid = 0;
  std::string executablePath;
  lmo::Dictionary description;  // the launch description the plug-in runs with
  // The plug-in's data container: its working directory and, under the
  // "plugin" profile, the only place it may write. Never taken from the
  // environment, which a bundle can set itself. nullopt: none.
  std::optional<std::string> dataContainer;
  bool operator==(const ExternalServiceRegistration&) const = default;
};

// A launch description as the launcher uses it.
struct LaunchDescription {
  std::string bundleIdentifier;
  std::string version;
  pid_t hostPid = 0;
  std::string executablePath;
  // "NAME=value" entries, sorted by name. Variables whose value is not a
  // string, or whose name is empty or holds '=', cannot be part of an
  // environment and are left out.
  std::vector<std::string> environment;
  std::string sandboxProfile;
  // The registration's data container; nullopt when it had none.
  std::optional<std::string> workingDirectory;
};

// Why path cannot be a service's executable: missing (the stat's errno), or
// not a regular file with an execute bit (EACCES); domain "POSIX". nullopt
// when it can be.
std::optional<base::Error> executableProblem(const std::string& path);

// <directory>/services: where every host's directory lies.
std::string servicesDirectoryPath(const std::string& directory);
// <directory>/services/<pid>
std::string launchDirectoryPath(const std::string& directory, pid_t pid);
// <directory>/services/<pid>/<bundleIdentifier>.plist
std::string launchDescriptionPath(const std::string& directory, pid_t pid,
                                  std::string_view bundleIdentifier);

// The launch description file's value for a registration. Errors (domain
// "POSIX"): EINVAL when the description's "LMOService" is not a dictionary,
// or its "EnvironmentVariables" is not a dictionary or its
// "_SandboxProfile" not a string; E2BIG beyond kMaxLaunchEnvironmentVariables.
base::Result<lmo::Value> encodeLaunchDescription(const ExternalServiceRegistration& registration);

// Reads a launch description file's value back. Errors: domain
// "PropertyList", code kPropertyListMalformed, with what is wrong in the
// description.
base::Result<LaunchDescription> decodeLaunchDescription(const lmo::Value& file);

}  // namespace vantrel::platform
