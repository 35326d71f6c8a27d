#include <fcntl.h>
#include <gtest/gtest.h>

#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "base/Log.h"
#include "lmo/Connection.h"
#include "lmo/Listener.h"
#include "tests/support/TempDir.h"

namespace vantrel::lmo {
namespace {

using namespace std::chrono_literals;
using Bytes = std::vector<uint8_t>;

// Collects events from other threads; waits with a deadline, never a sleep.
class Recorder {
 public:
  void add(std::string what) {
    std::lock_guard lock(mutex_);
    events_.push_back(std::move(what));
    changed_.notify_all();
  }
  bool waitFor(size_t count, std::chrono::milliseconds timeout = 10s) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [&] { return events_.size() >= count; });
  }
  std::vector<std::string> events() const {
    std::lock_guard lock(mutex_);
    return events_;
  }
  size_t count(const std::string& what) const {
    std::lock_guard lock(mutex_);
    return static_cast<size_t>(std::count(events_.begin(), events_.end(), what));
  }

 private:
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> events_;
};

std::string eventText(const Event& e) {
  if (e.isError()) return describe(*e.error());
  return describe(e.message()->body());
}

QueuePtr makeQueue(const char* label) {
  return std::make_shared<base::SerialQueue>(label);
}

using RecorderPtr = std::shared_ptr<Recorder>;
RecorderPtr recorder() {
  return std::make_shared<Recorder>();
}

// Records the text of each event. Handlers capture recorders by shared
// pointer: a connection may deliver its last event after the test that made
// it has returned.
Connection::EventHandler recordInto(RecorderPtr recorder) {
  return [recorder](const Event& e) { recorder->add(eventText(e)); };
}

// A listener whose connections answer each request with {"echo": body},
// answer {"flood": 1} with 16 MiB of messages first, and end the connection on
// {"die": 1}. Handlers hold the shared state, never the server object, so a
// late event after a test has ended touches nothing that is gone.
class EchoServer {
 public:
  struct State {
    Recorder events;
    std::atomic<size_t> outputLimit{0};
    std::mutex mutex;
    std::vector<std::shared_ptr<Connection>> accepted;  // Guarded by mutex.
    // Replies to {"hold": 1} requests, sent when the test releases them.
    std::vector<std::pair<std::weak_ptr<Connection>, Reply>> held;  // Guarded by mutex.
  };

  explicit EchoServer(const std::string& path) : queue_(makeQueue("lmo-test")) {
    auto listener = Listener::create(path, queue_);
    EXPECT_TRUE(listener.has_value()) << listener.error().description();
    listener_ = listener.value();
    listener_->setConnectionHandler([state = state_](std::shared_ptr<Connection> c) {
      {
        std::lock_guard lock(state->mutex);
        state->accepted.push_back(c);
      }
      std::weak_ptr<Connection> weak = c;
      c->setEventHandler([state, weak](const Event& e) {
        state->events.add(eventText(e));
        auto connection = weak.lock();
        const IncomingMessage* m = e.message();
        if (connection == nullptr || m == nullptr) return;
        if (m->body().contains("die")) {
          connection->cancel();
          return;
        }
        if (m->body().contains("flood")) {
          for (int i = 0; i < 256; ++i) {
            (void)connection->send(Dictionary{{"bulk", Value::data(Bytes(64 * 1024, 1))}});
          }
        }
        if (auto reply = createReply(*m)) {
          reply->body = reply->body.setting("echo", Value(m->body()));
          if (m->body().contains("hold")) {
            std::lock_guard lock(state->mutex);
            state->held.emplace_back(weak, std::move(*reply));
            return;
          }
          (void)connection->sendReply(*reply);
        }
      });
      if (size_t limit = state->outputLimit.load(); limit != 0) c->setOutputLimitForTest(limit);
      c->resume();
    });
    listener_->resume();
  }
  ~EchoServer() {
    listener_->cancel();
    std::lock_guard lock(state_->mutex);
    for (auto& c : state_->accepted) c->cancel();
  }
  std::vector<std::shared_ptr<Connection>> accepted() const {
    std::lock_guard lock(state_->mutex);
    return state_->accepted;
  }
  void setOutputLimit(size_t bytes) { state_->outputLimit = bytes; }
  // Sends the replies held so far; returns how many.
  size_t releaseHeld() {
    std::vector<std::pair<std::weak_ptr<Connection>, Reply>> held;
    {
      std::lock_guard lock(state_->mutex);
      held.swap(state_->held);
    }
    for (auto& [weak, reply] : held) {
      if (auto connection = weak.lock()) (void)connection->sendReply(reply);
    }
    return held.size();
  }

 private:
  std::shared_ptr<State> state_ = std::make_shared<State>();

 public:
  Recorder& serverEvents = state_->events;

 private:
  QueuePtr queue_;
  std::shared_ptr<Listener> listener_;
};

std::shared_ptr<Connection> connectRecorded(const std::string& path, const RecorderPtr& recorder) {
  auto c = Connection::connectToService(path, makeQueue("client"));
  c->setEventHandler(recordInto(recorder));
  c->resume();
  return c;
}

sockaddr_un unixAddress(const std::string& path) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::memcpy(addr.sun_path, path.data(), path.size());
  return addr;
}

// A plain socket connected to path, for writing raw bytes.
int rawConnect(const std::string& path) {
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr = unixAddress(path);
  EXPECT_EQ(::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
  return fd;
}

// Whether the log holds fragment within a few seconds.
bool logEventually(const base::LogCapture& log, const std::string& fragment) {
  const auto deadline = std::chrono::steady_clock::now() + 5s;
  while (!log.contains(fragment)) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(10ms);
  }
  return true;
}

Bytes frameOf(FrameKind kind, uint64_t id, const Dictionary& body) {
  return encodeFrame({kind, id, 0, body}).value();
}

// An echo server listening at "svc" in a fresh directory.
class ConnectionTest : public ::testing::Test {
 protected:
  // Sends body on c; its reply (or failure) is recorded in replies.
  void request(Connection& c, const Dictionary& body, const RecorderPtr& replies) {
    ASSERT_TRUE(c.sendWithReply(body, replyQueue_, recordInto(replies)).has_value());
  }

  testing::TempDir dir_;
  const std::string path_ = dir_.file("svc");
  EchoServer server_{path_};
  QueuePtr replyQueue_ = makeQueue("replies");
};

TEST_F(ConnectionTest, RepliesReachTheirOwnHandlersOnce) {
  struct stat st {};
  ASSERT_EQ(::stat(path_.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0666u);

  auto eventsA = recorder(), eventsB = recorder();
  auto a = connectRecorded(path_, eventsA);
  auto b = connectRecorded(path_, eventsB);
  // Each request has a recorder of its own: its handler must see its reply
  // and nothing else.
  std::vector<std::pair<std::string, RecorderPtr>> sent;
  for (int i = 0; i < 3; ++i) {
    for (const auto& [name, c] : {std::pair{"a", a}, std::pair{"b", b}}) {
      sent.emplace_back(name + std::to_string(i), recorder());
      request(*c, Dictionary{{"tag", Value(sent.back().first)}}, sent.back().second);
    }
  }
  ASSERT_TRUE(a->send(Dictionary{{"note", Value("no reply")}}).has_value());
  for (const auto& [tag, replies] : sent) ASSERT_TRUE(replies->waitFor(1)) << tag;
  ASSERT_TRUE(server_.serverEvents.waitFor(7));
  a->cancel();
  b->cancel();
  ASSERT_TRUE(eventsA->waitFor(1));
  ASSERT_TRUE(eventsB->waitFor(1));
  ASSERT_TRUE(server_.serverEvents.waitFor(9));
  for (const auto& [tag, replies] : sent) {
    EXPECT_EQ(replies->events(), std::vector<std::string>{"{echo = {tag = " + tag + "}}"});
  }
  EXPECT_EQ(eventsA->events(), std::vector<std::string>{"connection invalid"});
  EXPECT_EQ(server_.serverEvents.count("connection invalid"), 2u);

  // Both ends see the other's kernel credentials; here that is this process.
  for (const auto& c : server_.accepted()) {
    EXPECT_EQ(c->pid(), ::getpid());
    EXPECT_EQ(c->uid(), ::geteuid());
    EXPECT_EQ(c->gid(), ::getegid());
    EXPECT_GE(c->pidfd(), 0);
  }
  EXPECT_EQ(a->pid(), ::getpid());
  if (::geteuid() == 0) {
    EXPECT_EQ(a->uid(), 0u);
  }
}

TEST_F(ConnectionTest, ConnectionEndFailsPendingRepliesAndRunsTheFinalizer) {
  auto events = recorder(), replies = recorder(), finalized = recorder();
  auto context = std::make_shared<int>(7);
  std::weak_ptr<int> weakContext = context;
  auto c = Connection::connectToService(path_, makeQueue("client"));
  c->setEventHandler(recordInto(events));
  c->setContext(context);
  c->setFinalizer([finalized, events] {
    finalized->add("finalized after " + std::to_string(events->events().size()) + " events");
  });
  context.reset();
  c->resume();
  // The server never answers these: it ends the connection on the first.
  for (int i = 0; i < 3; ++i) request(*c, Dictionary{{"die", Value::integer(1)}}, replies);
  ASSERT_TRUE(replies->waitFor(3));
  ASSERT_TRUE(finalized->waitFor(1));
  EXPECT_EQ(replies->count("connection invalid"), 3u);
  EXPECT_EQ(events->events(), std::vector<std::string>{"connection invalid"});
  EXPECT_EQ(finalized->events(), std::vector<std::string>{"finalized after 1 events"});
  // The context goes with the finalizer's block, just after the finalizer
  // has run: wait (bounded) for that block to finish.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (!weakContext.expired() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::yield();
  }
  EXPECT_TRUE(weakContext.expired());

  // After the end, a request fails at once instead of waiting for ever.
  request(*c, Dictionary{}, replies);
  ASSERT_TRUE(replies->waitFor(4));
  EXPECT_EQ(replies->count("connection invalid"), 4u);

  // A service nobody listens on behaves the same.
  auto missingEvents = recorder();
  auto missing = connectRecorded(dir_.file("nobody"), missingEvents);
  ASSERT_TRUE(missingEvents->waitFor(1));
  EXPECT_EQ(missingEvents->events(), std::vector<std::string>{"connection invalid"});
}

TEST_F(ConnectionTest, BadInputClosesOnlyThatPeer) {
  auto events = recorder(), replies = recorder();
  auto good = connectRecorded(path_, events);

  // Every frame the reader refuses takes one path; its reasons are the
  // frame tests' business. These are a header, a body, and the two refusals
  // the connection makes itself.
  Bytes oversized = {0x01, 0x00, 0x00, 0x01};  // 16 MiB + 1, refused from the length alone
  Bytes notMap = {0, 0, 0, 21, 1, 2, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0, 0x01};
  Bytes truncated = frameOf(FrameKind::kMessage, 1, Dictionary{{"k", Value("v")}});
  truncated.pop_back();
  Bytes strayReply = encodeFrame({FrameKind::kReply, 1, 99, Dictionary{}}).value();
  struct Case {
    const char* name;
    Bytes bytes;
    const char* reason;
  };
  const Case cases[] = {
      {"too long", oversized, "exceeds the limit"},
      {"not a map", notMap, "not a map"},
      {"truncated", truncated, "truncated frame"},
      {"reply to nothing", strayReply, "reply to unknown message 99"},
  };
  size_t invalidations = 0;
  size_t serverEvents = 0;  // the bad peers' invalidations and the good client's requests
  for (const Case& c : cases) {
    base::LogCapture log;
    int fd = rawConnect(path_);
    ASSERT_EQ(::send(fd, c.bytes.data(), c.bytes.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(c.bytes.size()));
    if (std::string(c.name) == "truncated") ::shutdown(fd, SHUT_WR);
    // The daemon closes the socket: the raw peer reads end of file.
    char byte;
    EXPECT_EQ(::recv(fd, &byte, 1, 0), 0) << c.name;
    ::close(fd);
    ++invalidations;
    ASSERT_TRUE(server_.serverEvents.waitFor(++serverEvents)) << c.name;
    EXPECT_EQ(server_.serverEvents.count("connection invalid"), invalidations) << c.name;
    std::vector<std::string> lines = log.lines();
    ASSERT_EQ(lines.size(), 1u) << c.name;
    EXPECT_EQ(lines[0].rfind("closing connection from pid " + std::to_string(::getpid()) + ": ", 0),
              0u)
        << lines[0];
    EXPECT_NE(lines[0].find(c.reason), std::string::npos) << lines[0];

    // The well-behaved client is still served.
    request(*good, Dictionary{{"after", Value(c.name)}}, replies);
    ++serverEvents;
    ASSERT_TRUE(replies->waitFor(invalidations)) << c.name;
    EXPECT_FALSE(replies->events().back() == "connection invalid") << c.name;
  }
  EXPECT_TRUE(events->events().empty());
}

TEST_F(ConnectionTest, PeerThatStopsReadingIsDisconnectedPastTheBound) {
  server_.setOutputLimit(1024 * 1024);
  base::LogCapture log;
  int fd = rawConnect(path_);
  Bytes flood = frameOf(FrameKind::kMessage, 1, Dictionary{{"flood", Value::integer(1)}});
  ASSERT_EQ(::send(fd, flood.data(), flood.size(), MSG_NOSIGNAL),
            static_cast<ssize_t>(flood.size()));
  // Never read: 16 MiB of output cannot fit in a 1 MiB bound plus the socket buffer.
  ASSERT_TRUE(server_.serverEvents.waitFor(2));
  EXPECT_EQ(server_.serverEvents.events()[1], "connection invalid");
  EXPECT_TRUE(log.contains("peer is not reading"));
  ::close(fd);
}

TEST_F(ConnectionTest, ListenerReplacesStaleSocketsOnly) {
  auto queue = makeQueue("lmo-test");

  // A socket file nobody listens on any more.
  std::string stale = dir_.file("stale");
  int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un addr = unixAddress(stale);
  ASSERT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
  ::close(fd);
  auto replaced = Listener::create(stale, queue);
  ASSERT_TRUE(replaced.has_value()) << replaced.error().description();

  // A live listener is not disturbed.
  auto second = Listener::create(stale, queue);
  ASSERT_FALSE(second.has_value());
  EXPECT_NE(second.error().description().find("already running"), std::string::npos);
  auto events = recorder(), replies = recorder();
  replaced.value()->setConnectionHandler([events](std::shared_ptr<Connection> c) {
    events->add("accepted");
    c->setEventHandler([](const Event&) {});
    c->resume();
  });
  replaced.value()->resume();
  auto client = connectRecorded(stale, replies);
  ASSERT_TRUE(events->waitFor(1));

  // Something that is not a socket is never removed.
  std::string file = dir_.write("plain", "keep me");
  auto onFile = Listener::create(file, queue);
  ASSERT_FALSE(onFile.has_value());
  EXPECT_NE(onFile.error().description().find("not a socket"), std::string::npos);

  // A relative name lives in the runtime directory.
  ::setenv("VANTREL_RUNTIME_DIR", dir_.file("run").c_str(), 1);
  auto named = Listener::create("com.example.test", queue);
  ::unsetenv("VANTREL_RUNTIME_DIR");
  ASSERT_TRUE(named.has_value());
  EXPECT_EQ(named.value()->path(), dir_.file("run") + "/com.example.test");
  named.value()->cancel();
  replaced.value()->cancel();
  client->cancel();
  ASSERT_TRUE(replies->waitFor(1));
}

TEST_F(ConnectionTest, TerminationImminentReachesHandlersAndChangesNothingElse) {
  auto events = recorder(), replies = recorder();
  auto c = connectRecorded(path_, events);
  const Dictionary ping{{"p", Value::integer(1)}};
  request(*c, ping, replies);
  ASSERT_TRUE(replies->waitFor(1));  // the connection is accepted and live on both ends
  IoLoop::shared().announceTerminationImminent();
  ASSERT_TRUE(events->waitFor(1));
  EXPECT_EQ(events->events()[0], "termination imminent");
  request(*c, ping, replies);
  ASSERT_TRUE(replies->waitFor(2));
  EXPECT_NE(replies->events()[1], "connection invalid");
  c->cancel();
  ASSERT_TRUE(events->waitFor(2));
}

TEST_F(ConnectionTest, APipeliningPeerIsReadNoFurtherThanItsUnansweredRequests) {
  // Three times the bound, in one write, none answered until released.
  const size_t total = 3 * kMaxUnansweredRequests;
  Bytes stream;
  for (size_t i = 1; i <= total; ++i) {
    Bytes frame = frameOf(FrameKind::kRequest, i, Dictionary{{"hold", Value::integer(1)}});
    stream.insert(stream.end(), frame.begin(), frame.end());
  }
  int fd = rawConnect(path_);
  ASSERT_EQ(::send(fd, stream.data(), stream.size(), MSG_NOSIGNAL),
            static_cast<ssize_t>(stream.size()));
  size_t delivered = 0;
  while (delivered < total) {
    ASSERT_TRUE(server_.serverEvents.waitFor(delivered + kMaxUnansweredRequests));
    delivered += kMaxUnansweredRequests;
    // Not one request more is read while all of those wait for replies.
    EXPECT_FALSE(server_.serverEvents.waitFor(delivered + 1, 200ms)) << delivered;
    EXPECT_EQ(server_.releaseHeld(), kMaxUnansweredRequests);
  }
  // Every request was answered, in order, and the connection stays.
  FrameReader replies;
  uint64_t answered = 0;
  uint8_t buffer[4096];
  while (answered < total) {
    const ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
    ASSERT_GT(n, 0);
    replies.feed(buffer, static_cast<size_t>(n));
    while (auto frame = replies.next()) {
      ASSERT_TRUE(frame->has_value());
      EXPECT_EQ((*frame)->inReplyTo, ++answered);
    }
  }
  EXPECT_EQ(server_.serverEvents.count("connection invalid"), 0u);
  ::close(fd);
}

TEST_F(ConnectionTest, ARequestCountsUntilItsReplyHasLeft) {
  // Requests with 64 KiB replies from a peer that reads none: once the
  // socket is full, replies waiting to be written keep the requests
  // unanswered, so the peer is read no further and nothing piles up here.
  const size_t total = 4 * kMaxUnansweredRequests;
  Bytes stream;
  for (size_t i = 1; i <= total; ++i) {
    Bytes frame =
        frameOf(FrameKind::kRequest, i, Dictionary{{"pad", Value::data(Bytes(64 * 1024, 7))}});
    stream.insert(stream.end(), frame.begin(), frame.end());
  }
  int fd = rawConnect(path_);
  ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK);
  size_t sent = 0;
  for (const auto until = std::chrono::steady_clock::now() + 1s;
       sent < stream.size() && std::chrono::steady_clock::now() < until;) {
    const ssize_t n = ::send(fd, stream.data() + sent, stream.size() - sent, MSG_NOSIGNAL);
    if (n > 0) sent += static_cast<size_t>(n);
    if (n < 0) std::this_thread::sleep_for(10ms);
  }
  // The bound, and the few replies the socket itself holds.
  constexpr size_t kInSocket = 16;
  ASSERT_TRUE(server_.serverEvents.waitFor(kMaxUnansweredRequests));
  EXPECT_FALSE(server_.serverEvents.waitFor(kMaxUnansweredRequests + kInSocket, 300ms));

  // Reading the replies lets the rest in: every request is answered.
  ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) & ~O_NONBLOCK);
  const timeval timeout{10, 0};
  ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  FrameReader replies;
  uint64_t answered = 0;
  std::vector<uint8_t> buffer(256 * 1024);
  while (answered < total) {
    if (sent < stream.size()) {
      const ssize_t n =
          ::send(fd, stream.data() + sent, stream.size() - sent, MSG_NOSIGNAL | MSG_DONTWAIT);
      if (n > 0) sent += static_cast<size_t>(n);
    }
    const ssize_t n = ::recv(fd, buffer.data(), buffer.size(), 0);
    ASSERT_GT(n, 0);
    replies.feed(buffer.data(), static_cast<size_t>(n));
    while (auto frame = replies.next()) {
      ASSERT_TRUE(frame->has_value());
      EXPECT_EQ((*frame)->inReplyTo, ++answered);
    }
  }
  EXPECT_EQ(server_.serverEvents.count("connection invalid"), 0u);
  ::close(fd);
}

TEST_F(ConnectionTest, UnfinishedFramesAreBoundedInSizeAndTime) {
  base::LogCapture log;
  // Peers each half-way through a large frame: the one whose input passes
  // the bound on all unfinished frames is dropped, the others stay.
  const size_t share = kMaxFrameLength - 4 * 1024 * 1024;
  const size_t peers = kMaxUnfinishedInput / share + 1;
  Bytes header = {0x00, 0xF0, 0x00, 0x00};  // a frame of 15 MiB, of which share arrives
  Bytes body(share - header.size(), 0);
  std::vector<int> fds;
  for (size_t i = 0; i < peers; ++i) {
    fds.push_back(rawConnect(path_));
    ASSERT_EQ(::send(fds.back(), header.data(), header.size(), MSG_NOSIGNAL), 4);
    // The last peer's write may fail part-way: it is disconnected.
    (void)::send(fds.back(), body.data(), body.size(), MSG_NOSIGNAL);
  }
  char byte;
  EXPECT_EQ(::recv(fds.back(), &byte, 1, 0), 0);
  EXPECT_EQ(::recv(fds.front(), &byte, 1, MSG_DONTWAIT), -1);  // still open
  // The line follows the close: the peer may see the end first.
  EXPECT_TRUE(logEventually(log, "unfinished frames of all peers exceed"));
  for (int fd : fds) ::close(fd);

  // A peer that stops in the middle of a frame is dropped after the deadline.
  int stalled = rawConnect(path_);
  ASSERT_EQ(::send(stalled, header.data(), header.size(), MSG_NOSIGNAL), 4);
  const auto start = std::chrono::steady_clock::now();
  timeval wait{static_cast<time_t>(kFrameDeadline.count() + 5), 0};
  ::setsockopt(stalled, SOL_SOCKET, SO_RCVTIMEO, &wait, sizeof wait);
  EXPECT_EQ(::recv(stalled, &byte, 1, 0), 0);
  EXPECT_GE(std::chrono::steady_clock::now() - start, kFrameDeadline);
  EXPECT_TRUE(logEventually(
      log, "frame not completed within " + std::to_string(kFrameDeadline.count()) + " seconds"));
  ::close(stalled);
}

TEST_F(ConnectionTest, OneUserCannotTakeEveryConnection) {
  base::LogCapture log;
  ::chmod(dir_.path().c_str(), 0755);
  const size_t extra = 4;
  // A child of another user opens more than its share and counts the
  // connections closed at once: its exit status. Everything it needs is
  // made before the fork, so the child only makes system calls.
  const size_t attempts = kMaxConnectionsPerUser + extra;
  std::vector<pollfd> polled(attempts, pollfd{-1, POLLIN, 0});
  const sockaddr_un addr = unixAddress(path_);
  pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    rlimit files{};
    ::getrlimit(RLIMIT_NOFILE, &files);
    files.rlim_cur = files.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &files);
    if (::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(100);
    for (pollfd& p : polled) {
      p.fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
      if (::connect(p.fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) != 0) ::_exit(101);
    }
    // The refused ones are closed as they are accepted; two seconds is ample.
    int closed = 0;
    for (int round = 0; round < 20; ++round) {
      if (::poll(polled.data(), polled.size(), 100) <= 0) continue;
      for (pollfd& p : polled) {
        char byte;
        if (p.revents != 0 && ::recv(p.fd, &byte, 1, MSG_DONTWAIT) == 0) {
          ++closed;
          p.fd = -1;  // poll ignores it from now on
        }
      }
    }
    ::_exit(closed);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(static_cast<size_t>(WEXITSTATUS(status)), extra);
  EXPECT_EQ(
      log.count("refusing a connection from uid 65534: " + std::to_string(kMaxConnectionsPerUser) +
                " connections of that user are open"),
      extra);
  // Root still connects.
  auto replies = recorder();
  auto c = connectRecorded(path_, recorder());
  request(*c, Dictionary{{"after", Value::integer(1)}}, replies);
  ASSERT_TRUE(replies->waitFor(1));
  EXPECT_NE(replies->events()[0], "connection invalid");
}

}  // namespace
}  // namespace vantrel::lmo
