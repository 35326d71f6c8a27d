#pragma once
// SIGINT and SIGTERM as readable events, for the commands that run until
// interrupted (hold, monitor).

namespace vantrel::ctl {

class InterruptSignals {
 public:
  // Blocks SIGINT and SIGTERM in this thread, and so in every thread started
  // after it (the client library's): call before the first request.
  InterruptSignals();
  ~InterruptSignals();
  InterruptSignals(const InterruptSignals&) = delete;
  InterruptSignals& operator=(const InterruptSignals&) = delete;

  // Readable when one of the signals is pending; -1 when it could not be
  // made.
  int fd() const { return fd_; }
  // Consumes a pending signal; whether there was one.
  bool take();

 private:
  int fd_ = -1;
};

}  // namespace vantrel::ctl
