#include "base/SerialQueue.h"

#include <pthread.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>

#include "base/Check.h"
#include "base/Format.h"

namespace vantrel::base {

struct SyncWaiter {
  bool finished = false;  // Guarded by the queue's mutex_.
  std::condition_variable cv;
};

namespace {

struct ThreadQueues {
  const SerialQueue* current = nullptr;
  // Every queue this thread is on: the current one and those whose sync is
  // waiting for the current block.
  std::vector<const SerialQueue*> held;
};

thread_local ThreadQueues tls;

int niceIncrement(QueuePriority p) {
  switch (p) {
    case QueuePriority::kUtility:
      return 5;
    case QueuePriority::kBackground:
      return 10;
    default:
      return 0;
  }
}

}  // namespace

SerialQueue::SerialQueue(std::string label, QueuePriority priority)
    : label_(std::move(label)), priority_(priority) {
  worker_ = std::thread([this] {
    std::string name = label_.substr(0, 15);
    pthread_setname_np(pthread_self(), name.c_str());
    if (int inc = niceIncrement(priority_); inc != 0) {
      // Per-thread nice value on Linux; failure only leaves the default.
      pid_t tid = gettid();
      int current = getpriority(PRIO_PROCESS, tid);
      (void)setpriority(PRIO_PROCESS, tid, current + inc);
    }
    workerLoop();
  });
}

SerialQueue::~SerialQueue() {
  VT_CHECK(std::this_thread::get_id() != worker_.get_id(),
           "serial queue destroyed from one of its own blocks");
  {
    std::lock_guard lock(mutex_);
    stopping_ = true;
  }
  wake_.notify_all();
  worker_.join();
}

void SerialQueue::async(Block block) {
  // Notified under the mutex: once it is released, the block may run and
  // its effects may let another thread destroy this queue, condition
  // variable included, before a notify made afterwards would happen.
  std::lock_guard lock(mutex_);
  tasks_.push_back(Task{std::move(block), {}, nullptr});
  wake_.notify_one();
}

void SerialQueue::sync(const Block& block) {
  if (isHeldByThisThread()) {
    internalInconsistency(
        format("sync onto queue \"%s\" from a block it is waiting for", label_.c_str()).c_str(),
        __FILE__, __LINE__);
  }
  std::unique_lock lock(mutex_);
  if (!running_ && tasks_.empty()) {
    // Idle: run on the caller's thread, holding the queue like a lock.
    running_ = true;
    lock.unlock();
    runHere(block);
    lock.lock();
    running_ = false;
    if (!tasks_.empty()) wake_.notify_one();
    return;
  }
  auto waiter = std::make_shared<SyncWaiter>();
  tasks_.push_back(Task{[&block] { block(); }, tls.held, waiter});
  wake_.notify_one();
  waiter->cv.wait(lock, [&] { return waiter->finished; });
}

bool SerialQueue::tryRunHere(const Block& block) {
  {
    std::lock_guard lock(mutex_);
    if (running_ || !tasks_.empty() || stopping_) return false;
    running_ = true;
  }
  runHere(block);
  std::lock_guard lock(mutex_);
  running_ = false;
  if (!tasks_.empty()) wake_.notify_one();
  return true;
}

bool SerialQueue::isCurrent() const {
  return tls.current == this;
}

void SerialQueue::assertCurrent() const {
  if (!isCurrent()) {
    internalInconsistency(format("must run on queue \"%s\"", label_.c_str()).c_str(), __FILE__,
                          __LINE__);
  }
}

const SerialQueue* SerialQueue::current() {
  return tls.current;
}

bool SerialQueue::isHeldByThisThread() const {
  return std::find(tls.held.begin(), tls.held.end(), this) != tls.held.end();
}

void SerialQueue::runBlock(Task& task) {
  ThreadQueues saved = std::move(tls);
  tls.current = this;
  tls.held = std::move(task.held);
  tls.held.push_back(this);
  task.block();
  tls = std::move(saved);
}

void SerialQueue::runHere(const Block& block) {
  // The thread keeps every queue it holds and holds this one too, as a
  // worker running a block submitted from here would; no copies, since
  // this is on every request's path.
  const SerialQueue* const previous = tls.current;
  tls.current = this;
  tls.held.push_back(this);
  block();
  tls.held.pop_back();
  tls.current = previous;
}

void SerialQueue::workerLoop() {
  std::unique_lock lock(mutex_);
  for (;;) {
    wake_.wait(lock,
               [&] { return (!running_ && !tasks_.empty()) || (stopping_ && tasks_.empty()); });
    if (tasks_.empty()) return;  // stopping, and everything submitted has run
    Task task = std::move(tasks_.front());
    tasks_.pop_front();
    running_ = true;
    lock.unlock();
    runBlock(task);
    // Drop the block (and what it captured) before the queue is free again.
    task.block = nullptr;
    lock.lock();
    running_ = false;
    if (task.waiter) {
      task.waiter->finished = true;
      task.waiter->cv.notify_all();
    }
  }
}

}  // namespace vantrel::base
