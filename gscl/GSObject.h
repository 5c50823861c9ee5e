// The root classes: GSObject for everything polymorphic, GSLockableObject for what several threads touch.
#ifndef GSCL_GSOBJECT_H
#define GSCL_GSOBJECT_H

#include <time.h>

#include "gscl/GSLockPrim.h"
#include "gscl/export.h"

namespace zelt_gscl_V1 {

/// Root of every polymorphic class of the library: no data, only a virtual destructor, so that objects can be
/// handed through a market or deleted by whoever got them. It makes no promise about threads.
class ZN_GSCL_EXPORT GSObject {
 public:
  GSObject();
  GSObject(const GSObject&);
  GSObject& operator=(const GSObject&);
  virtual ~GSObject();
};

/// An object that carries its own reader/writer lock (see GSRWLockImpl for its rules). What the lock guards is the
/// subclass's to say. A copy gets its own, free lock; assignment leaves both locks alone.
/// The object is destroyed by a thread that knows that nobody has or awaits the lock.
class ZN_GSCL_EXPORT GSLockableObject : public GSObject {
 public:
  GSLockableObject();
  GSLockableObject(const GSLockableObject&);
  GSLockableObject& operator=(const GSLockableObject&);
  ~GSLockableObject() override;

  /// Any thread; cancellation points. They wait without limit whatever `abstime` says. Return 0.
  int ReadLock(const timespec* abstime);
  int WriteLock(const timespec* abstime);
  /// Any thread; on a free lock they do nothing. Return 0.
  int ReadUnlock();
  int WriteUnlock();

 private:
  GSRWLock _locker;
};

}  // namespace zelt_gscl_V1

#endif
