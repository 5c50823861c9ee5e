// The controller: the one object per process through which every provider and subscriber talks to the
// group-services daemon, in its three versions.
//
// Used in: examples/member.cpp, examples/watcher.cpp.
#ifndef GSCL_GSCONTROLLER_H
#define GSCL_GSCONTROLLER_H

#include "gscl/GSObject.h"
#include "gscl/GSTypes.h"
#include "gscl/export.h"
#include "gscl/wyx_api.h"

namespace zelt_gscl_V1 {

class GSClient;
class GSProvider;
class GSSubscriber;
class GSDelivery;
class GSRequest;
struct GSxControllerData;

/// Opens and closes the session with the daemon, keeps the registry of the process's clients, issues their
/// requests and, inside dispatch(), routes the daemon's notifications to them.
///
/// Life: construct one (the newest is the current one, see theController()), set options, initialize(), let a
/// thread call dispatch() whenever getGSDescriptor() is readable, quit(), destroy. Construct it before the
/// clients: a client registers itself with the controller that is current when the client is constructed, and one
/// that was built without any never receives a notification. Destroying a controller, current or not, leaves no
/// current controller; an open session is quit first; clients that still live stay valid objects that nothing is
/// routed to.
///
///   constructed --initialize() WYX_OK--> session open --quit()--> constructed
///
/// Threads: every operation may be called from any thread. While a controller is destroyed no thread may be inside
/// dispatch() or any other operation of it or of a client. The controller's lock is taken before a client's, never
/// the reverse. A client's destructor takes the lock of each controller: destroy none while holding one.
///
/// Forks: the session stays the parent's. In the child every operation is answered as without a session, quit()
/// and the destructors of controller and clients reach nothing of the parent's, and initialize() opens a session
/// of the child's own. Locks that other threads held at the fork stay held in the child: fork while no other
/// thread is inside a controller or client, or let the child do no more than exec or _exit.
///
/// Callbacks (the virtual functions below and those of the clients) run on the thread that called dispatch(),
/// inside it, with no lock of the library held: they may issue requests, call dispatch() again, construct clients
/// and destroy them, the one that the callback belongs to included. They must not wait for notifications, nor for
/// a thread that destroys the client that they belong to. What a callback throws goes on out of dispatch(), after
/// the notification has been reported to waiting threads.
///
/// Errors: results are the base API's, passed on unchanged. WYX_NOT_SUPPORTED also stands for an operation that
/// the base API library does not have. Fatal: the base API library or the product version cannot be had; the
/// process aborts with a message on standard error.
///
/// Cancellation: dispatch(WYX_BLOCKING) is a cancellation point while it waits, and leaves nothing behind; the
/// base API library runs the callbacks with cancellation disabled. initialize(), quit(), a change of
/// responsiveness, a client's request and a destructor are none: a cancelled thread finishes them first.
class ZN_GSCL_EXPORT GSController : public GSLockableObject {
 public:
  /// Becomes the current controller, whichever was current before, and reads the installed product version.
  GSController();

  /// Quits the session when it is open (not through an override of quit()), forgets the registry, leaves no
  /// current controller. Neither touches nor destroys the clients. Like quit() it does not wake threads that wait.
  virtual ~GSController();

  GSController(const GSController&) = delete;
  GSController& operator=(const GSController&) = delete;

  /// Opens the session (wyx_setup) with the options as they are; the base API's result. The options are read
  /// without the lock: set them before. On WYX_OK getGSDescriptor() is the session's, otherwise nothing changes.
  virtual wyx_rc_t initialize();

  /// Closes the session (wyx_quit), also when none is open, and sets the descriptor to -1 whatever the result,
  /// which is the base API's. Takes the write lock after the call. Clients keep their state and are told nothing;
  /// wakes no thread that waits for a notification: see GSClient::waitForNotification.
  virtual wyx_rc_t quit();

  /// The daemon asks whether the process is alive. The answer goes back to it; here WYX_CALLBACK_OK.
  virtual wyx_callback_rc_t responsivenessCb(const wyx_responsiveness_notification_t* notification);

  /// The answer to a query. Does nothing here. The record lives only during the call.
  virtual void queryCb(const wyx_query_notification_t* notification);

  /// Delivers the notifications that are there (WYX_NON_BLOCKING) or waits for some first (WYX_BLOCKING), by
  /// calling the callbacks on this thread (wyx_dispatch). The base API's result. Takes no lock of the controller;
  /// the routing does: called inside a signal handler it deadlocks with what the signal has interrupted.
  virtual wyx_rc_t dispatch(wyx_dispatch_flag_t flag);

  /// The controller constructed last, null when one has been destroyed since. Takes no lock.
  static GSController* theController();

  /// The session's descriptor, for the application's poll loop; -1: no session. The base API owns it. No lock.
  wyx_descriptor_t getGSDescriptor();

  // Options of the session. They take effect at the next initialize(). Getters take the read lock, setters the
  // write lock; a null record is ignored.

  wyx_socket_ctrl_t getSocketOption();
  void setSocketOption(wyx_socket_ctrl_t option);
  void getResponsiveness(wyx_responsiveness_t* responsiveness);
  void setResponsiveness(wyx_responsiveness_t* responsiveness);
  /// The path of the deactivate script; null until it is set. The controller's, valid until it is set again.
  const char* getDeactivatePath();
  /// Copies the path; null unsets it.
  void setDeactivatePath(const char* path);

  // Queries. Each calls one entry point of the base API with the arguments as they are, null pointers included,
  // and returns its result. No controller and no session is needed for calling; no lock is taken; any thread. The
  // caller owns what is filled.

  static wyx_rc_t getLimits(wyx_limits* limits);                ///< wyx_get_limits
  static wyx_rc_t get_node_number(int* node);                   ///< wyx_get_node_number
  static wyx_rc_t get_domain_master_node_number(int* node);     ///< wyx_get_domain_master_node_number
  static wyx_rc_t get_adapter_info(wyx_adapter_info* adapter);  ///< wyx_get_adapter_info
  static wyx_rc_t get_adapter_info_by_addr(const wyx_ip_addr* address,
                                           wyx_adapter_info* adapter);  ///< wyx_get_adapter_info_by_addr
  static wyx_rc_t get_adapter_info_by_id(int provider_token, const wyx_provider_t* id,
                                         wyx_adapter_info* adapter);  ///< wyx_get_adapter_info_by_id
  static wyx_rc_t get_ipaddr_by_id(int provider_token, const wyx_provider_t* id,
                                   wyx_ip_addr* address);                   ///< wyx_get_ipaddr_by_id
  static wyx_rc_t get_ffdc_id(char* id);                                    ///< wyx_get_ffdc_id
  static wyx_rc_t get_zelt_active_version(wyx_zelt_version_t* version);     ///< wyx_get_zelt_active_version
  static wyx_rc_t get_zelt_installed_version(wyx_zelt_version_t* version);  ///< wyx_get_zelt_installed_version
  static wyx_rc_t pell_migrate_prep();                                      ///< wyx_migrate_to_pell_prep
  static wyx_rc_t pell_migrate_commit();                                    ///< wyx_migrate_to_pell_commit
  static wyx_rc_t pell_migrate_abort();                                     ///< wyx_migrate_to_pell_abort
  static wyx_rc_t pell_migrate_vote(wyx_migration_vote_t vote);             ///< wyx_migrate_vote

  // Routing functions. A join or subscribe request and wyx_setup carry their addresses; the base API calls them on
  // the dispatching thread. Each finds the client by the record's token, updates the client's state, membership
  // and state values, then calls the client's callback and reports the notification to waiting threads. A
  // notification for no client, or while there is no controller, is dropped with a trace line. Everything is
  // copied that is kept.

  static void stub_nPhaseCb(const wyx_n_phase_notification_t* notification);
  static void stub_approvedCb(const wyx_approved_notification_t* notification);
  static void stub_rejectedCb(const wyx_rejected_notification_t* notification);
  static void stub_announcementCb(const wyx_announcement_notification_t* notification);
  static void stub_mergeCb(const wyx_merge_notification_t* notification);
  static void stub_subscribeCb(const wyx_subscription_notification_t* notification);
  static void stub_delayedErrorCb(const wyx_delayed_error_notification_t* notification);

 private:
  friend class GSClient;
  friend class GSProvider;
  friend class GSSubscriber;
  friend class GSDelivery;

  // Registry; not owning. Guarded by the controller's lock.
  int addClient(GSClient* client);          // 1
  int removeClient(GSClient* client);       // 1 removed, 0 not registered, -1 null
  GSClient* findClient(wyx_token_t token);  // idle clients are never found; null: none
  GSProvider* findProvider(wyx_token_t token);
  GSSubscriber* findSubscriber(wyx_token_t token);

  // Requests. The base API's result, or WYX_BAD_MEMBER_TOKEN when the client's state refuses the request.
  static wyx_rc_t stub_join_group(GSProvider* provider, const wyx_proposal_info_t* proposal);
  static wyx_rc_t stub_subscribe_group(GSSubscriber* subscriber, const wyx_proposal_info_t* proposal);
  static wyx_rc_t stub_unsubscribe_group(GSSubscriber* subscriber);
  static wyx_rc_t stub_change_state_value(GSProvider* provider, const wyx_proposal_info_t* proposal);
  static wyx_rc_t stub_send_message(GSProvider* provider, const wyx_proposal_info_t* proposal);
  static wyx_rc_t stub_leave(GSProvider* provider, const wyx_proposal_info_t* proposal);
  static wyx_rc_t stub_expel(GSProvider* provider, const wyx_proposal_info_t* proposal);
  static wyx_rc_t stub_change_attributes(GSProvider* provider, const wyx_proposal_info_t* proposal);
  static wyx_rc_t stub_vote(GSProvider* provider, wyx_vote_value_t vote, const wyx_state_value_t* proposed,
                            const wyx_provider_message_t* message, wyx_vote_value_t default_vote);
  static wyx_rc_t stub_goodbye_group(GSProvider* provider);

  GSxControllerData* _ctrlData;
};

}  // namespace zelt_gscl_V1

namespace zelt_gscl_V2 {

/// The first version, told which interface its caller was built for.
class ZN_GSCL_EXPORT GSController : public zelt_gscl_V1::GSController {
 public:
  /// The low 16 bits of `version` are the base API version that every later wyx_setup of the process is given,
  /// also after this controller is gone; the high 16 bits are the client library version and change nothing.
  /// 0x0003001C stands for the defaults.
  explicit GSController(unsigned int version);
  virtual ~GSController();
};

}  // namespace zelt_gscl_V2

namespace zelt_gscl_V3 {

/// The second version with the operations that act on the whole domain. Each passes its arguments to one entry
/// point of the base API and returns its result; they need no session of their own, take no lock and keep nothing.
class ZN_GSCL_EXPORT GSController : public zelt_gscl_V2::GSController {
 public:
  /// As the second version; `version` is passed on to it.
  explicit GSController(unsigned int version);
  virtual ~GSController();

  /// wyx_change_responsiveness. When it answers WYX_OK, the record becomes the current controller's option too, so
  /// that a later initialize() opens the session with it (write lock).
  virtual wyx_rc_t changeResponsiveness(const wyx_responsiveness_t* responsiveness);

  /// wyx_dissolve_domain.
  virtual wyx_rc_t dissolveDomain(const wyx_domain_spec_t* domain);

  /// A domain event; does nothing here. Arrives only where the installed product is 2.3.0.10 or later and the
  /// socket option asks for it. The record lives only during the call. Controllers of older versions have no such
  /// callback: while one of them is current the event is dropped with a trace line.
  virtual void domainControlCb(const wyx_domain_control_notification_t* notification);

  /// wyx_dissolve_site.
  wyx_rc_t dissolveSite(const wyx_site_spec_t* site, wyx_site_dissolve_action_t action);

  /// wyx_dissolve_subcluster.
  wyx_rc_t dissolveSubcluster(const wyx_subcluster_dissolution_info_t* subcluster);

  /// wyx_internal_send_domain_msg_to_gsd; `length` in bytes.
  wyx_rc_t sendDomainMsgToGSD(wyx_priv_channel_msg_type_t type, void* data, unsigned long length);

  /// The pointer that the first version's function returns, as one to this version: null only when there is no
  /// current controller. Where the current one may have been constructed as an older version, use nothing through
  /// it that this class adds virtually.
  static GSController* theController();
};

}  // namespace zelt_gscl_V3

// What the base API calls for the process as a whole; each passes the record to the current controller. With no
// controller the record is dropped with a trace line, and the process is reported as responsive.
ZN_GSCL_EXPORT wyx_callback_rc_t stub_responsivenessCb(const wyx_responsiveness_notification_t* notification);
ZN_GSCL_EXPORT void stub_queryCb(const wyx_query_notification_t* notification);
ZN_GSCL_EXPORT void stub_domain_controlCb(const wyx_domain_control_notification_t* notification);

// The domain operations without an object; see zelt_gscl_V3::GSController.
ZN_GSCL_EXPORT wyx_rc_t stub_dissolve_domain(const wyx_domain_spec_t* domain);
ZN_GSCL_EXPORT wyx_rc_t stub_dissolve_site(const wyx_site_spec_t* site, wyx_site_dissolve_action_t action);
ZN_GSCL_EXPORT wyx_rc_t stub_dissolve_subcluster(const wyx_subcluster_dissolution_info_t* subcluster);
ZN_GSCL_EXPORT wyx_rc_t stub_send_domain_msg_to_gsd(wyx_priv_channel_msg_type_t type, void* data,
                                                    unsigned long length);
ZN_GSCL_EXPORT wyx_rc_t stub_change_responsiveness(const wyx_responsiveness_t* responsiveness);

#endif
