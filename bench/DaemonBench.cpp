// Daemon figures: the round trip of a request the daemon answers without
// work ("annotate" with an empty change) through an lmo connection to an
// in-process server, next to a raw AF_UNIX ping-pong of the same frame sizes
// (the floor), and the request rate with 1, 4 and 16 concurrent clients.
//
// Every client keeps exactly one request in flight: it sends, waits for the
// reply on its own reply queue, then sends the next. The rate figures are
// therefore closed-loop: what N such clients get out of the daemon together.

#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "bench/BenchTrees.h"
#include "daemon/VTDServer.h"
#include "lmo/Connection.h"
#include "lmo/Frame.h"
#include "lmo/Protocol.h"
#include "omnidex/Omnidex.h"

namespace vantrel::bench {
namespace {

using namespace std::chrono_literals;
using lmo::Dictionary;
using lmo::Value;

// How long one request may stay unanswered before the benchmark reports an
// error instead of waiting on (a lost reply must not hang the run).
constexpr auto kReplyTimeout = 10s;
// How long teardown at exit waits for every connection to close before it
// leaves the server to the process's end rather than destroy it under them.
constexpr auto kTeardownTimeout = 5s;
constexpr auto kTeardownPoll = 5ms;

// An empty change: the daemon validates it and replies {} without touching
// the database.
Dictionary annotateRequest() {
  return Dictionary{{protocol::kKeyRequest, Value(protocol::kRequestAnnotate)},
                    {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
                    {protocol::kKeyAnnotations, Value(Dictionary{})}};
}

// The frames as they travel: the request, and the daemon's empty reply. The
// header's ids are fixed-width, so the sizes do not depend on them.
std::vector<uint8_t> requestFrame() {
  return lmo::encodeFrame({lmo::FrameKind::kRequest, 1, 0, annotateRequest()}).value();
}
std::vector<uint8_t> replyFrame() {
  return lmo::encodeFrame({lmo::FrameKind::kReply, 1, 1, Dictionary{}}).value();
}

void setFrameCounters(benchmark::State& state) {
  state.counters["request_bytes"] = static_cast<double>(requestFrame().size());
  state.counters["reply_bytes"] = static_cast<double>(replyFrame().size());
}

// The process's one server (the server is a process singleton) over an empty
// registry, with its socket, state and preferences in a temporary directory.
// Built on first use; torn down when static objects are destroyed at exit.
class InProcessDaemon {
 public:
  static InProcessDaemon& shared() {
    static InProcessDaemon instance;
    return instance;
  }
  ~InProcessDaemon();
  InProcessDaemon(const InProcessDaemon&) = delete;
  InProcessDaemon& operator=(const InProcessDaemon&) = delete;

  // Null when the server could not be made; error() then says why.
  const daemon::VTDServerPtr& server() const { return server_; }
  const std::string& error() const { return error_; }
  // The service name: the socket's absolute path.
  const std::string& socket() const { return socket_; }

 private:
  InProcessDaemon();

  // Constant after construction.
  std::string root_;
  std::string socket_;
  std::string error_;
  std::shared_ptr<omnidex::Omnidex> registry_;
  daemon::VTDServerPtr server_;
};

// Where a server that could not be torn down is kept until the process ends:
// reachable, so that the leak checker does not report it, and never destroyed
// under a connection that is still open. Written once, by the teardown at exit.
daemon::VTDServerPtr* gServerLeftToExit = nullptr;

InProcessDaemon::InProcessDaemon() : root_(makeTempDir()), socket_(root_ + "/vantreld.socket") {
  // Read when the server and its stores are made, so set before anything.
  ::setenv("VANTREL_RUNTIME_DIR", (root_ + "/run").c_str(), 1);
  ::setenv("VANTREL_STATE_DIR", (root_ + "/state").c_str(), 1);
  ::setenv("XDG_STATE_HOME", (root_ + "/xdg").c_str(), 1);
  ::setenv("VANTREL_PREFERENCES_DIR", (root_ + "/prefs").c_str(), 1);
  // The 10,000 plug-ins the match figure needs; the annotate figures do not
  // touch them.
  registry_ = largeRegistry();
  const std::string annotations = root_ + "/Annotations";
  server_ = daemon::VTDServer::initForService(socket_.c_str(), annotations.c_str(), registry_);
  if (server_ == nullptr) {
    error_ = "cannot make the server on " + socket_ + " (see the log)";
    return;
  }
  server_->resume();
}

InProcessDaemon::~InProcessDaemon() {
  if (server_ != nullptr) {
    server_->cancelListenerForTest();
    const auto deadline = std::chrono::steady_clock::now() + kTeardownTimeout;
    while (lmo::Connection::openCount() != 0 && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(kTeardownPoll);
    }
    if (lmo::Connection::openCount() == 0) {
      // The connections' last events and the transactions they queued run
      // before the server goes, so none of it is released on its queues.
      server_->lmoQueue()->sync([] {});
      server_->mainQueue()->sync([] {});
      daemon::VTDServer::resetForTest();
      server_.reset();
    } else {
      gServerLeftToExit = new daemon::VTDServerPtr(std::move(server_));
    }
  }
  registry_.reset();
  std::error_code ec;
  std::filesystem::remove_all(root_, ec);
}

// One client of the daemon: its own connection and reply queue, one request
// in flight at a time.
class Client {
 public:
  explicit Client(const std::string& service)
      : queue_(std::make_shared<base::SerialQueue>("bench-client")),
        connection_(lmo::Connection::connectToService(service, queue_)),
        replies_(std::make_shared<Replies>()) {
    connection_->setEventHandler([](const lmo::Event&) {});
    connection_->resume();
  }
  ~Client() { connection_->cancel(); }
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  // Sends request and waits for its reply. nullopt when the reply came and
  // was the empty dictionary an empty change gets; otherwise what went wrong
  // (not sent, no reply in time, connection ended, another reply).
  // With reply given, any reply is taken and stored there.
  std::optional<std::string> roundTrip(const Dictionary& request, Dictionary* reply = nullptr) {
    const uint64_t ticket = ++sent_;
    auto sent =
        connection_->sendWithReply(request, queue_, [replies = replies_](const lmo::Event& event) {
          {
            std::lock_guard lock(replies->mutex);
            replies->last = event.message() ? std::optional(event.message()->body()) : std::nullopt;
            ++replies->count;
          }
          replies->arrived.notify_one();
        });
    if (!sent.has_value()) return "cannot send: " + sent.error().description();
    std::unique_lock lock(replies_->mutex);
    if (!replies_->arrived.wait_for(lock, kReplyTimeout,
                                    [&] { return replies_->count >= ticket; })) {
      return "no reply within the timeout";
    }
    if (!replies_->last) return "the connection ended instead of replying";
    if (reply != nullptr) {
      *reply = *replies_->last;
      return std::nullopt;
    }
    if (!replies_->last->empty()) return "unexpected reply " + lmo::describe(*replies_->last);
    return std::nullopt;
  }

 private:
  // Shared with the reply handlers, which may outlive a timed-out wait.
  struct Replies {
    std::mutex mutex;
    std::condition_variable arrived;
    uint64_t count = 0;              // Guarded by mutex.
    std::optional<Dictionary> last;  // Guarded by mutex; nullopt: connection ended.
  };

  lmo::QueuePtr queue_;
  std::shared_ptr<lmo::Connection> connection_;
  std::shared_ptr<Replies> replies_;
  uint64_t sent_ = 0;  // The benchmark thread's own.
};

// Runs the annotate round trip for as long as state asks, on one client of
// the shared server. The first round trip (connection accepted, client set
// up in the daemon) is not timed.
//
// On a failure the loop is still entered and left through KeepRunning():
// the threads of a threaded run meet at its start and its end, so a thread
// that returned or broke out early would leave the others waiting for good.
void runAnnotateLoop(benchmark::State& state) {
  InProcessDaemon& server = InProcessDaemon::shared();
  const Dictionary request = annotateRequest();
  std::unique_ptr<Client> client;
  std::optional<std::string> failure;
  if (server.server() == nullptr) {
    failure = server.error();
  } else {
    client = std::make_unique<Client>(server.socket());
    failure = client->roundTrip(request);
  }
  if (failure) state.SkipWithError(failure->c_str());
  while (state.KeepRunning()) {
    if (auto trip = client->roundTrip(request)) state.SkipWithError(trip->c_str());
  }
}

void BM_DaemonAnnotateRoundTrip(benchmark::State& state) {
  runAnnotateLoop(state);
  setFrameCounters(state);
}
BENCHMARK(BM_DaemonAnnotateRoundTrip)->UseRealTime()->Unit(benchmark::kMicrosecond);

// Each benchmark thread is one client with its own connection.
// "match" through the socket over 10,000 registered plug-ins with a rule
// that selects the 100 of one extension point, warm (the daemon's cache
// and the registry are filled by an untimed first request). Each reply
// carries 100 forms with their read tokens. p50 and p99 of the requests.
void BM_DaemonMatchOver10000(benchmark::State& state) {
  InProcessDaemon& server = InProcessDaemon::shared();
  const Dictionary request{
      {protocol::kKeyRequest, Value(protocol::kRequestMatch)},
      {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
      {protocol::kKeyRules,
       Value(Dictionary{{"QXExtensionPointIdentifier", Value("com.bench.point42")}})}};
  std::unique_ptr<Client> client;
  std::optional<std::string> failure;
  Dictionary reply;
  if (server.server() == nullptr) {
    failure = server.error();
  } else {
    client = std::make_unique<Client>(server.socket());
    failure = client->roundTrip(request, &reply);
  }
  const lmo::Array* matches = reply.get(protocol::kKeyMatches).getIfArray();
  const size_t matched = matches ? matches->size() : 0;
  if (!failure && matched != 10000 / kExtensionPoints) {
    failure = "unexpected reply " + lmo::describe(reply).substr(0, 200);
  }
  if (failure) state.SkipWithError(failure->c_str());
  std::vector<double> micros;
  while (state.KeepRunning()) {
    if (failure) continue;
    const auto start = std::chrono::steady_clock::now();
    if (auto trip = client->roundTrip(request, &reply)) state.SkipWithError(trip->c_str());
    micros.push_back(
        std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start)
            .count());
  }
  if (micros.empty()) return;
  std::sort(micros.begin(), micros.end());
  state.counters["p50_us"] = micros[micros.size() / 2];
  state.counters["p99_us"] = micros[std::min(micros.size() - 1, micros.size() * 99 / 100)];
  state.counters["matches"] = static_cast<double>(matched);
}
BENCHMARK(BM_DaemonMatchOver10000)->UseRealTime()->Unit(benchmark::kMicrosecond)->MinTime(2.0);

void BM_DaemonAnnotateRate(benchmark::State& state) {
  runAnnotateLoop(state);
  state.SetItemsProcessed(state.iterations());
  state.counters["clients"] = benchmark::Counter(state.threads(), benchmark::Counter::kAvgThreads);
  state.counters["requests_per_s"] =
      benchmark::Counter(static_cast<double>(state.iterations()), benchmark::Counter::kIsRate);
}
BENCHMARK(BM_DaemonAnnotateRate)
    ->Threads(1)
    ->Threads(4)
    ->Threads(16)
    ->UseRealTime()
    ->Unit(benchmark::kMicrosecond);

// Whole-buffer read and write on a blocking socket; false when the peer is
// gone or the call fails.
bool readFully(int fd, uint8_t* data, size_t size) {
  size_t got = 0;
  while (got < size) {
    const ssize_t n = ::read(fd, data + got, size - got);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    got += static_cast<size_t>(n);
  }
  return true;
}

bool writeFully(int fd, const uint8_t* data, size_t size) {
  size_t put = 0;
  while (put < size) {
    const ssize_t n = ::write(fd, data + put, size - put);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    put += static_cast<size_t>(n);
  }
  return true;
}

// The floor for the daemon's round trip: two threads, one socket pair, the
// request frame's bytes one way and the reply frame's bytes back, with plain
// blocking read and write and nothing else.
void BM_RawSocketPingPongDaemonFrames(benchmark::State& state) {
  const std::vector<uint8_t> request = requestFrame();
  const std::vector<uint8_t> reply = replyFrame();
  int fds[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) {
    state.SkipWithError("socketpair failed");
    return;
  }
  std::thread answerer([fd = fds[1], &request, &reply] {
    std::vector<uint8_t> in(request.size());
    while (readFully(fd, in.data(), in.size()) && writeFully(fd, reply.data(), reply.size())) {
    }
  });
  std::vector<uint8_t> in(reply.size());
  for (auto _ : state) {
    if (!writeFully(fds[0], request.data(), request.size()) ||
        !readFully(fds[0], in.data(), in.size())) {
      state.SkipWithError("ping-pong socket failed");
      break;
    }
  }
  // The answerer's read sees the end of the stream and it returns.
  ::shutdown(fds[0], SHUT_RDWR);
  answerer.join();
  ::close(fds[0]);
  ::close(fds[1]);
  setFrameCounters(state);
}
BENCHMARK(BM_RawSocketPingPongDaemonFrames)->UseRealTime()->Unit(benchmark::kMicrosecond);

}  // namespace
}  // namespace vantrel::bench
