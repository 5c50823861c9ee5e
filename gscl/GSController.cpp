// The controller's life: construction, session, options, destruction; and its registry of clients.
#include "gscl/GSController.h"

#include <cstddef>
#include <memory>

#include "gscl/GSClient.h"
#include "gscl/GSControllerData_internal.h"
#include "gscl/GSProvider.h"
#include "gscl/GSSubscriber.h"
#include "gscl/base_api_internal.h"
#include "gscl/fatal_internal.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace_text_internal.h"
#include "zn_cu.h"

namespace {

constexpr unsigned int kDefaultBaseApiVersion = 28;
constexpr unsigned int kFirstVersionWithDomainControl = 0x0203000A;
constexpr int kSetupArguments = 7;
constexpr int kSetupArgumentsWithDomainControl = 8;

// What the caller was built for, given to wyx_setup. It belongs to the process, not to a controller.
std::atomic<unsigned int> gsapi_compiled_version{kDefaultBaseApiVersion};
// The installed product version in one word, as the latest constructed controller found it.
std::atomic<unsigned int> zelt_vrmf_version{0};

unsigned int get_zelt_vrmf_version() {
  cu_vrmf_t* vrmf = nullptr;
  cu_get_version_1(0, &vrmf);
  GSCL_REQUIRE(vrmf != nullptr, "vrmf != __null");
  return (static_cast<unsigned int>(vrmf->version) << 24) | ((vrmf->release & 0xFFu) << 16) |
         ((vrmf->modlevel & 0xFFu) << 8) | (vrmf->fixlevel & 0xFFu);
}

}  // namespace

namespace zelt_gscl_V1 {

using gscl_internal::addressText;
using gscl_internal::callBaseApi;
using ReadScope = gscl_internal::ReadScope<GSController>;
using WriteScope = gscl_internal::WriteScope<GSController>;

// Compiled into callers and checked by them: objects and records have a fixed layout.
static_assert(sizeof(GSController) == 24, "virtual table, lock, private record");
static_assert(sizeof(GSxControllerData) == 88, "fields as listed, nothing between them");
static_assert(sizeof(std::atomic<wyx_descriptor_t>) == sizeof(wyx_descriptor_t), "");

pthread_mutex_t GSxControllerData::_allMutex = PTHREAD_MUTEX_INITIALIZER;
GSxControllerData* GSxControllerData::_all = nullptr;
std::atomic<GSController*> GSxControllerData::_theController{nullptr};
std::atomic<zelt_gscl_V3::GSController*> GSxControllerData::_theDomainController{nullptr};

GSxControllerData::~GSxControllerData() {
  while (pClientList != nullptr) {
    GSClientItem_t* item = pClientList;
    pClientList = item->pNext;
    delete item;
  }
}

void GSxControllerData::enlist() {
  pthread_mutex_lock(&_allMutex);
  _next = _all;
  _all = this;
  pthread_mutex_unlock(&_allMutex);
}

void GSxControllerData::delist() {
  pthread_mutex_lock(&_allMutex);
  GSxControllerData** link = &_all;
  while (*link != this) link = &(*link)->_next;
  *link = _next;
  pthread_mutex_unlock(&_allMutex);
}

GSClient* GSxControllerData::find(wyx_token_t token) const {
  GSClient* found = nullptr;
  for (const GSClientItem_t* item = pClientList; item != nullptr; item = item->pNext) {
    const GSClient* client = item->pClient;
    if (client == nullptr || client->getClientState() == zelt_gscl::GS_IAM_IDLE) continue;
    if (client->getToken() == token) found = item->pClient;
  }
  return found;
}

GSController::GSController() : _ctrlData(nullptr) {
  auto data = std::make_unique<GSxControllerData>(this);
  _ctrlData = data.get();
  GS_TRACE(GSCL_TRC_API, "GSController %x is created.\n", addressText(this));
  GSxControllerData::_theDomainController.store(nullptr, std::memory_order_release);
  GSxControllerData::_theController.store(this, std::memory_order_release);
  zelt_vrmf_version.store(get_zelt_vrmf_version(), std::memory_order_relaxed);
  data.release()->enlist();
}

GSController::~GSController() {
  gscl_internal::CancellationHold hold;
  GS_TRACE(GSCL_TRC_API, "GSController %x is being destroyed.\n", addressText(this));
  if (gscl_internal::loadedBaseApi() != nullptr && _ctrlData != nullptr && getGSDescriptor() >= 0) {
    GSController::quit();
  }
  _ctrlData->delist();
  {
    WriteScope lock(*this);
    delete _ctrlData;
    _ctrlData = nullptr;
  }
  GSxControllerData::_theController.store(nullptr, std::memory_order_release);
  GSxControllerData::_theDomainController.store(nullptr, std::memory_order_release);
}

wyx_rc_t GSController::initialize() {
  gscl_internal::CancellationHold hold;
  GS_TRACE(GSCL_TRC_API, "GSCntrl %x is being initialized\n", addressText(this));
  wyx_descriptor_t descriptor = -1;
  // Read through a volatile: the compiler takes for granted that `this` is not null.
  const GSController* const volatile self = this;
  GSCL_REQUIRE(self != nullptr && self->_ctrlData != nullptr, "this != __null && cData != __null");
  const int count = zelt_vrmf_version.load(std::memory_order_relaxed) >= kFirstVersionWithDomainControl
                        ? kSetupArgumentsWithDomainControl
                        : kSetupArguments;
  gscl_internal::baseApi();  // first, so that the options are those at the time of the call
  const wyx_rc_t rc = callBaseApi<&GSAPIRtnCollection::wyx_setup>(
      static_cast<int>(gsapi_compiled_version.load(std::memory_order_relaxed)), count, &descriptor,
      _ctrlData->sockOption, &_ctrlData->responsiveness, static_cast<const char*>(_ctrlData->deactive_path),
      &stub_responsivenessCb, &GSController::stub_delayedErrorCb, &stub_queryCb, &stub_domain_controlCb);
  GS_TRACE(GSCL_TRC_API, "GSCntrl %x initialize rc=%s\n", addressText(this), gscl_rc_name(rc));
  if (rc == WYX_OK) _ctrlData->_gsd_fd.store(descriptor, std::memory_order_relaxed);
  return rc;
}

wyx_rc_t GSController::quit() {
  gscl_internal::CancellationHold hold;
  GS_TRACE(GSCL_TRC_API, "GSCntl %x is being quitted.\n", addressText(this));
  const wyx_rc_t rc = callBaseApi<&GSAPIRtnCollection::wyx_quit>();
  WriteScope lock(*this);
  _ctrlData->_gsd_fd.store(-1, std::memory_order_relaxed);
  return rc;
}

wyx_callback_rc_t GSController::responsivenessCb(const wyx_responsiveness_notification_t*) {
  return WYX_CALLBACK_OK;
}

void GSController::queryCb(const wyx_query_notification_t*) {}

wyx_rc_t GSController::dispatch(wyx_dispatch_flag_t flag) {
  return callBaseApi<&GSAPIRtnCollection::wyx_dispatch>(flag);
}

GSController* GSController::theController() {
  return GSxControllerData::_theController.load(std::memory_order_acquire);
}

wyx_descriptor_t GSController::getGSDescriptor() { return _ctrlData->_gsd_fd.load(std::memory_order_relaxed); }

wyx_socket_ctrl_t GSController::getSocketOption() {
  ReadScope lock(*this);
  return _ctrlData->sockOption;
}

void GSController::setSocketOption(wyx_socket_ctrl_t option) {
  WriteScope lock(*this);
  _ctrlData->sockOption = option;
}

void GSController::getResponsiveness(wyx_responsiveness_t* responsiveness) {
  if (responsiveness == nullptr) return;
  ReadScope lock(*this);
  *responsiveness = _ctrlData->responsiveness;
}

void GSController::setResponsiveness(wyx_responsiveness_t* responsiveness) {
  if (responsiveness == nullptr) return;
  WriteScope lock(*this);
  _ctrlData->responsiveness = *responsiveness;
}

const char* GSController::getDeactivatePath() {
  ReadScope lock(*this);
  return _ctrlData->deactive_path;
}

void GSController::setDeactivatePath(const char* path) {
  WriteScope lock(*this);
  _ctrlData->deactive_path = path;
}

int GSController::addClient(GSClient* client) {
  WriteScope lock(*this);
  _ctrlData->pClientList = new GSClientItem_t{_ctrlData->pClientList, client};
  return 1;
}

int GSController::removeClient(GSClient* client) {
  if (client == nullptr) return -1;
  WriteScope lock(*this);
  for (GSClientItem_t** link = &_ctrlData->pClientList; *link != nullptr; link = &(*link)->pNext) {
    GSClientItem_t* item = *link;
    if (item->pClient != client) continue;
    *link = item->pNext;
    delete item;
    return 1;
  }
  return 0;
}

GSClient* GSController::findClient(wyx_token_t token) {
  ReadScope lock(*this);
  return _ctrlData->find(token);
}

GSProvider* GSController::findProvider(wyx_token_t token) {
  GSClient* client = findClient(token);
  if (client == nullptr || client->type() != zelt_gscl::GS_PROVIDER) return nullptr;
  return static_cast<GSProvider*>(client);
}

GSSubscriber* GSController::findSubscriber(wyx_token_t token) {
  GSClient* client = findClient(token);
  if (client == nullptr || client->type() != zelt_gscl::GS_SUBSCRIBER) return nullptr;
  return static_cast<GSSubscriber*>(client);
}

}  // namespace zelt_gscl_V1

namespace zelt_gscl_V2 {

GSController::GSController(unsigned int version) {
  GS_TRACE(GSCL_TRC_API, "GSController::GSController GSCL_VER=%x\n", version);
  gsapi_compiled_version.store(version & 0xFFFFu, std::memory_order_relaxed);
}

GSController::~GSController() = default;

}  // namespace zelt_gscl_V2
