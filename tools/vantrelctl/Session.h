#pragma once
// vantrelctl's one connection to the daemon: made on first use, every
// request bounded by the --timeout, and every failure mapped to an exit
// status (ExitStatus.h) with the text to show for it.

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "client/VTDaemonClient.h"
#include "lmo/Value.h"

namespace vantrel::ctl {

// What one request came to.
struct Answer {
  int status = 0;         // kExitOk, kExitRefused or kExitUnreachable
  lmo::Dictionary reply;  // the daemon's reply, error replies included
  int64_t code = 0;       // the daemon's error code when it refused
  std::string message;    // for a failure: the complaint, without "vantrelctl: "
  bool ok() const { return status == 0; }
};

class Session {
 public:
  Session(std::string service, std::chrono::milliseconds timeout);

  const std::string& service() const { return service_; }
  const std::string& socketPath() const { return socketPath_; }
  std::chrono::milliseconds timeout() const { return timeout_; }

  // A message with the envelope ("request", "version") filled in.
  static lmo::Dictionary request(const char* type);

  // Sends message and waits at most timeout() for the reply.
  Answer call(const lmo::Dictionary& message);

  // The daemon's pid as the kernel reported it for our connection; nullopt
  // before a connection was made or when it could not be.
  std::optional<pid_t> daemonPid() const;

  // Prints the answer's complaint on stderr (the unreachable one with how to
  // start the daemon) and returns its exit status.
  int complain(const Answer& answer) const;

 private:
  // Whether the connection is up; on false, failure_ says why.
  bool connect();

  const std::string service_;
  const std::string socketPath_;
  const std::chrono::milliseconds timeout_;
  client::VTDaemonClientPtr client_;
  std::optional<Answer> failure_;  // set once the daemon turned out unreachable
};

}  // namespace vantrel::ctl
