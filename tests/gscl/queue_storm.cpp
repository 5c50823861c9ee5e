// Event queue and market under everything at once. A wake-up that falls between a look and a wait would hang these
// tests (no thread polls), a lost or doubled event fails the count.
#include <dlfcn.h>
#include <sched.h>

#include <atomic>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "peek.h"
#include "platform/common/sanitizers.h"

namespace {

using namespace peek;

constexpr int kProducers = 4;
constexpr int kConsumers = 6;
constexpr int kEach = 3000;  // items of one producer
constexpr int kItems = kProducers * kEach;

// While it is on, threads dawdle at random before they lock a mutex. The windows in which a wake-up can be lost
// are a few instructions wide; this makes them wide enough to be hit. The sanitizers do not allow it, they replace
// pthread_mutex_lock too: there the noise is silent.
std::atomic<bool> noise{false};

// No cancellation point, like the lock itself.
[[maybe_unused]] void dawdle() {
  thread_local std::minstd_rand random(static_cast<unsigned>(pthread_self() >> 12));
  const unsigned dice = static_cast<unsigned>(random());
  if (dice % 4 == 0) sched_yield();
  if (dice % 3 != 0) return;
  for (volatile unsigned spin = dice / 16 % 4096; spin > 0;) spin = spin - 1;
}

}  // namespace

#if !ZN_THREAD_SANITIZER && !ZN_ADDRESS_SANITIZER
extern "C" __attribute__((visibility("default"))) int pthread_mutex_lock(pthread_mutex_t* mutex) noexcept {
  using Lock = int (*)(pthread_mutex_t*);
  static std::atomic<Lock> real{nullptr};
  Lock lock = real.load();
  if (lock == nullptr) real = lock = reinterpret_cast<Lock>(dlsym(RTLD_NEXT, "pthread_mutex_lock"));
  if (noise) dawdle();
  return lock(mutex);
}
#endif

namespace {

class Storm : public testing::Test {
 protected:
  Storm() { noise = true; }
  ~Storm() override { noise = false; }

  /// Notes an item; each is taken once.
  void take(int item) {
    EXPECT_EQ(_taken[static_cast<size_t>(item)].fetch_add(1), 0) << item << " taken twice";
    ++count;
  }
  bool allTaken() {
    return eventually([&] { return count == kItems; });
  }
  template <class Give>
  Threads startProducers(Give give) {
    return startThreads(kProducers, [give](int p) {
      for (int i = 0; i < kEach; ++i) give(p * kEach + i);
    });
  }

  std::atomic<int> count{0};

 private:
  std::vector<std::atomic<int>> _taken = std::vector<std::atomic<int>>(kItems);
};

// One item at a time without time-outs, given just when the taker comes back for it, so that many fall between its
// look and its wait. A lost wake-up hangs it.
template <class Give, class Take>
void expectNoWakeUpLost(Give give, Take take) {
  constexpr int kRounds = 5000;
  std::atomic<int> taken{0};
  std::jthread taker([&] {
    for (; taken < kRounds; ++taken) take();
  });
  for (int round = 0; round < kRounds; ++round) {
    while (taken < round) std::this_thread::yield();
    give();
  }
}

TEST_F(Storm, whatFallsAroundTheStartOfAWait_isNotLost) {
  GSIntegerEventQueue queue;
  expectNoWakeUpLost([&] { queue.post_event(1); }, [&] { EXPECT_EQ(queue.wait_event(nullptr, -1, 0), 0); });
  GSMarket market(0);
  GSObject object;
  expectNoWakeUpLost([&] { market.produce(&object); }, [&] { EXPECT_EQ(market.consume(nullptr), &object); });
  expectNoWakeUpLost([&] { market.stopMarket(); },
                     [&] {
                       EXPECT_EQ(market.consume(nullptr), nullptr);
                       market.resumeMarket();
                     });
}

TEST_F(Storm, timeOutsAndCancellations_loseNoEvent) {
  GSIntegerEventQueue queue;
  Threads mortals = startThreads(kConsumers, [&](int seed) {  // some time out, all are cancelled some time
    std::minstd_rand random(static_cast<unsigned>(seed) + 1);
    for (int event = 0;;) {
      pthread_testcancel();
      const bool limited = random() % 2 == 0;
      if (queue.wait_event(&event, limited ? 0 : -1, static_cast<int>(random() % 300)) == 0) take(event);
    }
  });
  Threads producers = startProducers([&](int item) { queue.post_event(item); });
  for (int i = 0; i < kConsumers / 2; ++i) {
    ASSERT_TRUE(eventually([&] { return count > i * 1000; }));
    mortals[static_cast<size_t>(i)]->cancel();
  }
  producers.clear();
  EXPECT_TRUE(allTaken()) << count;
  for (auto& m : mortals) m->cancel();
  mortals.clear();
  EXPECT_EQ(waiters(queue), 0);
  EXPECT_EQ(queue.count(), 0);
}

struct Item : GSObject {
  explicit Item(int n) : number(n) {}
  const int number;
};

TEST_F(Storm, stopsResumesDeadlinesAndCancellations_loseNoObject) {
  GSMarket market(0);
  std::atomic<bool> closing{false};
  const auto consume = [&](const timespec* until) {
    std::unique_ptr<GSObject> object(market.consume(until));
    if (object != nullptr) take(static_cast<Item&>(*object).number);
    return object != nullptr;
  };
  Threads consumers = startThreads(kConsumers, [&](int seed) {
    std::minstd_rand random(static_cast<unsigned>(seed) + 1);
    while (!closing) {
      pthread_testcancel();
      const timespec soon = inMillis(static_cast<long>(random() % 2));
      if (!consume(random() % 3 == 0 ? &soon : nullptr)) std::this_thread::yield();
    }
    while (consume(nullptr)) {
    }
  });
  Threads producers = startProducers([&](int item) { market.produce(new Item(item)); });
  for (size_t i = 0; i < 200; ++i) {
    market.stopMarket();
    std::this_thread::yield();
    market.resumeMarket();
    if (i % 100 == 50) consumers[i / 100]->cancel();
  }
  producers.clear();
  EXPECT_TRUE(allTaken()) << count;
  closing = true;
  market.stopMarket();  // must reach every consumer, wherever it is
  consumers.clear();
  EXPECT_EQ(waiters(market), 0);
  EXPECT_EQ(market.QueueCount(), 0);
}

}  // namespace
