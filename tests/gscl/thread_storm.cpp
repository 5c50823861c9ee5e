// Event queue and market under everything at once. A wake-up that falls between a look and a wait would hang these
// tests (no thread polls), a lost or doubled event fails the count.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "thread_noise.h"
#include "thread_peek.h"

namespace {

using namespace thread_peek;
using lock_peek::CancellableThread;
using lock_peek::eventually;
using lock_peek::inMillis;

constexpr int kProducers = 4;
constexpr int kConsumers = 6;
constexpr int kEach = 3000;  // items of one producer
constexpr int kItems = kProducers * kEach;

class Tally {
 public:
  void take(int item) {
    EXPECT_EQ(_taken[static_cast<size_t>(item)].fetch_add(1), 0) << item << " taken twice";
    ++_count;
  }
  int count() const { return _count; }

 private:
  std::vector<std::atomic<int>> _taken = std::vector<std::atomic<int>>(kItems);
  std::atomic<int> _count{0};
};

template <class Body>
std::vector<std::unique_ptr<CancellableThread>> startThreads(int n, Body body) {
  std::vector<std::unique_ptr<CancellableThread>> threads;
  for (int i = 0; i < n; ++i) threads.push_back(std::make_unique<CancellableThread>([body, i] { body(i); }));
  return threads;
}

// One item at a time without time-outs, given just when the taker comes back for it, so that many fall between its
// look and its wait. A lost wake-up hangs it.
template <class Give, class Take>
void expectNoWakeUpLost(Give give, Take take) {
  constexpr int kRounds = 5000;
  const Noise noise;
  std::atomic<int> taken{0};
  std::thread taker([&] {
    for (; taken < kRounds; ++taken) take();
  });
  for (int round = 0; round < kRounds; ++round) {
    while (taken < round) std::this_thread::yield();
    give();
  }
  taker.join();
}

TEST(EventQueueStorm, postsAroundTheStartOfAWait_loseNoWakeUp) {
  GSIntegerEventQueue queue;
  expectNoWakeUpLost([&] { queue.post_event(1); }, [&] { EXPECT_EQ(queue.wait_event(nullptr, -1, 0), 0); });
}

TEST(MarketStorm, objectsAroundTheStartOfAWait_loseNoWakeUp) {
  GSMarket market(0);
  GSObject object;
  expectNoWakeUpLost([&] { market.produce(&object); }, [&] { EXPECT_EQ(market.consume(nullptr), &object); });
}

TEST(MarketStorm, stopsAroundTheStartOfAWait_alwaysReachTheConsumer) {
  GSMarket market(0);
  expectNoWakeUpLost([&] { market.stopMarket(); },
                     [&] {
                       EXPECT_EQ(market.consume(nullptr), nullptr);
                       market.resumeMarket();
                     });
}

TEST(EventQueueStorm, timeOutsAndCancellations_loseNoEvent) {
  const Noise noise;
  GSIntegerEventQueue queue;
  Tally tally;
  auto mortals = startThreads(kConsumers, [&](int seed) {  // some time out, all are cancelled some time
    std::minstd_rand random(static_cast<unsigned>(seed) + 1);
    for (int event = 0;;) {
      pthread_testcancel();
      const bool limited = random() % 2 == 0;
      if (queue.wait_event(&event, limited ? 0 : -1, static_cast<int>(random() % 300)) == 0) tally.take(event);
    }
  });
  auto producers = startThreads(kProducers, [&](int p) {
    for (int i = 0; i < kEach; ++i) queue.post_event(p * kEach + i);
  });
  for (size_t i = 0; i < mortals.size() / 2; ++i) {
    ASSERT_TRUE(eventually([&] { return tally.count() > static_cast<int>(i) * 1000; }));
    mortals[i]->cancel();
    EXPECT_TRUE(mortals[i]->join());
  }
  producers.clear();
  EXPECT_TRUE(eventually([&] { return tally.count() == kItems; })) << tally.count();
  for (auto& m : mortals) m->cancel();
  mortals.clear();
  EXPECT_EQ(waiters(queue), 0);
  EXPECT_EQ(queue.count(), 0);
}

struct Item : GSObject {
  explicit Item(int n) : number(n) {}
  const int number;
};

TEST(MarketStorm, stopsResumesDeadlinesAndCancellations_loseNoObject) {
  const Noise noise;
  GSMarket market(0);
  Tally tally;
  std::atomic<bool> closing{false};
  const auto consume = [&](const timespec* until) {
    std::unique_ptr<GSObject> object(market.consume(until));
    if (object != nullptr) tally.take(static_cast<Item&>(*object).number);
    return object != nullptr;
  };
  auto consumers = startThreads(kConsumers, [&](int seed) {
    std::minstd_rand random(static_cast<unsigned>(seed) + 1);
    while (!closing) {
      pthread_testcancel();
      const timespec soon = inMillis(static_cast<long>(random() % 2));
      if (!consume(random() % 3 == 0 ? &soon : nullptr)) std::this_thread::yield();
    }
    while (consume(nullptr)) {
    }
  });
  auto producers = startThreads(kProducers, [&](int p) {
    for (int i = 0; i < kEach; ++i) market.produce(new Item(p * kEach + i));
  });
  for (size_t i = 0; i < 200; ++i) {
    market.stopMarket();
    std::this_thread::yield();
    market.resumeMarket();
    if (i % 100 != 50) continue;
    consumers[i / 100]->cancel();
    EXPECT_TRUE(consumers[i / 100]->join());
  }
  producers.clear();
  EXPECT_TRUE(eventually([&] { return tally.count() == kItems; })) << tally.count();
  closing = true;
  market.stopMarket();  // must reach every consumer, wherever it is
  consumers.clear();
  EXPECT_EQ(waiters(market), 0);
  EXPECT_EQ(market.QueueCount(), 0);
}

}  // namespace
