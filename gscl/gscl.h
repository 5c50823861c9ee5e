// All public headers of the group-services classes.
#ifndef GSCL_GSCL_H
#define GSCL_GSCL_H

#include "gscl/GSBitSet.h"
#include "gscl/GSClient.h"
#include "gscl/GSController.h"
#include "gscl/GSDebug.h"
#include "gscl/GSDispatcher.h"
#include "gscl/GSLocalVar.h"
#include "gscl/GSLockPrim.h"
#include "gscl/GSMarket.h"
#include "gscl/GSObject.h"
#include "gscl/GSProvider.h"
#include "gscl/GSQueue.h"
#include "gscl/GSString.h"
#include "gscl/GSSubscriber.h"
#include "gscl/GSThread.h"
#include "gscl/GSTypes.h"
#include "gscl/GSUtils.h"
#include "gscl/GSValues.h"
#include "gscl/KPLDriver.h"
#include "gscl/gslib_dli.h"
#include "gscl/wyx_api.h"

#endif
