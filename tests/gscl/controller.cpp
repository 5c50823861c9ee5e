// The controller: life cycle, session, options, queries, domain operations, and the layout of its classes.
#include <string.h>

#include <functional>
#include <memory>
#include <thread>

#include "peek.h"
#include "recording_api.h"
#include "zn_cu.h"

namespace {

cu_vrmf_t installed = {3, 2, 6, 0};
cu_vrmf_t* installed_record = &installed;

}  // namespace

// Stands before the one of the utilities library, so that a test can say what is installed.
extern "C" __attribute__((visibility("default"))) int cu_get_version_1(int, cu_vrmf_t** vrmf) {
  *vrmf = installed_record;
  return 0;
}

namespace {

using namespace recording;
using V2 = zelt_gscl_V2::GSController;
using V3 = zelt_gscl_V3::GSController;

TEST(Controller, LifeOfASession_linesCallsAndDescriptor) {
  RecordingApi api;
  auto controller = std::make_unique<GSController>();
  const std::string at = lowHex(reinterpret_cast<uintptr_t>(controller.get()));
  const auto expect = [&](int descriptor, const std::vector<std::string>& lines) {
    EXPECT_EQ(controller->getGSDescriptor(), descriptor);
    EXPECT_EQ(api.take(), lines);
  };
  const std::string named = "A GSCntrl " + at;
  expect(-1, {"A GSController " + at + " is created."});
  api.answer = WYX_CONNECT_FAILED;
  EXPECT_EQ(controller->initialize(), WYX_CONNECT_FAILED);
  expect(-1, {named + " is being initialized", "wyx_setup()", named + " initialize rc=WYX_CONNECT_FAILED"});
  api.answer = WYX_OK;
  EXPECT_EQ(controller->initialize(), WYX_OK);
  expect(7, {named + " is being initialized", "wyx_setup()", named + " initialize rc=WYX_OK"});
  api.answer = WYX_NOT_OK;
  EXPECT_EQ(controller->quit(), WYX_NOT_OK);
  expect(-1, {"A GSCntl " + at + " is being quitted.", "wyx_quit()"});
  controller.reset();
  EXPECT_EQ(api.take(), Lines{"A GSController " + at + " is being destroyed."});
}

TEST(Controller, Destroyed_withTheSessionOpen_quitsItOnceAndNotThroughAnOverride) {
  struct Quitter : GSController {
    wyx_rc_t quit() override { return WYX_NOT_OK; }
  };
  RecordingApi api(0);
  Quitter().initialize();
  EXPECT_EQ(api.take(), (Lines{"wyx_setup()", "wyx_quit()"}));
}

TEST(Controller, TheNewest_isCurrent_andAnyEndLeavesNone) {
  RecordingApi api(0);
  EXPECT_EQ(GSController::theController(), nullptr);
  auto first = std::make_unique<GSController>();
  GSProvider provider("a", 1, nullptr);
  provider.joinGroup();
  {
    V3 second(0x0003001C);
    EXPECT_EQ(GSController::theController(), &second);
    EXPECT_EQ(V3::theController(), &second);
  }
  EXPECT_EQ(GSController::theController(), nullptr);
  api.answer = WYX_NO_INIT;
  EXPECT_EQ(provider.joinGroup(), WYX_NO_INIT) << "the base API decides";
  api.answer = WYX_OK;
  provider.joinGroup();
  first.reset();
  EXPECT_EQ(provider.getClientState(), GS_IAM_JOINING) << "lives on, unregistered";
  GSController third;
  EXPECT_EQ(static_cast<GSController*>(V3::theController()), &third) << "whatever its version";
  approve(WYX_JOIN);
  EXPECT_EQ(provider.getClientState(), GS_IAM_JOINING);
}

TEST(Controller, ClientThatGoes_leavesTheRegistryThatItStandsIn) {
  RecordingApi api(0);
  GSController first;
  const auto registry = [&] { return (*reinterpret_cast<void***>(reinterpret_cast<char*>(&first) + 16))[1]; };
  {
    const GSProvider provider("a", 1, nullptr);
    EXPECT_NE(registry(), nullptr);
    const GSController second;
    EXPECT_NE(registry(), nullptr);
  }
  EXPECT_EQ(registry(), nullptr) << "with no controller current";
}

TEST(Controller, Initialize_handsOverOptionsAndCallbacksByTheInstalledVersion) {
  RecordingApi api(0);
  for (const auto& [version, count] :
       {std::pair(cu_vrmf_t{2, 3, 0, 9}, 7), std::pair(cu_vrmf_t{2, 3, 0, 10}, 8),
        std::pair(cu_vrmf_t{0x80, 0, 0, 0}, 8),  // the word is unsigned
        // The three lower fields are masked.
        std::pair(cu_vrmf_t{2, 0x102, 0xFF, 0xFF}, 7), std::pair(cu_vrmf_t{2, 2, 0x1FF, 0x1FF}, 7)}) {
    installed = version;
    GSController().initialize();
    EXPECT_EQ(api.setup.count, count) << version.version << '.' << version.release << '.' << version.modlevel;
    EXPECT_EQ(api.setup.path, nullptr);
  }
  installed = {3, 2, 6, 0};
  GSController controller;
  wyx_responsiveness_t responsiveness = {WYX_PING_RESPONSIVENESS, 10, 5, nullptr, 0};
  controller.setResponsiveness(&responsiveness);
  controller.setSocketOption(WYX_ENABLE_DOMAIN_EVENT);
  controller.setDeactivatePath("/bin/true");
  controller.initialize();
  EXPECT_EQ(api.setup.socket, WYX_ENABLE_DOMAIN_EVENT);
  EXPECT_EQ(api.setup.responsiveness.gs_responsiveness_interval, 10u);
  EXPECT_STREQ(api.setup.path, "/bin/true");
  EXPECT_EQ(api.setup.callbacks,
            (std::vector<void*>{(void*)stub_responsivenessCb, (void*)GSController::stub_delayedErrorCb,
                                (void*)stub_queryCb, (void*)stub_domain_controlCb}));
}

TEST(Controller, CallersVersion_outlivesItsController) {
  RecordingApi api;
  const auto expectVersion = [&](GSController&& controller, int version) {
    controller.initialize();
    EXPECT_EQ(api.setup.version, version);
  };
  expectVersion(GSController(), 28);
  api.take();
  expectVersion(V2(0x00040020), 32);
  EXPECT_EQ(api.take()[1], "A C::GSController GSCL_VER=40020");
  expectVersion(GSController(), 32);
  expectVersion(V3(0x0003001D), 29);
  expectVersion(V2(0x0003001C), 28);
}

TEST(ControllerDeathTest, WithoutVersionOrRecord_theProcessEnds) {
  EXPECT_DEATH(
      {
        installed_record = nullptr;
        GSController controller;
      },
      "vrmf != __null");
  EXPECT_DEATH(
      {
        GSController controller;
        memset(reinterpret_cast<char*>(&controller) + 16, 0, sizeof(void*));
        controller.initialize();
      },
      "this != __null && cData != __null");
}

TEST(Controller, ProcessWideNotifications_reachTheCurrentControllersOverrides) {
  struct Asked : V3 {
    using V3::V3;
    wyx_callback_rc_t responsivenessCb(const wyx_responsiveness_notification_t* n) override {
      seen = n;
      return WYX_CALLBACK_NOT_OK;
    }
    void queryCb(const wyx_query_notification_t* n) override { seen = n; }
    void domainControlCb(const wyx_domain_control_notification_t* n) override { seen = n; }
    const void* seen = nullptr;
  };
  RecordingApi api;
  Asked controller(0x0003001C);
  const wyx_responsiveness_notification_t alive = {};
  const wyx_query_notification_t query = {};
  wyx_domain_control_notification_t domain = {};
  domain.domain_event_type = WYX_DOMAIN_MASTER_NODE;
  EXPECT_EQ(stub_responsivenessCb(&alive), WYX_CALLBACK_NOT_OK);
  EXPECT_EQ(controller.seen, &alive);
  EXPECT_EQ(controller.V3::responsivenessCb(&alive), WYX_CALLBACK_OK);
  stub_queryCb(&query);
  EXPECT_EQ(controller.seen, &query);
  api.take();
  stub_domain_controlCb(&domain);
  EXPECT_EQ(controller.seen, &domain);
  const std::string line = "stub_domain_control_cb() domain_event=8 ";
  EXPECT_EQ(api.take(), (Lines{"A " + line + "ENTER", "A " + line + "LEAVE"}));
  V2 older(0x0003001C);
  api.take();
  stub_domain_controlCb(&domain);
  EXPECT_EQ(api.take(), (Lines{"A " + line + "ENTER", "W " + line + "dropped: no controller of version 3",
                               "A " + line + "LEAVE"}));
}

TEST(Controller, ChangeResponsiveness_acceptedIsKept_refusedIsNot) {
  RecordingApi api;
  V3 controller(0x0003001C);
  wyx_responsiveness_t wanted = {WYX_PING_RESPONSIVENESS, 10, 5, nullptr, 0}, held = {};
  for (wyx_rc_t answer : {WYX_BAD_PARAMETER, WYX_OK}) {
    api.answer = answer;
    api.take();
    EXPECT_EQ(controller.changeResponsiveness(&wanted), answer);
    EXPECT_EQ(api.take(), (Lines{"wyx_change_responsiveness()", "A GSCntl::changeResponsiveness issued. RC=" +
                                                                    std::string(gscl_rc_name(answer)) + "."}));
    controller.getResponsiveness(&held);
    EXPECT_EQ(held.gs_responsiveness_interval, answer == WYX_OK ? 10u : 0u);
  }
}

std::vector<uintptr_t> given;  // the arguments of the last entry point

/// `call` reaches `entry`, the only one that is there, with the same arguments, and gives back its result.
template <class... Parameters, class Call, class... Arguments>
void expectPassed(wyx_rc_t (*&entry)(Parameters...), Call call, Arguments... arguments) {
  entry = [](Parameters... parameters) {
    given = {(uintptr_t)parameters...};
    return static_cast<wyx_rc_t>(30);
  };
  given.clear();
  EXPECT_EQ(std::invoke(call, arguments...), static_cast<wyx_rc_t>(30));
  EXPECT_EQ(given, (std::vector<uintptr_t>{(uintptr_t)arguments...}));
  entry = nullptr;
}

/// The same with arguments of its own, which the types keep apart.
template <class... Parameters>
void expectQuery(wyx_rc_t (*&entry)(Parameters...), wyx_rc_t (*call)(Parameters...)) {
  [&](auto... arguments) { expectPassed(entry, call, arguments...); }((Parameters)uintptr_t{16}...);
}

TEST(Controller, Queries_passArgumentsAndResultThrough) {
  RecordingApi api(0);
  GSAPIRtnCollection_t& t = api.table;
  using C = GSController;
  expectQuery(t.wyx_get_limits, C::getLimits);
  expectQuery(t.wyx_get_node_number, C::get_node_number);
  expectQuery(t.wyx_get_domain_master_node_number, C::get_domain_master_node_number);
  expectQuery(t.wyx_get_adapter_info, C::get_adapter_info);
  expectQuery(t.wyx_get_adapter_info_by_addr, C::get_adapter_info_by_addr);
  expectQuery(t.wyx_get_adapter_info_by_id, C::get_adapter_info_by_id);
  expectQuery(t.wyx_get_ipaddr_by_id, C::get_ipaddr_by_id);
  expectQuery(t.wyx_get_ffdc_id, C::get_ffdc_id);
  expectQuery(t.wyx_get_zelt_active_version, C::get_zelt_active_version);
  expectQuery(t.wyx_get_zelt_installed_version, C::get_zelt_installed_version);
  expectQuery(t.wyx_migrate_to_pell_prep, C::pell_migrate_prep);
  expectQuery(t.wyx_migrate_to_pell_commit, C::pell_migrate_commit);
  expectQuery(t.wyx_migrate_to_pell_abort, C::pell_migrate_abort);
  expectQuery(t.wyx_migrate_vote, C::pell_migrate_vote);
  const auto dispatcher = [](auto flag) { return zelt_gscl_V1::GSDispatcher().dispatch(flag); };
  const auto controller = [](auto flag) { return GSController().dispatch(flag); };
  expectPassed(t.wyx_dispatch, dispatcher, WYX_BLOCKING);
  expectPassed(t.wyx_dispatch, controller, WYX_NON_BLOCKING);
}

TEST(Controller, DomainOperations_traceAndPassThrough) {
  RecordingApi api;
  V3 controller(0x0003001C);
  api.take();
  const wyx_domain_spec_t domain = {5, 0, 0};
  wyx_site_spec_t site = {};
  site.site_number = 6;
  wyx_subcluster_dissolution_info_t local = {}, remote = {};
  local.gs_subcluster_type = WYX_SUBCLUSTER_TYPE_LOCAL;
  local.info.local_domain.node_number = 8;
  remote.gs_subcluster_type = WYX_SUBCLUSTER_TYPE_REMOTE;
  remote.action = WYX_SUBCLUSTER_DISSOLVE_AND_HALT;
  remote.info.site_spec.site_number = 9;
  char data[4] = {};
  const auto on = [&](auto function) { return std::bind_front(function, &controller); };
  expectPassed(api.table.wyx_dissolve_domain, on(&V3::dissolveDomain), &domain);
  expectPassed(api.table.wyx_dissolve_site, on(&V3::dissolveSite), &site, WYX_SITE_DISSOLVE_AND_REBOOT);
  expectPassed(api.table.wyx_dissolve_subcluster, on(&V3::dissolveSubcluster), &local);
  expectPassed(api.table.wyx_dissolve_subcluster, on(&V3::dissolveSubcluster), &remote);
  expectPassed(api.table.wyx_internal_send_domain_msg_to_gsd, on(&V3::sendDomainMsgToGSD), WYX_PRIV_MSG_OPQUORUM,
               &data[0], 4);
  EXPECT_EQ(api.take(), (Lines{"A stub_dissolve_domain node=5", "A stub_dissolve_site site=6, action=1",
                               "A stub_dissolve_subcluster node=8", "A stub_dissolve_subcluster site=9, action=2",
                               "A stub_send_domain_msg_to_gsd msg_code=1"}));
}

TEST(Controller, Join_holdsTheLookUpBackUntilTokenAndStateAreRecorded) {
  RecordingApi api(0);
  GSController controller;
  Member member("a", 3, nullptr);
  std::thread dispatcher;
  auto* locker = *reinterpret_cast<peek::GSRWLockImpl**>(reinterpret_cast<char*>(&controller) + 8);
  api.during = [&] {
    api.during = nullptr;
    dispatcher = std::thread([] { approve(WYX_JOIN); });
    EXPECT_TRUE(peek::eventually([&] { return peek::readersWaiting(*locker) == 1; }));
    EXPECT_EQ(member.getToken(), -1);
  };
  EXPECT_EQ(member.joinGroup(), WYX_OK);
  dispatcher.join();
  EXPECT_EQ(member.getClientState(), GS_IAM_JOINED);
}

/// The slots of virtual functions in the Itanium ABI, in the order given; destructors have slots 0 and 1.
template <class... Functions>
std::vector<long> slots(Functions... functions) {
  const auto slot = [](auto function) {
    long words[2];
    static_assert(sizeof words == sizeof function);
    memcpy(words, &function, sizeof words);
    return (words[0] - 1) / static_cast<long>(sizeof(void*));
  };
  return {slot(functions)...};
}

TEST(Layout, VirtualSlots_areInTheStatedOrder) {
  using C = GSController;
  using P = GSProvider;
  using S = GSSubscriber;
  using Request = wyx_rc_t (P::*)(const wyx_proposal_info_t*);
  EXPECT_EQ(slots(&C::initialize, &C::quit, &C::responsivenessCb, &C::queryCb, &C::dispatch,
                  &V3::changeResponsiveness, &V3::dissolveDomain, &V3::domainControlCb),
            (std::vector<long>{2, 3, 4, 5, 6, 7, 8, 9}));
  EXPECT_EQ(slots(&zelt_gscl_V1::GSDispatcher::dispatch), std::vector<long>{2});
  EXPECT_EQ(slots(&GSClient::type, &GSClient::delayedErrorCb, &P::nPhaseCb, &P::approvedCb, &P::rejectedCb,
                  &P::announcementCb, &P::mergeCb, &P::joinGroup, &P::goodbyeGroup, Request(&P::changeStateValue),
                  Request(&P::leaveGroup), Request(&P::expelMembers), Request(&P::send_message), &P::vote,
                  Request(&P::change_attributes)),
            (std::vector<long>{2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16}));
  EXPECT_EQ(slots(&S::subscribeGroup, &S::unsubscribeGroup, &S::subscribeCb), (std::vector<long>{4, 5, 6}));
}

}  // namespace
