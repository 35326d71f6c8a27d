#include "platform/SandboxCheck.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/seccomp.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include "tests/support/PeerProcess.h"

namespace vantrel::platform {
namespace {

// A forked child that calls prctl(option, arg) (nothing for option 0), says
// whether that worked, then blocks until killed. Raw system calls only: it is
// a fork of a threaded process, and strict seccomp allows little but read and
// write.
struct ConfinedChild {
  ConfinedChild(int option, unsigned long arg) {
    int ready[2], hold[2];
    if (::pipe2(ready, O_CLOEXEC) != 0 || ::pipe2(hold, O_CLOEXEC) != 0) return;
    if ((pid = ::fork()) == 0) {
      char ok = option == 0 || ::syscall(SYS_prctl, option, arg, 0, 0, 0) == 0 ? 'y' : 'n';
      ::syscall(SYS_write, ready[1], &ok, 1);
      ::syscall(SYS_read, hold[0], &ok, 1);
      ::syscall(SYS_exit, 0);
    }
    char ok = 0;
    started = pid > 0 && ::read(ready[0], &ok, 1) == 1 && ok == 'y';
    pidfd = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
    for (int fd : {ready[0], ready[1], hold[0], hold[1]}) ::close(fd);
  }
  ~ConfinedChild() {
    if (pid > 0) {
      ::kill(pid, SIGKILL);
      ::waitpid(pid, nullptr, 0);
    }
    if (pidfd >= 0) ::close(pidfd);
  }
  pid_t pid = -1;
  int pidfd = -1;
  bool started = false;
};

TEST(SandboxCheck, EitherConfinementMarkCountsAndAnUnprovableProcessCountsToo) {
  // A test run inside a confiner passes its confinement on to every child.
  if (::prctl(PR_GET_NO_NEW_PRIVS, 0, 0, 0, 0) != 0 || ::prctl(PR_GET_SECCOMP, 0, 0, 0, 0) != 0) {
    GTEST_SKIP() << "the test process is confined itself";
  }
  const struct {
    const char* name;
    int option;
    unsigned long arg;
    bool sandboxed;
  } cases[] = {{"ordinary", 0, 0, false},
               {"no-new-privs", PR_SET_NO_NEW_PRIVS, 1, true},
               {"strict seccomp alone", PR_SET_SECCOMP, SECCOMP_MODE_STRICT, true}};
  for (const auto& c : cases) {
    ConfinedChild child(c.option, c.arg);
    ASSERT_TRUE(child.started && child.pidfd >= 0) << c.name;
    EXPECT_EQ(processIsSandboxed(child.pid, child.pidfd), c.sandboxed) << c.name;
  }

  auto peer = testing::PeerProcess::start(testing::testPeerPath(), {"sleep"});
  auto other = testing::PeerProcess::start(testing::testPeerPath(), {"sleep"});
  ASSERT_TRUE(peer && other && peer->readLine() == "ready" && other->readLine() == "ready");
  EXPECT_FALSE(processIsSandboxed(peer->pid(), peer->pidfd()));
  // Unconfined processes whose pidfd does not vouch for the pid.
  EXPECT_TRUE(processIsSandboxed(peer->pid(), other->pidfd()));
  EXPECT_TRUE(processIsSandboxed(peer->pid(), -1));
  EXPECT_TRUE(processIsSandboxed(0, peer->pidfd()));
  // Exited: a zombie (its status still readable), then reaped.
  peer->kill();
  siginfo_t info{};
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(peer->pid()), &info, WEXITED | WNOWAIT), 0);
  EXPECT_TRUE(processIsSandboxed(peer->pid(), peer->pidfd()));
  peer->wait();
  EXPECT_TRUE(processIsSandboxed(peer->pid(), peer->pidfd()));
}

}  // namespace
}  // namespace vantrel::platform
