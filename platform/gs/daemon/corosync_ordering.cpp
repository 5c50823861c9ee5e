#include "daemon/corosync_ordering.h"

#include <signal.h>

#include <algorithm>
#include <cerrno>
#include <string_view>

#include "cluster/codec.h"
#include "common/random_number.h"
#include "engine/digest.h"

namespace gs::daemon {
namespace {

using namespace cluster;
using platform::now;
using platform::random_number;

std::uint64_t milliseconds_since_1970() {
  const auto since = std::chrono::system_clock::now().time_since_epoch();
  return static_cast<std::uint64_t>(std::chrono::duration_cast<std::chrono::milliseconds>(since).count());
}

std::uint64_t digest_of(const CorosyncOrdering::Settings& settings) {
  Digest digest;
  digest.add(settings.engine);
  digest.add(settings.safe);
  return digest.value();
}

bool runs(std::uint32_t pid) { return kill(static_cast<pid_t>(pid), 0) == 0 || errno == EPERM; }

}  // namespace

CorosyncOrdering::CorosyncOrdering(const Settings& settings, event_base* base, Around around,
                                   std::shared_ptr<spdlog::logger> log,
                                   std::function<void(const std::string& why)> give_up)
    : settings_(settings),
      around_(std::move(around)),
      log_(std::move(log)),
      give_up_(std::move(give_up)),
      link_(settings.link, base, around_, *this, log_),
      datagrams_(base, around_, [this](Node from, const Confirmed& confirmed) {
        tell([&] { replication_->confirmed(from, confirmed); });
      }) {
  const auto callback = [](evutil_socket_t, short, void* self) {
    auto* ordering = static_cast<CorosyncOrdering*>(self);
    ordering->around_([ordering] { ordering->tell([] {}); });
  };
  deadline_.reset(event_new(base, -1, 0, callback, this));
  if (!deadline_) throw std::bad_alloc();
}

void CorosyncOrdering::start(Replica& replica) {
  replica_ = &replica;
  link_.start();
}

/// Gives the replication an input with the time at which it comes. Nothing is thrown through Corosync: after an
/// input that could not be taken the state is not the others'.
template <typename Input>
void CorosyncOrdering::tell(Input input) {
  if (!replication_) return;
  const std::string_view before = replication_->state();
  try {
    replication_->advance(now());
    input();
  } catch (const std::exception& error) {
    replication_->fail(std::string("an event of the cluster could not be taken: ") + error.what());
  }
  if (replication_->state() != before) log_->info("{}, was: {}", replication_->state(), before);
  arm();
}

void CorosyncOrdering::arm() {
  const auto next = replication_->next_deadline();
  if (!next) return void(event_del(deadline_.get()));
  const auto wait = std::max(*next - now(), Duration(1)).count();
  const timeval after = {wait / 1000, static_cast<suseconds_t>(wait % 1000 * 1000)};
  event_add(deadline_.get(), &after);
}

/// What it throws concerns the event alone: it was not sent.
void CorosyncOrdering::submit(Event event) {
  if (!replication_) return;
  replication_->advance(now());
  replication_->submit(std::move(event));
  arm();
}

void CorosyncOrdering::fail(const std::string& why) {
  tell([&] { replication_->fail(why); });
}

// --------------------------------------------------------------------------------------------------- of Corosync

void CorosyncOrdering::connected(const Process& self, const std::string& host_address) {
  datagrams_.open(self.node, host_address);
  if (datagrams_.address().empty()) {
    log_->warn("no address of this host for datagrams: events wait for confirmations in Corosync's order");
  }
  if (replication_ && self == self_) return;
  self_ = self;
  const Replication::Settings settings{.self = self,
                                       .safe = settings_.safe,
                                       .member_timeout = settings_.member_timeout,
                                       .limits = digest_of(settings_)};
  Order& order = *this;  // named, since only here they are known to be
  Host& host = *this;
  replication_.emplace(settings, order, *replica_, host, random_number, milliseconds_since_1970);
}

void CorosyncOrdering::gone(const std::string& why) {
  log_->error("{}", why);
  tell([&] { replication_->gone(why); });
}

/// Two daemons of one node would answer for one another. One that has ended may still be in the view.
void CorosyncOrdering::view_changed(const View& view) {
  for (const Process& member : view.members) {
    if (member.node != self_.node || member == self_ || replication_->is_member() || !runs(member.pid)) continue;
    return give_up_("another gsd (pid " + std::to_string(member.pid) +
                    ") is this host's in the cluster: stop one");
  }
  std::string members;
  for (const Process& member : view.members) members += (members.empty() ? "" : ", ") + name_of(member);
  log_->debug("in the group: {}", members);
  tell([&] { replication_->view_changed(view); });
}

void CorosyncOrdering::ring_changed(const RingId& ring) {
  log_->debug("ring {}.{}", ring.node, ring.sequence);
  tell([&] { replication_->ring_changed(ring); });
}

void CorosyncOrdering::verdict(const Verdict& verdict) {
  const RingId& ring = verdict.ring;
  log_->debug("ring {}.{} has {}", ring.node, ring.sequence, verdict.quorate ? "quorum" : "no quorum");
  tell([&] { replication_->verdict(verdict); });
}

void CorosyncOrdering::received(const Process& from, std::span<const std::byte> bytes) {
  std::string error;
  const auto message = decode(bytes, &error);
  tell([&] {
    if (message) return replication_->received(from, *message);
    log_->error("what {} has sent is no message: {}", name_of(from), error);
    if (replication_->relies_on(from.node))
      replication_->fail("what " + name_of(from) + " has sent is no message: run the same release on all hosts");
  });
}

void CorosyncOrdering::settle() {
  tell([&] { replication_->settle(); });
}

// ------------------------------------------------------------------------------------------- of the replication

void CorosyncOrdering::send(const Message& message) {
  auto bytes = encode(message);
  if (bytes.empty()) return log_->error("a message cannot be sent: {}", problem_with(message));
  link_.send(std::move(bytes));
}

}  // namespace gs::daemon
