// A daemon that says what a fuzzer's input makes it say, to the base API library of this process, on this thread:
// connections are taken over, every answer lies there before it is asked for, and whoever waits for one that is
// not there has waited long enough. To be included by one source file of a program.
#pragma once

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "fuzz/input.h"
#include "gs/made_up_request.h"
#include "gs/wire_samples.h"
#include "support/client_fixture.h"

namespace fuzz {

class HostileDaemon {
 public:
  explicit HostileDaemon(Input& input) : in_(input) {
    current_ = this;
    setenv("GSD_ENDPOINT", "unix:/hostile", 1);
    GTEST_FLAG_SET(break_on_failure, true);  // the callbacks' expectations
  }
  ~HostileDaemon() {
    for (const int peer : peers_) close(peer);
    current_ = nullptr;
  }
  HostileDaemon(const HostileDaemon&) = delete;
  HostileDaemon& operator=(const HostileDaemon&) = delete;

  static HostileDaemon* current() { return current_; }

  /// The next connection is the first of a session.
  void begin() { greeting_ = true; }
  /// A connection to the daemon, greeted as it should be or not.
  void accept(int fd) {
    int ends[2];
    if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0) abort();
    if (dup3(ends[0], fd, O_CLOEXEC) < 0) abort();
    close(ends[0]);
    peers_.push_back(ends[1]);
    if (querying_) return answer(ends[1], kNode);
    (greeting_ ? request_ : event_) = ends[1];
    answer(ends[1], greeting_ ? gs::wire::ServerMessage(gs::wire::Welcome{1, 1, 1}) : gs::wire::Answer{WYX_OK});
    greeting_ = !greeting_;
  }

  /// What the next request is told.
  void answer_request() {
    const int rc = in_.byte();
    answer(request_, gs::wire::Answer{rc < 0xc0 ? WYX_OK : static_cast<wyx_rc_t>(rc % 37)});
  }
  /// Runs a query of the node, in the session or without one.
  template <typename Query>
  void answer_query(const Query& query) {
    answer(request_, kNode);
    querying_ = true;
    query();
    querying_ = false;
  }
  /// On the event channel.
  void say() { say(event_); }
  void hang_up() { shutdown(in_.byte() % 2 == 0 ? request_ : event_, SHUT_RDWR); }
  /// The clients that it speaks of.
  void know(gs::Token token) { tokens_.push_back(token); }

 private:
  using Packets = std::vector<gs::wire::Packet>;

  static constexpr gs::wire::NodeInfo kNode{1, 1};

  static void put(int peer, const Packets& packets) {
    for (const auto& packet : packets) ::send(peer, packet.data(), packet.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    char asked[16];
    while (recv(peer, asked, sizeof asked, MSG_DONTWAIT | MSG_TRUNC) > 0) {
    }
  }
  static void put(int peer, const gs::wire::ServerMessage& message) { put(peer, gs::wire::packets_of(message)); }

  /// Mostly `usual`; else nothing, or anything and then no more.
  void answer(int peer, const gs::wire::ServerMessage& usual) {
    const int how = in_.byte();
    if (how < 0xe0) return put(peer, usual);
    if (how < 0xe8) return;
    say(peer);
    shutdown(peer, SHUT_WR);
  }

  void say(int peer) {
    switch (in_.byte() % 10) {
      case 0:
        return put(peer, Packets{in_.bytes(in_.byte() + 1)});
      case 1:
        return put(peer, Packets{framed_payload(in_)});
      case 2:
        return put(peer, sample());
      case 3: {
        Packets packets = gs::wire::packets_of(in_.byte() % 2 == 0 ? sample() : notify(token()));
        damage(in_, packets);
        return put(peer, packets);
      }
      case 4:
      case 5:
        return say_to_many(peer);
      default:
        return put(peer, notify(token()));
    }
  }

  /// A fan-out, mostly whole and in order.
  void say_to_many(int peer) {
    gs::wire::Fanout fanout{std::vector<gs::Token>(2 + in_.byte() % 4)};
    for (gs::Token& to : fanout.tokens) to = token();
    const int missing = in_.byte();
    if (missing != 1) put(peer, fanout);
    if (missing == 2) put(peer, notify(token()));
    if (missing != 3) put(peer, notify(-1));
    if (missing != 4) put(peer, gs::wire::FanoutEnd{});
  }

  gs::wire::ServerMessage sample() {
    static const auto kMessages = gs::wire::samples::server_messages();
    gs::wire::ServerMessage message = kMessages[in_.byte() % kMessages.size()];
    if (auto* notify = std::get_if<gs::wire::Notify>(&message)) notify->token = token();
    return message;
  }
  gs::wire::ServerMessage notify(gs::Token to) {
    return gs::wire::Notify{to, std::make_shared<const gs::Notification>(notification())};
  }

  gs::Token token() {
    const std::uint8_t which = in_.byte();
    return tokens_.empty() || which == 0xff ? which : tokens_[which % tokens_.size()];
  }

  gs::Notification notification() {
    switch (in_.byte() % 8) {
      case 0:
        return gs::AnnouncementNotification{1u << (in_.byte() % 10), members()};
      case 1: {
        const gs::Request request = requests_.request();
        return gs::DelayedErrorNotification{protocol_of(request), static_cast<wyx_rc_t>(1 + in_.byte() % 36),
                                            request, attributes()};
      }
      case 2:
      case 3: {
        gs::SubscriptionNotification n{in_.word() & 0x28fu, state(), members(), members(), {}, in_.byte()};
        if ((n.type & WYX_SUBSCRIPTION_DELTA_LEAVE) != 0) n.leave_codes = codes_for(*n.changing_membership);
        return n;
      }
      case 4:
        return approval_of_join();
      default:
        return protocol();
    }
  }

  static gs::SharedLeaveCodes codes_for(const gs::Membership& leaving) {
    if (leaving.empty()) return nullptr;
    return std::make_shared<const std::vector<gs::LeaveCode>>(leaving.size());
  }

  /// Of one of those that ask.
  gs::ProtocolNotification approval_of_join() {
    gs::ProtocolNotification n = gs::wire::samples::plain_protocol();
    n.type = WYX_APPROVED_NOTIFICATION;
    n.protocol = WYX_JOIN;
    n.proposal.whats_changed = WYX_UPDATED_MEMBERSHIP;
    n.proposal.proposed_by = provider();
    n.proposal.changing_providers = gs::wire::samples::members({n.proposal.proposed_by});
    n.proposal.current_providers = members();
    return n;
  }

  gs::ProtocolNotification protocol() {
    gs::ProtocolNotification n = gs::wire::samples::full_protocol();
    n.type = static_cast<wyx_notification_type_t>(WYX_N_PHASE_NOTIFICATION + in_.byte() % 3);
    n.protocol = gs::kProtocols[in_.byte() % std::size(gs::kProtocols)].type;
    gs::Proposal& p = n.proposal;
    const int parts = in_.byte();
    p.whats_changed = in_.word() & 0x7eff;
    p.proposed_by = provider();
    p.current_providers = members();
    p.changing_providers = members();
    p.leave_codes = (parts & 1) ? codes_for(*p.changing_providers) : nullptr;
    if (parts & 2) p.current_vote_results = nullptr;
    if (parts & 4) p.proposed_state = state();
    if (parts & 8) p.phase = 1;
    if (parts & 16) p.current_state = state();
    if ((parts & 0xc0) != 0xc0) return n;
    p.whats_changed &= WYX_UPDATED_MEMBERSHIP | WYX_CURRENT_STATE_VALUE;
    p.expel_info.reset();
    p.proposed_state = p.message = nullptr;
    p.new_attributes = attributes();
    return n;
  }

  gs::ProviderId provider() { return {static_cast<std::int16_t>(in_.byte() % 4), 1}; }
  gs::SharedMembership members() {
    gs::Membership ids(in_.byte() % 4);
    for (gs::ProviderId& id : ids) id = provider();
    return std::make_shared<const gs::Membership>(std::move(ids));
  }
  /// Some too large for one packet.
  gs::SharedBytes state() {
    const std::size_t size = in_.byte();
    return gs::wire::samples::bytes(gs::Bytes(size == 0xff ? 100'000 : size, 's'));
  }
  std::shared_ptr<const gs::GroupAttributes> attributes() {
    if (in_.byte() % 4 == 0) return nullptr;
    return std::make_shared<const gs::GroupAttributes>(requests_.attributes());
  }

  static inline HostileDaemon* current_ = nullptr;
  Input& in_;
  gs::test::MadeUp<Input> requests_{in_};
  std::vector<int> peers_;         // its ends of all connections
  int request_ = -1, event_ = -1;  // of the latest session
  bool greeting_ = true, querying_ = false;
  std::vector<gs::Token> tokens_;
};

}  // namespace fuzz

extern "C" __attribute__((visibility("default"))) int connect(int fd, const sockaddr*, socklen_t) {
  fuzz::HostileDaemon::current()->accept(fd);
  return 0;
}

/// What is not there at once never comes.
extern "C" __attribute__((visibility("default"))) ssize_t recv(int fd, void* packet, size_t size, int flags) {
  return recvfrom(fd, packet, size, flags | MSG_DONTWAIT, nullptr, nullptr);
}

extern "C" __attribute__((visibility("default"))) int poll(pollfd* watched, nfds_t count, int patience) {
  constexpr timespec kAtOnce{};
  const int ready = ppoll(watched, count, &kAtOnce, nullptr);
  if (ready != 0 || patience == 0) return ready;
  errno = ENOMEM;
  return -1;
}
