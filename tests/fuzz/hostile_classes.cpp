// What the classes make of a daemon that may say anything, over the base API library that they load: the input is
// a small program of their requests, messages of the daemon and dispatches, with clients that come and go.
#include "fuzz/hostile_daemon.h"
#include "gscl/gscl.h"

namespace {

using namespace zelt_gscl_V1;

class Provider : public GSProvider {
 public:
  explicit Provider(short instance) : GSProvider("g", instance, "local") {}
  void nPhaseCb(const wyx_n_phase_notification_t* n) override { test_support::on_n_phase(n); }
  void approvedCb(const wyx_approved_notification_t* n) override { test_support::on_approved(n); }
  void rejectedCb(const wyx_rejected_notification_t* n) override { test_support::on_rejected(n); }
  void announcementCb(const wyx_announcement_notification_t* n) override { test_support::on_announcement(n); }
};

class Subscriber : public GSSubscriber {
 public:
  Subscriber() : GSSubscriber("g", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP) {}
  void subscribeCb(const wyx_subscription_notification_t* n) override { test_support::on_subscription(n); }
};

class Run {
 public:
  Run(const std::uint8_t* data, std::size_t size) : in_(data, size) {
    test_support::Recorder::get().reset();
    controller_.initialize();
    first_ = std::make_unique<Provider>(1);
    second_ = std::make_unique<Provider>(2);
    subscriber_ = std::make_unique<Subscriber>();
  }
  ~Run() {
    daemon_.answer_request();
    daemon_.answer_request();  // an unsubscription, a farewell
  }

  void run() {
    for (int steps = 0; !in_.empty() && steps < kMaxSteps; ++steps) step();
  }

 private:
  static constexpr int kMaxSteps = 64;

  void step() {
    switch (in_.byte() % 8) {
      case 0:
      case 1:
        return in_.byte() % 2 == 0 ? request(first_, 1) : request(second_, 2);
      case 2:
        return watch();
      case 3:
        daemon_.answer_request();
        if (in_.byte() < 128) controller_.quit();
        daemon_.begin();
        controller_.initialize();
        return;
      case 4:
      case 5:
        controller_.dispatch(WYX_NON_BLOCKING);
        return look_at(*subscriber_);
      default:
        return in_.byte() < 8 ? daemon_.hang_up() : daemon_.say();
    }
  }

  void request(std::unique_ptr<Provider>& provider, short instance) {
    daemon_.answer_request();
    const wyx_provider_message_t message = {1, const_cast<char*>("m")};
    switch (in_.byte() % 6) {
      case 0:
      case 1:
        if (provider->joinGroup() == WYX_OK) daemon_.know(provider->getToken());
        break;
      case 2:
        provider->send_message(message, WYX_1_PHASE, 0);
        break;
      case 3:
        provider->leaveGroup(0, WYX_1_PHASE, 0);
        break;
      case 4:
        provider->goodbyeGroup();
        break;
      default:
        provider = std::make_unique<Provider>(instance);
    }
    look_at(*provider);
  }

  void watch() {
    daemon_.answer_request();
    if (in_.byte() % 4 == 0) subscriber_ = std::make_unique<Subscriber>();
    daemon_.answer_request();
    const wyx_rc_t rc = in_.byte() < 192 ? subscriber_->subscribeGroup() : subscriber_->unsubscribeGroup();
    if (rc == WYX_OK) daemon_.know(subscriber_->getToken());
  }

  static void look_at(GSClient& client) {
    GSMembershipList members;
    GSStateValue current, proposed;
    client.getMembers(members);
    client.getCurrentStateValue(current);
    client.getProposedStateValue(proposed);
  }

  fuzz::Input in_;
  fuzz::HostileDaemon daemon_{in_};
  GSController controller_;
  std::unique_ptr<Provider> first_, second_;
  std::unique_ptr<Subscriber> subscriber_;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  Run(data, size).run();
  return 0;
}
