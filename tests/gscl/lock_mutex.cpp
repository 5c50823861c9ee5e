// The recursive mutex and the condition.
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>

#include <atomic>
#include <future>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "lock_peek.h"

namespace {

using namespace lock_peek;

TEST(MutexLock, contender_proceedsOnlyAfterTheLastUnlockOfTheHolder) {
  GSMutexLock lock;
  const timespec past = inMillis(-1000);
  ASSERT_EQ(lock.lock(&past), 0) << "a free lock is taken also past the deadline";
  ASSERT_EQ(lock.lock(nullptr), 0);
  std::atomic<int> unlocks{0};
  std::thread contender([&] {
    EXPECT_EQ(lock.lock(&past), ETIMEDOUT);
    EXPECT_EQ(lock.lock(nullptr), 0);
    EXPECT_EQ(unlocks, 2);
    EXPECT_EQ(lock.unlock(), 0);
  });
  ASSERT_TRUE(eventually([&] { return waiters(lock) == 1; }));
  ++unlocks;
  EXPECT_EQ(lock.unlock(), 0);
  EXPECT_EQ(peek(lock, &MutexFields::nholders), 1);
  ++unlocks;
  EXPECT_EQ(lock.unlock(), 0);
  contender.join();
  EXPECT_EQ(waiters(lock), 0);
}

TEST(MutexLock, unlockOfAFreeLock_isRefused) {
  GSMutexLock lock;
  EXPECT_EQ(lock.unlock(), EPERM);
  EXPECT_EQ(peek(lock, &MutexFields::nholders), 0);
  EXPECT_EQ(lock.lock(nullptr), 0);
  EXPECT_EQ(lock.unlock(), 0);
  EXPECT_EQ(lock.unlock(), EPERM);
}

TEST(MutexLock, lastLevel_mayBeReleasedByAnotherThread) {
  GSMutexLock lock;
  ASSERT_EQ(lock.lock(nullptr), 0);
  EXPECT_EQ(std::async(std::launch::async, [&] { return lock.unlock(); }).get(), 0);
  EXPECT_EQ(std::async(std::launch::async, [&] { return lock.lock(nullptr); }).get(), 0);
}

TEST(MutexLock, nestedUnlockByAnotherThread_endsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        signal(SIGABRT, SIG_DFL);
        GSMutexLock lock;
        lock.lock(nullptr);
        lock.lock(nullptr);
        std::thread([&] { lock.unlock(); }).join();
      },
      testing::KilledBySignal(SIGABRT),
      testing::MatchesRegex("(.|\n)*"
                            " GSMutexLock::unlock holder\\([0-9a-f]+\\) <> self\\([0-9a-f]+\\)\n"
                            "asserted: rc=-1 in gscl/GSLockPrim \\(line=[0-9]+\\)\n(.|\n)*"));
}

// Deadlines and cancellations race with releases; a lost wake-up would hang the rest.
TEST(MutexLock, storm_keepsExclusionAndLosesNobody) {
  GSMutexLock lock;
  int guarded = 0;
  std::atomic<int> taken{0};
  const auto body = [&](unsigned seed) {
    std::minstd_rand random(seed);
    for (int i = 0; i < 3000; ++i) {
      pthread_testcancel();
      const timespec soon = inMillis(static_cast<long>(random() % 2));
      if (lock.lock(random() % 3 == 0 ? &soon : nullptr) != 0) continue;
      ++guarded;
      ++taken;
      if (random() % 8 == 0) std::this_thread::yield();
      lock.unlock();
    }
  };
  std::vector<std::unique_ptr<CancellableThread>> threads;
  for (unsigned i = 0; i < 6; ++i) threads.push_back(std::make_unique<CancellableThread>([&, i] { body(i + 1); }));
  threads[1]->cancel();
  threads[4]->cancel();
  threads.clear();
  EXPECT_EQ(guarded, taken);
  EXPECT_EQ(waiters(lock), 0);
  EXPECT_EQ(peek(lock, &MutexFields::nholders), 0);
}

TEST(Condition, signalWithoutWaiter_isLostAndALaterWaitBlocks) {
  GSCondition condition;
  EXPECT_EQ(condition.signal(), 0);
  EXPECT_EQ(condition.broadcast(), 0);
  const timespec past = inMillis(-1);
  EXPECT_EQ(condition.wait(&past), ETIMEDOUT);
  EXPECT_EQ(waiters(condition), 0);
}

TEST(Condition, broadcast_wakesAllAndSignalAtLeastOne) {
  GSCondition condition;
  std::atomic<int> woken{0};
  std::vector<std::thread> threads;
  for (int i = 0; i < 3; ++i) {
    threads.emplace_back([&] {
      EXPECT_EQ(condition.wait(nullptr), 0);
      ++woken;
    });
  }
  ASSERT_TRUE(eventually([&] { return waiters(condition) == 3; }));
  EXPECT_EQ(condition.signal(), 0);
  ASSERT_TRUE(eventually([&] { return woken >= 1; }));
  EXPECT_EQ(condition.broadcast(), 0);
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(waiters(condition), 0);
}

}  // namespace
