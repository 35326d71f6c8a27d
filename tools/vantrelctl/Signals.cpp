#include "tools/vantrelctl/Signals.h"

#include <signal.h>
#include <sys/signalfd.h>
#include <unistd.h>

namespace vantrel::ctl {
namespace {

sigset_t interruptSet() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  return set;
}

}  // namespace

InterruptSignals::InterruptSignals() {
  const sigset_t set = interruptSet();
  ::pthread_sigmask(SIG_BLOCK, &set, nullptr);
  fd_ = ::signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK);
}

InterruptSignals::~InterruptSignals() {
  if (fd_ >= 0) ::close(fd_);
}

bool InterruptSignals::take() {
  signalfd_siginfo info;
  return fd_ >= 0 && ::read(fd_, &info, sizeof info) == static_cast<ssize_t>(sizeof info);
}

}  // namespace vantrel::ctl
