// The controller: life cycle, session, options, queries, domain operations, registry.
#include <stdint.h>
#include <string.h>

#include <functional>
#include <thread>

#include "lock_peek.h"
#include "private_access.h"
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
using Lines = std::vector<std::string>;
using V2 = zelt_gscl_V2::GSController;
using V3 = zelt_gscl_V3::GSController;

std::string address(const void* p) {
  char text[16];
  snprintf(text, sizeof text, "%x", static_cast<unsigned>(reinterpret_cast<uintptr_t>(p)));
  return text;
}

TEST(Controller, LifeOfASession_linesCallsAndDescriptor) {
  RecordingApi api;
  auto controller = std::make_unique<GSController>();
  const std::string at = address(controller.get());
  EXPECT_EQ(api.take(), Lines{"A GSController " + at + " is created."});
  EXPECT_EQ(controller->getGSDescriptor(), -1);
  api.answer = WYX_CONNECT_FAILED;
  EXPECT_EQ(controller->initialize(), WYX_CONNECT_FAILED);
  EXPECT_EQ(controller->getGSDescriptor(), -1);
  EXPECT_EQ(api.take(), (Lines{"A GSCntrl " + at + " is being initialized", "wyx_setup",
                               "A GSCntrl " + at + " initialize rc=WYX_CONNECT_FAILED"}));
  api.answer = WYX_OK;
  EXPECT_EQ(controller->initialize(), WYX_OK);
  EXPECT_EQ(controller->getGSDescriptor(), 7);
  api.take();
  api.answer = WYX_NOT_OK;
  EXPECT_EQ(controller->quit(), WYX_NOT_OK);
  EXPECT_EQ(controller->getGSDescriptor(), -1);
  EXPECT_EQ(api.take(), (Lines{"A GSCntl " + at + " is being quitted.", "wyx_quit"}));
  controller.reset();
  EXPECT_EQ(api.take(), Lines{"A GSController " + at + " is being destroyed."});
}

TEST(Controller, Destroyed_withTheSessionOpen_quitsItOnceAndNotThroughAnOverride) {
  struct Quitter : GSController {
    wyx_rc_t quit() override { return WYX_NOT_OK; }
  };
  RecordingApi api(0);
  {
    Quitter controller;
    controller.initialize();
  }
  EXPECT_EQ(api.take(), (Lines{"wyx_setup", "wyx_quit"}));
}

TEST(Controller, TheNewest_isCurrent_andAnyEndLeavesNone) {
  RecordingApi api(0);
  EXPECT_EQ(GSController::theController(), nullptr);
  GSController first;
  {
    V3 second(0x0003001C);
    EXPECT_EQ(GSController::theController(), &second);
    EXPECT_EQ(V3::theController(), &second);
  }
  EXPECT_EQ(GSController::theController(), nullptr);
  GSController third;
  EXPECT_EQ(V3::theController(), nullptr);
}

TEST(Controller, Initialize_handsOverVersionCountAndOptions) {
  RecordingApi api(0);
  GSController controller;
  controller.initialize();
  EXPECT_EQ(api.setup.version, 28);
  EXPECT_EQ(api.setup.path, nullptr);
  wyx_responsiveness_t responsiveness = {WYX_PING_RESPONSIVENESS, 10, 5, nullptr, 0};
  controller.setResponsiveness(&responsiveness);
  controller.setSocketOption(WYX_ENABLE_DOMAIN_EVENT);
  controller.setDeactivatePath("/bin/true");
  EXPECT_STREQ(controller.getDeactivatePath(), "/bin/true");
  EXPECT_EQ(controller.getSocketOption(), WYX_ENABLE_DOMAIN_EVENT);
  controller.initialize();
  EXPECT_EQ(api.setup.socket, WYX_ENABLE_DOMAIN_EVENT);
  EXPECT_EQ(api.setup.responsiveness.gs_responsiveness_interval, 10u);
  EXPECT_STREQ(api.setup.path, "/bin/true");
  EXPECT_EQ(api.setup.responsiveness_cb, &stub_responsivenessCb);
  EXPECT_EQ(api.setup.error_cb, &GSController::stub_delayedErrorCb);
  EXPECT_EQ(api.setup.query_cb, &stub_queryCb);
  EXPECT_EQ(api.setup.domain_cb, &stub_domain_controlCb);
}

TEST(Controller, InstalledVersion_choosesTheCount) {
  RecordingApi api(0);
  const auto countFor = [&](cu_vrmf_t version) {
    installed = version;
    GSController controller;
    controller.initialize();
    return api.setup.count;
  };
  EXPECT_EQ(countFor({2, 3, 0, 9}), 7);
  EXPECT_EQ(countFor({2, 3, 0, 10}), 8);
  EXPECT_EQ(countFor({0x80, 0, 0, 0}), 8) << "the word is unsigned";
  EXPECT_EQ(countFor({2, 0x102, 0xFF, 0xFF}), 7) << "the three lower fields are masked";
  EXPECT_EQ(countFor({2, 2, 0x1FF, 0x1FF}), 7);
  installed = {3, 2, 6, 0};
}

TEST(Controller, CallersVersion_outlivesItsController) {
  RecordingApi api;
  {
    V2 controller(0x00040020);
    EXPECT_EQ(api.take()[1], "A GSController::GSController GSCL_VER=40020");
    controller.initialize();
    EXPECT_EQ(api.setup.version, 32);
  }
  {
    GSController later;
    later.initialize();
    EXPECT_EQ(api.setup.version, 32);
  }
  V3 restored(0x0003001C);
  restored.initialize();
  EXPECT_EQ(api.setup.version, 28);
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
        void* none = nullptr;
        memcpy(reinterpret_cast<char*>(&controller) + 16, &none, sizeof none);
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
  api.take();
  const wyx_responsiveness_notification_t alive = {};
  const wyx_query_notification_t query = {};
  wyx_domain_control_notification_t domain = {};
  domain.domain_event_type = WYX_DOMAIN_MASTER_NODE;
  EXPECT_EQ(stub_responsivenessCb(&alive), WYX_CALLBACK_NOT_OK);
  EXPECT_EQ(controller.seen, &alive);
  EXPECT_EQ(controller.V3::responsivenessCb(&alive), WYX_CALLBACK_OK);
  stub_queryCb(&query);
  EXPECT_EQ(controller.seen, &query);
  stub_domain_controlCb(&domain);
  EXPECT_EQ(controller.seen, &domain);
  EXPECT_EQ(api.take(), (Lines{"A stub_domain_control_cb() domain_event=8 ENTER",
                               "A stub_domain_control_cb() domain_event=8 LEAVE"}));
  V2 older(0x0003001C);
  api.take();
  stub_domain_controlCb(&domain);
  EXPECT_EQ(api.take().size(), 3u) << "dropped with a line of its own between the two";
}

TEST(Controller, ChangeResponsiveness_acceptedIsKept_refusedIsNot) {
  RecordingApi api;
  V3 controller(0x0003001C);
  api.take();
  wyx_responsiveness_t wanted = {WYX_PING_RESPONSIVENESS, 10, 5, nullptr, 0}, held = {};
  api.answer = WYX_BAD_PARAMETER;
  EXPECT_EQ(controller.changeResponsiveness(&wanted), WYX_BAD_PARAMETER);
  controller.getResponsiveness(&held);
  EXPECT_EQ(held.gs_responsiveness_type, WYX_NO_RESPONSIVENESS);
  api.answer = WYX_OK;
  EXPECT_EQ(controller.changeResponsiveness(&wanted), WYX_OK);
  controller.getResponsiveness(&held);
  EXPECT_EQ(held.gs_responsiveness_interval, 10u);
  EXPECT_EQ(api.take(),
            (Lines{"wyx_change_responsiveness", "A GSCntl::changeResponsiveness issued. RC=WYX_BAD_PARAMETER.",
                   "wyx_change_responsiveness", "A GSCntl::changeResponsiveness issued. RC=WYX_OK."}));
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

TEST(Controller, Queries_passArgumentsAndResultThrough) {
  RecordingApi api(0);
  GSAPIRtnCollection_t& t = api.table;
  int node = 0;
  char id[64];
  wyx_limits limits;
  wyx_adapter_info adapter;
  wyx_ip_addr address;
  wyx_provider_t provider = ownId();
  wyx_zelt_version_t version;
  using C = GSController;
  expectPassed(t.wyx_get_limits, C::getLimits, &limits);
  expectPassed(t.wyx_get_node_number, C::get_node_number, &node);
  expectPassed(t.wyx_get_domain_master_node_number, C::get_domain_master_node_number, &node);
  expectPassed(t.wyx_get_adapter_info, C::get_adapter_info, &adapter);
  expectPassed(t.wyx_get_adapter_info_by_addr, C::get_adapter_info_by_addr, &address, &adapter);
  expectPassed(t.wyx_get_adapter_info_by_id, C::get_adapter_info_by_id, 12, &provider, &adapter);
  expectPassed(t.wyx_get_ipaddr_by_id, C::get_ipaddr_by_id, 12, &provider, &address);
  expectPassed(t.wyx_get_ffdc_id, C::get_ffdc_id, &id[0]);
  expectPassed(t.wyx_get_zelt_active_version, C::get_zelt_active_version, &version);
  expectPassed(t.wyx_get_zelt_installed_version, C::get_zelt_installed_version, &version);
  expectPassed(t.wyx_migrate_to_pell_prep, C::pell_migrate_prep);
  expectPassed(t.wyx_migrate_to_pell_commit, C::pell_migrate_commit);
  expectPassed(t.wyx_migrate_to_pell_abort, C::pell_migrate_abort);
  expectPassed(t.wyx_migrate_vote, C::pell_migrate_vote, WYX_MIGRATION_VOTE_NO);
  zelt_gscl_V1::GSDispatcher dispatcher;
  expectPassed(
      t.wyx_dispatch, [&](auto flag) { return dispatcher.dispatch(flag); }, WYX_BLOCKING);
  GSController controller;
  expectPassed(
      t.wyx_dispatch, [&](auto flag) { return controller.dispatch(flag); }, WYX_NON_BLOCKING);
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

// ---------------------------------------------------------------------------------------------------------
// Registry

class Registry : public testing::Test {
 protected:
  GSClient* find(wyx_token_t token) { return (controller.*reveal(private_access::FindClient{}))(token); }
  int add(GSClient* client) { return (controller.*reveal(private_access::AddClient{}))(client); }
  int remove(GSClient* client) { return (controller.*reveal(private_access::RemoveClient{}))(client); }

  RecordingApi api{0};
  GSController controller;
};

TEST_F(Registry, Find_skipsIdleClientsAndTakesTheEarliestRegistered) {
  EXPECT_EQ(find(kToken), nullptr);
  GSProvider first("a", 1, nullptr), second("b", 2, nullptr);
  EXPECT_EQ(find(-1), nullptr);
  second.joinGroup();
  EXPECT_EQ(find(kToken), &second);
  first.joinGroup();
  EXPECT_EQ(find(kToken), &first);
  EXPECT_EQ(find(kToken + 1), nullptr);
}

TEST_F(Registry, Remove_oneEntryAtATime) {
  GSProvider provider("a", 1, nullptr), other("b", 1, nullptr), outside("c", 1, nullptr);
  EXPECT_EQ(remove(nullptr), -1);
  EXPECT_EQ(remove(&outside), 1);
  EXPECT_EQ(remove(&outside), 0);
  provider.joinGroup();
  EXPECT_EQ(add(&provider), 1);
  EXPECT_EQ(add(nullptr), 1);
  EXPECT_EQ(remove(&provider), 1);
  EXPECT_EQ(find(kToken), &provider);
  EXPECT_EQ(remove(&provider), 1);
  EXPECT_EQ(find(kToken), nullptr);
}

TEST(RegistryLife, ClientsOfAControllerThatIsGone_liveOnUnregistered) {
  RecordingApi api(0);
  auto controller = std::make_unique<GSController>();
  GSProvider provider("a", 1, nullptr);
  provider.joinGroup();
  controller.reset();
  EXPECT_EQ(provider.getClientState(), GS_IAM_JOINING);
  GSController next;
  EXPECT_EQ((next.*reveal(private_access::FindClient{}))(kToken), nullptr);
}

TEST_F(Registry, Join_holdsTheLookUpBackUntilTokenAndStateAreRecorded) {
  Member member("a", 3, nullptr);
  Proposal proposal(ownId());
  const auto n = proposal.approved(WYX_JOIN);
  std::thread dispatcher;
  auto* locker = *reinterpret_cast<lock_peek::GSRWLockImpl**>(reinterpret_cast<char*>(&controller) + 8);
  api.during = [&] {
    api.during = nullptr;
    dispatcher = std::thread([&] { GSController::stub_approvedCb(&n); });
    EXPECT_TRUE(lock_peek::eventually([&] { return lock_peek::readersWaiting(*locker) == 1; }));
    EXPECT_EQ(member.getToken(), -1);
  };
  EXPECT_EQ(member.joinGroup(), WYX_OK);
  dispatcher.join();
  EXPECT_EQ(member.getClientState(), GS_IAM_JOINED);
}

// ---------------------------------------------------------------------------------------------------------
// Layout

/// The slot of a virtual function in the Itanium ABI; destructors have slots 0 and 1.
template <class Function>
long slot(Function function) {
  long words[2];
  static_assert(sizeof words == sizeof function);
  memcpy(words, &function, sizeof words);
  return (words[0] - 1) / static_cast<long>(sizeof(void*));
}

TEST(Layout, VirtualSlots_areInTheStatedOrder) {
  using Numbers = std::vector<long>;
  EXPECT_EQ(
      (Numbers{slot(&GSController::initialize), slot(&GSController::quit), slot(&GSController::responsivenessCb),
               slot(&GSController::queryCb), slot(&GSController::dispatch), slot(&V3::changeResponsiveness),
               slot(&V3::dissolveDomain), slot(&V3::domainControlCb)}),
      (Numbers{2, 3, 4, 5, 6, 7, 8, 9}));
  EXPECT_EQ(slot(&zelt_gscl_V1::GSDispatcher::dispatch), 2);
  EXPECT_EQ((Numbers{slot(&GSClient::type), slot(&GSClient::delayedErrorCb)}), (Numbers{2, 3}));
  using P = GSProvider;
  using Request = wyx_rc_t (P::*)(const wyx_proposal_info_t*);
  EXPECT_EQ(
      (Numbers{slot(&P::nPhaseCb), slot(&P::approvedCb), slot(&P::rejectedCb), slot(&P::announcementCb),
               slot(&P::mergeCb), slot(&P::joinGroup), slot(&P::goodbyeGroup), slot<Request>(&P::changeStateValue),
               slot<Request>(&P::leaveGroup), slot<Request>(&P::expelMembers), slot<Request>(&P::send_message),
               slot(&P::vote), slot<Request>(&P::change_attributes)}),
      (Numbers{4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16}));
  using S = GSSubscriber;
  EXPECT_EQ((Numbers{slot(&S::subscribeGroup), slot(&S::unsubscribeGroup), slot(&S::subscribeCb)}),
            (Numbers{4, 5, 6}));
}

}  // namespace
