#include "gscl/GSLockPrim.h"

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>

#include "gscl/GSCondition_internal.h"

namespace zelt_gscl_V1 {

static_assert(sizeof(GSBaseMutex) == 40 && sizeof(GSBaseCondition) == 48, "thin over the POSIX objects");
static_assert(sizeof(GSCondition) == 96 && sizeof(GSMutexLock) == 104 && sizeof(GSRWLockImpl) == 160,
              "fixed layouts");
static_assert(sizeof(GSRWLock) == sizeof(void*), "a handle is one pointer");

namespace {

[[noreturn]] [[gnu::cold]] void failCheck(int rc, int line) {
  fprintf(stderr, "asserted: rc=%d in %s (line=%d)\n", rc, "gscl/GSLockPrim", line);
  abort();
}

// The one check of internal results; not an assert, because it holds in every build type.
inline int check(int rc, int line = __builtin_LINE()) {
  if (__builtin_expect(rc != 0, 0)) failCheck(rc, line);
  return rc;
}

bool isSelf(pthread_t thread) { return pthread_equal(thread, pthread_self()) != 0; }

}  // namespace

// ---------------------------------------------------------------------------------------------------------
// GSBaseMutex, GSBaseCondition

GSBaseMutex::GSBaseMutex() { check(pthread_mutex_init(&_mutex, nullptr)); }
GSBaseMutex::~GSBaseMutex() { pthread_mutex_destroy(&_mutex); }
int GSBaseMutex::lock() { return pthread_mutex_lock(&_mutex); }
int GSBaseMutex::unlock() { return pthread_mutex_unlock(&_mutex); }

GSBaseCondition::GSBaseCondition() { check(pthread_cond_init(&_cond, nullptr)); }
GSBaseCondition::~GSBaseCondition() { pthread_cond_destroy(&_cond); }

int GSBaseCondition::wait(GSBaseMutex* m, const timespec* abstime) {
  if (abstime == nullptr) return pthread_cond_wait(&_cond, &m->_mutex);
  return pthread_cond_timedwait(&_cond, &m->_mutex, abstime);
}

int GSBaseCondition::signal() { return pthread_cond_signal(&_cond); }
int GSBaseCondition::broadcast() { return pthread_cond_broadcast(&_cond); }

// ---------------------------------------------------------------------------------------------------------
// GSCondition

GSConditionGuard::GSConditionGuard(GSCondition& condition) : _condition(condition) {
  check(_condition._mutex.lock());
}

GSConditionGuard::~GSConditionGuard() { check(_condition._mutex.unlock()); }

// Only the count: the guard's destructor releases the mutex as the cancellation unwinds on.
void GSConditionGuard::cancelled(void* condition) { --static_cast<GSCondition*>(condition)->_nwaiters; }

int GSConditionGuard::wait(const timespec* abstime) {
  int rc = 0;
  ++_condition._nwaiters;
  pthread_cleanup_push(cancelled, &_condition);
  rc = _condition._cond.wait(&_condition._mutex, abstime);
  pthread_cleanup_pop(0);
  --_condition._nwaiters;
  return rc;
}

GSCondition::GSCondition() : _nwaiters(0) {}
GSCondition::~GSCondition() = default;

int GSCondition::wait(const timespec* abstime) {
  GSConditionGuard guard(*this);
  return guard.wait(abstime);
}

int GSCondition::signal() {
  check(_mutex.lock());
  if (_nwaiters > 0) _cond.signal();
  return check(_mutex.unlock());
}

int GSCondition::broadcast() {
  check(_mutex.lock());
  if (_nwaiters > 0) _cond.broadcast();
  return check(_mutex.unlock());
}

// ---------------------------------------------------------------------------------------------------------
// GSMutexLock

GSMutexLock::GSMutexLock() : _nwaiters(0), _nholders(0), _holder(0) {}
GSMutexLock::~GSMutexLock() = default;

int GSMutexLock::lock(const timespec* abstime) {
  check(_mutex.lock());
  while (_nholders > 0 && !isSelf(_holder)) {
    const int rc = waitForRelease(abstime);
    if (rc != 0) {
      writemsg("timeout");
      passOn();
      check(_mutex.unlock());
      return rc;
    }
  }
  ++_nholders;
  _holder = pthread_self();
  writemsg("locked");
  return check(_mutex.unlock());
}

int GSMutexLock::waitForRelease(const timespec* abstime) {
  int rc = 0;
  ++_nwaiters;
  pthread_cleanup_push(cancelledInWait, this);
  rc = _cond.wait(&_mutex, abstime);
  pthread_cleanup_pop(0);
  --_nwaiters;
  return rc;
}

// Called by a contender that gives up: the one wake-up of a release may have been meant for it.
void GSMutexLock::passOn() {
  if (_nholders == 0 && _nwaiters > 0) _cond.signal();
}

void GSMutexLock::cancelledInWait(void* self) {
  GSMutexLock* lock = static_cast<GSMutexLock*>(self);
  --lock->_nwaiters;
  lock->passOn();
  check(lock->_mutex.unlock());
}

int GSMutexLock::unlock() {
  check(_mutex.lock());
  if (_nholders == 0) {
    check(_mutex.unlock());
    return EPERM;
  }
  if (_nholders == 1) {
    if (_nwaiters > 0) signalRelease();
    _holder = 0;
  } else if (!isSelf(_holder)) {
    fprintf(stderr, " GSMutexLock::unlock holder(%x) <> self(%x)\n", static_cast<unsigned>(_holder),
            static_cast<unsigned>(pthread_self()));
    check(_mutex.unlock());
    check(-1);
  }
  writemsg("unlocked");
  --_nholders;
  return check(_mutex.unlock());
}

// The handler is for a caller with asynchronous cancellation: the release is then completed by the handler.
void GSMutexLock::signalRelease() {
  writemsg("unlock_signaling");
  pthread_cleanup_push(cancelledInSignal, this);
  _cond.signal();
  pthread_cleanup_pop(0);
}

void GSMutexLock::cancelledInSignal(void* self) {
  GSMutexLock* lock = static_cast<GSMutexLock*>(self);
  --lock->_nholders;
  lock->_holder = 0;
  check(lock->_mutex.unlock());
}

// ---------------------------------------------------------------------------------------------------------
// GSRWLockImpl

GSRWLockImpl::GSRWLockImpl() : _refcount(0), _nwriters_waiting(0), _nreaders_waiting(0), _holder(0) {}
GSRWLockImpl::GSRWLockImpl(const GSRWLockImpl&) : GSRWLockImpl() {}
GSRWLockImpl::~GSRWLockImpl() = default;

int GSRWLockImpl::ReadLock(const timespec* abstime) {
  check(_mutex.lock());
  while (_refcount < 0 || _nwriters_waiting > 0) {
    writemsg("read_lock_waiting..");
    const int rc = waitToRead(abstime);
    if (rc != 0) {
      check(_mutex.unlock());
      return rc;
    }
  }
  ++_refcount;
  writemsg("read_locked");
  return check(_mutex.unlock());
}

int GSRWLockImpl::waitToRead(const timespec* abstime) {
  int rc = 0;
  ++_nreaders_waiting;
  pthread_cleanup_push(cancelledReader, this);
  rc = _readcond.wait(&_mutex, abstime);
  pthread_cleanup_pop(0);
  --_nreaders_waiting;
  return rc;
}

void GSRWLockImpl::cancelledReader(void* self) {
  GSRWLockImpl* lock = static_cast<GSRWLockImpl*>(self);
  --lock->_nreaders_waiting;
  check(lock->_mutex.unlock());
}

int GSRWLockImpl::WriteLock(const timespec* abstime) {
  check(_mutex.lock());
  if (_refcount < 0 && isSelf(_holder)) {
    --_refcount;
    writemsg("write_recursive_locked");
    return check(_mutex.unlock());
  }
  while (_refcount != 0) {
    writemsg("write_lock_waiting");
    const int rc = waitToWrite(abstime);
    if (rc != 0) {
      writemsg("timeout");
      writerGivesUp();
      check(_mutex.unlock());
      return rc;
    }
  }
  _refcount = -1;
  _holder = pthread_self();
  writemsg("write_locked");
  return check(_mutex.unlock());
}

int GSRWLockImpl::waitToWrite(const timespec* abstime) {
  int rc = 0;
  ++_nwriters_waiting;
  pthread_cleanup_push(cancelledWriter, this);
  rc = _writecond.wait(&_mutex, abstime);
  pthread_cleanup_pop(0);
  --_nwriters_waiting;
  return rc;
}

// A writer that leaves without the lock hands on what it held up: readers wait behind the last waiting writer, and
// a release may have been signalled to this writer instead of another one.
void GSRWLockImpl::writerGivesUp() {
  if (_nwriters_waiting > 0) {
    if (_refcount == 0) _writecond.signal();
  } else if (_nreaders_waiting > 0 && _refcount >= 0) {
    _readcond.broadcast();
  }
}

void GSRWLockImpl::cancelledWriter(void* self) {
  GSRWLockImpl* lock = static_cast<GSRWLockImpl*>(self);
  --lock->_nwriters_waiting;
  lock->writerGivesUp();
  check(lock->_mutex.unlock());
}

int GSRWLockImpl::ReadUnlock() { return Unlock(); }
int GSRWLockImpl::WriteUnlock() { return Unlock(); }

int GSRWLockImpl::Unlock() {
  check(_mutex.lock());
  if (_refcount == 0) return check(_mutex.unlock());
  _refcount += _refcount > 0 ? -1 : 1;
  if (_nwriters_waiting >= 1) {
    writemsg("reader-->signal to writer");
    _writecond.signal();
  } else if (_nreaders_waiting > 0) {
    _readcond.broadcast();
  }
  writemsg("unlocked");
  return check(_mutex.unlock());
}

// ---------------------------------------------------------------------------------------------------------
// GSRWLock

GSRWLock::GSRWLock() : pLockImpl(new GSRWLockImpl) {}
GSRWLock::GSRWLock(const GSRWLock&) : pLockImpl(new GSRWLockImpl) {}
GSRWLock::~GSRWLock() { delete pLockImpl; }

int GSRWLock::ReadLock(const timespec*) { return pLockImpl->ReadLock(nullptr); }
int GSRWLock::WriteLock(const timespec*) { return pLockImpl->WriteLock(nullptr); }
int GSRWLock::ReadUnlock() { return pLockImpl->ReadUnlock(); }
int GSRWLock::WriteUnlock() { return pLockImpl->WriteUnlock(); }

}  // namespace zelt_gscl_V1
