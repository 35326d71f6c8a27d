// vantrel-abuse: what hostile peers cost an honest one. vantreld runs as its
// own process on a small generated tree; this program measures one honest
// client's round trips against the idle daemon, then opens idle connections,
// peers that stall half-way through a large frame, and peers that pipeline
// requests without ever reading, and measures the honest client again while
// they do. It reports both latencies, the daemon's peak memory, and how many
// of the stalled peers the daemon dropped.
//
//   vantrel-abuse [--vantreld PATH] [--idle N] [--stalled N] [--pipeliners N]
//                 [--requests N] [--linger S] [--json]
//
// --linger keeps the abusers on for S more seconds after the honest run
// (default: long enough for the frame deadline to drop the stalled peers).
// Exit status 0 when every honest request was answered and the daemon
// lived through the run, 1 when not, 2 for a bad command line. Latencies
// are reported, never judged.

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "bench/BenchTrees.h"
#include "bench/load/Arguments.h"
#include "bench/load/DaemonProcess.h"
#include "bench/load/Wire.h"
#include "bench/load/Workers.h"
#include "lmo/Limits.h"
#include "lmo/Protocol.h"

namespace vantrel::bench::load {
namespace {

using Clock = std::chrono::steady_clock;
using lmo::Dictionary;
using lmo::Value;
using namespace std::chrono_literals;

constexpr auto kStartTimeout = 30s;
// A stalled peer announces a frame this long and sends half of it.
constexpr size_t kStalledFrameBytes = 1024 * 1024;

struct Options {
  std::string vantreld = VANTRELD_PATH;
  int idle = 1000;
  int stalled = 300;
  int pipeliners = 5;
  int requests = 2000;
  double linger = std::chrono::duration<double>(lmo::kFrameDeadline).count() + 2;
  bool json = false;
};

[[noreturn]] void usage(const char* problem) {
  std::fprintf(stderr,
               "vantrel-abuse: %s\n"
               "usage: vantrel-abuse [--vantreld PATH] [--idle N] [--stalled N] "
               "[--pipeliners N] [--requests N] [--linger S] [--json]\n",
               problem);
  std::exit(2);
}

Options parseOptions(int argc, char** argv) {
  Options options;
  const std::optional<std::string> problem =
      walkArguments(argc, argv, &options.json, &options.vantreld,
                    [&](std::string_view name, double number) -> std::optional<std::string> {
                      if (name == "--idle") {
                        options.idle = static_cast<int>(number);
                      } else if (name == "--stalled") {
                        options.stalled = static_cast<int>(number);
                      } else if (name == "--pipeliners") {
                        options.pipeliners = static_cast<int>(number);
                      } else if (name == "--requests") {
                        options.requests = std::max(1, static_cast<int>(number));
                      } else if (name == "--linger") {
                        options.linger = number;
                      } else {
                        return "unknown option " + std::string(name);
                      }
                      return std::nullopt;
                    });
  if (problem) usage(problem->c_str());
  return options;
}

Bytes annotateRequest() {
  return requestFrame(
      Dictionary{{protocol::kKeyRequest, Value(protocol::kRequestAnnotate)},
                 {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
                 {protocol::kKeyAnnotations, Value(Dictionary{})}});
}

// Round trips of one blocking client, in microseconds, sorted; empty when a
// reply was missing or wrong (why is in *problem).
std::vector<double> honestRun(const std::string& socket, int requests, std::string* problem) {
  const int fd = connectTo(socket);
  if (fd < 0) {
    *problem = "the honest client cannot connect";
    return {};
  }
  FrameSocket connection(fd);
  Bytes request = annotateRequest();
  std::vector<double> micros;
  micros.reserve(static_cast<size_t>(requests));
  for (int i = 1; i <= requests; ++i) {
    setFrameId(request, static_cast<uint64_t>(i));
    const auto start = Clock::now();
    std::span<uint8_t> reply;
    if (connection.send(request)) reply = connection.receive();
    if (reply.empty()) {
      *problem = "no reply to honest request " + std::to_string(i);
      return {};
    }
    if (auto wrong = checkReply(reply, static_cast<uint64_t>(i), {})) {
      *problem = "honest request " + std::to_string(i) + " got " + *wrong;
      return {};
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  std::sort(micros.begin(), micros.end());
  return micros;
}

bool waitUntilServing(const std::string& socket) {
  const auto deadline = Clock::now() + kStartTimeout;
  std::string ignored;
  while (Clock::now() < deadline) {
    if (!honestRun(socket, 1, &ignored).empty()) return true;
    std::this_thread::sleep_for(10ms);
  }
  return false;
}

// Sends request frames without reading a reply, as fast as the socket
// takes them, until stop.
void pipeline(int fd, const std::atomic<bool>& stop, std::atomic<uint64_t>& sent) {
  Bytes request = annotateRequest();
  uint64_t id = 0;
  size_t offset = request.size();  // whole: the next frame is due
  while (!stop.load(std::memory_order_relaxed)) {
    if (offset == request.size()) {
      setFrameId(request, ++id);
      offset = 0;
    }
    const ssize_t n =
        ::send(fd, request.data() + offset, request.size() - offset, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (n > 0) {
      offset += static_cast<size_t>(n);
      if (offset == request.size()) sent.fetch_add(1, std::memory_order_relaxed);
      continue;
    }
    if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) return;  // dropped
    pollfd p{fd, POLLOUT, 0};
    ::poll(&p, 1, 50);
  }
}

// Whether the daemon has closed fd (end of stream or reset), without waiting.
bool closedByDaemon(int fd) {
  uint8_t byte;
  const ssize_t n = ::recv(fd, &byte, 1, MSG_DONTWAIT);
  return n == 0 || (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK);
}

void raiseDescriptorLimit() {
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur < limit.rlim_max) {
    limit.rlim_cur = limit.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &limit);
  }
}

struct Figures {
  std::vector<double> idle;
  std::vector<double> abused;
  uint64_t peakBeforeKiB = 0;
  uint64_t peakKiB = 0;
  int idleOpened = 0;
  int stalledOpened = 0;
  int stalledDropped = 0;
  uint64_t pipelined = 0;
  int pipelinersDropped = 0;
};

void print(const Options& options, const Figures& f) {
  const auto p = [](const std::vector<double>& v, double q) { return percentile(v, q); };
  if (options.json) {
    std::printf(
        "{\"idle_connections\": %d, \"stalled_peers\": %d, \"stalled_dropped\": %d, "
        "\"pipeliners\": %d, \"pipeliners_dropped\": %d, \"pipelined_requests\": %llu, "
        "\"requests\": %d, \"idle_p50_us\": %.1f, \"idle_p99_us\": %.1f, "
        "\"abused_p50_us\": %.1f, \"abused_p99_us\": %.1f, \"peak_before_kib\": %llu, "
        "\"peak_kib\": %llu}\n",
        f.idleOpened, f.stalledOpened, f.stalledDropped, options.pipeliners, f.pipelinersDropped,
        static_cast<unsigned long long>(f.pipelined), options.requests, p(f.idle, 0.5),
        p(f.idle, 0.99), p(f.abused, 0.5), p(f.abused, 0.99),
        static_cast<unsigned long long>(f.peakBeforeKiB),
        static_cast<unsigned long long>(f.peakKiB));
    return;
  }
  std::printf("| figure | idle daemon | under abuse |\n|---|---|---|\n");
  std::printf("| honest round trip p50 (us) | %.1f | %.1f |\n", p(f.idle, 0.5), p(f.abused, 0.5));
  std::printf("| honest round trip p99 (us) | %.1f | %.1f |\n", p(f.idle, 0.99), p(f.abused, 0.99));
  std::printf("| daemon peak memory (MiB) | %.1f | %.1f |\n", f.peakBeforeKiB / 1024.0,
              f.peakKiB / 1024.0);
  std::printf(
      "\nabusers: %d idle connections, %d stalled half-frames (%d dropped by the daemon), "
      "%d pipeliners (%d dropped) that sent %llu requests unread; %d honest requests per "
      "phase\n",
      f.idleOpened, f.stalledOpened, f.stalledDropped, options.pipeliners, f.pipelinersDropped,
      static_cast<unsigned long long>(f.pipelined), options.requests);
}

int run(const Options& options) {
  raiseDescriptorLimit();
  Tree tree(2, 10);
  const std::string work = makeTempDir();
  auto started = DaemonProcess::start(
      DaemonConfig{options.vantreld, tree.root + "/apps", work + "/state", work, 0});
  if (!started.has_value()) {
    std::fprintf(stderr, "vantrel-abuse: %s\n", started.error().description().c_str());
    return 1;
  }
  std::unique_ptr<DaemonProcess> daemon = std::move(started).value();
  const std::string& socket = daemon->socket();
  if (!waitUntilServing(socket)) {
    std::fprintf(stderr, "vantrel-abuse: the daemon did not answer\n%s", daemon->logTail().c_str());
    return 1;
  }

  Figures figures;
  std::string problem;
  figures.idle = honestRun(socket, options.requests, &problem);
  if (auto memory = daemon->memory()) figures.peakBeforeKiB = memory->peakKiB;

  std::vector<int> idle;
  for (int i = 0; i < options.idle; ++i) {
    if (int fd = connectTo(socket); fd >= 0) idle.push_back(fd);
  }
  figures.idleOpened = static_cast<int>(idle.size());

  // Half of a frame that announces kStalledFrameBytes.
  const Bytes big = requestFrame(
      Dictionary{{protocol::kKeyRequest, Value(protocol::kRequestAnnotate)},
                 {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
                 {"padding", Value::data(Bytes(kStalledFrameBytes, 0x5a))}});
  std::vector<int> stalled;
  for (int i = 0; i < options.stalled; ++i) {
    const int fd = connectTo(socket);
    if (fd < 0) continue;
    ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK);
    size_t sent = 0;
    const auto until = Clock::now() + 1s;
    while (sent < big.size() / 2 && Clock::now() < until) {
      const ssize_t n = ::send(fd, big.data() + sent, big.size() / 2 - sent, MSG_NOSIGNAL);
      if (n > 0) {
        sent += static_cast<size_t>(n);
      } else if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
        pollfd p{fd, POLLOUT, 0};
        ::poll(&p, 1, 10);
      } else {
        break;  // already dropped
      }
    }
    stalled.push_back(fd);
  }
  figures.stalledOpened = static_cast<int>(stalled.size());

  std::atomic<bool> stop{false};
  std::atomic<uint64_t> pipelined{0};
  std::vector<int> pipelineFds;
  std::vector<std::thread> pipeliners;
  for (int i = 0; i < options.pipeliners; ++i) {
    const int fd = connectTo(socket);
    if (fd < 0) continue;
    pipelineFds.push_back(fd);
    pipeliners.emplace_back(pipeline, fd, std::cref(stop), std::ref(pipelined));
  }
  std::this_thread::sleep_for(500ms);  // the pipeliners fill what they can

  if (problem.empty()) figures.abused = honestRun(socket, options.requests, &problem);
  std::this_thread::sleep_for(std::chrono::duration<double>(options.linger));
  stop = true;
  for (std::thread& t : pipeliners) t.join();
  figures.pipelined = pipelined.load();
  for (int fd : stalled) figures.stalledDropped += closedByDaemon(fd) ? 1 : 0;
  for (int fd : pipelineFds) figures.pipelinersDropped += closedByDaemon(fd) ? 1 : 0;
  const std::optional<DaemonProcess::Memory> memory = daemon->memory();
  if (memory) figures.peakKiB = memory->peakKiB;
  // A daemon still serving a fresh client after all that.
  if (problem.empty() && (!memory || honestRun(socket, 1, &problem).empty())) {
    if (problem.empty()) problem = "the daemon is gone";
  }
  for (int fd : idle) ::close(fd);
  for (int fd : stalled) ::close(fd);
  for (int fd : pipelineFds) ::close(fd);
  daemon->stop();

  print(options, figures);
  if (!problem.empty()) {
    std::fprintf(stderr, "vantrel-abuse: %s\n%s", problem.c_str(), daemon->logTail().c_str());
    return 1;
  }
  return 0;
}

}  // namespace
}  // namespace vantrel::bench::load

int main(int argc, char** argv) {
  using namespace vantrel::bench::load;
  const Options options = parseOptions(argc, argv);
  if (::access(options.vantreld.c_str(), X_OK) != 0) {
    std::fprintf(stderr, "vantrel-abuse: cannot run %s (--vantreld names the daemon)\n",
                 options.vantreld.c_str());
    return 2;
  }
  ::signal(SIGPIPE, SIG_IGN);
  return run(options);
}
