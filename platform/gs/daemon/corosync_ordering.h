// Several hosts as one: events are ordered by Corosync and applied by the rules of the replication.
#pragma once

#include <optional>

#include "corosync/corosync_link.h"
#include "corosync/datagrams.h"
#include "daemon/ordering.h"
#include "engine/limits.h"

namespace gs::daemon {

/// Not safe for concurrent use; the loop of `base` drives it.
class CorosyncOrdering : public Ordering,
                         private cluster::CorosyncListener,
                         private cluster::Order,
                         private cluster::Host {
 public:
  struct Settings {
    cluster::CorosyncLink::Settings link;
    bool safe = true;
    std::chrono::milliseconds member_timeout{5'000};
    Limits engine;
  };
  /// `give_up` is called, by the loop, where this daemon cannot be one of the cluster's.
  CorosyncOrdering(const Settings& settings, event_base* base, cluster::Around around,
                   std::shared_ptr<spdlog::logger> log, std::function<void(const std::string& why)> give_up);

  void start(Replica& replica) override;
  void submit(Event event) override;
  void fail(const std::string& why) override;
  bool will_serve() const override { return replication_ && replication_->will_serve(); }
  bool has_room() const override {
    return link_.unsent() + (replication_ ? replication_->waiting_bytes() : 0) < kMostWaiting;
  }

 private:
  static constexpr std::size_t kMostWaiting = 64 * 1024 * 1024;  // bytes, to be sent or applied

  // Of Corosync.
  void connected(const cluster::Process& self, const std::string& host_address) override;
  void gone(const std::string& why) override;
  void view_changed(const cluster::View& view) override;
  void ring_changed(const cluster::RingId& ring) override;
  void verdict(const cluster::Verdict& verdict) override;
  void received(const cluster::Process& from, std::span<const std::byte> bytes) override;
  void settle() override;
  // Of the replication.
  void join() override { link_.join(); }
  void leave() override { link_.leave(); }
  void send(const cluster::Message& message) override;
  void confirm(const cluster::Confirmed& confirmed) override { datagrams_.send(confirmed); }
  void set_peers(const std::map<Node, cluster::Word>& peers) override { datagrams_.set_peers(peers); }
  std::string address() const override { return datagrams_.address(); }
  std::string key() const override { return datagrams_.key(); }
  void log(const std::string& line) override { log_->warn("{}", line); }
  void give_up(const std::string& why) override { give_up_(why); }

  template <typename Input>
  void tell(Input input);
  void arm();

  const Settings settings_;
  const cluster::Around around_;
  const std::shared_ptr<spdlog::logger> log_;
  const std::function<void(const std::string& why)> give_up_;
  platform::EventPtr deadline_;
  Replica* replica_ = nullptr;
  cluster::CorosyncLink link_;
  cluster::Datagrams datagrams_;
  cluster::Process self_;
  std::optional<cluster::Replication> replication_;
};

}  // namespace gs::daemon
