#include "omnidex/Watcher.h"

#include <sys/inotify.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <utility>

#include "base/Log.h"
#include "lmo/IoLoop.h"
#include "omnidex/BundlePaths.h"
#include "omnidex/Limits.h"
#include "platform/AtomicFile.h"

namespace vantrel::omnidex {
namespace {

// What makes a bundle look different to the registry: entries appearing,
// going or being renamed, files finished being written, and owner or mode
// changes (which decide whether entitlements are trusted).
constexpr uint32_t kWatchMask = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO |
                                IN_CLOSE_WRITE | IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF |
                                IN_ONLYDIR;
constexpr size_t kEventBufferBytes = 64 * 1024;

std::string_view lastComponent(const std::string& path) {
  return std::string_view(path).substr(path.rfind('/') + 1);
}

std::string parentOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
}

}  // namespace

// Watches one of the watcher's descriptors on the I/O loop. The I/O thread
// only drains the descriptor and hands what it read to the watcher's queue.
class Watcher::Source : public lmo::IoSource {
 public:
  Source(Watcher* watcher, int fd, bool timer) : watcher_(watcher), fd_(fd), timer_(timer) {}

  void handleIo(uint32_t) override {
    Watcher* const watcher = watcher_;
    if (timer_) {
      uint64_t expirations = 0;
      while (::read(fd_, &expirations, sizeof expirations) < 0 && errno == EINTR) {
      }
      watcher->queue_->async([watcher] { watcher->flushIfDue(); });
      return;
    }
    std::vector<char> bytes;
    bool overflow = false;
    alignas(inotify_event) char buffer[kEventBufferBytes];
    while (true) {
      const ssize_t n = ::read(fd_, buffer, sizeof buffer);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;  // EAGAIN: drained
      // Events the queue has not caught up with are bounded like the
      // kernel's own queue: past the bound they stand for "everything".
      if (watcher->unhandledEventBytes_.load(std::memory_order_relaxed) + bytes.size() + n >
          kMaxUnhandledEventBytes) {
        overflow = true;
        continue;
      }
      bytes.insert(bytes.end(), buffer, buffer + n);
    }
    if (bytes.empty() && !overflow) return;
    watcher->unhandledEventBytes_.fetch_add(bytes.size(), std::memory_order_relaxed);
    watcher->queue_->async([watcher, bytes = std::move(bytes), overflow] {
      watcher->unhandledEventBytes_.fetch_sub(bytes.size(), std::memory_order_relaxed);
      if (overflow) watcher->noteAll();
      watcher->handleEvents(bytes);
    });
  }

  uint64_t token = 0;

 private:
  Watcher* const watcher_;  // outlives the source: ~Watcher removes it first
  const int fd_;
  const bool timer_;
};

base::Result<std::unique_ptr<Watcher>> Watcher::create(std::vector<ScanRoot> roots,
                                                       ChangeHandler handler) {
  const int inotifyFd = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (inotifyFd < 0)
    return platform::posixError(errno, "cannot watch", "the application directories");
  const int timerFd = ::timerfd_create(CLOCK_MONOTONIC, TFD_NONBLOCK | TFD_CLOEXEC);
  if (timerFd < 0) {
    const int err = errno;
    ::close(inotifyFd);
    return platform::posixError(err, "cannot watch", "the application directories");
  }
  std::unique_ptr<Watcher> watcher(
      new Watcher(std::move(roots), std::move(handler), inotifyFd, timerFd));
  for (size_t i = 0; i < watcher->roots_.size(); ++i) watcher->watchRoot(i);
  return watcher;
}

Watcher::Watcher(std::vector<ScanRoot> roots, ChangeHandler handler, int inotifyFd, int timerFd)
    : roots_(std::move(roots)),
      handler_(std::move(handler)),
      inotifyFd_(inotifyFd),
      timerFd_(timerFd),
      queue_(
          std::make_shared<base::SerialQueue>("omnidex.watcher", base::QueuePriority::kUtility)) {}

Watcher::~Watcher() {
  lmo::IoLoop& loop = lmo::IoLoop::shared();
  loop.runAndWait([&] {
    if (inotifySource_) loop.remove(inotifyFd_, inotifySource_->token);
    if (timerSource_) loop.remove(timerFd_, timerSource_->token);
    inotifySource_.reset();
    timerSource_.reset();
  });
  // Nothing is handed to the queue any more; this waits for what already
  // was, a handler call in progress included.
  queue_->sync([] {});
  ::close(inotifyFd_);
  ::close(timerFd_);
}

void Watcher::start() {
  lmo::IoLoop& loop = lmo::IoLoop::shared();
  loop.runAndWait([&] {
    if (inotifySource_) return;
    inotifySource_ = std::make_shared<Source>(this, inotifyFd_, false);
    timerSource_ = std::make_shared<Source>(this, timerFd_, true);
    inotifySource_->token = loop.add(inotifyFd_, EPOLLIN, inotifySource_);
    timerSource_->token = loop.add(timerFd_, EPOLLIN, timerSource_);
  });
}

void Watcher::noteWatchLimit(const std::string& path) {
  if (loggedWatchLimit_) return;
  base::vtlog(
      "inotify watch limit reached at %@: changes there are noticed only by the next "
      "reconciliation",
      path);
  loggedWatchLimit_ = true;
}

bool Watcher::addWatch(Target target, bool followLink) {
  if (watchCount_ >= kMaxWatches) {
    noteWatchLimit(target.path);
    return false;
  }
  const uint32_t mask = kWatchMask | (followLink ? 0 : IN_DONT_FOLLOW);
  const int wd = ::inotify_add_watch(inotifyFd_, target.path.c_str(), mask);
  if (wd < 0) {
    if (errno == ENOSPC) {
      noteWatchLimit(target.path);  // the kernel's max_user_watches
    } else if (errno != ENOENT && errno != ENOTDIR && errno != ELOOP) {
      // (Gone again, or a link or file where a directory was expected:
      // nothing to watch there.)
      base::vtlog("cannot watch %@: %@", target.path, std::strerror(errno));
    }
    return false;
  }
  std::vector<Target>& targets = targets_[wd];
  if (targets.empty()) ++watchCount_;
  if (std::find(targets.begin(), targets.end(), target) == targets.end()) {
    targets.push_back(std::move(target));
  }
  return true;
}

void Watcher::watchRoot(size_t root) {
  const std::string& path = roots_[root].path;
  if (path != "/") addWatch(Target{parentOf(path), root, Level::kParent, {}}, true);
  if (!addWatch(Target{path, root, Level::kRoot, {}}, true)) return;
  for (const std::string& item : itemsOf(roots_[root])) watchItem(root, item);
}

void Watcher::watchItem(size_t root, const std::string& item) {
  if (!isRealDirectory(item)) return;
  if (!addWatch(Target{item, root, Level::kItem, item}, false)) return;
  if (roots_[root].kind != RootKind::kApplications) return;
  const std::string plugIns = childPath(item, "PlugIns");
  if (!addWatch(Target{plugIns, root, Level::kInner, item}, false)) return;
  for (const std::string& bundle : listSubdirectories(plugIns, DirectoryLink::kRefuse)) {
    addWatch(Target{bundle, root, Level::kInner, item}, false);
  }
}

void Watcher::handleEvents(const std::vector<char>& bytes) {
  queue_->assertCurrent();
  size_t offset = 0;
  while (offset + sizeof(inotify_event) <= bytes.size()) {
    inotify_event event;
    std::memcpy(&event, bytes.data() + offset, sizeof event);
    const size_t next = offset + sizeof(inotify_event) + event.len;
    if (next > bytes.size()) break;
    const char* name = bytes.data() + offset + sizeof(inotify_event);
    handleEvent(event.wd, event.mask,
                std::string_view(name, event.len == 0 ? 0 : ::strnlen(name, event.len)));
    offset = next;
  }
  if (pendingAll_ || !pending_.empty()) {
    armTimer(std::min(lastChange_ + kWatchQuietPeriod, firstChange_ + kWatchMaxDelay));
  }
}

void Watcher::armTimer(Clock::time_point due) {
  // steady_clock is CLOCK_MONOTONIC, the timer's clock.
  const auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(due.time_since_epoch());
  itimerspec spec{};
  spec.it_value.tv_sec = static_cast<time_t>(ns.count() / 1000000000);
  spec.it_value.tv_nsec = static_cast<long>(ns.count() % 1000000000);
  if (spec.it_value.tv_sec == 0 && spec.it_value.tv_nsec == 0) spec.it_value.tv_nsec = 1;
  ::timerfd_settime(timerFd_, TFD_TIMER_ABSTIME, &spec, nullptr);
}

void Watcher::flushIfDue() {
  queue_->assertCurrent();
  if (!pendingAll_ && pending_.empty()) return;
  const Clock::time_point due =
      std::min(lastChange_ + kWatchQuietPeriod, firstChange_ + kWatchMaxDelay);
  if (Clock::now() >= due) {
    flush();
  } else {
    armTimer(due);  // changes came in since the timer was set
  }
}

void Watcher::touch() {
  const Clock::time_point now = Clock::now();
  if (!pendingAll_ && pending_.empty()) firstChange_ = now;
  lastChange_ = now;
}

void Watcher::noteAll() {
  touch();
  pending_.clear();
  pendingAll_ = true;
}

void Watcher::noteChange(std::string item) {
  touch();
  if (pendingAll_) return;
  if (pending_.size() >= kMaxDirectoryEntries) {
    // So many items changed that rescanning everything is as cheap.
    noteAll();
    return;
  }
  pending_.insert(std::move(item));
}

void Watcher::handleEvent(int wd, uint32_t mask, std::string_view name) {
  if ((mask & IN_Q_OVERFLOW) != 0) {
    noteAll();
    return;
  }
  auto it = targets_.find(wd);
  if (it == targets_.end()) return;
  for (const Target& target : it->second) {
    const ScanRoot& root = roots_[target.root];
    switch (target.level) {
      case Level::kParent:
        if (name == lastComponent(root.path)) noteAll();
        break;
      case Level::kRoot:
        if ((mask & (IN_DELETE_SELF | IN_MOVE_SELF)) != 0) {
          noteAll();
        } else if (isItemName(root.kind, name) && root.path.size() + name.size() < kMaxPathLength) {
          noteChange(childPath(root.path, name));
        }
        break;
      case Level::kItem:
      case Level::kInner:
        noteChange(target.item);
        break;
    }
  }
  if ((mask & IN_IGNORED) != 0) {
    targets_.erase(it);
    --watchCount_;
  }
}

void Watcher::flush() {
  const bool all = pendingAll_;
  std::set<std::string> items = std::move(pending_);
  pending_.clear();
  pendingAll_ = false;
  // Watch first, then rescan: a change made while the rescan reads is
  // reported again rather than lost.
  if (all) {
    for (size_t i = 0; i < roots_.size(); ++i) watchRoot(i);
    handler_({}, true);
    return;
  }
  for (const std::string& item : items) {
    for (size_t i = 0; i < roots_.size(); ++i) {
      if (parentOf(item) == roots_[i].path) watchItem(i, item);
    }
  }
  handler_(std::vector<std::string>(items.begin(), items.end()), false);
}

}  // namespace vantrel::omnidex
