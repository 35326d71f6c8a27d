#include "lmo/IoLoop.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <cerrno>
#include <future>

#include "base/Check.h"

namespace vantrel::lmo {
namespace {

constexpr uint64_t kWakeToken = 0;
constexpr int kMaxEventsPerWait = 64;

thread_local bool tOnIoThread = false;

}  // namespace

IoLoop& IoLoop::shared() {
  // Never destroyed: connections may still be live while static destructors
  // run, and the thread must outlive them.
  static IoLoop* loop = new IoLoop();
  return *loop;
}

IoLoop::IoLoop()
    : epollFd_(::epoll_create1(EPOLL_CLOEXEC)), wakeFd_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  VT_CHECK(epollFd_ >= 0 && wakeFd_ >= 0, "unable to create the I/O loop");
  epoll_event ev{};
  ev.events = EPOLLIN;
  ev.data.u64 = kWakeToken;
  VT_CHECK(::epoll_ctl(epollFd_, EPOLL_CTL_ADD, wakeFd_, &ev) == 0, "epoll_ctl on the wake fd");
  thread_ = std::thread([this] { run(); });
  thread_.detach();
}

uint64_t IoLoop::add(int fd, uint32_t events, std::shared_ptr<IoSource> source) {
  uint64_t token;
  {
    std::lock_guard lock(mutex_);
    token = nextToken_++;
    sources_.emplace(token, std::move(source));
  }
  epoll_event ev{};
  ev.events = events;
  ev.data.u64 = token;
  VT_CHECK(::epoll_ctl(epollFd_, EPOLL_CTL_ADD, fd, &ev) == 0, "epoll_ctl add");
  return token;
}

void IoLoop::modify(int fd, uint64_t token, uint32_t events) {
  epoll_event ev{};
  ev.events = events;
  ev.data.u64 = token;
  VT_CHECK(::epoll_ctl(epollFd_, EPOLL_CTL_MOD, fd, &ev) == 0, "epoll_ctl modify");
}

void IoLoop::remove(int fd, uint64_t token) {
  VT_CHECK(isCurrent(), "IoLoop::remove off the I/O thread");
  ::epoll_ctl(epollFd_, EPOLL_CTL_DEL, fd, nullptr);
  std::shared_ptr<IoSource> released;
  {
    std::lock_guard lock(mutex_);
    auto it = sources_.find(token);
    if (it == sources_.end()) return;
    released = std::move(it->second);
    sources_.erase(it);
  }
  // released goes out of scope here, outside the lock: destroying a source
  // may post tasks of its own.
}

void IoLoop::post(std::function<void()> task) {
  {
    std::lock_guard lock(mutex_);
    tasks_.push_back(std::move(task));
  }
  uint64_t one = 1;
  ssize_t n = ::write(wakeFd_, &one, sizeof one);
  (void)n;  // EAGAIN means the counter is already non-zero: the loop wakes anyway
}

void IoLoop::runAndWait(const std::function<void()>& task) {
  if (isCurrent()) return task();
  std::promise<void> ran;
  post([&] {
    task();
    ran.set_value();
  });
  ran.get_future().wait();
}

bool IoLoop::isCurrent() const {
  return tOnIoThread;
}

void IoLoop::announceTerminationImminent() {
  post([this] {
    std::vector<std::shared_ptr<IoSource>> sources;
    {
      std::lock_guard lock(mutex_);
      for (auto& [token, source] : sources_) sources.push_back(source);
    }
    for (auto& source : sources) source->terminationImminent();
  });
}

void IoLoop::runPostedTasks() {
  uint64_t count;
  ssize_t n = ::read(wakeFd_, &count, sizeof count);
  (void)n;
  std::vector<std::function<void()>> tasks;
  {
    std::lock_guard lock(mutex_);
    tasks.swap(tasks_);
  }
  for (auto& task : tasks) task();
}

void IoLoop::run() {
  tOnIoThread = true;
  epoll_event events[kMaxEventsPerWait];
  for (;;) {
    int n = ::epoll_wait(epollFd_, events, kMaxEventsPerWait, -1);
    if (n < 0) {
      VT_CHECK(errno == EINTR, "epoll_wait failed");
      continue;
    }
    for (int i = 0; i < n; ++i) {
      uint64_t token = events[i].data.u64;
      if (token == kWakeToken) {
        runPostedTasks();
        continue;
      }
      std::shared_ptr<IoSource> source;
      {
        std::lock_guard lock(mutex_);
        auto it = sources_.find(token);
        // Removed by an earlier callback of this same batch.
        if (it == sources_.end()) continue;
        source = it->second;
      }
      source->handleIo(events[i].events);
    }
  }
}

}  // namespace vantrel::lmo
