// The recursive mutex, the condition, the reader/writer lock, its handle and the lockable object.
#include <errno.h>
#include <signal.h>

#include <atomic>
#include <future>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "gscl/GSObject.h"
#include "peek.h"

namespace {

using namespace peek;

/// What `call` returns on a thread of its own.
template <class Call>
auto elsewhere(Call call) {
  return std::async(std::launch::async, call).get();
}

const timespec kPast = inMillis(-1000);

TEST(MutexLock, contender_proceedsOnlyAfterTheLastUnlockOfTheHolder) {
  GSMutexLock lock;
  ASSERT_EQ(lock.lock(&kPast), 0) << "a free lock is taken also past the deadline";
  ASSERT_EQ(lock.lock(nullptr), 0);
  std::atomic<int> unlocks{0};
  std::atomic<bool> timedOut{false};
  std::thread contender([&] {
    timedOut = lock.lock(&kPast) == ETIMEDOUT;
    EXPECT_EQ(lock.lock(nullptr), 0);
    EXPECT_EQ(unlocks, 2);
    EXPECT_EQ(lock.unlock(), 0);
  });
  ASSERT_TRUE(eventually([&] { return timedOut && waiters(lock) == 1; }));
  ++unlocks;
  EXPECT_EQ(lock.unlock(), 0);
  EXPECT_EQ(locked(lock, &MutexFields::nholders), 1);
  ++unlocks;
  EXPECT_EQ(lock.unlock(), 0);
  contender.join();
  EXPECT_EQ(waiters(lock), 0);
  EXPECT_EQ(lock.unlock(), EPERM);
  EXPECT_EQ(lock.lock(nullptr), 0);
  EXPECT_EQ(elsewhere([&] { return lock.unlock(); }), 0) << "the last level";
  EXPECT_EQ(elsewhere([&] { return lock.lock(nullptr); }), 0);
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
      testing::ContainsRegex(" GSMutexLock::unlock holder\\([0-9a-f]+\\) <> self\\([0-9a-f]+\\)\n"
                             "asserted: rc=-1 in gscl/GSLockPrim \\(line=[0-9]+\\)\n"));
}

TEST(Condition, wakeUps_reachThoseWhoWaitAndNobodyLater) {
  GSCondition condition;
  EXPECT_EQ(condition.signal(), 0);
  EXPECT_EQ(condition.broadcast(), 0);
  EXPECT_EQ(condition.wait(&kPast), ETIMEDOUT);
  EXPECT_EQ(waiters(condition), 0);
  std::atomic<int> woken{0};
  Threads threads = startThreads(3, [&](int) {
    EXPECT_EQ(condition.wait(nullptr), 0);
    ++woken;
  });
  ASSERT_TRUE(eventually([&] { return waiters(condition) == 3; }));
  EXPECT_EQ(condition.signal(), 0);
  ASSERT_TRUE(eventually([&] { return woken >= 1; }));
  EXPECT_EQ(condition.broadcast(), 0);
  threads.clear();
  EXPECT_EQ(waiters(condition), 0);
}

bool canRead(GSRWLockImpl& lock) {
  return elsewhere([&] { return lock.ReadLock(&kPast) == 0 && lock.ReadUnlock() == 0; });
}

void expectFree(GSRWLockImpl& lock) {
  EXPECT_EQ(refcount(lock), 0);
  EXPECT_EQ(readersWaiting(lock), 0);
  EXPECT_EQ(writersWaiting(lock), 0);
  EXPECT_TRUE(elsewhere([&] { return lock.WriteLock(&kPast) == 0 && lock.WriteUnlock() == 0; }));
}

TEST(RWLock, waitingWriter_keepsNewReadersOutUntilItIsDone) {
  GSRWLockImpl lock;
  ASSERT_EQ(lock.ReadLock(nullptr), 0);
  EXPECT_TRUE(canRead(lock)) << "readers share";
  std::atomic<bool> wrote{false};
  std::thread writer([&] {
    lock.WriteLock(nullptr);
    wrote = true;
    lock.WriteUnlock();
  });
  ASSERT_TRUE(eventually([&] { return writersWaiting(lock) == 1; }));
  std::thread reader([&] {
    lock.ReadLock(nullptr);
    EXPECT_TRUE(wrote) << "the reader came after the waiting writer";
    lock.ReadUnlock();
  });
  ASSERT_TRUE(eventually([&] { return readersWaiting(lock) == 1; }));
  EXPECT_FALSE(canRead(lock));
  EXPECT_EQ(lock.ReadUnlock(), 0);
  writer.join();
  reader.join();
  EXPECT_EQ(lock.Unlock(), 0) << "of a free lock: changes nothing";
  expectFree(lock);
}

TEST(RWLock, writerReentering_needsAsManyReleases) {
  GSRWLockImpl lock;
  for (int i = 0; i < 3; ++i) ASSERT_EQ(lock.WriteLock(&kPast), 0) << "a deadline matters only to a wait";
  EXPECT_EQ(refcount(lock), -3);
  std::thread reader([&] {
    const timespec soon = inMillis(50);
    EXPECT_EQ(lock.WriteLock(&soon), ETIMEDOUT);
    const timespec now = inMillis(0);
    EXPECT_LE(soon.tv_sec * 1000 + soon.tv_nsec / 1000000, now.tv_sec * 1000 + now.tv_nsec / 1000000);
    lock.ReadLock(nullptr);
    lock.ReadUnlock();
  });
  ASSERT_TRUE(eventually([&] { return readersWaiting(lock) == 1; }));
  for (int i = 0; i < 2; ++i) {
    EXPECT_EQ(lock.WriteUnlock(), 0);
    EXPECT_FALSE(canRead(lock));
  }
  EXPECT_EQ(lock.WriteUnlock(), 0);
  reader.join();
  expectFree(lock);
}

// A reader holds the lock, a writer waits, a second reader waits behind the writer alone.
class WriterGivesUp : public testing::TestWithParam<bool> {};

TEST_P(WriterGivesUp, readersBehindIt_proceed) {
  GSRWLockImpl lock;
  ASSERT_EQ(lock.ReadLock(nullptr), 0);
  const timespec soon = inMillis(200);
  const bool byCancellation = GetParam();
  CancellableThread writer([&] { lock.WriteLock(byCancellation ? nullptr : &soon); });
  ASSERT_TRUE(eventually([&] { return writersWaiting(lock) == 1; }));
  auto reader =
      std::async(std::launch::async, [&] { return lock.ReadLock(nullptr) == 0 && lock.ReadUnlock() == 0; });
  if (byCancellation) {
    ASSERT_TRUE(eventually([&] { return readersWaiting(lock) == 1; }));
    writer.cancel();
  }
  EXPECT_EQ(writer.join(), byCancellation);
  ASSERT_EQ(reader.wait_for(std::chrono::minutes(1)), std::future_status::ready);
  EXPECT_TRUE(reader.get());
  EXPECT_EQ(lock.ReadUnlock(), 0);
  expectFree(lock);
}

INSTANTIATE_TEST_SUITE_P(RWLock, WriterGivesUp, testing::Bool(),
                         [](const auto& param) { return param.param ? "cancelled" : "timedOut"; });

TEST(RWLock, copies_areFreeAndIndependent) {
  GSLockableObject object;
  ASSERT_EQ(object.WriteLock(nullptr), 0);
  GSLockableObject other(object), assigned;
  assigned = object;
  assigned = *&assigned;
  for (GSLockableObject* copy : {&other, &assigned}) {
    EXPECT_EQ(elsewhere([&] { return copy->WriteLock(nullptr); }), 0);
  }
  EXPECT_EQ(object.WriteUnlock(), 0);
  GSRWLockImpl lock;
  ASSERT_EQ(lock.WriteLock(nullptr), 0);
  GSRWLockImpl copy(lock);
  expectFree(copy);
}

TEST(RWLock, handle_waitsWithoutLimitWhateverTheDeadline) {
  GSRWLock lock;
  ASSERT_EQ(lock.WriteLock(nullptr), 0);
  std::jthread writer([&] { EXPECT_EQ(lock.WriteLock(&kPast) + lock.WriteUnlock(), 0); });
  std::jthread reader([&] { EXPECT_EQ(lock.ReadLock(&kPast) + lock.ReadUnlock(), 0); });
  auto& inner = **reinterpret_cast<GSRWLockImpl**>(&lock);
  EXPECT_TRUE(eventually([&] { return writersWaiting(inner) == 1 && readersWaiting(inner) == 1; }));
  EXPECT_EQ(lock.WriteUnlock(), 0);
}

// Readers, writers, deadlines and cancellations race with releases: never a writer beside anybody; a lost wake-up
// would hang the rest.
template <class Take, class Release>
void storm(Take take, Release release) {
  std::atomic<int> inside{0}, progress{0};
  int guarded = 0;
  Threads threads = startThreads(8, [&](int seed) {
    std::minstd_rand random(static_cast<unsigned>(seed) + 1);
    for (int i = 0; i < 2000; ++i) {
      pthread_testcancel();
      const timespec soon = inMillis(static_cast<long>(random() % 2));
      const bool writing = random() % 3 == 0;
      const int weight = take(writing, random() % 3 == 0 ? &soon : nullptr);
      if (weight == 0) continue;
      EXPECT_LT(inside.fetch_add(weight), weight == 1 ? 1000 : 1);
      if (weight > 1) ++guarded;
      EXPECT_GE(guarded, 0);
      if (random() % 4 == 0) std::this_thread::yield();
      ++progress;
      inside -= weight;
      release();
    }
  });
  for (size_t i = 0; i < threads.size(); i += 2) {
    const int before = progress;
    ASSERT_TRUE(eventually([&] { return progress > before + 100; }));
    threads[i]->cancel();
  }
}

TEST(MutexLock, storm_keepsExclusionAndLosesNobody) {
  GSMutexLock lock;
  storm([&](bool, const timespec* limit) { return lock.lock(limit) == 0 ? 1000 : 0; }, [&] { lock.unlock(); });
  EXPECT_EQ(waiters(lock), 0);
  EXPECT_EQ(locked(lock, &MutexFields::nholders), 0);
}

TEST(RWLock, storm_keepsExclusionAndLosesNobody) {
  GSRWLockImpl lock;
  storm(
      [&](bool writing, const timespec* limit) {
        if (writing) return lock.WriteLock(limit) == 0 ? 1000 : 0;
        return lock.ReadLock(limit) == 0 ? 1 : 0;
      },
      [&] { lock.Unlock(); });
  expectFree(lock);
}

}  // namespace
