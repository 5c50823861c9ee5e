// The client's life, its getters, and the setters through which the controller brings it up to date.
#include "gscl/GSClient.h"

#include <cstddef>
#include <memory>

#include "gscl/GSClientData_internal.h"
#include "gscl/GSController.h"
#include "gscl/GSDelivery_internal.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace_text_internal.h"

namespace zelt_gscl_V1 {

using gscl_internal::addressText;
using ReadScope = gscl_internal::ReadScope<GSClient>;
using WriteScope = gscl_internal::WriteScope<GSClient>;

static_assert(sizeof(GSClient) == 24, "virtual table, lock, private record");
static_assert(sizeof(std::atomic<wyx_token_t>) == 4 && sizeof(std::atomic<GSClientState>) == 4, "");
static_assert(sizeof(waitfor_control_block_t) == 48, "");

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Winvalid-offsetof"
static_assert(offsetof(GSxClientData, _token) == 16, "");
static_assert(offsetof(GSxClientData, _state) == 20, "");
static_assert(offsetof(GSxClientData, _oldstate) == 24, "");
static_assert(offsetof(GSxClientData, _members) == 32, "");
static_assert(offsetof(GSxClientData, _currentStateValue) == 56, "");
static_assert(offsetof(GSxClientData, _proposedStateValue) == 88, "");
static_assert(offsetof(GSxClientData, waiters) == 120, "");
static_assert(offsetof(GSxClientData, last_seq_for_my_own) == 312, "");
static_assert(offsetof(GSxClientData, _transactionLock) == 320 + sizeof(GSBaseMutex) + sizeof(GSBaseCondition),
              "");
#pragma GCC diagnostic pop

namespace {

GSxClientData& dataOf(void* data) { return *static_cast<GSxClientData*>(data); }

bool idle(const GSxClientData& data) {
  return data._state.load(std::memory_order_relaxed) == zelt_gscl::GS_IAM_IDLE;
}

/// Gives a lock that is already held back at the end of the scope, unless it is to be kept.
class LockRelease {
 public:
  explicit LockRelease(GSRWLock& lock) : lock_(lock) {}
  ~LockRelease() {
    if (!kept_) lock_.WriteUnlock();
  }
  LockRelease(const LockRelease&) = delete;
  LockRelease& operator=(const LockRelease&) = delete;
  void keep() { kept_ = true; }

 private:
  GSRWLock& lock_;
  bool kept_ = false;
};

}  // namespace

GSxClientData::GSxClientData()
    : _groupName(kMaxGroupNameLength + 1),
      _token(-1),
      _state(zelt_gscl::GS_IAM_IDLE),
      _oldstate(zelt_gscl::GS_IAM_IDLE),
      waiters(),
      last_seq_for_my_own(0) {
  for (waitfor_control_block_t& block : waiters) block.clean();
}

GSClient::GSClient(const char* gname) : _clData(nullptr) {
  auto data = std::make_unique<GSxClientData>();
  _clData = data.get();
  setGroupName(gname);
  if (GSController* controller = GSController::theController()) controller->addClient(this);
  data.release();
}

GSClient::~GSClient() {
  gscl_internal::CancellationHold hold;
  GSDelivery::retire(this);
  delete &dataOf(_clData);
}

void GSClient::delayedErrorCb(const wyx_delayed_error_notification_t*) {}

GSClientState GSClient::getClientState() const { return dataOf(_clData)._state.load(std::memory_order_relaxed); }

GSClientState GSClient::getOldClientState() const {
  return dataOf(_clData)._oldstate.load(std::memory_order_relaxed);
}

wyx_token_t GSClient::getToken() const { return dataOf(_clData)._token.load(std::memory_order_relaxed); }

void GSClient::setGroupName(const char* gname) {
  WriteScope lock(*this);
  dataOf(_clData)._groupName.set_string(gname, kMaxGroupNameLength);
}

const char* GSClient::getGroupName() const { return dataOf(_clData)._groupName; }

int GSClient::getMembers(GSMembershipList& out) {
  ReadScope lock(*this);
  GSxClientData& data = dataOf(_clData);
  if (idle(data)) return 0;
  out = data._members;
  return 1;
}

int GSClient::getMemberCount() {
  ReadScope lock(*this);
  GSxClientData& data = dataOf(_clData);
  return idle(data) ? 0 : data._members.count();
}

int GSClient::getMemberAt(int idx, wyx_provider_t* id) {
  if (id == nullptr) return 0;
  ReadScope lock(*this);
  GSxClientData& data = dataOf(_clData);
  const int count = idle(data) ? 0 : data._members.count();
  if (idx < 0 || idx >= count) return 0;
  *id = data._members.at(idx);
  return 1;
}

int GSClient::getCurrentStateValue(GSStateValue& out) {
  ReadScope lock(*this);
  GSxClientData& data = dataOf(_clData);
  out = data._currentStateValue;
  return idle(data) ? 0 : 1;
}

int GSClient::getProposedStateValue(GSStateValue& out) {
  ReadScope lock(*this);
  GSxClientData& data = dataOf(_clData);
  out = data._proposedStateValue;
  return idle(data) ? 0 : 1;
}

void GSClient::setClientState(GSClientState state) {
  GSxClientData& data = dataOf(_clData);
  if (type() == zelt_gscl::GS_PROVIDER) {
    GS_TRACE(GSCL_TRC_API, "Client[%s] ClientState: %s to %s.\n", GSCL_ID(this),
             zelt_gscl::gscl_GSClientStateName(getClientState()), zelt_gscl::gscl_GSClientStateName(state));
  }
  WriteScope lock(*this);
  data._oldstate.store(data._state.load(std::memory_order_relaxed), std::memory_order_relaxed);
  data._state.store(state, std::memory_order_relaxed);
}

void GSClient::setToken(wyx_token_t token) { dataOf(_clData)._token.store(token, std::memory_order_relaxed); }

void GSClient::eraseMembers() {
  WriteScope lock(*this);
  dataOf(_clData)._members.eraseall();
}

void GSClient::setMembers(const wyx_membership_t* members) {
  WriteScope lock(*this);
  dataOf(_clData)._members = members;
}

void GSClient::setMembers(GSMembershipList& members) {
  WriteScope lock(*this);
  dataOf(_clData)._members = members;
}

void GSClient::plusMembers(const wyx_membership_t* members) {
  WriteScope lock(*this);
  dataOf(_clData)._members.plus(members);
}

void GSClient::minusMembers(const wyx_membership_t* members) {
  WriteScope lock(*this);
  dataOf(_clData)._members.minus(members);
}

void GSClient::setCurrentStateValue(const wyx_state_value_t* value) {
  WriteScope lock(*this);
  dataOf(_clData)._currentStateValue = value;
}

void GSClient::setProposedStateValue(const wyx_state_value_t* value) {
  WriteScope lock(*this);
  dataOf(_clData)._proposedStateValue = value;
}

void GSClient::beginTransaction() {
  GSRWLock& lock = dataOf(_clData)._transactionLock;
  lock.WriteLock(nullptr);
  LockRelease release(lock);  // should the line not come to its end
  GS_TRACE(GSCL_TRC_DETAIL, "beginTransaction %x\n", addressText(this));
  release.keep();
}

void GSClient::endTransaction() {
  LockRelease release(dataOf(_clData)._transactionLock);
  GS_TRACE(GSCL_TRC_DETAIL, "endTransaction %x\n", addressText(this));
}

}  // namespace zelt_gscl_V1
