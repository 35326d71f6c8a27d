#pragma once
// Follows the watched trees with inotify and reports which top-level items
// (applications, stand-alone plug-in bundles) changed.
//
// Watched: each root's parent (so that a root created later is noticed),
// each root, and below an application directory each application, its
// PlugIns directory and each bundle in it, below a plug-in directory each
// bundle. Symbolic links below a root are not followed. Deeper directories
// are not watched: a change there does not change what the registry reads.
// A root whose parent does not exist either is picked up only by the next
// full reconciliation.
//
// Changes are coalesced: the handler runs once the trees have been quiet
// for kWatchQuietPeriod, and at the latest kWatchMaxDelay after the first
// change, on the watcher's own serial queue, one call at a time.
//
// The inotify descriptor and the coalescing timer (a timerfd) are watched
// by the process's I/O loop, whose thread only reads them and hands the
// bytes and expiries to the queue; the watch table and every directory
// listing live on the queue.

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "base/Result.h"
#include "base/SerialQueue.h"
#include "omnidex/Scanner.h"

namespace vantrel::omnidex {

class Watcher {
 public:
  // items: the changed top-level items, each below one of the roots; all:
  // rescan everything (the kernel's event queue overflowed, or a root
  // appeared or went).
  using ChangeHandler = std::function<void(const std::vector<std::string>& items, bool all)>;

  // Sets up inotify and watches the trees as they are now; nothing is
  // reported before start(). Errors (domain "POSIX"): inotify or the timer
  // descriptor cannot be made. A watch that cannot be added is not an error:
  // it is logged (the watch limit once) and the rest is watched.
  static base::Result<std::unique_ptr<Watcher>> create(std::vector<ScanRoot> roots,
                                                       ChangeHandler handler);
  // Stops watching (waiting for a handler call in progress) and closes the
  // descriptors; the handler is not called afterwards.
  ~Watcher();
  Watcher(const Watcher&) = delete;
  Watcher& operator=(const Watcher&) = delete;

  void start();

 private:
  using Clock = std::chrono::steady_clock;
  enum class Level {
    kParent,  // the directory that holds a root
    kRoot,
    kItem,  // an application, or a stand-alone plug-in bundle
    kInner  // an application's PlugIns directory, or a bundle in it
  };
  struct Target {
    std::string path;
    size_t root;
    Level level;
    std::string item;  // for kItem and kInner
    bool operator==(const Target&) const = default;
  };

  class Source;

  Watcher(std::vector<ScanRoot> roots, ChangeHandler handler, int inotifyFd, int timerFd);
  void watchRoot(size_t root);
  void watchItem(size_t root, const std::string& item);
  bool addWatch(Target target, bool followLink);
  void handleEvents(const std::vector<char>& bytes);
  void handleEvent(int wd, uint32_t mask, std::string_view name);
  void noteWatchLimit(const std::string& path);
  void touch();
  void noteAll();
  void noteChange(std::string item);
  void flushIfDue();
  void flush();
  void armTimer(Clock::time_point due);

  // Constant after construction.
  const std::vector<ScanRoot> roots_;
  const ChangeHandler handler_;
  const int inotifyFd_;
  const int timerFd_;
  const std::shared_ptr<base::SerialQueue> queue_;
  // Event bytes read on the I/O thread and not yet handled on queue_. Kept
  // here, not in the source that reads them: a source is gone before the
  // queue has handled what it handed over.
  std::atomic<size_t> unhandledEventBytes_{0};

  // Touched by the creating thread until start(), then only on queue_
  // (start() submits the first block, which orders the two).
  std::unordered_map<int, std::vector<Target>> targets_;
  size_t watchCount_ = 0;
  bool loggedWatchLimit_ = false;
  std::set<std::string> pending_;
  bool pendingAll_ = false;
  Clock::time_point firstChange_;
  Clock::time_point lastChange_;

  // The I/O loop's registrations; set by start() and cleared by the
  // destructor, both on the I/O thread.
  std::shared_ptr<Source> inotifySource_;
  std::shared_ptr<Source> timerSource_;
};

}  // namespace vantrel::omnidex
