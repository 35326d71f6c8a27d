#pragma once
// A peer connection: one AF_UNIX stream socket carrying frames both ways.
//
// Every event of a connection (messages from the peer, then finally
// kConnectionInvalid) runs its event handler on the connection's target
// queue, in order. Reply handlers run on the queue given with the request.
// The socket itself is served by the I/O thread (IoLoop), which never runs
// handler code.
//
// Lifetime: once resumed, the I/O loop keeps the connection alive until it
// becomes invalid (peer gone, bad input, output bound passed, or cancel()).
// Then pending reply handlers get kConnectionInvalid, the event handler gets
// kConnectionInvalid as its last event, the finalizer runs once right after
// it on the target queue, and the handler, finalizer and context are
// released (so a handler that captures the context's owner forms no lasting
// cycle).

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "base/Result.h"
#include "base/SerialQueue.h"
#include "lmo/Event.h"
#include "lmo/Frame.h"
#include "lmo/IoLoop.h"
#include "lmo/Limits.h"

namespace vantrel::lmo {

using QueuePtr = std::shared_ptr<base::SerialQueue>;

// Drops a reference to a queue on the I/O thread, so that a queue is never
// destroyed on its own worker thread.
void releaseQueue(QueuePtr queue);

class Connection : public IoSource, public std::enable_shared_from_this<Connection> {
 public:
  using EventHandler = std::function<void(const Event&)>;
  using Finalizer = std::function<void()>;

  // The client side: connects to the named service (see socketPathForService)
  // with events delivered on targetQueue. Never null: when the service cannot
  // be reached, the connection is invalid from the start and resume()
  // delivers kConnectionInvalid (and sends are dropped).
  static std::shared_ptr<Connection> connectToService(std::string_view name, QueuePtr targetQueue);

  // The server side: takes ownership of an accepted, non-blocking socket and
  // reads the peer's credentials from it.
  static std::shared_ptr<Connection> fromAcceptedSocket(int fd, QueuePtr targetQueue);

  ~Connection() override;
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Set before resume(); a handler set later applies to later events.
  void setEventHandler(EventHandler handler);
  // Replaces the target queue; only before resume().
  void setTargetQueue(QueuePtr queue);
  // An object owned by the connection until it is done; see the finalizer.
  void setContext(std::shared_ptr<void> context);
  std::shared_ptr<void> context() const;
  // Runs once on the target queue after the last event (kConnectionInvalid),
  // or in the destructor when the connection was never resumed.
  void setFinalizer(Finalizer finalizer);

  // Lets the I/O thread run the handler for a message itself, on the target
  // queue, when that queue is idle, instead of waking the queue's worker;
  // other events always go through the worker. Only for handlers that never
  // wait (for this connection's I/O above all: a handler that sends a request
  // and waits for its reply would wait for itself). Before resume().
  void setInlineMessageDelivery(bool enabled);

  // Starts delivering events. An event handler must be set first. Calling it
  // again does nothing.
  void resume();
  // Closes the connection: the usual kConnectionInvalid sequence follows.
  void cancel();

  // Sends a message that expects no reply. Messages to a connection that is
  // invalid (or about to be) are dropped without error. Errors: the message
  // cannot be encoded (nested too deep, or larger than a frame may be); the
  // connection is unaffected.
  base::Result<void> send(const Dictionary& message);
  // Sends a message that expects a reply. handler runs exactly once on
  // replyQueue: with the reply, or with kConnectionInvalid when the
  // connection ends first. On an encoding error (as send) it never runs.
  base::Result<void> sendWithReply(const Dictionary& message, QueuePtr replyQueue,
                                   EventHandler handler);
  // Sends a reply made by createReply(). Dropped as send() when invalid.
  base::Result<void> sendReply(const Reply& reply);

  // The peer's identity, read once when the socket was connected or accepted
  // and kept after the connection ends. -1 / (uid_t)-1 when unknown.
  pid_t pid() const { return pid_; }
  uid_t uid() const { return uid_; }
  gid_t gid() const { return gid_; }
  // The peer's supplementary groups when it connected (SO_PEERGROUPS);
  // empty when unknown.
  const std::vector<gid_t>& groups() const { return groups_; }
  // A pidfd of the peer process (stands in for an audit token: it keeps
  // naming that process even if its pid is reused), or -1 when neither
  // SO_PEERPIDFD nor pidfd_open could provide one. Owned by the connection.
  int pidfd() const { return pidfd_; }

  // Live (not yet closed) connection sockets in this process, and the
  // accepted ones whose peer is of user uid.
  static size_t openCount();
  static size_t openCountForUser(uid_t uid);
  // Bytes of unfinished frames held for all peers of this process.
  static size_t unfinishedInput();

  void setOutputLimitForTest(size_t bytes);

  // IoSource
  void handleIo(uint32_t events) override;
  void terminationImminent() override;

 private:
  struct PendingReply {
    QueuePtr queue;
    EventHandler handler;
  };

  class FrameDeadlines;

  Connection(int fd, QueuePtr targetQueue, bool accepted);

  base::Result<void> sendFrame(FrameKind kind, uint64_t inReplyTo, const Dictionary& body,
                               std::optional<PendingReply> pending);
  void writeLocked();
  // Counts one request or message answered; whether reading must resume.
  bool answeredLocked();
  void readAvailable();
  // Hands out the complete frames buffered; false when the connection
  // closed or stopped reading meanwhile.
  bool drainFrames();
  bool handleFrame(Frame&& frame, bool fromPeer);
  // Reads from the socket: recv, or on an accepted connection recvmsg with
  // the writer's credentials (fromPeer: the peer process wrote them).
  ssize_t receive(uint8_t* buffer, size_t size, bool& fromPeer);
  // Takes bytes of the writer record for a frame; whether the peer wrote
  // every one of them.
  bool takeWriters(size_t bytes);
  void deliver(Event event, bool counted);
  // Runs task on queue after every task this connection handed it before,
  // holding at most one place in the queue at a time: connections take
  // turns, so one that sends a lot waits behind the others, not ahead.
  // mayRunHere: on the calling thread when the queue is idle and this
  // connection has nothing waiting in it.
  void enqueue(const QueuePtr& queue, std::function<void()> task, bool mayRunHere = false);
  // Runs the oldest task of the inbox, then gives up its place.
  void runInbox(const QueuePtr& queue);
  // Accounts the buffered input of an unfinished frame and its deadline.
  void noteUnfinishedInput();
  // A request was answered or a message handled: below the bound, reading
  // resumes.
  void noteAnswered();
  void resumeReading();
  // Called by the deadline timer; true when the connection stays.
  bool checkFrameDeadline(std::chrono::steady_clock::time_point now);
  // Closes the socket and delivers the final events. I/O thread only.
  // reason, when given, is logged: the peer misbehaved.
  void invalidate(std::optional<base::Error> reason);
  void invalidateLater(std::optional<base::Error> reason);
  uint32_t watchedEventsLocked() const;

  // Constant after construction.
  const int fd_;         // -1 when the connection never connected
  const bool accepted_;  // the server side: counted per user
  pid_t pid_ = -1;
  uid_t uid_ = static_cast<uid_t>(-1);
  gid_t gid_ = static_cast<gid_t>(-1);
  int pidfd_ = -1;
  std::vector<gid_t> groups_;

  // I/O thread only.
  FrameReader reader_;
  size_t unfinishedBytes_ = 0;  // reader_'s bytes, as counted in unfinishedInput()
  // reader_'s bytes by writer, oldest first: (bytes, written by the peer
  // process). Accepted connections only.
  std::deque<std::pair<size_t, bool>> writers_;
  uint64_t framesSeen_ = 0;  // reader_.framesRead() when last accounted
  std::optional<std::chrono::steady_clock::time_point> frameStarted_;

  std::atomic<uint64_t> nextId_{1};

  mutable std::mutex mutex_;
  // Everything below is guarded by mutex_.
  QueuePtr targetQueue_;
  EventHandler handler_;
  Finalizer finalizer_;
  std::shared_ptr<void> context_;
  bool resumed_ = false;
  bool doomed_ = false;  // an invalidation is on its way; new output is dropped
  bool closed_ = false;  // the socket is closed and the final events sent
  uint64_t token_ = 0;   // the IoLoop registration, 0 when not registered
  bool watchingOutput_ = false;
  // Frames to write, each with whether it is the reply that answers a
  // request: a request counts as unanswered until its reply has left.
  std::deque<std::pair<std::vector<uint8_t>, bool>> output_;
  size_t outputOffset_ = 0;  // bytes of output_.front() already written
  size_t outputBytes_ = 0;   // unsent bytes in output_
  size_t outputLimit_ = kMaxPendingOutput;
  // Requests whose reply has not been written out yet, messages not yet
  // handled.
  size_t unanswered_ = 0;
  bool readPaused_ = false;  // unanswered_ reached kMaxUnansweredRequests
  std::unordered_map<uint64_t, PendingReply> pending_;

  // Tasks for the target queue, oldest first, and whether one of them is in
  // the queue now. Guarded by inboxMutex_, never held with mutex_.
  std::mutex inboxMutex_;
  std::deque<std::function<void()>> inbox_;
  bool inboxScheduled_ = false;

  // Set before resume(), then constant.
  bool inlineMessageDelivery_ = false;
};

// "<connection pid=%d>" for log lines.
std::string describe(const Connection& connection);

}  // namespace vantrel::lmo
