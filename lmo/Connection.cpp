#include "lmo/Connection.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "base/Check.h"
#include "base/Log.h"
#include "lmo/LmoError.h"
#include "lmo/ServicePath.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace vantrel::lmo {
namespace {

// One read() call's worth, and how much one wake-up may read from one peer
// before the loop moves on to the others.
constexpr size_t kReadChunk = 64 * 1024;
constexpr size_t kMaxReadPerWakeup = 4 * kReadChunk;

std::atomic<size_t> gOpenConnections{0};

int peerPidfd(int fd, pid_t pid) {
  int pidfd = -1;
  socklen_t len = sizeof pidfd;
  if (::getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &len) == 0 && pidfd >= 0) return pidfd;
  if (pid <= 0) return -1;
  long r = ::syscall(SYS_pidfd_open, pid, 0);
  return r >= 0 ? static_cast<int>(r) : -1;
}

}  // namespace

void releaseQueue(QueuePtr queue) {
  // A connection is often the last owner of its target queue, and often dies
  // on that queue's worker thread (inside a block, or as a finished block's
  // captures are destroyed), where the queue cannot be destroyed. Which thread
  // will drop the last reference cannot be known, so every reference dropped
  // off the I/O thread is dropped on it; that thread is no queue's worker.
  if (queue != nullptr && !IoLoop::shared().isCurrent()) {
    IoLoop::shared().post([queue = std::move(queue)] {});
  }
}

Connection::Connection(int fd, QueuePtr targetQueue)
    : fd_(fd), targetQueue_(std::move(targetQueue)) {
  VT_CHECK(targetQueue_ != nullptr, "connection without a target queue");
  if (fd_ < 0) return;
  gOpenConnections.fetch_add(1, std::memory_order_relaxed);
  ucred cred{};
  socklen_t len = sizeof cred;
  if (::getsockopt(fd_, SOL_SOCKET, SO_PEERCRED, &cred, &len) == 0) {
    pid_ = cred.pid;
    uid_ = cred.uid;
    gid_ = cred.gid;
  }
  pidfd_ = peerPidfd(fd_, pid_);
}

std::shared_ptr<Connection> Connection::connectToService(std::string_view name,
                                                         QueuePtr targetQueue) {
  std::string path = socketPathForService(name);
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  bool ok = fd >= 0 && path.size() < sizeof addr.sun_path;
  if (ok) {
    std::memcpy(addr.sun_path, path.data(), path.size());
    int r;
    do {
      r = ::connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr);
    } while (r < 0 && errno == EINTR);
    ok = r == 0 && ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK) == 0;
  }
  if (!ok && fd >= 0) {
    ::close(fd);
    fd = -1;
  }
  return std::shared_ptr<Connection>(new Connection(fd, std::move(targetQueue)));
}

std::shared_ptr<Connection> Connection::fromAcceptedSocket(int fd, QueuePtr targetQueue) {
  VT_CHECK(fd >= 0, "accepted socket without a descriptor");
  return std::shared_ptr<Connection>(new Connection(fd, std::move(targetQueue)));
}

Connection::~Connection() {
  // Reached with the socket open only when the connection was never resumed
  // (a resumed one is held by the loop until invalidate() closes it).
  if (!closed_ && fd_ >= 0) {
    ::close(fd_);
    gOpenConnections.fetch_sub(1, std::memory_order_relaxed);
  }
  if (pidfd_ >= 0) ::close(pidfd_);
  if (finalizer_) finalizer_();
  releaseQueue(std::move(targetQueue_));
}

size_t Connection::openCount() {
  return gOpenConnections.load(std::memory_order_relaxed);
}

void Connection::setEventHandler(EventHandler handler) {
  std::lock_guard lock(mutex_);
  handler_ = std::move(handler);
}

void Connection::setTargetQueue(QueuePtr queue) {
  std::lock_guard lock(mutex_);
  VT_CHECK(!resumed_ && queue != nullptr, "setTargetQueue after resume");
  targetQueue_ = std::move(queue);
}

void Connection::setContext(std::shared_ptr<void> context) {
  std::lock_guard lock(mutex_);
  context_ = std::move(context);
}

std::shared_ptr<void> Connection::context() const {
  std::lock_guard lock(mutex_);
  return context_;
}

void Connection::setFinalizer(Finalizer finalizer) {
  std::lock_guard lock(mutex_);
  finalizer_ = std::move(finalizer);
}

void Connection::setOutputLimitForTest(size_t bytes) {
  std::lock_guard lock(mutex_);
  outputLimit_ = bytes;
}

uint32_t Connection::watchedEventsLocked() const {
  return EPOLLIN | EPOLLRDHUP | (output_.empty() ? 0u : static_cast<uint32_t>(EPOLLOUT));
}

void Connection::resume() {
  std::lock_guard lock(mutex_);
  VT_CHECK(handler_ != nullptr, "connection resumed without an event handler");
  if (resumed_) return;
  resumed_ = true;
  if (closed_ || doomed_) return;
  if (fd_ < 0) {
    doomed_ = true;
    auto self = shared_from_this();
    IoLoop::shared().post([self] { self->invalidate(std::nullopt); });
    return;
  }
  watchingOutput_ = !output_.empty();
  token_ = IoLoop::shared().add(fd_, watchedEventsLocked(), shared_from_this());
}

void Connection::cancel() {
  invalidateLater(std::nullopt);
}

void Connection::invalidateLater(std::optional<base::Error> reason) {
  {
    std::lock_guard lock(mutex_);
    if (closed_) return;
    doomed_ = true;
  }
  auto self = shared_from_this();
  IoLoop::shared().post([self, reason] { self->invalidate(reason); });
}

base::Result<void> Connection::send(const Dictionary& message) {
  return sendFrame(FrameKind::kMessage, 0, message, std::nullopt);
}

base::Result<void> Connection::sendWithReply(const Dictionary& message, QueuePtr replyQueue,
                                             EventHandler handler) {
  VT_CHECK(replyQueue != nullptr && handler != nullptr, "sendWithReply without a handler");
  return sendFrame(FrameKind::kRequest, 0, message,
                   PendingReply{std::move(replyQueue), std::move(handler)});
}

base::Result<void> Connection::sendReply(const Reply& reply) {
  VT_CHECK(reply.inReplyTo != 0, "reply not made by createReply");
  return sendFrame(FrameKind::kReply, reply.inReplyTo, reply.body, std::nullopt);
}

base::Result<void> Connection::sendFrame(FrameKind kind, uint64_t inReplyTo, const Dictionary& body,
                                         std::optional<PendingReply> pending) {
  Frame frame{kind, nextId_.fetch_add(1, std::memory_order_relaxed), inReplyTo, body};
  std::vector<uint8_t> bytes = VT_TRY(encodeFrame(frame));
  std::unique_lock lock(mutex_);
  if (doomed_ || closed_) {
    if (pending) {
      PendingReply p = std::move(*pending);
      lock.unlock();
      p.queue->async([handler = std::move(p.handler)] { handler(ErrorEvent::kConnectionInvalid); });
      releaseQueue(std::move(p.queue));
    }
    return base::Result<void>::success();
  }
  if (pending) pending_.emplace(frame.id, std::move(*pending));
  outputBytes_ += bytes.size();
  output_.push_back(std::move(bytes));
  if (output_.size() == 1) writeLocked();
  if (doomed_) return base::Result<void>::success();
  if (outputBytes_ > outputLimit_) {
    size_t unsent = outputBytes_;
    doomed_ = true;
    lock.unlock();
    auto self = shared_from_this();
    IoLoop::shared().post([self, unsent] {
      base::vtlog("closing connection to pid %d: peer is not reading (%u bytes unsent)",
                  self->pid(), unsent);
      self->invalidate(std::nullopt);
    });
    return base::Result<void>::success();
  }
  if (token_ != 0 && !output_.empty() && !watchingOutput_) {
    watchingOutput_ = true;
    IoLoop::shared().modify(fd_, token_, watchedEventsLocked());
  }
  return base::Result<void>::success();
}

// Writes queued output until the socket would block. A write error means the
// peer is gone: the connection is invalidated (quietly; that is not bad input).
void Connection::writeLocked() {
  while (!output_.empty() && fd_ >= 0) {
    const std::vector<uint8_t>& front = output_.front();
    ssize_t n = ::send(fd_, front.data() + outputOffset_, front.size() - outputOffset_,
                       MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) return;
      doomed_ = true;
      auto self = shared_from_this();
      IoLoop::shared().post([self] { self->invalidate(std::nullopt); });
      return;
    }
    outputBytes_ -= static_cast<size_t>(n);
    outputOffset_ += static_cast<size_t>(n);
    if (outputOffset_ == front.size()) {
      output_.pop_front();
      outputOffset_ = 0;
    }
  }
}

void Connection::handleIo(uint32_t events) {
  if (events & EPOLLOUT) {
    std::lock_guard lock(mutex_);
    if (!closed_ && !doomed_) {
      writeLocked();
      if (output_.empty() && watchingOutput_ && token_ != 0) {
        watchingOutput_ = false;
        IoLoop::shared().modify(fd_, token_, watchedEventsLocked());
      }
    }
  }
  if (events & (EPOLLIN | EPOLLRDHUP | EPOLLHUP | EPOLLERR)) readAvailable();
}

void Connection::readAvailable() {
  uint8_t buffer[kReadChunk];
  size_t total = 0;
  while (total < kMaxReadPerWakeup) {
    {
      std::lock_guard lock(mutex_);
      if (closed_) return;
    }
    ssize_t n = ::recv(fd_, buffer, sizeof buffer, MSG_DONTWAIT);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) return;
      invalidate(std::nullopt);
      return;
    }
    if (n == 0) {
      if (reader_.hasPartialFrame()) {
        invalidate(lmoError(kLmoMalformed, "truncated frame: the peer closed the connection"));
      } else {
        invalidate(std::nullopt);
      }
      return;
    }
    total += static_cast<size_t>(n);
    reader_.feed(buffer, static_cast<size_t>(n));
    while (auto frame = reader_.next()) {
      if (!frame->has_value()) {
        invalidate(frame->error());
        return;
      }
      if (!handleFrame(std::move(*frame).value())) return;
    }
    // The socket is drained: epoll is level-triggered, so anything that
    // arrives now wakes us again, and a second recv would only say EAGAIN.
    if (static_cast<size_t>(n) < sizeof buffer) return;
  }
}

// Returns false when the frame closed the connection.
bool Connection::handleFrame(Frame&& frame) {
  if (frame.kind != FrameKind::kReply) {
    deliver(IncomingMessage(std::move(frame.body), frame.id, frame.kind == FrameKind::kRequest));
    return true;
  }
  std::unique_lock lock(mutex_);
  auto it = pending_.find(frame.inReplyTo);
  if (it == pending_.end()) {
    lock.unlock();
    invalidate(lmoErrorf(kLmoMalformed, "reply to unknown message %u", frame.inReplyTo));
    return false;
  }
  PendingReply pending = std::move(it->second);
  pending_.erase(it);
  lock.unlock();
  IncomingMessage reply(std::move(frame.body), frame.id, false);
  pending.queue->async(
      [handler = std::move(pending.handler), reply = std::move(reply)] { handler(Event(reply)); });
  return true;
}

void Connection::deliver(Event event) {
  EventHandler handler;
  QueuePtr queue;
  {
    std::lock_guard lock(mutex_);
    if (closed_) return;
    handler = handler_;
    queue = targetQueue_;
  }
  if (!handler) return;
  queue->async([handler = std::move(handler), event = std::move(event)] { handler(event); });
}

void Connection::terminationImminent() {
  deliver(ErrorEvent::kTerminationImminent);
}

void Connection::invalidate(std::optional<base::Error> reason) {
  VT_CHECK(IoLoop::shared().isCurrent(), "connection invalidated off the I/O thread");
  auto self = shared_from_this();  // the loop's reference goes in remove()
  std::unordered_map<uint64_t, PendingReply> pending;
  EventHandler handler;
  Finalizer finalizer;
  std::shared_ptr<void> context;
  QueuePtr queue;
  {
    std::lock_guard lock(mutex_);
    if (closed_) return;
    closed_ = true;
    doomed_ = true;
    if (token_ != 0) IoLoop::shared().remove(fd_, token_);
    token_ = 0;
    if (fd_ >= 0) {
      ::close(fd_);
      gOpenConnections.fetch_sub(1, std::memory_order_relaxed);
    }
    output_.clear();
    outputBytes_ = 0;
    pending.swap(pending_);
    handler = std::move(handler_);
    finalizer = std::move(finalizer_);
    context = std::move(context_);
    queue = targetQueue_;
  }
  if (reason) base::vtlog("closing connection from pid %d: %@", pid_, *reason);
  for (auto& [id, p] : pending) {
    p.queue->async([h = std::move(p.handler)] { h(ErrorEvent::kConnectionInvalid); });
  }
  queue->async([handler = std::move(handler), finalizer = std::move(finalizer),
                context = std::move(context)]() mutable {
    if (handler) handler(ErrorEvent::kConnectionInvalid);
    if (finalizer) finalizer();
    // The context goes with this block, after the finalizer.
  });
}

std::string describe(const Connection& connection) {
  return base::format("<connection pid=%d>", connection.pid());
}

}  // namespace vantrel::lmo
