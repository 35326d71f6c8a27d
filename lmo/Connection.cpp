#include "lmo/Connection.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/timerfd.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <unordered_map>
#include <utility>

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
std::atomic<size_t> gUnfinishedInput{0};

// Accepted connections per peer user, guarded by its mutex. Never destroyed:
// the shared I/O loop's thread may still close connections while the
// process exits.
struct UserConnections {
  std::mutex mutex;
  std::unordered_map<uid_t, size_t> count;
};
UserConnections& userConnections() {
  static auto* table = new UserConnections;
  return *table;
}

void countUser(uid_t uid, bool open) {
  UserConnections& users = userConnections();
  std::lock_guard lock(users.mutex);
  if (open) {
    ++users.count[uid];
  } else if (auto it = users.count.find(uid); it != users.count.end() && --it->second == 0) {
    users.count.erase(it);
  }
}

std::vector<gid_t> peerGroups(int fd) {
  std::vector<gid_t> groups(16);
  for (int attempt = 0; attempt < 2; ++attempt) {
    socklen_t len = static_cast<socklen_t>(groups.size() * sizeof(gid_t));
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &len) == 0) {
      groups.resize(len / sizeof(gid_t));
      return groups;
    }
    if (errno != ERANGE) break;
    groups.resize(len / sizeof(gid_t));  // the kernel said how many
  }
  return {};
}

int peerPidfd(int fd, pid_t pid) {
  int pidfd = -1;
  socklen_t len = sizeof pidfd;
  if (::getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &len) == 0 && pidfd >= 0) return pidfd;
  if (pid <= 0) return -1;
  long r = ::syscall(SYS_pidfd_open, pid, 0);
  return r >= 0 ? static_cast<int>(r) : -1;
}

}  // namespace

// Disconnects peers that stall in the middle of a frame: one timer for the
// process, ticking while some connection holds an unfinished frame. Lives on
// the I/O thread, like every connection's reader.
class Connection::FrameDeadlines : public IoSource {
 public:
  static void watch(const std::shared_ptr<Connection>& connection) {
    static const std::shared_ptr<FrameDeadlines> instance = [] {
      auto made = std::make_shared<FrameDeadlines>();
      IoLoop::shared().add(made->fd_, EPOLLIN, made);
      return made;
    }();
    instance->add(connection);
  }

  FrameDeadlines() : fd_(::timerfd_create(CLOCK_MONOTONIC, TFD_NONBLOCK | TFD_CLOEXEC)) {
    VT_CHECK(fd_ >= 0, "no timer for frame deadlines");
  }

  void handleIo(uint32_t) override {
    uint64_t expirations = 0;
    while (::read(fd_, &expirations, sizeof expirations) < 0 && errno == EINTR) {
    }
    const auto now = std::chrono::steady_clock::now();
    std::vector<std::weak_ptr<Connection>> kept;
    for (std::weak_ptr<Connection>& weak : watched_) {
      std::shared_ptr<Connection> connection = weak.lock();
      if (connection && connection->checkFrameDeadline(now)) kept.push_back(std::move(weak));
    }
    watched_ = std::move(kept);
    if (watched_.empty()) arm(false);
  }

 private:
  void add(const std::shared_ptr<Connection>& connection) {
    for (const std::weak_ptr<Connection>& weak : watched_) {
      if (weak.lock() == connection) return;
    }
    watched_.push_back(connection);
    if (watched_.size() == 1) arm(true);
  }

  // A tick a second: a deadline is met to within a second.
  void arm(bool on) {
    itimerspec spec{};
    if (on) spec.it_value.tv_sec = spec.it_interval.tv_sec = 1;
    ::timerfd_settime(fd_, 0, &spec, nullptr);
  }

  const int fd_;
  std::vector<std::weak_ptr<Connection>> watched_;
};

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

Connection::Connection(int fd, QueuePtr targetQueue, bool accepted)
    : fd_(fd), accepted_(accepted), targetQueue_(std::move(targetQueue)) {
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
  if (accepted_) {
    groups_ = peerGroups(fd_);
    countUser(uid_, true);
    // Every read then says which process wrote the bytes.
    const int on = 1;
    ::setsockopt(fd_, SOL_SOCKET, SO_PASSCRED, &on, sizeof on);
  }
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
  return std::shared_ptr<Connection>(new Connection(fd, std::move(targetQueue), false));
}

std::shared_ptr<Connection> Connection::fromAcceptedSocket(int fd, QueuePtr targetQueue) {
  VT_CHECK(fd >= 0, "accepted socket without a descriptor");
  return std::shared_ptr<Connection>(new Connection(fd, std::move(targetQueue), true));
}

Connection::~Connection() {
  // Reached with the socket open only when the connection was never resumed
  // (a resumed one is held by the loop until invalidate() closes it).
  if (!closed_ && fd_ >= 0) {
    ::close(fd_);
    gOpenConnections.fetch_sub(1, std::memory_order_relaxed);
    if (accepted_) countUser(uid_, false);
  }
  if (pidfd_ >= 0) ::close(pidfd_);
  if (finalizer_) finalizer_();
  releaseQueue(std::move(targetQueue_));
}

size_t Connection::openCount() {
  return gOpenConnections.load(std::memory_order_relaxed);
}

size_t Connection::openCountForUser(uid_t uid) {
  UserConnections& users = userConnections();
  std::lock_guard lock(users.mutex);
  auto it = users.count.find(uid);
  return it == users.count.end() ? 0 : it->second;
}

size_t Connection::unfinishedInput() {
  return gUnfinishedInput.load(std::memory_order_relaxed);
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

void Connection::setInlineMessageDelivery(bool enabled) {
  std::lock_guard lock(mutex_);
  VT_CHECK(!resumed_, "setInlineMessageDelivery after resume");
  inlineMessageDelivery_ = enabled;
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
  // A paused connection watches neither input nor the peer's half-close:
  // both are level-triggered and would wake the loop until read.
  return (readPaused_ ? 0u : static_cast<uint32_t>(EPOLLIN | EPOLLRDHUP)) |
         (output_.empty() ? 0u : static_cast<uint32_t>(EPOLLOUT));
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
  // The request is answered once the reply has been written out (see
  // writeLocked): a peer that does not read its replies stops being read,
  // instead of having them pile up here. A reply that cannot be encoded
  // answers it now.
  base::Result<void> sent = sendFrame(FrameKind::kReply, reply.inReplyTo, reply.body, std::nullopt);
  if (!sent.has_value()) noteAnswered();
  return sent;
}

bool Connection::answeredLocked() {
  if (unanswered_ > 0) --unanswered_;
  if (!readPaused_ || unanswered_ >= kMaxUnansweredRequests || closed_ || doomed_) return false;
  readPaused_ = false;
  return true;
}

void Connection::noteAnswered() {
  {
    std::lock_guard lock(mutex_);
    if (!answeredLocked()) return;
  }
  auto self = shared_from_this();
  IoLoop::shared().post([self] { self->resumeReading(); });
}

void Connection::resumeReading() {
  {
    std::lock_guard lock(mutex_);
    if (closed_ || readPaused_ || token_ == 0) return;
    IoLoop::shared().modify(fd_, token_, watchedEventsLocked());
  }
  // The frames that waited were not the peer's delay.
  if (reader_.hasPartialFrame()) frameStarted_ = std::chrono::steady_clock::now();
  readAvailable();
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
  output_.emplace_back(std::move(bytes), kind == FrameKind::kReply);
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
  bool resume = false;
  while (!output_.empty() && fd_ >= 0) {
    const std::vector<uint8_t>& front = output_.front().first;
    ssize_t n = ::send(fd_, front.data() + outputOffset_, front.size() - outputOffset_,
                       MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) break;
      doomed_ = true;
      auto self = shared_from_this();
      IoLoop::shared().post([self] { self->invalidate(std::nullopt); });
      return;
    }
    outputBytes_ -= static_cast<size_t>(n);
    outputOffset_ += static_cast<size_t>(n);
    if (outputOffset_ == front.size()) {
      if (output_.front().second) resume |= answeredLocked();
      output_.pop_front();
      outputOffset_ = 0;
    }
  }
  if (resume) {
    auto self = shared_from_this();
    IoLoop::shared().post([self] { self->resumeReading(); });
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
  bool paused;
  {
    std::lock_guard lock(mutex_);
    paused = readPaused_;
  }
  if (paused) {
    // Hang-ups cannot be masked; with input paused, one means nobody is
    // left to read the replies still due.
    if (events & (EPOLLHUP | EPOLLERR)) invalidate(std::nullopt);
    return;
  }
  if (events & (EPOLLIN | EPOLLRDHUP | EPOLLHUP | EPOLLERR)) readAvailable();
}

void Connection::readAvailable() {
  if (!drainFrames()) return;
  uint8_t buffer[kReadChunk];
  size_t total = 0;
  while (total < kMaxReadPerWakeup) {
    {
      std::lock_guard lock(mutex_);
      if (closed_ || readPaused_) return;
    }
    bool fromPeer = true;
    ssize_t n = receive(buffer, sizeof buffer, fromPeer);
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
    if (accepted_) {
      if (!writers_.empty() && writers_.back().second == fromPeer) {
        writers_.back().first += static_cast<size_t>(n);
      } else {
        writers_.emplace_back(static_cast<size_t>(n), fromPeer);
      }
    }
    if (!drainFrames()) return;
    // The socket is drained: epoll is level-triggered, so anything that
    // arrives now wakes us again, and a second recv would only say EAGAIN.
    if (static_cast<size_t>(n) < sizeof buffer) return;
  }
}

ssize_t Connection::receive(uint8_t* buffer, size_t size, bool& fromPeer) {
  fromPeer = true;
  if (!accepted_) return ::recv(fd_, buffer, size, MSG_DONTWAIT);
  iovec io{buffer, size};
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))];
  msghdr message{};
  message.msg_iov = &io;
  message.msg_iovlen = 1;
  message.msg_control = control;
  message.msg_controllen = sizeof control;
  const ssize_t n = ::recvmsg(fd_, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  if (n <= 0) return n;
  // The kernel hands out one writer's bytes per read. Without credentials
  // (which SO_PASSCRED guarantees) the writer is unknown: not the peer.
  fromPeer = false;
  for (cmsghdr* c = CMSG_FIRSTHDR(&message); c != nullptr; c = CMSG_NXTHDR(&message, c)) {
    if (c->cmsg_level == SOL_SOCKET && c->cmsg_type == SCM_CREDENTIALS &&
        c->cmsg_len >= CMSG_LEN(sizeof(ucred))) {
      ucred cred{};
      std::memcpy(&cred, CMSG_DATA(c), sizeof cred);
      fromPeer = cred.pid == pid_;
    }
  }
  return n;
}

bool Connection::takeWriters(size_t bytes) {
  if (!accepted_) return true;
  bool fromPeer = true;
  while (bytes > 0 && !writers_.empty()) {
    auto& [count, peer] = writers_.front();
    const size_t taken = std::min(count, bytes);
    fromPeer = fromPeer && peer;
    count -= taken;
    bytes -= taken;
    if (count == 0) writers_.pop_front();
  }
  return fromPeer;
}

bool Connection::drainFrames() {
  while (true) {
    {
      std::lock_guard lock(mutex_);
      if (closed_) return false;
      if (readPaused_) break;
    }
    const size_t before = reader_.bufferedBytes();
    std::optional<base::Result<Frame>> frame = reader_.next();
    if (!frame) break;
    if (!frame->has_value()) {
      invalidate(frame->error());
      return false;
    }
    const bool fromPeer = takeWriters(before - reader_.bufferedBytes());
    if (!handleFrame(std::move(*frame).value(), fromPeer)) return false;
  }
  noteUnfinishedInput();
  bool paused;
  {
    std::lock_guard lock(mutex_);
    if (closed_) return false;
    paused = readPaused_;
  }
  if (!paused && unfinishedBytes_ > 0 && Connection::unfinishedInput() > kMaxUnfinishedInput) {
    invalidate(lmoErrorf(kLmoLimitExceeded, "unfinished frames of all peers exceed %u bytes",
                         kMaxUnfinishedInput));
    return false;
  }
  return !paused;
}

void Connection::noteUnfinishedInput() {
  const size_t held = reader_.bufferedBytes();
  if (held >= unfinishedBytes_) {
    gUnfinishedInput.fetch_add(held - unfinishedBytes_, std::memory_order_relaxed);
  } else {
    gUnfinishedInput.fetch_sub(unfinishedBytes_ - held, std::memory_order_relaxed);
  }
  unfinishedBytes_ = held;
  if (held == 0) {
    frameStarted_.reset();
  } else if (!frameStarted_ || reader_.framesRead() != framesSeen_) {
    // A new frame began: its clock starts now.
    frameStarted_ = std::chrono::steady_clock::now();
    FrameDeadlines::watch(shared_from_this());
  }
  framesSeen_ = reader_.framesRead();
}

bool Connection::checkFrameDeadline(std::chrono::steady_clock::time_point now) {
  {
    std::lock_guard lock(mutex_);
    if (closed_) return false;
    if (readPaused_) return true;  // waiting on us, not on the peer
  }
  if (!frameStarted_) return false;
  if (now - *frameStarted_ < kFrameDeadline) return true;
  invalidate(lmoErrorf(kLmoLimitExceeded, "frame not completed within %u seconds",
                       static_cast<uint64_t>(kFrameDeadline.count())));
  return false;
}

// Returns false when the frame closed the connection.
bool Connection::handleFrame(Frame&& frame, bool fromPeer) {
  if (frame.kind != FrameKind::kReply) {
    const bool request = frame.kind == FrameKind::kRequest;
    {
      std::lock_guard lock(mutex_);
      if (++unanswered_ >= kMaxUnansweredRequests && !readPaused_ && token_ != 0) {
        readPaused_ = true;
        IoLoop::shared().modify(fd_, token_, watchedEventsLocked());
      }
    }
    // A request counts until its reply is sent, a message until its
    // handler has run.
    deliver(IncomingMessage(std::move(frame.body), frame.id, request, fromPeer), !request);
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

void Connection::deliver(Event event, bool counted) {
  EventHandler handler;
  QueuePtr queue;
  {
    std::lock_guard lock(mutex_);
    if (closed_) return;
    handler = handler_;
    queue = targetQueue_;
  }
  if (!handler) {
    if (counted) noteAnswered();
    return;
  }
  const bool mayRunHere = inlineMessageDelivery_ && event.message() != nullptr;
  if (!counted) {
    enqueue(
        queue, [handler = std::move(handler), event = std::move(event)] { handler(event); },
        mayRunHere);
    return;
  }
  enqueue(
      queue,
      [self = shared_from_this(), handler = std::move(handler), event = std::move(event)] {
        handler(event);
        self->noteAnswered();
      },
      mayRunHere);
}

void Connection::enqueue(const QueuePtr& queue, std::function<void()> task, bool mayRunHere) {
  bool schedule = false;
  {
    std::lock_guard lock(inboxMutex_);
    inbox_.push_back(std::move(task));
    schedule = !std::exchange(inboxScheduled_, true);
  }
  if (!schedule) return;
  if (mayRunHere && queue->tryRunHere([this, &queue] { runInbox(queue); })) return;
  queue->async([self = shared_from_this(), queue] { self->runInbox(queue); });
}

void Connection::runInbox(const QueuePtr& queue) {
  std::function<void()> task;
  {
    std::lock_guard lock(inboxMutex_);
    task = std::move(inbox_.front());
    inbox_.pop_front();
  }
  task();
  task = nullptr;  // what it holds goes before the next turn, as a block's would
  bool more = false;
  {
    std::lock_guard lock(inboxMutex_);
    more = !inbox_.empty();
    if (!more) inboxScheduled_ = false;
  }
  // To the back of the queue: every other connection's turn comes first.
  if (more) queue->async([self = shared_from_this(), queue] { self->runInbox(queue); });
}

void Connection::terminationImminent() {
  deliver(ErrorEvent::kTerminationImminent, false);
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
      if (accepted_) countUser(uid_, false);
    }
    output_.clear();
    outputBytes_ = 0;
    pending.swap(pending_);
    handler = std::move(handler_);
    finalizer = std::move(finalizer_);
    context = std::move(context_);
    queue = targetQueue_;
  }
  gUnfinishedInput.fetch_sub(unfinishedBytes_, std::memory_order_relaxed);
  unfinishedBytes_ = 0;
  if (reason) base::vtlog("closing connection from pid %d: %@", pid_, *reason);
  for (auto& [id, p] : pending) {
    p.queue->async([h = std::move(p.handler)] { h(ErrorEvent::kConnectionInvalid); });
  }
  // After every event delivered before it.
  enqueue(queue, [handler = std::move(handler), finalizer = std::move(finalizer),
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
