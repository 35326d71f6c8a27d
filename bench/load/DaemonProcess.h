#pragma once
// vantreld as the benchmark runs it: the real binary, fork()ed and exec()ed
// on a generated tree, with every directory it reads or writes private to
// the run, its log lines in a file, and a clock that starts at the fork.

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Result.h"
#include "bench/load/Wire.h"

namespace vantrel::bench::load {

struct DaemonConfig {
  std::string vantreld;  // the binary
  std::string appsDir;   // VANTREL_APP_DIRS: the applications of the tree
  // What survives from one run to the next: the registry, the annotations,
  // the preferences. Empty for a cold start, a previous run's for a warm one.
  std::string stateDir;
  std::string runDir;  // the socket, the log, and the empty directories the rest points at
  uint32_t cacheLimit = 0;
};

class DaemonProcess {
 public:
  // Forks and execs the daemon on config; the clock starts just before the
  // fork. Errors: the fork fails, or a directory cannot be made.
  static base::Result<std::unique_ptr<DaemonProcess>> start(const DaemonConfig& config);
  // Stops the daemon when it still runs.
  ~DaemonProcess();
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  // Connects as soon as the socket takes connections and sends request (a
  // "match") until a reply carries expected forms: the first complete
  // answer. The seconds from the fork to that reply. Errors: the daemon
  // exits, an error reply, or no complete answer within timeout.
  base::Result<double> firstCompleteAnswer(const Bytes& request, uint64_t expected,
                                           std::chrono::milliseconds timeout);

  // VmRSS and VmHWM from /proc, in KiB; nullopt once the process is gone.
  struct Memory {
    uint64_t residentKiB = 0;
    uint64_t peakKiB = 0;
  };
  std::optional<Memory> memory() const;

  // SIGTERM, then the wait for its exit.
  void stop();

  const std::string& socket() const { return socket_; }
  // The daemon's command line as it was run.
  const std::vector<std::string>& arguments() const { return arguments_; }
  // The last lines of its log, for an error message.
  std::string logTail() const;

 private:
  DaemonProcess() = default;

  pid_t pid_ = -1;
  std::chrono::steady_clock::time_point started_;
  std::string socket_;
  std::string log_;
  std::vector<std::string> arguments_;
};

}  // namespace vantrel::bench::load
