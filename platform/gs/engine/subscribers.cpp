#include "engine/subscribers.h"

#include <algorithm>
#include <functional>

namespace gs {
namespace {

using Note = std::shared_ptr<const Notification>;

/// What comes with `type`, and nothing else.
SubscriptionNotification compose(std::uint32_t type, const GroupView& view) {
  SubscriptionNotification n;
  n.type = type;
  n.seqnum = view.seqnum;
  if (type & WYX_SUBSCRIPTION_STATE) n.state = view.state;
  if (type & WYX_SUBSCRIPTION_MEMBERSHIP) n.full_membership = view.members;
  if (type & WYX_SUBSCRIPTION_DELTA_JOIN) n.changing_membership = view.joined;
  if (type & WYX_SUBSCRIPTION_DELTA_LEAVE) {
    n.changing_membership = view.left;
    n.leave_codes = view.leave_codes;
  }
  return n;
}

// The flags of what is asked for and of what is carried have the same values.
std::uint32_t first_type(std::uint32_t control) {
  if (control & WYX_SUBSCRIBE_MEMBERSHIP) return control & (WYX_SUBSCRIPTION_STATE | WYX_SUBSCRIPTION_MEMBERSHIP);
  return control & (WYX_SUBSCRIPTION_STATE | WYX_SUBSCRIPTION_DELTA_JOIN);
}

std::uint32_t changed_type(std::uint32_t control, const GroupView& view) {
  std::uint32_t type = 0;
  if (view.state_changed) type |= WYX_SUBSCRIPTION_STATE;
  if (view.joined) type |= WYX_SUBSCRIPTION_DELTA_JOIN | WYX_SUBSCRIPTION_MEMBERSHIP;
  if (view.left) type |= WYX_SUBSCRIPTION_DELTA_LEAVE | WYX_SUBSCRIPTION_MEMBERSHIP;
  return control & type;
}

/// One shared notification for each type that occurs.
class NoteCache {
 public:
  explicit NoteCache(const GroupView& view) : view_(view) {}
  const Note& of(std::uint32_t type) {
    Note& note = notes_[type];
    if (!note) note = std::make_shared<Notification>(compose(type, view_));
    return note;
  }

 private:
  const GroupView& view_;
  std::map<std::uint32_t, Note> notes_;
};

GroupView as_first(const GroupView& view) {
  GroupView first = view;
  first.joined = view.members;
  return first;
}

}  // namespace

std::uint64_t SubscriberTable::add(const std::string& group, Subscriber subscriber) {
  groups_[group].emplace(++last_subscription_, std::move(subscriber));
  return last_subscription_;
}

void SubscriberTable::remove(const std::string& group, std::uint64_t subscription) {
  auto it = groups_.find(group);
  it->second.erase(subscription);
  if (it->second.empty()) groups_.erase(it);
}

std::size_t SubscriberTable::count(const std::string& group) const {
  auto it = groups_.find(group);
  return it == groups_.end() ? 0 : it->second.size();
}

void SubscriberTable::greet(const Endpoint& to, std::uint32_t control, const GroupView& view,
                            std::vector<Delivery>& out) {
  auto note = std::make_shared<Notification>(compose(first_type(control), as_first(view)));
  out.push_back({to, std::move(note)});
}

void SubscriberTable::born(const std::string& group, const GroupView& view, std::vector<Delivery>& out) const {
  auto it = groups_.find(group);
  if (it == groups_.end()) return;
  const GroupView first = as_first(view);
  NoteCache notes(first);
  for (const auto& [number, s] : it->second) out.push_back({s.to, notes.of(first_type(s.control))});
}

void SubscriberTable::changed(const std::string& group, const GroupView& view, std::vector<Delivery>& out) const {
  auto it = groups_.find(group);
  if (it == groups_.end()) return;
  NoteCache notes(view);
  for (const auto& [number, s] : it->second) {
    const std::uint32_t type = changed_type(s.control, view);
    if (type != 0) out.push_back({s.to, notes.of(type)});
  }
}

std::vector<Endpoint> SubscriberTable::ended(const std::string& group, const GroupView& view,
                                             std::vector<Delivery>& out) {
  std::vector<Endpoint> over;
  auto it = groups_.find(group);
  if (it == groups_.end()) return over;
  GroupView last = view;
  last.state = std::make_shared<const Bytes>();
  NoteCache notes(view), last_notes(last);
  for (const auto& [number, s] : it->second) {
    const std::uint32_t type = changed_type(s.control, view);
    if (s.control & WYX_SUBSCRIBE_PERSISTENCE) {
      const std::uint32_t state = s.control & WYX_SUBSCRIPTION_STATE;
      out.push_back({s.to, last_notes.of(type | state | WYX_SUBSCRIPTION_PERSISTENT)});
      continue;
    }
    if (type != 0) out.push_back({s.to, notes.of(type)});
    out.push_back({s.to, notes.of(WYX_SUBSCRIPTION_DISSOLVED)});
    over.push_back(s.to);
  }
  std::erase_if(it->second, [](const auto& s) { return !(s.second.control & WYX_SUBSCRIBE_PERSISTENCE); });
  if (it->second.empty()) groups_.erase(it);
  return over;
}

void SubscriberTable::add_to(Digest& digest) const {
  digest.add(groups_.size());
  for (const auto& [name, subscribers] : groups_) {
    digest.add(name);
    digest.add(subscribers.size());
    for (const auto& [number, s] : subscribers) {
      digest.add(s.to);
      digest.add(s.control);
    }
  }
}

}  // namespace gs
