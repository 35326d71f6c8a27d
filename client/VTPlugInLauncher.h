#pragma once
// Starting a plug-in that the daemon has enabled for this process.
//
// Enabling a plug-in for a host publishes a launch description that only the
// host can read: <runtime dir>/services/<host pid>/<bundle identifier>.plist
// (docs/launch-descriptions.md). The launcher reads the one for its own pid,
// so another process's description is out of reach, and starts the
// plug-in's executable as it says: with exactly the described environment
// (nothing of the host's), in the described working directory ("/" when
// there is none), with no_new_privs set. The sandbox profile "plugin" also
// confines file writes to beneath the working directory (the plug-in's data
// container) with Landlock; reads stay free. On a kernel without Landlock
// the plug-in starts unconfined, with one log line.
//
// The description is honoured only under the trust rule of
// platform/TrustedFile.h: owned by root or by this process's effective user,
// and not writable by group or others.

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "base/Result.h"

namespace vantrel::client {

inline constexpr const char* kPlugInLauncherErrorDomain = "VTPlugInLauncher";

enum PlugInLauncherErrorCode : int64_t {
  kLaunchNotEnabled = 1,            // no launch description for this process
  kLaunchUntrustedDescription = 2,  // unreadable, or someone else could have written it
  kLaunchMalformedDescription = 3,  // not a launch description of this plug-in for this process
};

// Arguments one launch passes at most, after argv[0].
inline constexpr size_t kMaxLaunchArguments = 1024;

struct LaunchOptions {
  // The arguments after argv[0], which is the executable's path.
  std::vector<std::string> arguments;
  // Descriptors that become the plug-in's standard input, output and error;
  // -1 passes on this process's own. No other descriptor is inherited.
  int standardInput = -1;
  int standardOutput = -1;
  int standardError = -1;
};

class VTPlugInLauncher {
 public:
  // Starts the plug-in bundleIdentifier and returns its pid once its
  // executable runs. The caller reaps it (waitpid). Errors:
  //   domain "VTPlugInLauncher": kLaunchNotEnabled ("no launch description
  //   for <id> (not enabled for this process)"), kLaunchUntrustedDescription,
  //   kLaunchMalformedDescription, each with the reason in the description;
  //   domain "POSIX", with the errno: EINVAL for an identifier that cannot be
  //   a file name or more than kMaxLaunchArguments arguments, EBADF for a
  //   standard stream that is not open, and any failed step of preparing or
  //   starting the process (Landlock, fork, the working directory,
  //   no_new_privs, exec), named in the description. A process that failed
  //   before its exec has been reaped already.
  static base::Result<pid_t> launch(std::string_view bundleIdentifier, LaunchOptions options = {});
};

}  // namespace vantrel::client
