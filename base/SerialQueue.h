#pragma once
// Serial work queues: blocks run one at a time, in submission order.
//
// Each queue has one worker thread. `async` enqueues and returns; `sync` runs
// the block before returning (on the caller's thread when the queue is idle,
// otherwise on the worker) and never overlaps another block of the queue.
// Every hand-off goes through the queue's mutex, so ThreadSanitizer sees the
// happens-before edge from submitter to block and from block to sync caller.
//
// A thread running a block knows which queues it is "on": the queue itself and
// every queue whose `sync` is waiting for it. `sync` onto one of those would
// deadlock, so it stops the process with a message naming the queue instead.

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace vantrel::base {

// Priority classes of work. Lower classes run their worker at a higher nice
// value; the higher classes run at the process's own priority (raising it
// would need privileges that the daemon does not ask for).
enum class QueuePriority { kUserInteractive, kUserInitiated, kDefault, kUtility, kBackground };

class SerialQueue {
 public:
  using Block = std::function<void()>;

  explicit SerialQueue(std::string label, QueuePriority priority = QueuePriority::kDefault);
  // Runs every block already submitted, then joins the worker. Destroying a
  // queue from one of its own blocks is a programming error and stops the
  // process.
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const { return label_; }
  QueuePriority priority() const { return priority_; }

  void async(Block block);
  // Runs block on this queue and waits for it. Calling it while already on
  // this queue (directly or through a chain of sync calls) stops the process.
  void sync(const Block& block);

  // Runs block on this queue from the calling thread when the queue is idle
  // (nothing running, nothing waiting) and returns true; otherwise returns
  // false at once without running it. For a thread that must never wait
  // (an I/O loop) to save the hand-off to the worker when it can.
  bool tryRunHere(const Block& block);

  // True when the calling thread is running a block of this queue: one
  // thread-local load and a compare.
  bool isCurrent() const;
  // Stops the process with "must run on queue <label>" when not isCurrent().
  void assertCurrent() const;

  // The queue whose block the calling thread runs, or null.
  static const SerialQueue* current();

 private:
  struct Task {
    Block block;
    std::vector<const SerialQueue*> held;       // queues the submitter is blocked on
    std::shared_ptr<struct SyncWaiter> waiter;  // set for sync blocks
  };

  void workerLoop();
  void runBlock(Task& task);
  // Runs block on the calling thread, which holds the queue (running_).
  void runHere(const Block& block);
  bool isHeldByThisThread() const;

  const std::string label_;
  const QueuePriority priority_;

  std::mutex mutex_;
  std::condition_variable wake_;
  std::deque<Task> tasks_;  // Guarded by mutex_.
  bool running_ = false;    // Guarded by mutex_: a block of this queue runs now.
  bool stopping_ = false;   // Guarded by mutex_.
  std::thread worker_;      // Constant after construction.
};

}  // namespace vantrel::base
