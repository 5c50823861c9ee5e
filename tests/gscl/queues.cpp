// The growing queue, the event queue and the market: hand-over, deadlines, stops, failed growth.
#include <errno.h>

#include <atomic>
#include <future>
#include <new>
#include <thread>
#include <vector>

#include "gscl/GSDebug.h"
#include "peek.h"
#include "tests/support/allocations.h"

namespace {

using namespace peek;

std::vector<int> drain(GSQueue<int>& queue) {
  std::vector<int> items;
  for (int item = 0; queue.dequeue(&item) == 1;) items.push_back(item);
  return items;
}

TEST(Queue, storage_growsBySixteenBeforeTheLastSlotIsTaken) {
  struct Case {
    int slots, items, room;
  };
  for (const Case& c : {Case{0, 0, 0}, Case{-5, 1, 16}, Case{0, 15, 16}, Case{0, 16, 32}, Case{4, 3, 4},
                        Case{4, 4, 20}, Case{16, 40, 48}}) {
    for (int skipped : {0, 3, 12}) {  // the items lie across the wrap then, also when it grows
      if (skipped >= c.slots && skipped > 0) continue;
      GSQueue<int> queue(c.slots);
      std::vector<int> expected;
      for (int i = 0; i < skipped; ++i) queue.enqueue(-1);
      for (int i = 0; i < skipped; ++i) EXPECT_EQ(queue.dequeue(nullptr), 1);
      for (int i = 1; i <= c.items; ++i) {
        EXPECT_EQ(queue.enqueue(i), i);
        expected.push_back(i);
      }
      EXPECT_EQ(queue.count(), c.items);
      EXPECT_EQ(drain(queue), expected);
      EXPECT_EQ(fields(queue).nalloc, c.room) << c.slots << " slots, " << c.items << " items";
    }
  }
}

// Fills to just before a growth, makes that fail, and goes on as if nothing had been.
template <class Enqueue, class Count>
void expectFailedGrowthChangesNothing(Enqueue enqueue, Count count) {
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

TEST(Queue, failedGrowth_changesNothing) {
  if (!allocations::kControlled) GTEST_SKIP() << "allocations cannot be refused in this build";
  GSQueue<int> queue(0);
  expectFailedGrowthChangesNothing([&](int i) { queue.enqueue(i); }, [&] { return queue.count(); });
  EXPECT_EQ(refcount(*fields(queue).lock), 0);
  const std::vector<int> items = drain(queue);
  ASSERT_EQ(items.size(), 16u);
  for (int i = 0; i < 16; ++i) EXPECT_EQ(items[static_cast<size_t>(i)], i);
  GSIntegerEventQueue events;
  expectFailedGrowthChangesNothing([&](int i) { events.post_event(i); }, [&] { return events.count(); });
  GSMarket market(0);
  GSObject object;
  expectFailedGrowthChangesNothing([&](int) { market.produce(&object); }, [&] { return market.QueueCount(); });
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
  EXPECT_EQ(queue.wait_event(nullptr, 0, 50000), ETIMEDOUT);
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
  std::this_thread::sleep_for(std::chrono::milliseconds(20));  // room to (wrongly) wake up and take it
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

class Market : public testing::Test {
 protected:
  std::future<GSObject*> startConsumer() {
    return std::async(std::launch::async, [this] { return market.consume(nullptr); });
  }
  bool waiting(int n) {
    return eventually([&] { return waiters(market) == n; });
  }

  const timespec past = inMillis(-1000);
  GSMarket market{0};
  GSObject first, second;
};

TEST_F(Market, consumer_takesTheOldestOrWaitsForOne) {
  EXPECT_EQ(market.produce(&first), 1);
  EXPECT_EQ(market.produce(&second), 2);
  EXPECT_EQ(market.consume(&past), &first) << "a deadline matters only to a wait";
  EXPECT_EQ(market.consume(nullptr), &second);
  EXPECT_EQ(market.consume(&past), nullptr);
  std::future<GSObject*> consumer = startConsumer();
  ASSERT_TRUE(waiting(1));
  market.produce(&first);
  EXPECT_EQ(consumer.get(), &first);
}

std::string debugLines;

TEST_F(Market, stop_releasesConsumersAndKeepsObjectsUntilTheyAreAskedFor) {
  GSSetDebugLevel(GSCL_TRC_API);
  const gscl_debugf_rtn before = GSSetDebugRtn([](int, char* text) { debugLines += text; });
  std::vector<std::future<GSObject*>> consumers;
  for (int i = 0; i < 3; ++i) consumers.push_back(startConsumer());
  ASSERT_TRUE(waiting(3));
  market.stopMarket();
  EXPECT_EQ(market.IsRunning(), 0);
  for (auto& consumer : consumers) EXPECT_EQ(consumer.get(), nullptr);
  market.produce(&first);
  EXPECT_EQ(market.consume(nullptr), &first);
  EXPECT_EQ(market.consume(nullptr), nullptr) << "without waiting";
  market.resumeMarket();
  EXPECT_EQ(market.IsRunning(), 1);
  std::future<GSObject*> consumer = startConsumer();
  ASSERT_TRUE(waiting(1));
  market.produce(&second);
  EXPECT_EQ(consumer.get(), &second);
  GSSetDebugRtn(before);
  GSSetDebugLevel(0);
  EXPECT_EQ(debugLines, "GSMarket::stopMarket \nGSMarket::resumeMarket \n");
}

// Holds the waiting consumer back until both an object and the stop are there.
TEST_F(Market, consumerThatWaited_returnsNothingWhenStoppedEvenIfObjectsCame) {
  std::future<GSObject*> consumer = startConsumer();
  ASSERT_TRUE(waiting(1));
  auto& condition = fields(*fields(market).cond);
  pthread_mutex_lock(&condition.mutex);
  std::thread producer([&] { market.produce(&first); });
  std::thread stopper([&] { market.stopMarket(); });
  ASSERT_TRUE(eventually([&] { return market.QueueCount() == 1 && market.IsRunning() == 0; }));
  pthread_mutex_unlock(&condition.mutex);
  producer.join();
  stopper.join();
  EXPECT_EQ(consumer.get(), nullptr);
  EXPECT_EQ(market.consume(nullptr), &first);
}

TEST_F(Market, nulls_areDroppedAndHideNoObject) {
  for (GSObject* object : {static_cast<GSObject*>(nullptr), static_cast<GSObject*>(nullptr), &first}) {
    market.produce(object);
  }
  EXPECT_EQ(market.QueueCount(), 3);
  EXPECT_EQ(market.consume(&past), &first);
  market.produce(nullptr);
  EXPECT_EQ(market.consume(&past), nullptr);
  EXPECT_EQ(market.QueueCount(), 0);
}

}  // namespace
