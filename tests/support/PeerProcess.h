#pragma once
// Real peer processes for tests: the vantrel-test-peer program, and a child
// process with pipes on its standard input and output.

#include <sys/types.h>

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace vantrel::testing {

// The built vantrel-test-peer: $VANTREL_TEST_PEER when set, else the path
// the build placed it at.
std::string testPeerPath();

// Copies the test peer to path (creating parent directories) with mode 0755.
// False when that fails.
bool installTestPeer(const std::string& path);

// A running child. Its standard input is a pipe that stays open until
// closeStdin() (so a peer in "sleep" mode runs until then); its standard
// output is a pipe read by readLine(). Destruction kills and reaps it.
class PeerProcess {
 public:
  // Starts executable with args after argv[0]; null when it cannot be
  // started (the reason is written to standard error).
  static std::unique_ptr<PeerProcess> start(const std::string& executable,
                                            const std::vector<std::string>& args);
  // As above, with environment entries ("NAME=value") on top of this
  // process's own environment: an entry replaces any variable of that name,
  // and a later entry an earlier one.
  static std::unique_ptr<PeerProcess> start(const std::string& executable,
                                            const std::vector<std::string>& args,
                                            const std::vector<std::string>& environment);
  ~PeerProcess();
  PeerProcess(const PeerProcess&) = delete;
  PeerProcess& operator=(const PeerProcess&) = delete;

  pid_t pid() const { return pid_; }
  // A pidfd for the child, opened right after it started; stays open (and
  // stands for the exited process) after wait().
  int pidfd() const { return pidfd_; }

  // One line of the child's output without its "\n"; nullopt at end of
  // output or when none arrives within timeout.
  std::optional<std::string> readLine(std::chrono::milliseconds timeout = std::chrono::seconds(10));
  void closeStdin();
  // Waits for the child to exit and reaps it; the wait status, or -1 when it
  // was reaped already.
  int wait();
  void kill();

 private:
  PeerProcess(pid_t pid, int pidfd, int stdinFd, int stdoutFd);

  pid_t pid_;
  int pidfd_;
  int stdin_;
  int stdout_;
  bool reaped_ = false;
};

}  // namespace vantrel::testing
