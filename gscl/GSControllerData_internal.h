// The controller's private record.
#ifndef GSCL_GSCONTROLLER_DATA_H
#define GSCL_GSCONTROLLER_DATA_H

#include <atomic>

#include "gscl/GSController.h"
#include "gscl/GSString.h"

namespace zelt_gscl_V1 {

/// One entry of the registry. The client is not owned.
typedef struct GSClientItem {
  GSClientItem* pNext;
  GSClient* pClient;
} GSClientItem_t;

/// Guarded by the controller's lock, but for the descriptor and the current controller, which are read without it.
/// initialize() reads the options without it, too.
struct GSxControllerData {
  GSxControllerData() = default;
  ~GSxControllerData();
  GSxControllerData(const GSxControllerData&) = delete;
  GSxControllerData& operator=(const GSxControllerData&) = delete;

  /// The registered client that is not idle and holds `token`; of several the one registered first. The caller
  /// holds the controller's lock.
  GSClient* find(wyx_token_t token) const;

  std::atomic<wyx_descriptor_t> _gsd_fd{-1};
  GSClientItem_t* pClientList = nullptr;
  wyx_socket_ctrl_t sockOption = WYX_SOCKET_NO_SIGNAL;
  GSString deactive_path;
  wyx_responsiveness_t responsiveness = {};

  static std::atomic<GSController*> _theController;
  /// The current controller where it is of the third version, else null. Programs may be compiled without runtime
  /// type information, so the object cannot be asked.
  static std::atomic<zelt_gscl_V3::GSController*> _theDomainController;
};

}  // namespace zelt_gscl_V1

#endif
