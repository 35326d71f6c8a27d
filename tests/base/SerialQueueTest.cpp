#include "base/SerialQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <latch>
#include <memory>
#include <thread>
#include <vector>

namespace vantrel::base {
namespace {

TEST(SerialQueue, BlocksRunOneAtATimeInSubmissionOrder) {
  std::vector<int> order;  // written only by blocks of q
  std::atomic<int> inside{0};
  bool overlapped = false;
  {
    SerialQueue q("order");
    for (int i = 0; i < 200; ++i) {
      auto block = [&, i] {
        if (inside.fetch_add(1) != 0) overlapped = true;
        order.push_back(i);
        inside.fetch_sub(1);
      };
      // Mix sync and async from two threads' worth of callers.
      if (i % 7 == 0) {
        q.sync(block);
      } else {
        q.async(block);
      }
    }
  }  // destruction drains everything submitted
  ASSERT_EQ(order.size(), 200u);
  for (int i = 0; i < 200; ++i) EXPECT_EQ(order[i], i);
  EXPECT_FALSE(overlapped);
}

TEST(SerialQueue, SyncFromManyThreadsNeverOverlaps) {
  SerialQueue q("contended");
  int counter = 0;  // guarded by q
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 500; ++i) q.sync([&] { ++counter; });
    });
  }
  for (auto& th : threads) th.join();
  int seen = 0;
  q.sync([&] { seen = counter; });
  EXPECT_EQ(seen, 2000);
}

TEST(SerialQueue, CurrentQueueIsKnownInsideBlocksOnly) {
  SerialQueue a("a");
  SerialQueue b("b");
  EXPECT_FALSE(a.isCurrent());
  EXPECT_EQ(SerialQueue::current(), nullptr);
  bool aInA = false, bInB = false, aInB = true, backInA = false;
  a.sync([&] {
    aInA = a.isCurrent();
    b.sync([&] {
      bInB = b.isCurrent();
      aInB = a.isCurrent();
    });
    backInA = a.isCurrent();
  });
  EXPECT_TRUE(aInA);
  EXPECT_TRUE(bInB);
  EXPECT_FALSE(aInB);
  EXPECT_TRUE(backInA);

  std::latch done(1);
  const SerialQueue* seen = nullptr;
  a.async([&] {
    seen = SerialQueue::current();
    done.count_down();
  });
  done.wait();
  EXPECT_EQ(seen, &a);
}

TEST(SerialQueue, SyncWaitsForABusyQueue) {
  SerialQueue q("busy");
  std::atomic<bool> release{false};
  std::atomic<bool> firstDone{false};
  q.async([&] {
    while (!release) std::this_thread::yield();
    firstDone = true;
  });
  std::thread releaser([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    release = true;
  });
  bool sawFirstDone = false;
  q.sync([&] { sawFirstDone = firstDone; });
  releaser.join();
  EXPECT_TRUE(sawFirstDone);
}

TEST(SerialQueue, TryRunHereRunsOnlyOnAnIdleQueueAndNeverWaits) {
  SerialQueue q("try");
  // Idle: the block runs now, on this thread, on the queue.
  const std::thread::id self = std::this_thread::get_id();
  bool ranHere = false;
  EXPECT_TRUE(q.tryRunHere([&] { ranHere = q.isCurrent() && std::this_thread::get_id() == self; }));
  EXPECT_TRUE(ranHere);

  // Busy (a block runs) or with work waiting: refused at once, not run.
  std::atomic<bool> release{false};
  std::latch started(1);
  q.async([&] {
    started.count_down();
    while (!release) std::this_thread::yield();
  });
  started.wait();
  bool ran = false;
  EXPECT_FALSE(q.tryRunHere([&] { ran = true; }));
  q.async([] {});
  release = true;
  EXPECT_FALSE(ran);
  // What was submitted meanwhile still runs, after the busy block.
  std::atomic<bool> later{false};
  q.async([&] { later = true; });
  q.sync([] {});
  EXPECT_TRUE(later);
}

// A block posted from another thread may be what lets the owner destroy the
// queue; the posting thread must be done with the queue by then. (A notify
// made after releasing the queue's lock raced the destructor; ThreadSanitizer
// reports it.)
TEST(SerialQueue, OwnerMayDestroyTheQueueOnceAPostedBlockRan) {
  for (int i = 0; i < 200; ++i) {
    auto queue = std::make_unique<SerialQueue>("reply");
    std::latch ran(1);
    std::thread poster([&] { queue->async([&] { ran.count_down(); }); });
    ran.wait();
    queue.reset();
    poster.join();
  }
}

TEST(SerialQueueDeathTest, DeadlocksAreCaughtInsteadOfHanging) {
  EXPECT_DEATH(
      {
        SerialQueue q("self");
        q.sync([&] { q.sync([] {}); });
      },
      "sync onto queue \"self\"");
  EXPECT_DEATH(
      {
        SerialQueue a("outer");
        SerialQueue b("inner");
        a.sync([&] { b.sync([&] { a.sync([] {}); }); });
      },
      "sync onto queue \"outer\"");
  EXPECT_DEATH(
      {
        SerialQueue q("checked");
        q.assertCurrent();
      },
      "must run on queue \"checked\"");
}

}  // namespace
}  // namespace vantrel::base
