// No allocation in steady state: every operator new of the library and of the test is counted.
#include "fake_daemon.h"
#include "lock_peek.h"
#include "tests/support/allocations.h"

namespace {

using namespace zelt_gscl_V1;

TEST(SteadyState, RequestRoutingAndWaiting_allocateNothing) {
  fake_daemon::FakeDaemon daemon;
  GSController controller;
  GSProvider provider("steady", 1, nullptr);
  GSSubscriber subscriber("steady", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP);
  GSMembershipList members;
  GSStateValue value;
  const long unrelated = allocations::count();
  { GSSubscriber another("steady", WYX_SUBSCRIBE_STATE); }
  if (!allocations::kControlled) GTEST_SKIP() << "nothing is counted in this build";
  ASSERT_GT(allocations::count(), unrelated) << "what the library allocates is counted";

  char text[] = "message";
  const timespec until = lock_peek::inMillis(600000);
  const auto round = [&] {
    wyx_notification_summary_t summary;
    const auto answered = [&](GSClient& client) {
      while (controller.dispatch(WYX_NON_BLOCKING) == WYX_OK) {
      }
      return client.waitForNotification(zelt_gscl::GS_TRIGGER_AFTER_CALLBACK, &until, nullptr, &summary) ==
             zelt_gscl::GS_WAITFOR_RECEIVED;
    };
    bool good = provider.joinGroup() == WYX_OK && answered(provider);
    good = good && provider.changeStateValue(wyx_state_value_t{7, text}, WYX_1_PHASE, 0) == WYX_OK;
    good = good && answered(provider) && provider.send_message({7, text}, WYX_1_PHASE, 0) == WYX_OK;
    good =
        good && answered(provider) && provider.vote(WYX_VOTE_APPROVE, WYX_NULL_VOTE, nullptr, nullptr) == WYX_OK;
    good = good && subscriber.subscribeGroup() == WYX_OK && answered(subscriber);
    good = good && provider.getMembers(members) == 1 && provider.getCurrentStateValue(value) == 1;
    good = good && subscriber.unsubscribeGroup() == WYX_OK && provider.goodbyeGroup() == WYX_OK;
    return good;
  };
  ASSERT_TRUE(round()) << "grows what must grow";
  const long before = allocations::count();
  bool good = true;
  for (int i = 0; i < 100; ++i) good = round() && good;
  EXPECT_EQ(allocations::count(), before);
  EXPECT_TRUE(good);
}

}  // namespace
