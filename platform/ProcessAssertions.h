#pragma once
// The process-assertion service: which plug-ins are running right now.
//
// A running instance of a plug-in is a process whose executable lies inside
// one of the plug-in's bundle directories. The caller knows which bundles
// carry a bundle identifier (the registry does); this service only looks at
// the processes.

#include <sys/types.h>

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

#include "lmo/Value.h"

namespace vantrel::platform {

// Keys of an instance's property dictionary.
// The bundle identifier the instance was asked for (a string).
inline constexpr const char* kInstanceBundleIdentifierKey = "BundleIdentifier";
// The instance's process id (an integer).
inline constexpr const char* kInstancePidKey = "PID";
// The bundle directory its executable lies in (a string).
inline constexpr const char* kInstanceBundlePathKey = "BundlePath";

// Entries of /proc examined by one scan. This is the kernel's own ceiling on
// pids (PID_MAX_LIMIT), so the bound stops a runaway scan without ever
// missing a process.
inline constexpr size_t kMaxScannedProcesses = 4 * 1024 * 1024;

// The executables of the running processes, read once, so that a check of
// many plug-ins (a hold over an application) reads each process once rather
// than once per plug-in. Processes that cannot be inspected (gone mid-scan,
// kernel threads, zombies, not ours to inspect) are left out; no /proc gives
// an empty snapshot.
class ProcessSnapshot {
 public:
  struct Process {
    pid_t pid;
    std::string executable;  // as /proc/<pid>/exe names it
  };
  static ProcessSnapshot take();
  const std::vector<Process>& processes() const { return processes_; }  // in pid order

 private:
  std::vector<Process> processes_;
};

// The running instances of the plug-in with bundleIdentifier whose bundles
// are at bundlePaths, among the processes of snapshot (a fresh one when not
// given), one property dictionary per process, in pid order.
// A process counts when the path of its executable lies strictly inside one
// of the directories (after resolving symbolic links in bundlePaths),
// including an executable deleted or replaced since it was started. A
// process in another mount namespace counts only when that path names, here,
// the very file it runs. Processes that cannot be inspected (gone mid-scan,
// kernel threads, zombies, not ours to inspect) are skipped. Never fails: no
// instance, or no /proc, gives an empty list.
std::vector<lmo::Dictionary> runningInstances(std::string_view bundleIdentifier,
                                              const std::vector<std::string>& bundlePaths);
std::vector<lmo::Dictionary> runningInstances(std::string_view bundleIdentifier,
                                              const std::vector<std::string>& bundlePaths,
                                              const ProcessSnapshot& snapshot);

}  // namespace vantrel::platform
