// A member of a group, as gsctl's commands are it.
#pragma once

#include <optional>
#include <string>

#include "gscl/gscl.h"
#include "tools/gsctl/loop.h"
#include "tools/gsctl/session.h"

namespace gsctl {

/// What the group says comes to the functions below, from the loop; they may throw. The records live only during
/// the call.
class Member : public zelt_gscl_V1::GSProvider {
 public:
  /// Throws Error: the name is over what the daemon takes.
  Member(Loop& loop, const std::string& group, const std::string& name);

  /// Asks to join, as this instance or as one that is free, with the group's attributes. Throws Error: refused.
  void ask_to_join(std::optional<short> instance = std::nullopt);
  /// The same, with the daemon's answer.
  wyx_rc_t try_to_join(std::optional<short> instance = std::nullopt);

  /// Whether this member is what the notification is about.
  bool is_me(const wyx_membership_t* members);
  bool is_mine(const wyx_proposal_t& proposal) { return proposal.gs_proposed_by == getId(); }

 protected:
  Loop& loop() { return loop_; }

  /// A phase of a protocol waits for this member's vote. Approves here.
  virtual void asked(const wyx_n_phase_notification_t& n);
  virtual void approved(const wyx_approved_notification_t& n) = 0;
  virtual void rejected(const wyx_rejected_notification_t& n) = 0;
  virtual void announced(const wyx_announcement_notification_t& n) = 0;
  /// A request that had been accepted is refused after all.
  virtual void refused(const wyx_delayed_error_notification_t& n) = 0;

 private:
  void nPhaseCb(const wyx_n_phase_notification_t* n) final {
    loop_.guard([&] { asked(*n); });
  }
  void approvedCb(const wyx_approved_notification_t* n) final {
    loop_.guard([&] { approved(*n); });
  }
  void rejectedCb(const wyx_rejected_notification_t* n) final {
    loop_.guard([&] { rejected(*n); });
  }
  void announcementCb(const wyx_announcement_notification_t* n) final {
    loop_.guard([&] { announced(*n); });
  }
  void delayedErrorCb(const wyx_delayed_error_notification_t* n) final;

  Loop& loop_;
  bool took_attributes_ = false;  // of the group, after a join that had others
};

/// Throws Error: there is no such group.
void require_group(Loop& loop, const std::string& group);

/// What a protocol is given for each phase, in seconds; --vote-time.
constexpr unsigned short kVoteTime = 30;

}  // namespace gsctl
