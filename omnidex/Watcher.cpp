#include "omnidex/Watcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "base/Log.h"
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

base::Result<std::unique_ptr<Watcher>> Watcher::create(std::vector<ScanRoot> roots,
                                                       ChangeHandler handler) {
  const int inotifyFd = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (inotifyFd < 0)
    return platform::posixError(errno, "cannot watch", "the application directories");
  const int wakeFd = ::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
  if (wakeFd < 0) {
    const int err = errno;
    ::close(inotifyFd);
    return platform::posixError(err, "cannot watch", "the application directories");
  }
  std::unique_ptr<Watcher> watcher(
      new Watcher(std::move(roots), std::move(handler), inotifyFd, wakeFd));
  for (size_t i = 0; i < watcher->roots_.size(); ++i) watcher->watchRoot(i);
  return watcher;
}

Watcher::Watcher(std::vector<ScanRoot> roots, ChangeHandler handler, int inotifyFd, int wakeFd)
    : roots_(std::move(roots)),
      handler_(std::move(handler)),
      inotifyFd_(inotifyFd),
      wakeFd_(wakeFd) {}

Watcher::~Watcher() {
  if (thread_.joinable()) {
    const uint64_t one = 1;
    while (::write(wakeFd_, &one, sizeof one) < 0 && errno == EINTR) {
    }
    thread_.join();
  }
  ::close(inotifyFd_);
  ::close(wakeFd_);
}

void Watcher::start() {
  thread_ = std::thread([this] { run(); });
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

void Watcher::run() {
  while (true) {
    const bool waiting = pendingAll_ || !pending_.empty();
    int timeoutMs = -1;
    if (waiting) {
      const Clock::time_point due =
          std::min(lastChange_ + kWatchQuietPeriod, firstChange_ + kWatchMaxDelay);
      const auto left = std::chrono::ceil<std::chrono::milliseconds>(due - Clock::now());
      timeoutMs = static_cast<int>(std::max<int64_t>(0, left.count()));
    }
    pollfd fds[2] = {{inotifyFd_, POLLIN, 0}, {wakeFd_, POLLIN, 0}};
    const int n = ::poll(fds, 2, timeoutMs);
    if (n < 0 && errno != EINTR) {
      base::vtlog("cannot watch %@: %@", "the application directories", std::strerror(errno));
      return;
    }
    if (n > 0 && (fds[1].revents & POLLIN) != 0) return;
    if (n > 0 && (fds[0].revents & POLLIN) != 0) readEvents();
    if (pendingAll_ || !pending_.empty()) {
      const Clock::time_point now = Clock::now();
      if (now >= lastChange_ + kWatchQuietPeriod || now >= firstChange_ + kWatchMaxDelay) flush();
    }
  }
}

void Watcher::readEvents() {
  alignas(inotify_event) char buffer[kEventBufferBytes];
  while (true) {
    const ssize_t n = ::read(inotifyFd_, buffer, sizeof buffer);
    if (n <= 0) return;  // EAGAIN: drained
    size_t offset = 0;
    while (offset + sizeof(inotify_event) <= static_cast<size_t>(n)) {
      const auto* event = reinterpret_cast<const inotify_event*>(buffer + offset);
      const size_t next = offset + sizeof(inotify_event) + event->len;
      if (next > static_cast<size_t>(n)) break;
      const std::string_view name(event->name,
                                  event->len == 0 ? 0 : ::strnlen(event->name, event->len));
      handleEvent(event->wd, event->mask, name);
      offset = next;
    }
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
