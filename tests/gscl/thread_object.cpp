// Thread objects: start, stop, join, restart, and destruction in every state.
#include <errno.h>
#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <type_traits>
#include <vector>

#include "gscl/GSDebug.h"
#include "thread_peek.h"
#include "zn_cu.h"

namespace {

using namespace thread_peek;
using lock_peek::CancellableThread;
using lock_peek::eventually;
using zelt_gscl::GS_THREAD_IDLE;
using zelt_gscl::GS_THREAD_RUNNING;
using Base = zelt_gscl_V2::GSThread;

constexpr pthread_t kNone = ~pthread_t{0};

static_assert(std::is_abstract<zelt_gscl_V1::GSThread>::value && std::is_abstract<Base>::value);

class Worker : public Base {
 public:
  explicit Worker(std::function<void*(Worker&, void*)> body, size_t stack = 0)
      : Base(stack), _body(std::move(body)) {}
  // As the header asks of a class whose run uses its own members.
  ~Worker() override {
    stop();
    join(nullptr);
  }
  void* run(void* args) override { return _body(*this, args); }

 private:
  std::function<void*(Worker&, void*)> _body;
};

// Without members or a destructor of its own: all the cleaning up is the base class's.
class Waiter : public zelt_gscl_V1::GSThread {
 public:
  Waiter() : GSThread(0) {}
  void* run(void*) override {
    int event = 0;
    while (event != -1) waitSyncEvent(&event, -1);
    return this;
  }
};

// Its run does not look at the object, so it may be destroyed at any time, from the compiler's point of view too.
template <class Version>
class Sleeper : public Version {
 public:
  Sleeper() : Version(0) {}
  void* run(void*) override {
    static GSCondition never;  // (ThreadSanitizer loses count of locks when a system call is cancelled)
    for (;;) never.wait(nullptr);
  }
};

void* const kResult = reinterpret_cast<void*>(0x5a);

// Collects what goes over one of the channels while it lives.
std::mutex linesMutex;
std::string lines;

class Lines {
 public:
  Lines() {
    const auto append = [](int, char* text) {
      std::lock_guard<std::mutex> lock(linesMutex);
      lines += text;
      lines += '|';
    };
    lines.clear();
    _debug = GSSetDebugRtn(append);
    _trace = GSSetTraceRtn(append);
    GSSetDebugLevel(GSCL_TRC_API | GSCL_TRC_DETAIL);
  }
  ~Lines() {
    GSSetDebugLevel(0);
    GSSetDebugRtn(_debug);
    GSSetTraceRtn(_trace);
  }
  static std::string take() {
    std::lock_guard<std::mutex> lock(linesMutex);
    return std::exchange(lines, "");
  }

 private:
  gscl_debugf_rtn _debug;
  gscl_tracef_rtn _trace;
};

std::string hex(pthread_t id) {
  char text[16];
  snprintf(text, sizeof text, "%x", static_cast<unsigned>(id));
  return text;
}
std::string hex(const void* p) { return hex(reinterpret_cast<pthread_t>(p)); }

TEST(Thread, life_goesFromIdleOverRunningToJoined) {
  std::promise<void> end;
  Worker thread([&](Worker&, void* args) {
    end.get_future().wait();
    return args;
  });
  EXPECT_EQ(thread.getThreadState(), GS_THREAD_IDLE);
  EXPECT_EQ(thread.getThreadId(), kNone);
  const pthread_t id = thread.start(kResult);
  ASSERT_NE(id, kNone);
  EXPECT_EQ(thread.getThreadState(), GS_THREAD_RUNNING);
  EXPECT_TRUE(eventually([&] { return thread.getThreadId() == id; }));
  EXPECT_EQ(fields(thread).start_args, kResult);
  EXPECT_EQ(thread.start(nullptr), kNone) << "one thread at a time";
  EXPECT_EQ(thread.getThreadState(), GS_THREAD_RUNNING);
  end.set_value();
  void* result = nullptr;
  EXPECT_EQ(thread.join(&result), 0);
  EXPECT_EQ(result, kResult);
  EXPECT_EQ(thread.getThreadState(), GS_THREAD_IDLE);
  EXPECT_EQ(thread.getThreadId(), id) << "join keeps the id";
}

TEST(Thread, joinRightAfterStart_waitsAndGivesTheResultAgainAndAgain) {
  Worker thread([](Worker&, void* args) { return args; });
  for (long i = 1; i <= 200; ++i) {
    ASSERT_NE(thread.start(reinterpret_cast<void*>(i)), kNone);
    void* result = nullptr;
    ASSERT_EQ(thread.join(&result), 0);
    ASSERT_EQ(result, reinterpret_cast<void*>(i));
    ASSERT_EQ(thread.join(&result), ESRCH) << "at most once per start";
  }
}

TEST(Thread, refusedJoins_areNotZeroAndJoinNothing) {
  std::promise<void> end;
  std::promise<int> ofItself;
  Worker thread([&](Worker& self, void*) {
    ofItself.set_value(self.stop() == -1 ? self.join(nullptr) : 0);
    end.get_future().wait();
    return kResult;
  });
  EXPECT_EQ(thread.join(nullptr), ESRCH) << "never started";
  thread.start(nullptr);
  EXPECT_EQ(ofItself.get_future().get(), EDEADLK) << "nor may it stop itself";

  std::vector<std::future<int>> joiners;
  for (int i = 0; i < 3; ++i) {
    joiners.push_back(std::async(std::launch::async, [&] { return thread.join(nullptr); }));
  }
  const auto busy = [&] {
    int ready = 0;
    for (auto& j : joiners) ready += j.wait_for(std::chrono::seconds(0)) == std::future_status::ready ? 1 : 0;
    return ready == 2;
  };
  EXPECT_TRUE(eventually(busy)) << "one waits, the others are refused at once";
  end.set_value();
  std::vector<int> results;
  for (auto& j : joiners) results.push_back(j.get());
  EXPECT_EQ(std::count(results.begin(), results.end(), 0), 1);
  EXPECT_EQ(std::count(results.begin(), results.end(), EBUSY), 2);
}

TEST(Thread, stop_cancelsWithoutJoining) {
  Waiter thread;
  EXPECT_EQ(thread.stop(), -1) << "never started";
  thread.start(nullptr);
  ASSERT_TRUE(eventually([&] { return waiters(thread) == 1; }));
  EXPECT_EQ(thread.stop(), 0);
  EXPECT_EQ(thread.getThreadState(), GS_THREAD_IDLE);
  EXPECT_EQ(thread.getThreadId(), kNone);
  EXPECT_EQ(thread.stop(), -1);
  void* result = nullptr;
  EXPECT_EQ(thread.join(&result), 0);
  EXPECT_EQ(result, PTHREAD_CANCELED);
  EXPECT_EQ(thread.join(&result), ESRCH);
  EXPECT_EQ(waiters(thread), 0);
}

TEST(Thread, stopRightAfterStart_endsAThreadThatHasNotRecordedItself) {
  for (int i = 0; i < 200; ++i) {
    Waiter thread;
    thread.start(nullptr);
    ASSERT_EQ(thread.stop(), 0);
    ASSERT_EQ(thread.join(nullptr), 0);
    ASSERT_EQ(thread.getThreadId(), kNone);
  }
}

TEST(Thread, startAfterStopOrEnd_joinsTheEarlierThreadFirst) {
  std::atomic<int> inside{0};
  Worker thread([&](Worker& self, void* args) -> void* {
    EXPECT_EQ(inside.exchange(1), 0) << "two threads in one object";
    struct Leave {
      std::atomic<int>& in;
      ~Leave() { in = 0; }
    } leave{inside};
    if (args == nullptr) self.waitSyncEvent(nullptr, -1);
    return args;
  });
  for (int i = 0; i < 50; ++i) {
    ASSERT_NE(thread.start(nullptr), kNone);
    ASSERT_EQ(thread.stop(), 0);
  }
  ASSERT_NE(thread.start(kResult), kNone);
  EXPECT_TRUE(eventually([&] { return thread.start(kResult) != kNone; })) << "once the earlier one has ended";
  void* result = nullptr;
  EXPECT_EQ(thread.join(&result), 0);
  EXPECT_EQ(result, kResult);
}

TEST(Thread, destruction_worksInEveryState) {
  { Waiter neverStarted; }
  for (int i = 0; i < 500; ++i) {  // wherever the new thread is just then
    Sleeper<zelt_gscl_V1::GSThread> running;
    Sleeper<zelt_gscl_V2::GSThread> second;
    ASSERT_NE(running.start(nullptr), kNone);
    ASSERT_NE(second.start(nullptr), kNone);
    if (i % 2 == 0) std::this_thread::yield();
  }
  {
    Waiter blocked;
    blocked.start(nullptr);
    ASSERT_TRUE(eventually([&] { return waiters(blocked) == 1; }));
  }
  {
    Waiter finished;
    finished.postSyncEvent(-1);
    finished.start(nullptr);
    ASSERT_TRUE(eventually([&] { return finished.SyncEventCount() == 0; }));
  }
  {
    Waiter joined;
    joined.postSyncEvent(-1);
    joined.start(nullptr);
    void* result = nullptr;
    ASSERT_EQ(joined.join(&result), 0);
    EXPECT_EQ(result, static_cast<void*>(static_cast<zelt_gscl_V1::GSThread*>(&joined)));
  }
  {
    Waiter stopped;
    stopped.start(nullptr);
    ASSERT_TRUE(eventually([&] { return waiters(stopped) == 1; }));
    ASSERT_EQ(stopped.stop(), 0);
  }
}

class SelfDestroyer : public zelt_gscl_V1::GSThread {
 public:
  explicit SelfDestroyer(std::shared_ptr<std::promise<void>> done) : GSThread(0), _done(std::move(done)) {}
  void* run(void*) override {
    const std::shared_ptr<std::promise<void>> done = _done;
    delete this;
    done->set_value();
    return nullptr;
  }

 private:
  std::shared_ptr<std::promise<void>> _done;
};

TEST(Thread, destructionOnItsOwnThread_letsTheThreadGo) {
  for (int i = 0; i < 20; ++i) {
    const auto done = std::make_shared<std::promise<void>>();
    ASSERT_NE((new SelfDestroyer(done))->start(nullptr), kNone);
    done->get_future().wait();
  }
}

TEST(Thread, destructionByAThreadBeingCancelled_isCompleted) {
  std::promise<void> started;
  auto thread = std::make_unique<Waiter>();
  thread->start(nullptr);
  ASSERT_TRUE(eventually([&] { return waiters(*thread) == 1; }));
  CancellableThread owner([&] {
    pthread_cancel(pthread_self());
    thread.reset();
    pthread_testcancel();
  });
  EXPECT_TRUE(owner.join());
  EXPECT_EQ(thread, nullptr);
}

TEST(Thread, detachedThread_isLeftAloneAndNeverJoined) {
  auto go = std::make_shared<std::promise<void>>();
  auto ended = std::make_shared<std::promise<void>>();
  std::future<void> end = ended->get_future();
  struct Detached : zelt_gscl_V1::GSThread {
    Detached() : GSThread(0) {}
    void* run(void* args) override {
      const auto body = std::unique_ptr<std::function<void()>>(static_cast<std::function<void()>*>(args));
      (*body)();
      return nullptr;
    }
  };
  {
    Detached thread;
    thread.setDetachState(PTHREAD_CREATE_DETACHED);
    EXPECT_EQ(thread.getDetachState(), PTHREAD_CREATE_DETACHED);
    std::promise<void> entered;
    const auto body = [go, ended, &entered] {
      entered.set_value();
      go->get_future().wait();
      ended->set_value();
    };
    ASSERT_NE(thread.start(new std::function<void()>(body)), kNone);
    entered.get_future().wait();
    EXPECT_EQ(thread.join(nullptr), EINVAL);
  }
  go->set_value();
  EXPECT_EQ(end.wait_for(std::chrono::minutes(1)), std::future_status::ready) << "it was not cancelled";
}

TEST(Thread, threadThatRuns_hasItsStackSizeAndIsRegisteredForDumps) {
  constexpr size_t kStack = 1 << 20;
  const auto body = [](Worker&, void*) -> void* {
    pthread_attr_t attributes;
    size_t size = 0;
    pthread_getattr_np(pthread_self(), &attributes);
    pthread_attr_getstacksize(&attributes, &size);
    pthread_attr_destroy(&attributes);
    EXPECT_EQ(cu_stackdump_thread_disable_1(pthread_self()), 0);
    EXPECT_EQ(cu_stackdump_thread_enable_1(), 0);
    return reinterpret_cast<void*>(size);
  };
  Worker thread(body, kStack);
  const pthread_t id = thread.start(nullptr);
  void* result = nullptr;
  ASSERT_EQ(thread.join(&result), 0);
  EXPECT_GE(reinterpret_cast<size_t>(result), kStack);
  EXPECT_LT(reinterpret_cast<size_t>(result), 2 * kStack);
  EXPECT_EQ(cu_stackdump_thread_disable_1(id), ESRCH);
}

TEST(Thread, events_arePostedPushedPoppedAndWaitedFor) {
  Worker thread([](Worker& self, void*) -> void* {
    int event = 0;
    EXPECT_EQ(self.waitSyncEvent(&event, -1, 0), 0);
    EXPECT_EQ(event, 1);
    EXPECT_EQ(self.waitSyncEvent(&event, 0), 0);
    EXPECT_EQ(event, 2);
    EXPECT_EQ(self.waitSyncEvent(&event, 0, 1000), ETIMEDOUT);
    return kResult;
  });
  EXPECT_EQ(thread.popSyncEvent(nullptr), 0);
  EXPECT_EQ(thread.pushSyncEvent(1), 1);
  int event = 0;
  EXPECT_EQ(thread.popSyncEvent(&event), 1);
  EXPECT_EQ(event, 1);
  EXPECT_EQ(thread.pushSyncEvent(1), 1);
  EXPECT_EQ(thread.postSyncEvent(2), 0);
  EXPECT_EQ(thread.SyncEventCount(), 2);
  thread.start(nullptr);
  void* result = nullptr;
  EXPECT_EQ(thread.join(&result), 0);
  EXPECT_EQ(result, kResult);
}

TEST(ThreadTrace, startStopAndFailures_writeTheirLines) {
  const Lines collect;
  Waiter thread;
  thread.stop();
  EXPECT_EQ(Lines::take(), "GSThread[ffffffff] is not running\n|");

  thread.setDetachState(77);
  EXPECT_EQ(Lines::take(), "GSThread::setDetachState(this=" + hex(&thread) + ") state = 77|");
  thread.setThreadState(GS_THREAD_RUNNING);
  EXPECT_EQ(thread.start(nullptr), kNone);
  EXPECT_EQ(thread.getThreadState(), GS_THREAD_IDLE) << "whatever it was before";
  EXPECT_EQ(Lines::take(),
            "GSThread[ffffffff] starts\n|Error on pthread_create rc=" + std::to_string(EINVAL) + "\n|");

  thread.setDetachState(PTHREAD_CREATE_JOINABLE);
  Lines::take();
  thread.postSyncEvent(-1);
  const pthread_t id = thread.start(nullptr);
  thread.join(nullptr);
  EXPECT_EQ(Lines::take(),
            "GSThread[ffffffff] starts\n|stub_run_thread tid=" + std::to_string(static_cast<int>(id)) + "\n|");
  EXPECT_EQ(std::string(static_cast<const char*>(getTraceIdStr(&thread))),
            "Thread[T=" + std::to_string(static_cast<int>(id)) + "]");
  fields(thread).tid = 0x1a2b;
  EXPECT_STREQ(static_cast<const char*>(getTraceIdStr(&thread)), "Thread[T=6699]");
  fields(thread).tid = id;
}

TEST(ThreadTrace, destruction_writesEachStepWithoutLineEnds) {
  const Lines collect;
  const std::string self = ", self=" + hex(pthread_self());
  std::string object, id;
  {
    Waiter never;
    object = hex(&never);
  }
  EXPECT_EQ(Lines::take(), "GSThread::~GSThread this=" + object + " tid=ffffffff" + self + "|");
  {
    Waiter blocked;
    object = hex(&blocked);
    id = hex(blocked.start(nullptr));
    ASSERT_TRUE(eventually([&] { return waiters(blocked) == 1; }));
    Lines::take();
  }
  EXPECT_EQ(Lines::take(), "GSThread::~GSThread this=" + object + " tid=" + id + self +
                               "|GSThread::~GSThread stop (tid=" + id + ")|GSThread::~GSThread joining tid=" + id +
                               "|GSThread::~GSThread join done tid=" + id + "|");
}

// The sanitizer does not know that a cancelled join has not joined.
#if !defined(__has_feature)
#define __has_feature(x) 0
#endif
#if !__has_feature(thread_sanitizer)
TEST(Thread, cancelledJoin_leavesTheThreadToBeJoined) {
  Waiter thread;
  thread.start(nullptr);
  std::atomic<bool> joining{false};
  CancellableThread joiner([&] {
    joining = true;
    thread.join(nullptr);
  });
  ASSERT_TRUE(eventually([&] { return joining && thread.join(nullptr) == EBUSY; }));
  joiner.cancel();
  EXPECT_TRUE(joiner.join());
  thread.postSyncEvent(-1);
  EXPECT_EQ(thread.join(nullptr), 0);
}
#endif

}  // namespace
