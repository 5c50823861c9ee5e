// A member of a group.
//
// Used in: examples/member.cpp.
#ifndef GSCL_GSPROVIDER_H
#define GSCL_GSPROVIDER_H

#include "gscl/GSClient.h"

namespace zelt_gscl_V1 {

/// Joins a group, takes part in its protocols by voting, and proposes changes itself. Derive from it and override
/// the callbacks; here they only write trace lines (in particular nPhaseCb casts no vote).
///
/// States, threads, lifetime: see GSClient. Idle until joinGroup() is accepted, joined when the join is approved,
/// idle again after a leave or goodbye, and it may then join again. Neither joinGroup() on a joined provider nor
/// its destruction tells the daemon that the member of before is gone: it stays in the group, without anybody who
/// votes for it, until the session ends. Say goodbye, or leave and wait for the approval, first.
///
/// Requests return the base API's synchronous result unchanged; what comes of the request is told by a callback,
/// and to a thread that waits with waitForNotification. Each kind of request has one virtual form; the convenience
/// forms build the request and call it. What a request points at stays the caller's. A class that overrides a
/// virtual form and wants to keep the others visible says so with a using-declaration. Requests take the client's
/// transaction lock around the base API call (joinGroup the controller's write lock before it, vote none).
class ZN_GSCL_EXPORT GSProvider : public GSClient {
 public:
  /// `gname` is cut at 32 characters: see setGroupName. `instance` tells the providers of one group on one node
  /// apart. `locname` null: "<gname>_<instance>".
  GSProvider(const char* gname, short instance, const char* locname);
  virtual ~GSProvider();

  virtual GSClientType type();

  // Callbacks, on the dispatching thread, no lock held. The records live only during the call.

  /// A phase of an n-phase protocol: cast the vote here, with vote().
  virtual void nPhaseCb(const wyx_n_phase_notification_t* notification);
  virtual void approvedCb(const wyx_approved_notification_t* notification);
  virtual void rejectedCb(const wyx_rejected_notification_t* notification);
  virtual void announcementCb(const wyx_announcement_notification_t* notification);
  virtual void mergeCb(const wyx_merge_notification_t* notification);

  /// Joins the group that the client is named after, with the attributes as set (wyx_join). They must not be set
  /// meanwhile: the request points at the provider's own gs_source_group_name.
  virtual wyx_rc_t joinGroup();
  /// Leaves at once, without a protocol (wyx_goodbye). WYX_NOT_OK when idle already.
  virtual wyx_rc_t goodbyeGroup();
  virtual wyx_rc_t changeStateValue(const wyx_proposal_info_t* proposal);  ///< wyx_change_state_value
  virtual wyx_rc_t leaveGroup(const wyx_proposal_info_t* proposal);        ///< wyx_leave
  virtual wyx_rc_t expelMembers(const wyx_proposal_info_t* proposal);      ///< wyx_expel
  virtual wyx_rc_t send_message(const wyx_proposal_info_t* proposal);      ///< wyx_send_message
  /// Votes in the current phase (wyx_vote). `def_vote_value` is counted for this provider in later phases that it
  /// misses. `proposed_state_value` and `message` may be null.
  virtual wyx_rc_t vote(wyx_vote_value_t vote_value, wyx_vote_value_t def_vote_value,
                        const wyx_state_value_t* proposed_state_value, const wyx_provider_message_t* message);
  virtual wyx_rc_t change_attributes(const wyx_proposal_info_t* proposal);  ///< wyx_change_attributes

  // Convenience forms. A time limit is in seconds, 0: none. A request record must not be null.

  wyx_rc_t changeStateValue(const wyx_state_change_request_t* request);
  wyx_rc_t changeStateValue(const wyx_state_value_t& new_val, wyx_num_phases_t num_phases,
                            wyx_time_limit_t time_limit);
  /// An empty value is proposed as one of length 0.
  wyx_rc_t changeStateValue(const GSStateValue& new_val, wyx_num_phases_t num_phases, wyx_time_limit_t time_limit);
  wyx_rc_t leaveGroup(const wyx_leave_request_t* request);
  wyx_rc_t leaveGroup(unsigned int leave_code, wyx_num_phases_t num_phases, wyx_time_limit_t time_limit);
  wyx_rc_t expelMembers(const wyx_expel_request_t* request);
  wyx_rc_t send_message(const wyx_message_request_t* request);
  wyx_rc_t send_message(const wyx_provider_message_t& message, wyx_num_phases_t num_phases,
                        wyx_time_limit_t time_limit);
  wyx_rc_t change_attributes(const wyx_attribute_change_request_t* request);
  wyx_rc_t change_attributes(const wyx_group_attributes_t& attr, wyx_num_phases_t num_phases,
                             wyx_time_limit_t time_limit);

  /// The id in the group; all ones until a join has been approved. No lock.
  wyx_provider_t getId();
  short getInstanceNumber();               ///< no lock
  void setInstanceNumber(short instance);  ///< for the next join; no lock
  const char* getLocalName();              ///< the provider's own copy; no lock

  /// Copies the attributes for the next join, names included (write lock). Ignored for null. The record's size,
  /// version and default vote of merges are not taken.
  void setGroupAttributes(const wyx_group_attributes_t* attributes);
  /// Copies the attributes out (read lock). Ignored for null. The names in the copy are the provider's and valid
  /// until its attributes change.
  void getGroupAttributes(wyx_group_attributes_t* attributes);

 private:
  friend class GSController;
  friend class GSDelivery;

  void setId(const wyx_provider_t& id);
  void setDefaultAttributes(const char* gname);

  void* _provData;
};

}  // namespace zelt_gscl_V1

#endif
