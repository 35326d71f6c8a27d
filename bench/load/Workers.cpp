#include "bench/load/Workers.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <memory>
#include <thread>
#include <unordered_map>

namespace vantrel::bench::load {
namespace {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

// How long stopChild waits for SIGTERM to take before it uses SIGKILL.
constexpr auto kStopTimeout = 5s;
constexpr auto kStopPoll = 5ms;
// Events taken from the epoll set per wait.
constexpr int kMaxEvents = 64;

base::Error failure(std::string text) {
  return base::Error{"LoadBench", 1, std::move(text)};
}

double secondsSince(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

// A report on the pipe: a status byte (1 fine, 0 failed), then either the
// figures and the latencies or the length and text of the error.
void sendReport(int fd, const ClientReport& report, const std::string& error) {
  const uint8_t ok = error.empty() ? 1 : 0;
  writeAll(fd, &ok, 1);
  if (!ok) {
    const uint64_t size = error.size();
    writeAll(fd, &size, sizeof size);
    writeAll(fd, error.data(), error.size());
    return;
  }
  const uint64_t header[] = {report.requests, report.replyBytes, report.micros.size()};
  writeAll(fd, header, sizeof header);
  writeAll(fd, &report.seconds, sizeof report.seconds);
  writeAll(fd, report.micros.data(), report.micros.size() * sizeof(double));
}

base::Result<ClientReport> receiveReport(int fd) {
  uint8_t ok = 0;
  if (!readAll(fd, &ok, 1)) return failure("a client process ended without a report");
  if (!ok) {
    uint64_t size = 0;
    std::string error;
    if (readAll(fd, &size, sizeof size)) {
      error.resize(size);
      readAll(fd, error.data(), size);
    }
    return failure(error);
  }
  ClientReport report;
  uint64_t header[3];
  if (!readAll(fd, header, sizeof header) || !readAll(fd, &report.seconds, sizeof report.seconds)) {
    return failure("a client process's report was cut short");
  }
  report.requests = header[0];
  report.replyBytes = header[1];
  report.micros.resize(header[2]);
  if (!readAll(fd, report.micros.data(), report.micros.size() * sizeof(double))) {
    return failure("a client process's report was cut short");
  }
  return report;
}

// A client process: warm up, say so on ready, wait until go reaches its
// end (the parent closes it once every client is ready), run, report.
[[noreturn]] void clientMain(const std::function<int()>& connect, const Load& load, int ready,
                             int go, int reportFd) {
  ClientReport report;
  std::string error;
  std::unique_ptr<FrameSocket> socket;
  Bytes request = load.request;
  uint64_t id = 0;
  const auto roundTrip = [&] {
    setFrameId(request, ++id);
    if (!socket->send(request)) {
      error = "cannot send request " + std::to_string(id);
      return false;
    }
    const std::span<uint8_t> reply = socket->receive();
    if (reply.empty()) {
      error = "the connection ended without a reply to request " + std::to_string(id);
      return false;
    }
    report.replyBytes = reply.size();
    if (auto wrong = checkReply(reply, id, load.reply)) error = "got " + *wrong;
    return error.empty();
  };

  if (const int fd = connect(); fd < 0) {
    error = "cannot connect";
  } else {
    socket = std::make_unique<FrameSocket>(fd);
    for (int i = 0; i < load.warmup && roundTrip(); ++i) {
    }
  }
  uint8_t byte = 1;
  writeAll(ready, &byte, 1);
  ::close(ready);
  readAll(go, &byte, 1);

  if (error.empty()) {
    const Clock::time_point start = Clock::now();
    if (load.requests > 0) {
      report.micros.reserve(load.requests);
      for (uint64_t i = 0; i < load.requests; ++i) {
        const Clock::time_point sent = Clock::now();
        if (!roundTrip()) break;
        report.micros.push_back(
            std::chrono::duration<double, std::micro>(Clock::now() - sent).count());
      }
      report.requests = report.micros.size();
    } else {
      const Clock::time_point deadline = start + std::chrono::duration_cast<Clock::duration>(
                                                     std::chrono::duration<double>(load.seconds));
      while (Clock::now() < deadline && roundTrip()) ++report.requests;
    }
    report.seconds = secondsSince(start);
  }
  sendReport(reportFd, report, error);
  ::_exit(error.empty() ? 0 : 1);
}

[[noreturn]] void answer(int fd, Bytes reply) {
  FrameSocket socket(fd);
  for (;;) {
    const std::span<uint8_t> request = socket.receive();
    if (request.empty()) ::_exit(0);
    setFrameInReplyTo(reply, frameId(request));
    if (!socket.send(reply)) ::_exit(0);
  }
}

// Level-triggered, one read per readiness: the fewest system calls a server
// of one request at a time per connection can make (wait, read, write).
[[noreturn]] void serveEpoll(int listener, Bytes reply) {
  const int epoll = ::epoll_create1(EPOLL_CLOEXEC);
  ::fcntl(listener, F_SETFL, ::fcntl(listener, F_GETFL) | O_NONBLOCK);
  const auto watch = [epoll](int fd) {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.fd = fd;
    return ::epoll_ctl(epoll, EPOLL_CTL_ADD, fd, &event) == 0;
  };
  if (epoll < 0 || !watch(listener)) ::_exit(1);
  std::unordered_map<int, FrameSplitter> peers;
  const auto drop = [&peers](int fd) {
    ::close(fd);  // also leaves the epoll set
    peers.erase(fd);
  };
  epoll_event events[kMaxEvents];
  for (;;) {
    const int count = ::epoll_wait(epoll, events, kMaxEvents, -1);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) ::_exit(1);
    for (int i = 0; i < count; ++i) {
      const int fd = events[i].data.fd;
      if (fd == listener) {
        for (int peer;
             (peer = ::accept4(listener, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC)) >= 0;) {
          if (watch(peer)) {
            peers[peer];
          } else {
            ::close(peer);
          }
        }
        continue;
      }
      FrameSplitter& in = peers[fd];
      const ssize_t got = ::read(fd, in.space(kReadSize), kReadSize);
      if (got < 0 && (errno == EAGAIN || errno == EINTR)) continue;
      if (got <= 0) {
        drop(fd);
        continue;
      }
      in.commit(static_cast<size_t>(got));
      bool alive = true;
      for (std::span<uint8_t> request = in.next(); alive && !request.empty(); request = in.next()) {
        setFrameInReplyTo(reply, frameId(request));
        // One request in flight per client: the reply always fits in the
        // socket's buffer, so a short write means the peer is gone.
        alive = ::write(fd, reply.data(), reply.size()) == static_cast<ssize_t>(reply.size());
      }
      if (!alive || in.bad()) drop(fd);
    }
  }
}

}  // namespace

base::Result<std::vector<ClientReport>> runClients(int clients, const std::function<int()>& connect,
                                                   const Load& load) {
  int ready[2];
  int go[2];
  if (::pipe2(ready, O_CLOEXEC) != 0) return failure("cannot make a pipe");
  if (::pipe2(go, O_CLOEXEC) != 0) {
    ::close(ready[0]);
    ::close(ready[1]);
    return failure("cannot make a pipe");
  }
  std::vector<pid_t> children;
  std::vector<int> reports;
  for (int i = 0; i < clients; ++i) {
    int report[2];
    if (::pipe2(report, O_CLOEXEC) != 0) break;
    const pid_t parent = ::getpid();
    const pid_t pid = ::fork();
    if (pid == 0) {
      dieWithParent(parent);
      ::close(ready[0]);
      ::close(go[1]);
      ::close(report[0]);
      clientMain(connect, load, ready[1], go[0], report[1]);
    }
    ::close(report[1]);
    if (pid < 0) {
      ::close(report[0]);
      break;
    }
    children.push_back(pid);
    reports.push_back(report[0]);
  }
  ::close(ready[1]);
  ::close(go[0]);
  // Every child says it is ready, or has died (its end of the pipe closes).
  for (size_t i = 0; i < children.size(); ++i) {
    uint8_t byte;
    if (!readAll(ready[0], &byte, 1)) break;
  }
  ::close(ready[0]);
  ::close(go[1]);  // the start

  std::vector<ClientReport> results;
  std::optional<base::Error> error;
  if (static_cast<int>(children.size()) != clients) {
    error = failure("cannot start " + std::to_string(clients) + " client processes");
  }
  for (size_t i = 0; i < children.size(); ++i) {
    base::Result<ClientReport> report = receiveReport(reports[i]);
    ::close(reports[i]);
    ::waitpid(children[i], nullptr, 0);
    if (report.has_value()) {
      results.push_back(std::move(report).value());
    } else if (!error) {
      error = report.error();
    }
  }
  if (error) return *error;
  return results;
}

pid_t startAnswerer(int fd, const Bytes& reply) {
  const pid_t parent = ::getpid();
  const pid_t pid = ::fork();
  if (pid == 0) {
    dieWithParent(parent);
    answer(fd, reply);
  }
  return pid;
}

pid_t startEpollServer(int listener, const Bytes& reply) {
  const pid_t parent = ::getpid();
  const pid_t pid = ::fork();
  if (pid == 0) {
    dieWithParent(parent);
    serveEpoll(listener, reply);
  }
  return pid;
}

void dieWithParent(pid_t parent) {
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (::getppid() != parent) ::_exit(127);
}

void stopChild(pid_t pid) {
  if (pid <= 0) return;
  ::kill(pid, SIGTERM);
  const Clock::time_point deadline = Clock::now() + kStopTimeout;
  while (::waitpid(pid, nullptr, WNOHANG) == 0) {
    if (Clock::now() > deadline) {
      ::kill(pid, SIGKILL);
      ::waitpid(pid, nullptr, 0);
      return;
    }
    std::this_thread::sleep_for(kStopPoll);
  }
}

double percentile(const std::vector<double>& sorted, double p) {
  if (sorted.empty()) return 0;
  // Nearest rank: the smallest sample with at least p of them at or below it.
  const auto rank = static_cast<size_t>(std::ceil(p * static_cast<double>(sorted.size())));
  return sorted[std::clamp<size_t>(rank, 1, sorted.size()) - 1];
}

}  // namespace vantrel::bench::load
