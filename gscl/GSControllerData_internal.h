// The controller's private record.
#ifndef GSCL_GSCONTROLLER_DATA_H
#define GSCL_GSCONTROLLER_DATA_H

#include <pthread.h>

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
  explicit GSxControllerData(GSController* owner) : _owner(owner) {}
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
  GSController* const _owner;
  GSxControllerData* _next = nullptr;  // in the list of all

  /// Enter and leave the list of all controllers, without the controller's lock.
  void enlist();
  void delist();
  /// Calls `visit` with each controller in the list. None of them can go away meanwhile.
  template <class Visit>
  static void forEach(Visit visit) {
    pthread_mutex_lock(&_allMutex);
    for (GSxControllerData* data = _all; data != nullptr; data = data->_next) visit(*data->_owner);
    pthread_mutex_unlock(&_allMutex);
  }

  static pthread_mutex_t _allMutex;  // guards the list; comes before a controller's lock
  static GSxControllerData* _all;
  static std::atomic<GSController*> _theController;
  /// The current controller where it is of the third version, else null. Programs may be compiled without runtime
  /// type information, so the object cannot be asked.
  static std::atomic<zelt_gscl_V3::GSController*> _theDomainController;
};

}  // namespace zelt_gscl_V1

#endif
