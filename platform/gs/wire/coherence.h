// What the parts of a notification promise one another, so that who reads one part may rely on the others.
#pragma once

#include "engine/types.h"

namespace gs::wire::detail {

/// What contradicts itself in a notification whose numbers are all values of their enumerations; null: nothing.
const char* contradiction_in(const Notification& notification);
const char* contradiction_in(const DomainNotification& notification);

}  // namespace gs::wire::detail
