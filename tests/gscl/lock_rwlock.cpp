// The reader/writer lock, its handle and the lockable object.
#include <errno.h>
#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "gscl/GSObject.h"
#include "lock_peek.h"

namespace {

using namespace lock_peek;

bool tryRead(GSRWLockImpl& lock) {
  return std::async(std::launch::async,
                    [&lock] {
                      const timespec past = inMillis(-1);
                      const bool taken = lock.ReadLock(&past) == 0;
                      if (taken) lock.ReadUnlock();
                      return taken;
                    })
      .get();
}

bool tryWrite(GSRWLockImpl& lock) {
  return std::async(std::launch::async,
                    [&lock] {
                      const timespec past = inMillis(-1);
                      const bool taken = lock.WriteLock(&past) == 0;
                      if (taken) lock.WriteUnlock();
                      return taken;
                    })
      .get();
}

void expectFree(GSRWLockImpl& lock) {
  EXPECT_EQ(refcount(lock), 0);
  EXPECT_EQ(readersWaiting(lock), 0);
  EXPECT_EQ(writersWaiting(lock), 0);
  EXPECT_TRUE(tryWrite(lock));
}

TEST(RWLock, waitingWriter_keepsNewReadersOutUntilItIsDone) {
  GSRWLockImpl lock;
  ASSERT_EQ(lock.ReadLock(nullptr), 0);
  EXPECT_TRUE(tryRead(lock)) << "readers share";
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
  EXPECT_FALSE(tryRead(lock));
  EXPECT_EQ(lock.ReadUnlock(), 0);
  writer.join();
  reader.join();
  expectFree(lock);
}

TEST(RWLock, writerReentering_needsAsManyReleases) {
  GSRWLockImpl lock;
  for (int i = 0; i < 3; ++i) ASSERT_EQ(lock.WriteLock(nullptr), 0);
  EXPECT_EQ(refcount(lock), -3);
  std::thread reader([&] {
    lock.ReadLock(nullptr);
    lock.ReadUnlock();
  });
  ASSERT_TRUE(eventually([&] { return readersWaiting(lock) == 1; }));
  for (int i = 0; i < 2; ++i) {
    EXPECT_EQ(lock.WriteUnlock(), 0);
    EXPECT_FALSE(tryRead(lock));
  }
  EXPECT_EQ(lock.WriteUnlock(), 0);
  reader.join();
  expectFree(lock);
}

TEST(RWLock, unlockOfAFreeLock_changesNothing) {
  GSRWLockImpl lock;
  EXPECT_EQ(lock.Unlock(), 0);
  EXPECT_EQ(lock.ReadUnlock(), 0);
  EXPECT_EQ(lock.WriteUnlock(), 0);
  expectFree(lock);
}

TEST(RWLock, deadline_countsOnlyWhileSomethingHoldsTheLock) {
  GSRWLockImpl lock;
  const timespec past = inMillis(-1000);
  ASSERT_EQ(lock.ReadLock(&past), 0);
  ASSERT_EQ(lock.ReadUnlock(), 0);
  ASSERT_EQ(lock.WriteLock(&past), 0);
  ASSERT_EQ(lock.WriteLock(&past), 0) << "re-entering does not wait either";
  std::thread([&] {
    const timespec soon = inMillis(50);
    const auto before = std::chrono::system_clock::now();
    EXPECT_EQ(lock.ReadLock(&soon), ETIMEDOUT);
    EXPECT_GE(std::chrono::system_clock::now() - before, std::chrono::milliseconds(40));
    EXPECT_EQ(lock.WriteLock(&soon), ETIMEDOUT);
  }).join();
  EXPECT_EQ(readersWaiting(lock), 0);
  EXPECT_EQ(writersWaiting(lock), 0);
  lock.WriteUnlock();
  lock.WriteUnlock();
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
  GSRWLockImpl lock;
  ASSERT_EQ(lock.WriteLock(nullptr), 0);
  GSRWLockImpl copy(lock);
  expectFree(copy);
  EXPECT_EQ(refcount(lock), -1);

  GSLockableObject object;
  ASSERT_EQ(object.WriteLock(nullptr), 0);
  GSLockableObject other(object);
  GSLockableObject assigned;
  assigned = object;
  assigned = *&assigned;
  const auto isFree = [](GSLockableObject& o) {
    return std::async(std::launch::async, [&o] {
             return o.WriteLock(nullptr) == 0 && o.WriteUnlock() == 0;
           }).wait_for(std::chrono::minutes(1)) == std::future_status::ready;
  };
  EXPECT_TRUE(isFree(other));
  EXPECT_TRUE(isFree(assigned));
  EXPECT_EQ(object.WriteUnlock(), 0);
}

TEST(RWLock, handle_waitsWithoutLimitWhateverTheDeadline) {
  GSRWLock lock;
  ASSERT_EQ(lock.WriteLock(nullptr), 0);
  const timespec past = inMillis(-1000);
  std::atomic<bool> released{false};
  std::thread writer([&] {
    EXPECT_EQ(lock.WriteLock(&past), 0);
    EXPECT_TRUE(released);
    lock.WriteUnlock();
  });
  std::thread reader([&] {
    EXPECT_EQ(lock.ReadLock(&past), 0);
    EXPECT_TRUE(released);
    lock.ReadUnlock();
  });
  // The handle hides the counters, so give both a fair chance to (wrongly) come back early.
  for (int i = 0; i < 50; ++i) std::this_thread::yield();
  released = true;
  EXPECT_EQ(lock.WriteUnlock(), 0);
  writer.join();
  reader.join();
}

// Readers, writers, deadlines and cancellations at once: never a writer beside anybody, no lost wake-up (the test
// would hang), counters back at nothing.
TEST(RWLock, storm_keepsExclusionAndLosesNobody) {
  GSRWLockImpl lock;
  std::atomic<int> inside{0};
  std::atomic<int> progress{0};
  int guarded = 0;
  const auto body = [&](unsigned seed) {
    std::minstd_rand random(seed);
    for (int i = 0; i < 2000; ++i) {
      pthread_testcancel();
      const timespec soon = inMillis(static_cast<long>(random() % 2));
      const timespec* limit = random() % 3 == 0 ? &soon : nullptr;
      if (random() % 3 == 0) {
        if (lock.WriteLock(limit) != 0) continue;
        EXPECT_EQ(inside.fetch_add(1000), 0);
        ++guarded;
        if (random() % 4 == 0) std::this_thread::yield();
        inside -= 1000;
        lock.WriteUnlock();
      } else {
        if (lock.ReadLock(limit) != 0) continue;
        EXPECT_LT(inside.fetch_add(1), 1000);
        EXPECT_GE(guarded, 0);
        if (random() % 4 == 0) std::this_thread::yield();
        ++progress;
        --inside;
        lock.ReadUnlock();
      }
    }
  };
  std::vector<std::unique_ptr<CancellableThread>> threads;
  for (unsigned i = 0; i < 8; ++i) threads.push_back(std::make_unique<CancellableThread>([&, i] { body(i + 1); }));
  for (size_t i = 0; i < threads.size(); i += 2) {
    const int before = progress;
    ASSERT_TRUE(eventually([&] { return progress > before + 100; }));
    threads[i]->cancel();
  }
  threads.clear();
  expectFree(lock);
}

}  // namespace
