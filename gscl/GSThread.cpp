#include "gscl/GSThread.h"

#include <cxxabi.h>
#include <errno.h>
#include <stdint.h>
#include <stdio.h>

#include <memory>
#include <mutex>
#include <new>

#include "gscl/GSThread_internal.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace.h"
#include "zn_cu.h"

using gscl_internal::ThreadControl;
using zelt_gscl::GS_THREAD_IDLE;
using zelt_gscl::GS_THREAD_RUNNING;

static_assert(sizeof(zelt_gscl_V1::GSThread) == 16 && sizeof(zelt_gscl_V2::GSThread) == 16, "fixed layout");
static_assert(sizeof(GSxThreadData) ==
                  32 + sizeof(zelt_gscl_V1::GSIntegerEventQueue) + sizeof(std::shared_ptr<ThreadControl>),
              "the fixed fields, and the control behind them");

namespace {

constexpr pthread_t kNoThread = ~pthread_t{0};

using RunFunction = void* (*)(zelt_gscl_V1::GSThread*, void*);

/// What a new thread needs to begin; it owns it.
struct Launch {
  std::shared_ptr<ThreadControl> control;
  zelt_gscl_V1::GSThread* thread;
  void* args;
};

GSxThreadData& dataOf(void* innerData) { return *static_cast<GSxThreadData*>(innerData); }

unsigned low32(pthread_t id) { return static_cast<unsigned>(id); }
unsigned low32(const void* p) { return static_cast<unsigned>(reinterpret_cast<uintptr_t>(p)); }

// What a virtual call of `run` calls at this moment; null while the object's destruction is in the classes that
// have none, in which a virtual call would end the process. The destructor of an object whose thread has just been
// started changes the table meanwhile, and either answer is right then.
__attribute__((noinline, no_sanitize("thread"))) RunFunction overriderOfRun(const zelt_gscl_V1::GSThread* thread) {
  typedef void* const* __attribute__((may_alias)) Table;
  constexpr size_t kRunSlot = 2;  // behind the two of the destructor
  void* const function = (*reinterpret_cast<const volatile Table*>(thread))[kRunSlot];
  if (function == reinterpret_cast<void*>(abi::__cxa_pure_virtual)) return nullptr;
  return reinterpret_cast<RunFunction>(function);
}

// Each way out of a thread, by return, cancellation or pthread_exit. It unregisters itself here and not in join,
// where its id may already be another thread's.
class ThreadEnd {
 public:
  explicit ThreadEnd(ThreadControl& control) : _control(control) {}
  ~ThreadEnd() {
    int previous = 0;
    pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &previous);
    cu_stackdump_thread_disable_1(pthread_self());
    std::lock_guard<std::mutex> lock(_control.mutex);
    _control.ended = true;
  }
  ThreadEnd(const ThreadEnd&) = delete;
  ThreadEnd& operator=(const ThreadEnd&) = delete;

 private:
  ThreadControl& _control;
};

class ThreadAttributes {
 public:
  ThreadAttributes() { pthread_attr_init(&_attributes); }
  ~ThreadAttributes() { pthread_attr_destroy(&_attributes); }
  ThreadAttributes(const ThreadAttributes&) = delete;
  ThreadAttributes& operator=(const ThreadAttributes&) = delete;

  int set(const GSxThreadData& data) {
    if (const int rc = pthread_attr_setdetachstate(&_attributes, data.detachstate)) return rc;
    if (data.stacksize == 0) return 0;
    return pthread_attr_setstacksize(&_attributes, cu_pick_thread_stacksize_1(data.stacksize));
  }
  bool detached() const {
    int state = PTHREAD_CREATE_JOINABLE;
    pthread_attr_getdetachstate(&_attributes, &state);
    return state == PTHREAD_CREATE_DETACHED;
  }
  const pthread_attr_t* get() const { return &_attributes; }

 private:
  pthread_attr_t _attributes;
};

// Whether the object may get a new thread without a join.
bool hasNoThread(const ThreadControl& control) {
  return control.phase == ThreadControl::kNone || (control.phase == ThreadControl::kDetached && control.ended);
}

// A thread that was cancelled while it joined has joined nothing.
void joinCancelled(void* argument) {
  ThreadControl& control = *static_cast<ThreadControl*>(argument);
  std::lock_guard<std::mutex> lock(control.mutex);
  control.phase = ThreadControl::kJoinable;
}

int beginJoin(ThreadControl& control) {
  std::lock_guard<std::mutex> lock(control.mutex);
  switch (control.phase) {
    case ThreadControl::kNone:
      return ESRCH;
    case ThreadControl::kDetached:
      return EINVAL;
    case ThreadControl::kJoining:
      return EBUSY;
    case ThreadControl::kJoinable:
      break;
  }
  if (pthread_equal(control.id, pthread_self())) return EDEADLK;
  control.phase = ThreadControl::kJoining;
  return 0;
}

// Cancels under the mutex, where a thread that has not said that it ended still has its id.
int cancelThread(ThreadControl& control) {
  if (control.phase == ThreadControl::kNone) return ESRCH;
  if (!control.ended) return pthread_cancel(control.id);
  return control.phase == ThreadControl::kDetached ? ESRCH : 0;
}

}  // namespace

namespace zelt_gscl_V1 {

GSThread::GSThread(size_t stacksize) : innerData(nullptr) {
  GSxThreadData* data = new GSxThreadData(stacksize);
  data->control->data = data;
  innerData = data;
}

GSThread::~GSThread() {
  if (innerData != nullptr) finish();
}

// The work of the destructor. The first one of the library's classes does it, so that virtual functions of the
// second version are still in place while `run` is on its way out.
void GSThread::finish() {
  const gscl_internal::CancellationHold hold;
  GSxThreadData& data = dataOf(innerData);
  pthread_t tid = data.tid;
  GS_DEBUG(GSCL_TRC_DETAIL, "GSThread::~GSThread this=%x tid=%x, self=%x", low32(this), low32(tid),
           low32(pthread_self()));
  const std::shared_ptr<ThreadControl> control = data.control;
  ThreadControl::Phase phase;
  {
    std::lock_guard<std::mutex> lock(control->mutex);
    phase = control->phase;
    if (phase == ThreadControl::kJoinable) tid = control->id;  // also when not yet recorded, or cleared by stop
  }
  if (tid != kNoThread && phase != ThreadControl::kDetached) letGo(tid);
  {
    std::lock_guard<std::mutex> lock(control->mutex);
    control->data = nullptr;
  }
  delete &data;
  innerData = nullptr;
}

// The part of the destructor for an object that has, or had, a thread that is not detached.
void GSThread::letGo(pthread_t tid) {
  ThreadControl& control = *dataOf(innerData).control;
  const bool own = pthread_equal(tid, pthread_self()) != 0;
  bool stopped = false;
  {
    std::lock_guard<std::mutex> lock(control.mutex);
    stopped = control.stopped;
  }
  if (!own && !stopped) {
    GS_DEBUG(GSCL_TRC_DETAIL, "GSThread::~GSThread stop (tid=%x)", low32(tid));
    stop();
  }
  GS_DEBUG(GSCL_TRC_DETAIL, "GSThread::~GSThread joining tid=%x", low32(tid));
  if (join(nullptr) == EDEADLK && own) {
    std::lock_guard<std::mutex> lock(control.mutex);
    control.phase = ThreadControl::kDetached;
    pthread_detach(tid);  // nobody can join it any more
  }
  GS_DEBUG(GSCL_TRC_DETAIL, "GSThread::~GSThread join done tid=%x", low32(tid));
}

pthread_t GSThread::start(void* args) {
  GS_TRACE(GSCL_TRC_API, "GSThread[%x] starts\n", low32(dataOf(innerData).tid));
  pthread_t id = kNoThread;
  int rc = finishEarlier();
  if (rc == 0) rc = launch(args, &id);
  if (rc == 0) return id;
  GS_TRACE(GSCL_TRC_API, "Error on pthread_create rc=%d\n", rc);
  return kNoThread;
}

// Joins what is left of an earlier thread. EBUSY while that one is running.
int GSThread::finishEarlier() {
  ThreadControl& control = *dataOf(innerData).control;
  {
    std::lock_guard<std::mutex> lock(control.mutex);
    if (hasNoThread(control)) return 0;
    if (!control.ended && !control.stopped) return EBUSY;
  }
  return join(nullptr);
}

int GSThread::launch(void* args, pthread_t* id) {
  GSxThreadData& data = dataOf(innerData);
  ThreadControl& control = *data.control;
  std::unique_ptr<Launch> start(new Launch{data.control, this, args});
  ThreadAttributes attributes;
  int rc = attributes.set(data);

  // Until the phase is set the new thread waits at its first look at the control.
  std::lock_guard<std::mutex> lock(control.mutex);
  if (!hasNoThread(control)) return EBUSY;
  data.start_args = args;
  data.state = GS_THREAD_RUNNING;
  if (rc == 0) rc = pthread_create(id, attributes.get(), stub_create_run_me, start.get());
  if (rc != 0) {
    data.state = GS_THREAD_IDLE;
    *id = kNoThread;
    return rc;
  }
  start.release();
  control.id = *id;
  control.phase = attributes.detached() ? ThreadControl::kDetached : ThreadControl::kJoinable;
  control.stopped = control.ended = false;
  return 0;
}

void* GSThread::stub_create_run_me(void* argument) {
  const std::unique_ptr<Launch> launch(static_cast<Launch*>(argument));
  ThreadControl& control = *launch->control;
  const ThreadEnd end(control);
  GS_TRACE(GSCL_TRC_API, "stub_run_thread tid=%d\n", static_cast<int>(pthread_self()));
  {
    std::lock_guard<std::mutex> lock(control.mutex);
    if (control.data == nullptr) return nullptr;
    if (!control.stopped) control.data->tid = pthread_self();
  }
  cu_stackdump_thread_enable_1();
  pthread_testcancel();
  RunFunction run = nullptr;
  {
    std::lock_guard<std::mutex> lock(control.mutex);  // the object is there as long as its data
    if (control.data != nullptr) run = overriderOfRun(launch->thread);
  }
  return run != nullptr ? run(launch->thread, launch->args) : nullptr;
}

int GSThread::stop() {
  GSxThreadData& data = dataOf(innerData);
  ThreadControl& control = *data.control;
  if (data.state != GS_THREAD_RUNNING) {
    GS_TRACE(GSCL_TRC_API, "GSThread[%x] is not running\n", low32(data.tid));
    return -1;
  }
  std::lock_guard<std::mutex> lock(control.mutex);
  if (control.phase != ThreadControl::kNone && pthread_equal(control.id, pthread_self())) return -1;
  if (const int rc = cancelThread(control)) return rc;
  control.stopped = true;
  data.state = GS_THREAD_IDLE;
  data.tid = kNoThread;
  return 0;
}

int GSThread::join(void** result) {
  const std::shared_ptr<ThreadControl> control = dataOf(innerData).control;
  if (const int rc = beginJoin(*control)) return rc;
  int rc = 0;
  pthread_cleanup_push(joinCancelled, control.get());
  rc = pthread_join(control->id, result);
  pthread_cleanup_pop(0);
  std::lock_guard<std::mutex> lock(control->mutex);
  control->phase = rc == 0 ? ThreadControl::kNone : ThreadControl::kJoinable;
  if (rc == 0 && control->data != nullptr) control->data->state = GS_THREAD_IDLE;
  return rc;
}

zelt_gscl::GSThreadState GSThread::getThreadState() { return dataOf(innerData).state; }
void GSThread::setThreadState(GSThreadState state) { dataOf(innerData).state = state; }
pthread_t GSThread::getThreadId() { return dataOf(innerData).tid; }
int GSThread::getDetachState() { return dataOf(innerData).detachstate; }

void GSThread::setDetachState(int state) {
  GS_TRACE(GSCL_TRC_API, "GSThread::setDetachState(this=%x) state = %d", low32(this), state);
  dataOf(innerData).detachstate = state;
}

void* GSThread::getInnerData() { return innerData; }

int GSThread::postSyncEvent(int e) { return dataOf(innerData).sync_events.post_event(e); }
int GSThread::waitSyncEvent(int* e, int secs) { return dataOf(innerData).sync_events.wait_event(e, secs, 0); }
int GSThread::SyncEventCount() { return dataOf(innerData).sync_events.count(); }

GSString getTraceIdStr(GSThread* thread) {
  constexpr int kSize = 100;
  GSString id(kSize);
  snprintf(id, kSize, "Thread[T=%d]", static_cast<int>(thread->getThreadId()));
  return id;
}

}  // namespace zelt_gscl_V1

namespace zelt_gscl_V2 {

GSThread::GSThread(size_t stacksize) : zelt_gscl_V1::GSThread(stacksize) {}
GSThread::~GSThread() { finish(); }

int GSThread::waitSyncEvent(int* e, int secs, int usecs) {
  return dataOf(getInnerData()).sync_events.wait_event(e, secs, usecs);
}
int GSThread::popSyncEvent(int* e) { return dataOf(getInnerData()).sync_events.pop_event(e); }
int GSThread::pushSyncEvent(int e) { return dataOf(getInnerData()).sync_events.push_event(e); }

}  // namespace zelt_gscl_V2
