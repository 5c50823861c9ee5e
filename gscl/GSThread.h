// Thread objects: a subclass supplies `run`, other threads hand it events.
#ifndef GSCL_GSTHREAD_H
#define GSCL_GSTHREAD_H

#include <pthread.h>
#include <stddef.h>

#include "gscl/GSQueue.h"
#include "gscl/GSString.h"
#include "gscl/export.h"

namespace zelt_gscl {

/// Whether a thread object counts as running: from start until join or stop, not until the end of `run`.
enum GSThreadState : int { GS_THREAD_IDLE = 0, GS_THREAD_RUNNING = 1 };

}  // namespace zelt_gscl

namespace zelt_gscl_V2 {
class GSThread;
}

namespace zelt_gscl_V1 {

typedef zelt_gscl::GSThreadState GSThreadState;

/// An object that runs one POSIX thread at a time and owns a queue of integer events for it.
///
/// Threads. Any thread may call any operation, `start` and the destructor excepted: those belong to the object's
/// owner, and only one thread destroys the object, when no other thread uses it any more.
///
/// Life. A new object is idle and has no thread. `start` makes it running. When `run` has returned it still counts
/// as running, until `join` (idle, id kept) or `stop` (idle, id cleared). Each thread is joined at most once. The
/// object may be started again when its thread has been joined; `start` itself joins one that has ended or was
/// stopped.
///
/// Cancellation. `stop` and the destructor cancel the thread: `run` is left at its next cancellation point, such
/// as any wait of this library, by unwinding, so its objects are destroyed; a catch (...) around such a point must
/// throw on. For their callers the event operations, `join` and a `start` that joins are cancellation points.
///
/// Destruction, on another thread than the object's own, cancels the thread and waits until it has ended, without
/// being a cancellation point itself; a thread that was stopped and never joined is joined. On its own thread
/// the object lets the thread go: it ends by itself when `run` returns. A thread that was started detached is
/// left alone, and its `run` must not use the object after that.
/// When the destructor of a subclass is over, `run` may still be on its way out: a subclass whose `run` uses
/// members of the subclass stops and joins in its own destructor.
///
/// Ownership. The object owns its event queue; the argument and the result of `run` are the application's. A
/// thread object cannot be copied. Errors are said at each operation; an exception must not leave `run`.
///
/// Example: examples/worker_pool.cpp.
class ZN_GSCL_EXPORT GSThread {
 public:
  /// `stacksize`: bytes of stack for the thread, raised to the system's minimum and to whole pages; 0: the
  /// default.
  explicit GSThread(size_t stacksize);
  virtual ~GSThread();
  GSThread(const GSThread&) = delete;
  GSThread& operator=(const GSThread&) = delete;

  /// What the thread does, on the thread itself; its result is the thread's. Registered for stack dumps meanwhile.
  virtual void* run(void* args) = 0;
  /// Hands the thread an event and wakes all that wait for one. Returns 0; throws when there is no memory.
  virtual int postSyncEvent(int e);
  /// Takes the oldest event, waiting at most `secs` seconds (-1: without limit). Returns 0, or ETIMEDOUT. Meant
  /// for `run`, but any thread may. A cancellation point.
  virtual int waitSyncEvent(int* e, int secs);

  /// Creates the thread, which calls run(args), with the detach state and the stack size recorded. Returns its id,
  /// or all bits set when it could not be created or the object's thread has not ended and was not stopped, or is
  /// detached. An earlier thread that was not joined is joined first, and if it was stopped, waited for. Throws
  /// when there is no memory.
  /// `run` is called as a virtual function by the new thread: when a constructor starts it, classes derived from
  /// that one may not be constructed yet, or just so. When the object is gone by then, nothing runs.
  pthread_t start(void* args);
  /// Cancels the thread, without waiting for its end or releasing it: `join`, the next `start` and the destructor
  /// do that. Returns 0, -1 when the object is not running or the caller is its thread, else the error number of
  /// the cancellation. A thread that is stopped before it has come to `run` does not run.
  int stop();
  /// Waits for the end of the thread and stores its result (PTHREAD_CANCELED after a stop) through `result` unless
  /// that is null. Right after `start` it waits as well. Returns 0, otherwise nothing is joined: ESRCH never
  /// started or already joined, EINVAL started detached, EBUSY another thread is joining, EDEADLK the caller is
  /// the thread itself, or an error number of the threads library.
  int join(void** result);

  GSThreadState getThreadState();
  /// Sets what getThreadState returns; `stop` acts on it, the thread does not.
  void setThreadState(GSThreadState state);
  /// The thread's id: all bits set until the thread has recorded itself (shortly after `start`) and after `stop`.
  pthread_t getThreadId();
  int getDetachState();
  /// PTHREAD_CREATE_JOINABLE (as created) or PTHREAD_CREATE_DETACHED, for the next `start`.
  void setDetachState(int state);
  /// The library's own record of the object; it lives as long as the object.
  void* getInnerData();
  /// The number of events that wait in the queue.
  int SyncEventCount();

 private:
  static void* stub_create_run_me(void* launch);
  ZN_GSCL_HIDDEN int finishEarlier();
  ZN_GSCL_HIDDEN int launch(void* args, pthread_t* id);
  ZN_GSCL_HIDDEN void finish();
  ZN_GSCL_HIDDEN void letGo(pthread_t tid);
  friend class zelt_gscl_V2::GSThread;

  void* innerData;  // GSxThreadData, owned; null once a destructor has let the thread go
};

/// The identification of a thread object in trace lines: "Thread[T=%d]" with its id, cut to an int. Any thread.
/// Throws when there is no memory.
ZN_GSCL_EXPORT GSString getTraceIdStr(GSThread* thread);

}  // namespace zelt_gscl_V1

namespace zelt_gscl_V2 {

/// A thread object whose events can also be waited for by the microsecond, and pushed and popped without waiting.
class ZN_GSCL_EXPORT GSThread : public zelt_gscl_V1::GSThread {
 public:
  explicit GSThread(size_t stacksize);
  ~GSThread() override;

  using zelt_gscl_V1::GSThread::waitSyncEvent;
  /// As waitSyncEvent of the first version, for at most `secs` seconds and `usecs` microseconds (secs -1: no
  /// limit).
  virtual int waitSyncEvent(int* e, int secs, int usecs);
  /// Takes the oldest event without waiting. Returns 1, or 0 when there is none.
  virtual int popSyncEvent(int* e);
  /// Queues an event without waking anybody. Returns the number of events then.
  virtual int pushSyncEvent(int e);
};

}  // namespace zelt_gscl_V2

#endif
