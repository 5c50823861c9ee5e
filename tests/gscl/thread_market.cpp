// The market: hand-over, stop and resume, deadlines.
#include <gtest/gtest.h>

#include <future>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "gscl/GSDebug.h"
#include "thread_peek.h"

namespace {

using namespace thread_peek;
using lock_peek::eventually;
using lock_peek::inMillis;

class Market : public testing::Test {
 protected:
  std::future<GSObject*> startConsumer(const timespec* abstime = nullptr) {
    return std::async(std::launch::async, [this, abstime] { return market.consume(abstime); });
  }
  bool waiting(int n) {
    return eventually([&] { return thread_peek::waiters(market) == n; });
  }

  GSMarket market{0};
  GSObject first, second, third;
};

TEST_F(Market, produce_countsAndConsumersTakeTheOldestFirst) {
  EXPECT_EQ(market.produce(&first), 1);
  EXPECT_EQ(market.produce(&second), 2);
  EXPECT_EQ(market.produce(&third), 3);
  const timespec past = inMillis(-1000);
  EXPECT_EQ(market.consume(&past), &first) << "a deadline matters only to a wait";
  EXPECT_EQ(market.consume(nullptr), &second);
  EXPECT_EQ(market.QueueCount(), 1);
}

TEST_F(Market, consumerOfAnEmptyMarket_waitsForTheObjectOrTheDeadline) {
  std::future<GSObject*> consumer = startConsumer();
  ASSERT_TRUE(waiting(1));
  market.produce(&first);
  EXPECT_EQ(consumer.get(), &first);

  const auto before = std::chrono::system_clock::now();
  const timespec soon = inMillis(50);
  EXPECT_EQ(market.consume(&soon), nullptr);
  EXPECT_GE(std::chrono::system_clock::now() - before, std::chrono::milliseconds(45));
}

TEST_F(Market, stop_releasesAllWaitingConsumersWithNothing) {
  std::vector<std::future<GSObject*>> consumers;
  for (int i = 0; i < 3; ++i) consumers.push_back(startConsumer());
  ASSERT_TRUE(waiting(3));
  market.stopMarket();
  EXPECT_EQ(market.IsRunning(), 0);
  for (auto& consumer : consumers) EXPECT_EQ(consumer.get(), nullptr);
  EXPECT_EQ(market.produce(&first), 1);
  EXPECT_EQ(market.QueueCount(), 1) << "stays queued";
}

TEST_F(Market, stoppedMarket_givesWhatItHasWithoutWaiting) {
  market.produce(&first);
  market.produce(&second);
  market.stopMarket();
  EXPECT_EQ(market.consume(nullptr), &first);
  EXPECT_EQ(market.consume(nullptr), &second);
  EXPECT_EQ(market.consume(nullptr), nullptr);

  market.resumeMarket();
  EXPECT_EQ(market.IsRunning(), 1);
  std::future<GSObject*> consumer = startConsumer();
  ASSERT_TRUE(waiting(1));
  market.produce(&third);
  EXPECT_EQ(consumer.get(), &third);
}

// Holds the waiting consumer back until both an object and the stop are there.
TEST_F(Market, consumerThatWaited_returnsNothingWhenStoppedEvenIfObjectsCame) {
  std::future<GSObject*> consumer = startConsumer();
  ASSERT_TRUE(waiting(1));
  auto& condition = reinterpret_cast<lock_peek::ConditionFields&>(*fields(market).cond);
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
  const timespec past = inMillis(-1000);
  EXPECT_EQ(market.consume(&past), &first);
  market.produce(nullptr);
  EXPECT_EQ(market.consume(&past), nullptr);
  EXPECT_EQ(market.QueueCount(), 0);
}

std::string debugLines;

TEST_F(Market, stopAndResume_sayItOnTheDebugChannel) {
  GSSetDebugLevel(GSCL_TRC_API);
  const gscl_debugf_rtn before = GSSetDebugRtn([](int, char* text) { debugLines += text; });
  market.stopMarket();
  market.resumeMarket();
  GSSetDebugRtn(before);
  GSSetDebugLevel(0);
  EXPECT_EQ(debugLines, "GSMarket::stopMarket \nGSMarket::resumeMarket \n");
}

}  // namespace
