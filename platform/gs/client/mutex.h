// The platform's mutex and condition, by the client's names.
#pragma once

#include "common/mutex.h"

#define GS_GUARDED_BY(x) ZN_GUARDED_BY(x)
#define GS_REQUIRES(x) ZN_REQUIRES(x)

namespace gs::client {

using platform::Condition;
using platform::Mutex;
using platform::MutexLock;

}  // namespace gs::client
