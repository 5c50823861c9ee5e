// The subscribers of all groups, also of groups that are not there yet.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "engine/digest.h"
#include "engine/ledger.h"
#include "engine/types.h"

namespace gs {

struct Subscriber {
  Endpoint to;
  std::uint32_t control = 0;  // flags of wyx_subscription_ctrl_t
  Ledger::Charge charge;      // for its being there
};

/// A group as a subscriber can see it, and what the event `seqnum` has changed in it.
struct GroupView {
  std::uint64_t seqnum = 0;
  SharedBytes state;
  SharedMembership members;
  SharedMembership joined;       // null: nobody
  SharedMembership left;         // null: nobody
  SharedLeaveCodes leave_codes;  // one for each of `left`
  bool state_changed = false;
};

/// Subscribers of one group are served in the order in which they subscribed; those that are to hear the same
/// share one notification.
///
/// The first notification says what was asked for as it is: the state value, the full membership; who asked for
/// joins but not for the full membership gets the present members as a join. It comes in any case, empty if need
/// be, so that a subscriber knows that it is one. Later ones come when something that was asked for has changed.
///
/// At the group's end a subscriber hears the last change, then WYX_SUBSCRIPTION_DISSOLVED, and is one no longer.
/// One with WYX_SUBSCRIBE_PERSISTENCE hears instead, in one notification, WYX_SUBSCRIPTION_PERSISTENT with the
/// last change, the empty membership and the empty state value (what it asked for of these): "dissolved" would
/// end its subscription in the client. It gets a first notification again when the group is born again.
class SubscriberTable {
 public:
  using OfGroup = std::map<std::uint64_t, Subscriber>;  // by number
  using Groups = std::map<std::string, OfGroup>;        // those with subscribers

  SubscriberTable() = default;
  /// As another one was; no number is greater than `last_subscription`.
  SubscriberTable(Groups groups, std::uint64_t last_subscription)
      : groups_(std::move(groups)), last_subscription_(last_subscription) {}

  /// Returns the subscription's number, greater than those before it.
  std::uint64_t add(const std::string& group, Subscriber subscriber);
  /// It must be one of the group's.
  void remove(const std::string& group, std::uint64_t subscription);
  std::size_t count(const std::string& group) const;
  const Groups& groups() const { return groups_; }
  std::uint64_t last_subscription() const { return last_subscription_; }

  /// The first notification of a group that is there already.
  static void greet(const Endpoint& to, std::uint32_t control, const GroupView& view, std::vector<Delivery>& out);
  /// To all that wait for the group.
  void born(const std::string& group, const GroupView& view, std::vector<Delivery>& out) const;
  void changed(const std::string& group, const GroupView& view, std::vector<Delivery>& out) const;
  /// Returns those that are subscribers no longer.
  std::vector<Endpoint> ended(const std::string& group, const GroupView& view, std::vector<Delivery>& out);

  void add_to(Digest& digest) const;

 private:
  Groups groups_;
  std::uint64_t last_subscription_ = 0;
};

}  // namespace gs
