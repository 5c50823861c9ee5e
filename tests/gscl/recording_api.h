// A base API that records its calls between the trace lines, so that a test can hold the whole order of steps.
#ifndef TESTS_GSCL_RECORDING_API_H
#define TESTS_GSCL_RECORDING_API_H

#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "gscl/gscl.h"

namespace recording {

using namespace zelt_gscl;
using zelt_gscl_V1::GSClient;
using zelt_gscl_V1::GSController;
using zelt_gscl_V1::GSMembershipList;
using zelt_gscl_V1::GSProvider;
using zelt_gscl_V1::GSStateValue;
using zelt_gscl_V1::GSSubscriber;
using zelt_gscl_V1::wyx_notification_summary_t;

constexpr int kAllLevels = GSCL_TRC_API | GSCL_TRC_DETAIL | GSCL_TRC_WARNING;
constexpr wyx_token_t kToken = 12;

/// One event reads "<state>/<token> <what>", state and token being the watched client's at that moment. <what> is
/// a call of the base API, "wyx_leave(12)", a callback, "-> approvedCb", or a trace line with its channel bit, "A
/// text" (D: detail, W: warning), without its line end. Addresses of the watched client read "@", the calling
/// thread's id reads "#".
class RecordingApi {
 public:
  explicit RecordingApi(int level = kAllLevels);
  ~RecordingApi();
  RecordingApi(const RecordingApi&) = delete;
  RecordingApi& operator=(const RecordingApi&) = delete;

  void watch(GSClient* client) { watched_ = client; }
  void record(const std::string& what);
  /// What was recorded since the last call.
  std::vector<std::string> take();

  static RecordingApi& current();
  wyx_rc_t enter(const std::string& call);

  wyx_rc_t answer = WYX_OK;
  wyx_token_t token = kToken;         // what join and subscribe give
  std::function<void()> during;       // runs inside every entry point
  wyx_proposal_info_t proposal = {};  // of the last request
  std::string join_text;              // "<group>/<instance>/<local name>" of the last join
  std::string subscribed_group;
  wyx_responsiveness_t responsiveness = {};
  struct Setup {
    int version, count;
    wyx_socket_ctrl_t socket;
    wyx_responsiveness_t responsiveness;
    const char* path;
    wyx_responsiveness_cb_t* responsiveness_cb;
    wyx_delayed_error_cb_t* error_cb;
    wyx_query_cb_t* query_cb;
    void (*domain_cb)(const wyx_domain_control_notification_t*);
  } setup = {};
  wyx_descriptor_t descriptor = 7;

  GSAPIRtnCollection_t table;

 private:
  std::mutex mutex_;
  std::vector<std::string> events_;
  GSClient* watched_ = nullptr;
  GSAPIRtnCollection_t* table_before_;
  gscl_tracef_rtn routine_before_;
};

/// A provider whose callbacks are recorded and then do what the test says.
class Member : public GSProvider {
 public:
  using GSProvider::GSProvider;
  void nPhaseCb(const wyx_n_phase_notification_t*) override { called("nPhaseCb"); }
  void approvedCb(const wyx_approved_notification_t*) override { called("approvedCb"); }
  void rejectedCb(const wyx_rejected_notification_t*) override { called("rejectedCb"); }
  void announcementCb(const wyx_announcement_notification_t*) override { called("announcementCb"); }
  void mergeCb(const wyx_merge_notification_t*) override { called("mergeCb"); }
  void delayedErrorCb(const wyx_delayed_error_notification_t*) override { called("delayedErrorCb"); }
  std::function<void()> action;

 private:
  void called(const char* name) {
    RecordingApi::current().record(std::string("-> ") + name);
    if (auto act = action) act();
  }
};

class Watcher : public GSSubscriber {
 public:
  using GSSubscriber::GSSubscriber;
  void subscribeCb(const wyx_subscription_notification_t*) override {
    RecordingApi::current().record("-> subscribeCb");
    if (auto act = action) act();
  }
  std::function<void()> action;
};

/// The id of instance 3 on node 7, which joined() gives.
wyx_provider_t ownId();
wyx_provider_t otherId();

/// Records as the base API hands them out, with everything that they point at.
struct Proposal {
  explicit Proposal(wyx_provider_t by, int changed = 0);
  Proposal(const Proposal&) = delete;
  void current(std::string value);
  void proposed(std::string value);
  void members(std::vector<wyx_provider_t> ids);

  wyx_approved_notification_t approved(wyx_request_t protocol, wyx_token_t to = kToken);
  wyx_rejected_notification_t rejected(wyx_request_t protocol, wyx_token_t to = kToken);
  wyx_n_phase_notification_t phase(wyx_request_t protocol, unsigned short number, unsigned short phases = 2,
                                   wyx_token_t to = kToken);

  wyx_proposal_t record = {};

 private:
  std::string current_text_, proposed_text_;
  wyx_state_value_t current_ = {}, proposed_ = {};
  std::vector<wyx_provider_t> ids_;
  wyx_membership_t members_ = {};
};

wyx_announcement_notification_t announcement(int summary);
wyx_subscription_notification_t subscription(int type);
wyx_delayed_error_notification_t delayedError(wyx_request_t protocol, wyx_rc_t rc);

/// Brings a client where most notifications find it; what was recorded on the way is dropped.
void joined(GSProvider& provider);
void subscribed(GSSubscriber& subscriber);

std::string textOf(GSStateValue& value);
std::string currentValue(GSClient& client);
std::string proposedValue(GSClient& client);

}  // namespace recording

#endif
