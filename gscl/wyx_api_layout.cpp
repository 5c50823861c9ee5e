#include "gscl/wyx_api.h"
