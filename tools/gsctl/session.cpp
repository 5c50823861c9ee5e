#include "tools/gsctl/session.h"

#include <cstdlib>
#include <cstring>

#include "tools/gsctl/text.h"

namespace gsctl {
namespace {

constexpr std::size_t kMaxGroupName = 32;
constexpr std::size_t kFailureId = 256;
constexpr std::chrono::duration<double> kReopenPause(0.1);

std::string daemon_name() {
  const char* endpoint = getenv("GSD_ENDPOINT");
  return endpoint == nullptr || *endpoint == 0 ? "" : std::string(" at ") + endpoint;
}

/// Of the failure that the library recorded last: see wyx_get_ffdc_id.
std::string why_not_reached() {
  char id[kFailureId] = {};
  if (zelt_gscl_V1::GSController::get_ffdc_id(id) != WYX_OK)
    return "start gsd, or give its socket with --endpoint";
  const std::string_view failure = id;
  if (failure.starts_with("connect-denied")) return "not permitted: be in the group that gsd lets in";
  if (failure.starts_with("hello-refused") || failure.starts_with("attach-refused")) {
    return "it refuses this client: see its log";
  }
  if (failure.starts_with("hello") || failure.starts_with("attach")) return "it does not answer as gsd does";
  return "start gsd, or give its socket with --endpoint";
}

}  // namespace

Session::~Session() { close(); }

void Session::open() {
  if (!try_open()) throw Error(kNoDaemon, "no daemon" + daemon_name() + ": " + why_not_reached());
}

bool Session::try_open() {
  if (initialize() != WYX_OK) return false;
  readable_ = loop_.on_readable(getGSDescriptor(), [this] { deliver(); });
  return true;
}

void Session::close() {
  readable_.reset();
  quit();
}

void Session::deliver() {
  // Twice: what hands out the last notification of a daemon that is gone is still good, and nothing follows it.
  if (dispatch(WYX_NON_BLOCKING) == WYX_OK && dispatch(WYX_NON_BLOCKING) == WYX_OK) {
    if (delivered_) delivered_();
    return;
  }
  close();
  if (lost_) lost_();
}

void Session::reopen(std::function<void()> callback) {
  retry_ = loop_.after(kReopenPause, [this, callback] {
    if (!try_open()) return reopen(callback);
    retry_.reset();
    callback();
  });
}

void Session::be_responsive(unsigned short seconds, std::function<void()> asked) {
  wyx_responsiveness_t wanted{};
  wanted.gs_responsiveness_type =
      static_cast<wyx_responsiveness_type_t>(WYX_PING_RESPONSIVENESS | WYX_ANNOUNCEMENT_WHEN_SLOW);
  wanted.gs_responsiveness_interval = 1;
  wanted.gs_responsiveness_response_time_limit = seconds;
  setResponsiveness(&wanted);
  asked_ = std::move(asked);
}

wyx_callback_rc_t Session::responsivenessCb(const wyx_responsiveness_notification_t*) {
  loop_.guard(asked_);
  return WYX_CALLBACK_OK;
}

short Session::node() {
  int number = 0;
  get_node_number(&number);
  return static_cast<short>(number);
}

void end_when_lost(Session& session, const std::string& text) {
  session.on_lost([text] { throw Error(kLost, text); });
}

Loop::Handle end_in_time(Loop& loop, const Settings& settings, const std::string& text) {
  if (!settings.timeout) return nullptr;
  return loop.after(std::chrono::duration<double>(*settings.timeout), [text] { throw Error(kTimeOver, text); });
}

Subscription::Subscription(Loop& loop, const std::string& group, int what, Change on_change)
    : GSSubscriber(group.c_str(), static_cast<wyx_subscription_ctrl_t>(what)),
      loop_(loop),
      on_change_(std::move(on_change)) {}

void Subscription::subscribeCb(const wyx_subscription_notification_t* notification) {
  loop_.guard([&] { on_change_(*notification); });
}

void check_group(const std::string& group) {
  if (group.empty()) throw Error(kWrongUse, "GROUP: a name is needed");
  if (group.size() > kMaxGroupName) {
    throw Error(kWrongUse, "GROUP: a name has at most " + std::to_string(kMaxGroupName) + " characters");
  }
}

}  // namespace gsctl
