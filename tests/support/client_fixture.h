// The base API's requests as one-liners, with the recorder's callbacks, and tests of its entry points over one
// kind of endpoint.
#pragma once

#include <gmock/gmock.h>

#include <cstdlib>
#include <memory>

#include "gs/engine_text.h"
#include "support/group_recorder.h"
#include "support/gsd_process.h"

namespace test_support {

struct SetupResult {
  wyx_rc_t rc = WYX_NOT_OK;
  wyx_descriptor_t descriptor = -1;
};

inline SetupResult setup(wyx_domain_control_cb_t* on_domain_control = nullptr) {
  SetupResult result;
  result.rc = wyx_setup(28, 8, &result.descriptor, WYX_SOCKET_NO_SIGNAL, nullptr, "", on_ping, on_delayed_error,
                        on_query, on_domain_control);
  return result;
}

inline std::string last_failure() {
  char id[64] = "";
  EXPECT_EQ(wyx_get_ffdc_id(id), WYX_OK);
  return id;
}

/// A group with everything at its plainest; change what a test is about.
struct Group {
  explicit Group(std::string name_of_group) : name(std::move(name_of_group)) {
    attributes.gs_sizeof_group_attributes = sizeof(attributes);
    attributes.gs_num_phases = WYX_1_PHASE;
    attributes.gs_source_reflection_num_phases = WYX_1_PHASE;
    attributes.gs_group_default_vote = WYX_VOTE_APPROVE;
  }
  wyx_group_attributes_t* record() {
    attributes.gs_group_name = name.data();
    return &attributes;
  }
  std::string name;
  wyx_group_attributes_t attributes = {};
};

inline wyx_proposal_info_t join_info(Group& group, short instance, std::string& local_name) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_join_request = {group.record(), instance,    local_name.data(), on_n_phase,
                                             on_approved,    on_rejected, on_announcement,   nullptr};
  return info;
}
inline wyx_rc_t join(Group& group, short instance, wyx_token_t* token) {
  std::string local_name = "local";
  const wyx_proposal_info_t info = join_info(group, instance, local_name);
  return wyx_join(token, &info);
}
inline wyx_proposal_info_t state_info(std::string& state, wyx_num_phases_t phases, wyx_time_limit_t limit = 0) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_state_change_request = {
      phases, limit, {static_cast<int>(state.size()), state.data()}};
  return info;
}
inline wyx_rc_t change_state(wyx_token_t token, std::string state, wyx_num_phases_t phases = WYX_1_PHASE,
                             wyx_time_limit_t limit = 0) {
  const wyx_proposal_info_t info = state_info(state, phases, limit);
  return wyx_change_state_value(token, &info);
}
inline wyx_rc_t send_message(wyx_token_t token, std::string text) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_message_request = {WYX_1_PHASE, 0, {static_cast<int>(text.size()), text.data()}};
  return wyx_send_message(token, &info);
}
inline wyx_rc_t leave(wyx_token_t token, unsigned code = 0) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_leave_request = {WYX_1_PHASE, 0, code};
  return wyx_leave(token, &info);
}
inline wyx_rc_t expel(wyx_token_t token, wyx_provider_t whom, std::string flag) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_expel_request = {WYX_1_PHASE, 0, {1, &whom}, 0, flag.data()};
  return wyx_expel(token, &info);
}
inline wyx_rc_t subscribe(std::string group, int control, wyx_token_t* token) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_subscribe_request = {static_cast<wyx_subscription_ctrl_t>(control), group.data(),
                                                  on_subscription};
  return wyx_subscribe(token, &info);
}
inline wyx_rc_t vote(wyx_token_t token, wyx_vote_value_t value) {
  return wyx_vote(token, value, nullptr, nullptr, WYX_NULL_VOTE);
}

/// Whether it tells a client that its daemon is gone.
inline bool is_end(const Seen& seen) {
  const auto* announcement = std::get_if<gs::AnnouncementNotification>(&seen.what);
  const auto* subscription = std::get_if<gs::SubscriptionNotification>(&seen.what);
  return (announcement && announcement->summary == WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY) ||
         (subscription && subscription->type == WYX_SUBSCRIPTION_GS_HAS_DIED);
}

/// With a session open at its start, that ends with it.
class SessionTest : public testing::Test {
 protected:
  /// Over the endpoint that the environment says.
  void open() {
    const SetupResult opened = setup();
    ASSERT_EQ(opened.rc, WYX_OK);
    descriptor_ = opened.descriptor;
  }
  void TearDown() override {
    recorder().set_hook(nullptr);
    wyx_quit();
  }

  static Recorder& recorder() { return Recorder::get(); }
  int fd() const { return descriptor_; }

  bool all_arrive(wyx_token_t token, std::size_t count) {
    return dispatch_until(fd(), [&] { return recorder().of(token).size() >= count; });
  }
  /// What `token` is told, once it is so much; a line each.
  std::string told(wyx_token_t token, std::size_t count = 1) {
    EXPECT_TRUE(all_arrive(token, count));
    std::string lines;
    for (const Seen& seen : recorder().of(token))
      lines += (is_end(seen) ? "died" : gs::test::brief(seen.what)) + "\n";
    return lines;
  }
  /// A member of `group`; what was told until then is forgotten.
  wyx_token_t joined(Group group, short instance = 1) {
    wyx_token_t token = -1;
    EXPECT_EQ(join(group, instance, &token), WYX_OK);
    EXPECT_TRUE(all_arrive(token, 1));
    recorder().reset();
    return token;
  }

 private:
  int descriptor_ = -1;
};

enum class EndpointKind { kEmbedded, kDaemon };

inline const auto kEndpoints = testing::Values(EndpointKind::kEmbedded, EndpointKind::kDaemon);

inline std::string endpoint_name(const testing::TestParamInfo<EndpointKind>& info) {
  return info.param == EndpointKind::kEmbedded ? "Embedded" : "Daemon";
}

/// The same over every kind of endpoint.
class ClientTest : public SessionTest, public testing::WithParamInterface<EndpointKind> {
 protected:
  void SetUp() override {
    if (GetParam() == EndpointKind::kDaemon) daemon_ = std::make_unique<GsdProcess>();
    setenv("GSD_ENDPOINT", daemon_ ? daemon_->endpoint().c_str() : "embedded:", 1);
    recorder().reset();
    open();
  }

 private:
  std::unique_ptr<GsdProcess> daemon_;
};

}  // namespace test_support
