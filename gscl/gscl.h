// All public headers of the group-services classes.
//
// Namespaces. zelt_gscl_V1 has all classes; zelt_gscl_V2 has later versions of GSController and GSThread,
// zelt_gscl_V3 one of GSController; zelt_gscl has enumerations and functions. Write `using namespace
// zelt_gscl_V1;` and name the rest in full; also, since the namespace of their arguments is looked into as well,
// zelt_gscl::gscl_GSClientStateName, zelt_gscl::gscl_GSClientTypeName and zelt_gscl::gscl_GSWaitForRCName.
// Under two such lines these are ambiguous:
//   zelt_gscl and zelt_gscl_V1: GSGetAbsTime and what both have of gscl_... (names of codes, membership records),
//     but no type and no value
//   any two of the versions: GSController; zelt_gscl_V1 and zelt_gscl_V2: GSThread
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
