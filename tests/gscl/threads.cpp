// Thread objects: start, stop, join, restart, and destruction in every state.
#include <errno.h>
#include <unistd.h>

#include <atomic>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "gscl/GSDebug.h"
#include "peek.h"
#include "platform/common/sanitizers.h"
#include "zn_cu.h"

namespace {

using namespace peek;
using zelt_gscl::GS_THREAD_IDLE;
using zelt_gscl::GS_THREAD_RUNNING;
using Base = zelt_gscl_V2::GSThread;

constexpr pthread_t kNone = ~pthread_t{0};
void* const kResult = reinterpret_cast<void*>(0x5a);

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

/// Starts it and returns when it waits.
void startWaiting(Waiter& thread) {
  ASSERT_NE(thread.start(nullptr), kNone);
  ASSERT_TRUE(eventually([&] { return waiters(thread) == 1; }));
}

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

TEST(Thread, life_goesFromIdleOverRunningToJoined) {
  std::promise<void> end;
  Worker thread([&](Worker&, void* args) {
    end.get_future().wait();
    return args;
  });
  EXPECT_EQ(thread.getThreadState(), GS_THREAD_IDLE);
  EXPECT_EQ(thread.join(nullptr), ESRCH) << "never started";
  EXPECT_EQ(thread.stop(), -1);
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

TEST(Thread, joinOrStopRightAfterStart_findsTheThread) {
  Worker thread([](Worker&, void* args) { return args; });
  for (long i = 1; i <= 200; ++i) {
    void* result = nullptr;
    ASSERT_NE(thread.start(reinterpret_cast<void*>(i)), kNone);
    ASSERT_EQ(thread.join(&result), 0);
    ASSERT_EQ(result, reinterpret_cast<void*>(i));
    ASSERT_EQ(thread.join(&result), ESRCH) << "at most once per start";
    Waiter stopped;
    stopped.start(nullptr);
    ASSERT_TRUE(i % 2 == 0 || eventually([&] { return waiters(stopped) == 1; }));
    ASSERT_EQ(stopped.stop(), 0);
    ASSERT_EQ(stopped.getThreadState(), GS_THREAD_IDLE);
    ASSERT_EQ(stopped.getThreadId(), kNone);
    ASSERT_EQ(stopped.stop(), -1);
    ASSERT_EQ(stopped.join(&result), 0);
    ASSERT_EQ(result, PTHREAD_CANCELED);
    ASSERT_EQ(waiters(stopped), 0);
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
  thread.start(nullptr);
  EXPECT_EQ(ofItself.get_future().get(), EDEADLK) << "nor may it stop itself";
  std::vector<std::future<int>> joiners;
  for (int i = 0; i < 3; ++i) {
    joiners.push_back(std::async(std::launch::async, [&] { return thread.join(nullptr); }));
  }
  EXPECT_TRUE(eventually([&] {
    return std::count_if(joiners.begin(), joiners.end(), [](auto& joiner) {
             return joiner.wait_for(std::chrono::seconds(0)) == std::future_status::ready;
           }) == 2;
  })) << "one waits, the others are refused at once";
  end.set_value();
  std::vector<int> results;
  for (auto& joiner : joiners) results.push_back(joiner.get());
  EXPECT_THAT(results, testing::UnorderedElementsAre(0, EBUSY, EBUSY));
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
  for (int i = 0; i < 500; ++i) {  // wherever the new thread is just then
    Sleeper<zelt_gscl_V1::GSThread> running;
    Sleeper<zelt_gscl_V2::GSThread> second;
    ASSERT_NE(running.start(nullptr), kNone);
    ASSERT_NE(second.start(nullptr), kNone);
    if (i % 2 == 0) std::this_thread::yield();
  }
  Waiter never, finished, joined, stopped;
  for (Waiter* thread : {&finished, &joined}) {
    thread->postSyncEvent(-1);
    thread->start(nullptr);
    ASSERT_TRUE(eventually([&] { return thread->SyncEventCount() == 0; }));
  }
  EXPECT_EQ(joined.join(nullptr), 0);
  startWaiting(stopped);
  EXPECT_EQ(stopped.stop(), 0);
}

TEST(Thread, destructionByAThreadBeingCancelled_isCompleted) {
  auto thread = std::make_unique<Waiter>();
  startWaiting(*thread);
  CancellableThread owner([&] {
    pthread_cancel(pthread_self());
    thread.reset();
    pthread_testcancel();
  });
  EXPECT_TRUE(owner.join());
  EXPECT_EQ(thread, nullptr);
}

/// Runs the function that it is started with, which does not need the object.
class Free : public zelt_gscl_V1::GSThread {
 public:
  using Body = std::function<void(Free*)>;
  explicit Free(int detachState) : GSThread(0) { setDetachState(detachState); }
  void go(Body body) { ASSERT_NE(start(new Body(std::move(body))), kNone); }
  void* run(void* args) override {
    const std::unique_ptr<Body> body(static_cast<Body*>(args));
    (*body)(this);
    return nullptr;
  }
};

TEST(Thread, destructionOnItsOwnThread_letsTheThreadGo) {
  std::atomic<int> done{0};
  for (int i = 0; i < 20; ++i) {
    (new Free(PTHREAD_CREATE_JOINABLE))->go([&](Free* self) {
      delete self;
      ++done;
    });
  }
  EXPECT_TRUE(eventually([&] { return done == 20; }));
}

TEST(Thread, detachedThread_isLeftAloneAndNeverJoined) {
  std::atomic<bool> entered{false}, go{false}, ended{false};
  {
    Free thread(PTHREAD_CREATE_DETACHED);
    thread.go([&](Free*) {
      entered = true;
      while (!go) usleep(1000);  // where it could be cancelled
      ended = true;
    });
    EXPECT_TRUE(eventually([&] { return entered.load(); }));
    EXPECT_EQ(thread.join(nullptr), EINVAL);
  }
  go = true;
  EXPECT_TRUE(eventually([&] { return ended.load(); }));
}

TEST(Thread, threadThatRuns_hasItsStackSizeEventsAndIsRegisteredForDumps) {
  constexpr size_t kStack = 1 << 20;
  const auto body = [](Worker& self, void*) -> void* {
    pthread_attr_t attributes;
    size_t size = 0;
    pthread_getattr_np(pthread_self(), &attributes);
    pthread_attr_getstacksize(&attributes, &size);
    pthread_attr_destroy(&attributes);
    EXPECT_EQ(cu_stackdump_thread_disable_1(pthread_self()), 0);
    EXPECT_EQ(cu_stackdump_thread_enable_1(), 0);
    int event = 0;
    EXPECT_EQ(self.waitSyncEvent(&event, -1, 0), 0);
    EXPECT_EQ(event, 1);
    EXPECT_EQ(self.waitSyncEvent(&event, -5, 0), 0) << "a deadline does not matter when there is one";
    EXPECT_EQ(event, 2);
    EXPECT_EQ(self.popSyncEvent(&event), 0);
    EXPECT_EQ(event, 2) << "left alone";
    EXPECT_EQ(self.waitSyncEvent(&event, 0, 1000), ETIMEDOUT);
    return reinterpret_cast<void*>(size);
  };
  Worker thread(body, kStack);
  EXPECT_EQ(thread.pushSyncEvent(1), 1);
  EXPECT_EQ(thread.postSyncEvent(2), 0);
  EXPECT_EQ(thread.SyncEventCount(), 2);
  const pthread_t id = thread.start(nullptr);
  void* result = nullptr;
  ASSERT_EQ(thread.join(&result), 0);
  EXPECT_GE(reinterpret_cast<size_t>(result), kStack);
  EXPECT_LT(reinterpret_cast<size_t>(result), 2 * kStack);
  EXPECT_EQ(cu_stackdump_thread_disable_1(id), ESRCH);
}

std::mutex linesMutex;
std::string lines;

std::string take() {
  std::lock_guard<std::mutex> lock(linesMutex);
  return std::exchange(lines, "");
}

std::string hex(uintptr_t value) {
  char text[16];
  snprintf(text, sizeof text, "%x", static_cast<unsigned>(value));
  return text;
}

TEST(Thread, lines_ofStartStopFailureAndDestruction) {
  const auto append = [](int, char* text) {
    std::lock_guard<std::mutex> lock(linesMutex);
    lines += text + std::string("|");
  };
  const gscl_debugf_rtn debug = GSSetDebugRtn(append);
  const gscl_tracef_rtn trace = GSSetTraceRtn(append);
  GSSetDebugLevel(GSCL_TRC_API | GSCL_TRC_DETAIL);
  std::string object, id, number;
  {
    Waiter thread;
    object = hex(reinterpret_cast<uintptr_t>(&thread));
    thread.stop();
    thread.setDetachState(77);
    thread.setThreadState(GS_THREAD_RUNNING);
    EXPECT_EQ(thread.start(nullptr), kNone);
    EXPECT_EQ(thread.getThreadState(), GS_THREAD_IDLE) << "whatever it was before";
    EXPECT_EQ(take(), "GSThread[ffffffff] is not running\n|GSThread::setDetachState(this=" + object +
                          ") state = 77|GSThread[ffffffff] starts\n|Error on pthread_create rc=22\n|");
    thread.setDetachState(PTHREAD_CREATE_JOINABLE);
    take();
    startWaiting(thread);
    id = hex(thread.getThreadId());
    number = std::to_string(static_cast<int>(thread.getThreadId()));
    EXPECT_STREQ(static_cast<const char*>(getTraceIdStr(&thread)), ("Thread[T=" + number + "]").c_str());
    EXPECT_EQ(take(), "GSThread[ffffffff] starts\n|stub_run_thread tid=" + number + "\n|");
  }
  EXPECT_EQ(take(), "GSThread::~GSThread this=" + object + " tid=" + id + ", self=" + hex(pthread_self()) +
                        "|GSThread::~GSThread stop (tid=" + id + ")|GSThread::~GSThread joining tid=" + id +
                        "|GSThread::~GSThread join done tid=" + id + "|");
  GSSetDebugLevel(0);
  GSSetDebugRtn(debug);
  GSSetTraceRtn(trace);
}

/// Starts in its constructor.
class Early : public Base {
 public:
  Early() : Base(0) { start(nullptr); }
  void* run(void*) override { return nullptr; }
};

class Late : public Early {
 public:
  ~Late() override { join(nullptr); }
  void* run(void*) override { return kResult; }
};

std::atomic<bool> constructed;

TEST(Thread, run_isTheOneOfTheObjectAsTheThreadFindsIt) {
  constructed = false;
  const gscl_tracef_rtn before = GSSetTraceRtn([](int, char* text) {
    while (std::string(text).starts_with("stub_run_thread") && !constructed) std::this_thread::yield();
  });
  GSSetDebugLevel(GSCL_TRC_API);
  Late thread;
  constructed = true;
  void* result = nullptr;
  EXPECT_EQ(thread.join(&result), 0);
  EXPECT_EQ(result, kResult);
  GSSetDebugLevel(0);
  GSSetTraceRtn(before);
}

// The sanitizer does not know that a cancelled join has not joined.
#if !ZN_THREAD_SANITIZER
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
