// The growing queue and the event queue.
#include <errno.h>
#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <new>
#include <thread>
#include <vector>

#include "tests/support/allocations.h"
#include "thread_peek.h"

namespace {

using namespace lock_peek;
using namespace thread_peek;
using lock_peek::waiters;
using thread_peek::waiters;

std::vector<int> drain(GSQueue<int>& queue) {
  std::vector<int> items;
  for (int item = 0; queue.dequeue(&item) == 1;) items.push_back(item);
  return items;
}

TEST(Queue, storage_growsBySixteenBeforeTheLastSlotIsTaken) {
  GSQueue<int> queue(0);
  EXPECT_EQ(fields(queue).data, nullptr);
  for (int i = 1; i <= 15; ++i) EXPECT_EQ(queue.enqueue(i), i);
  EXPECT_EQ(fields(queue).nalloc, 16);
  EXPECT_EQ(queue.enqueue(16), 16);
  EXPECT_EQ(fields(queue).nalloc, 32);
  EXPECT_EQ(drain(queue).size(), 16u);
  EXPECT_EQ(fields(queue).nalloc, 32) << "never shrinks";

  GSQueue<int> four(4);
  for (int i = 1; i <= 3; ++i) four.enqueue(i);
  EXPECT_EQ(fields(four).nalloc, 4);
  four.enqueue(4);
  EXPECT_EQ(fields(four).nalloc, 20);
  EXPECT_EQ(drain(four), (std::vector<int>{1, 2, 3, 4}));
  GSQueue<int> negative(-5);
  EXPECT_EQ(negative.enqueue(1), 1);
}

TEST(Queue, itemsAcrossTheWrap_keepTheirOrderWhenItGrows) {
  GSQueue<int> queue(16);
  for (int i = 0; i < 12; ++i) queue.enqueue(-1);
  for (int i = 0; i < 12; ++i) EXPECT_EQ(queue.dequeue(nullptr), 1);
  std::vector<int> expected;
  for (int i = 0; i < 40; ++i) {
    queue.enqueue(i);
    expected.push_back(i);
  }
  EXPECT_EQ(queue.count(), 40);
  EXPECT_EQ(drain(queue), expected);
}

TEST(Queue, dequeue_dropsForNullAndLeavesTheTargetWhenEmpty) {
  GSQueue<int> queue(0);
  int item = 7;
  EXPECT_EQ(queue.dequeue(&item), 0);
  EXPECT_EQ(item, 7);
  queue.enqueue(1);
  queue.enqueue(2);
  EXPECT_EQ(queue.dequeue(nullptr), 1);
  EXPECT_EQ(queue.dequeue(&item), 1);
  EXPECT_EQ(item, 2);
}

// Fills to just before a growth, makes that fail, and goes on as if nothing had been.
template <class Enqueue, class Count>
void expectFailedGrowthChangesNothing(Enqueue enqueue, Count count) {
  if (!allocations::kControlled) GTEST_SKIP() << "allocations cannot be refused in this build";
  for (int i = 0; i < 15; ++i) enqueue(i);
  {
    const allocations::Refuse refuse;
    EXPECT_THROW(enqueue(99), std::bad_alloc);
    EXPECT_THROW(enqueue(99), std::bad_alloc) << "the lock is free again";
  }
  EXPECT_EQ(count(), 15);
  enqueue(15);
  EXPECT_EQ(count(), 16);
}

TEST(Queue, failedGrowth_leavesItemsAndLockAsTheyWere) {
  if (!allocations::kControlled) GTEST_SKIP() << "allocations cannot be refused in this build";
  GSQueue<int> queue(0);
  {
    const allocations::Refuse refuse;
    EXPECT_THROW(queue.enqueue(1), std::bad_alloc);
  }
  expectFailedGrowthChangesNothing([&](int i) { queue.enqueue(i); }, [&] { return queue.count(); });
  EXPECT_EQ(refcount(*fields(queue).lock), 0);
  const std::vector<int> items = drain(queue);
  ASSERT_EQ(items.size(), 16u);
  for (int i = 0; i < 16; ++i) EXPECT_EQ(items[static_cast<size_t>(i)], i);
}

TEST(EventQueue, failedGrowth_postsNothing) {
  GSIntegerEventQueue queue;
  expectFailedGrowthChangesNothing([&](int i) { queue.post_event(i); }, [&] { return queue.count(); });
}

TEST(MarketGrowth, failedGrowth_producesNothing) {
  GSMarket market(0);
  GSObject object;
  expectFailedGrowthChangesNothing([&](int) { market.produce(&object); }, [&] { return market.QueueCount(); });
}

TEST(EventQueue, wait_takesWhatIsThereWhateverTheTimeOut) {
  GSIntegerEventQueue queue;
  int event = 0;
  EXPECT_EQ(queue.wait_event(&event, 0, 0), ETIMEDOUT);
  EXPECT_EQ(queue.push_event(5), 1);
  EXPECT_EQ(queue.push_event(6), 2);
  EXPECT_EQ(queue.wait_event(&event, 0, 0), 0);
  EXPECT_EQ(event, 5);
  EXPECT_EQ(queue.wait_event(nullptr, -5, 0), 0) << "a deadline in the past does not matter either";
  EXPECT_EQ(queue.pop_event(&event), 0);
  EXPECT_EQ(event, 5);
}

TEST(EventQueue, timeOut_isCountedOnceFromTheCall) {
  GSIntegerEventQueue queue;
  std::atomic<bool> stop{false};
  std::thread noise([&] {  // wakes the waiter all the time, with nothing for it
    while (!stop) {
      fields(queue).cond.broadcast();
      std::this_thread::yield();
    }
  });
  const auto before = std::chrono::system_clock::now();
  int event = 0;
  EXPECT_EQ(queue.wait_event(&event, 0, 50000), ETIMEDOUT);
  EXPECT_GE(std::chrono::system_clock::now() - before, std::chrono::milliseconds(45));
  stop = true;
  noise.join();
}

TEST(EventQueue, push_wakesNobodyAndPostWakesForBoth) {
  GSIntegerEventQueue queue;
  std::vector<std::future<int>> got;
  for (int i = 0; i < 2; ++i) {
    got.push_back(std::async(std::launch::async, [&] {
      int event = 0;
      return queue.wait_event(&event, -1, 0) == 0 ? event : -1;
    }));
  }
  ASSERT_TRUE(eventually([&] { return waiters(queue) == 2; }));
  queue.push_event(1);
  EXPECT_EQ(waiters(queue), 2);
  EXPECT_EQ(queue.count(), 1);
  EXPECT_EQ(queue.post_event(2), 0);
  EXPECT_EQ(got[0].get() + got[1].get(), 3);
}

// The other wait inside wait_event: for the queue's lock, while the condition's mutex is held.
TEST(EventQueue, waiterCancelledAtTheQueuesLock_releasesTheCondition) {
  GSIntegerEventQueue queue;
  GSRWLockImpl& lock = *fields(queue).queue.lock;
  ASSERT_EQ(lock.WriteLock(nullptr), 0);
  CancellableThread waiter([&] { queue.wait_event(nullptr, -1, 0); });
  ASSERT_TRUE(eventually([&] { return writersWaiting(lock) == 1; }));
  waiter.cancel();
  EXPECT_TRUE(waiter.join());
  lock.WriteUnlock();
  EXPECT_EQ(writersWaiting(lock), 0);
  EXPECT_EQ(waiters(queue), 0);
  EXPECT_EQ(queue.post_event(1), 0);
  EXPECT_EQ(queue.pop_event(nullptr), 1);
}

}  // namespace
