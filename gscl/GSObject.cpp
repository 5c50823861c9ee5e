#include "gscl/GSObject.h"

namespace zelt_gscl_V1 {

static_assert(sizeof(GSObject) == sizeof(void*), "a GSObject has no fields");
static_assert(sizeof(GSLockableObject) == 2 * sizeof(void*), "a GSLockableObject has only its lock");

GSObject::GSObject() = default;
GSObject::GSObject(const GSObject&) = default;
GSObject& GSObject::operator=(const GSObject&) = default;
GSObject::~GSObject() = default;

GSLockableObject::GSLockableObject() = default;
GSLockableObject::GSLockableObject(const GSLockableObject&) = default;
GSLockableObject& GSLockableObject::operator=(const GSLockableObject&) = default;
GSLockableObject::~GSLockableObject() = default;

int GSLockableObject::ReadLock(const timespec* abstime) { return _locker.ReadLock(abstime); }
int GSLockableObject::WriteLock(const timespec* abstime) { return _locker.WriteLock(abstime); }
int GSLockableObject::ReadUnlock() { return _locker.ReadUnlock(); }
int GSLockableObject::WriteUnlock() { return _locker.WriteUnlock(); }

}  // namespace zelt_gscl_V1
