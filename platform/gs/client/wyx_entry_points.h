// The entry points of libwyx_r.so, with what this implementation promises.
//
// The client classes reach them through the table of gslib_dli.h; an application may also link the library and
// call them itself. One process has one session, from wyx_setup to wyx_quit.
//
// Threads: any thread may call any entry point at any time, also from inside a callback. A request waits for the
// daemon's answer; requests of several threads are answered one after the other. No entry point is a cancellation
// point but a wyx_dispatch that waits, and it leaves nothing behind when it is cancelled; callbacks run with
// cancellation disabled. errno is left as it was. No signal is raised (but SIGIO on request).
// Errors: an entry point that does not return WYX_OK has changed nothing. WYX_BAD_PARAMETER: a null pointer, a
// length or a value that cannot be; WYX_NAME_TOO_LONG; WYX_NO_INIT: no session, or group services are gone;
// WYX_BAD_MEMBER_TOKEN: not the token of a live client of this session and of the right kind; WYX_NO_MEMORY. The
// other codes are the group's. Ownership: what a request is given is not read after it returns. What a callback is
// given belongs to the library and lives until the callback returns.
//
// A session ends when the daemon dies, says what makes no sense or leaves a request unanswered for
// GSD_REQUEST_LIMIT seconds (see wyx_api.h): requests under way and to come answer WYX_NO_INIT, what had arrived
// before is still handed out, then who was told of quorum is told that there is none, every provider gets the
// announcement WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY and every subscriber WYX_SUBSCRIPTION_GS_HAS_DIED, in the
// order of their tokens. The descriptor stays valid, and is no longer readable, until wyx_quit or the next
// wyx_setup.
//
// A session belongs to the process that opened it; what that means to the child of a fork: wyx_api.h. Descriptors
// are closed on exec.
#ifndef WYX_ENTRY_POINTS_H
#define WYX_ENTRY_POINTS_H

#include <stdint.h>

#include "gscl/wyx_api.h"

#define WYX_ENTRY extern "C" __attribute__((visibility("default")))

/// Opens the session. GSD_ENDPOINT in the environment chooses the daemon: "unix:/path" of its socket, "embedded:"
/// for group services inside this process, with no daemon and for this process alone; without it the default path.
/// `version` is the base API's version that the caller was built for, at least 1. `count` is the number of
/// arguments after it: 7, or 8 with a domain-control routine (wyx_domain_control_cb_t) at the end.
/// `*descriptor` is then readable exactly when wyx_dispatch has something to hand out (half a message may show for
/// a moment); it stays the library's. `socket_control`: WYX_SOCKET_SIGNAL raises SIGIO for each arrival from a
/// daemon; with a domain-control routine WYX_ENABLE_DOMAIN_EVENT has it told of the domain's nodes and master,
/// WYX_ENABLE_OPQUORUM_CALLBACK of quorum, and WYX_ENABLE_OPQUORUM_ACK_REQUIRED beside that one makes these
/// notifications ask for an answer: how it is, once, then each change; what is in them: docs/group-services.md.
/// The other flags change nothing. `responsiveness` as for wyx_change_responsiveness; null: none.
/// `deactivate_path` is accepted and not used. A routine that is null gets nothing; there are no query
/// notifications.
/// WYX_EXISTS: there is a session. Connecting and each step of the greeting wait ten seconds for
/// the daemon. A session whose group services are gone is replaced; clients of it that have
/// not been told yet are told by the first wyx_dispatch. WYX_CONNECT_FAILED: no daemon there.
/// WYX_SOCK_CREATE_FAILED. WYX_BAD_PARAMETER: also for a GSD_ENDPOINT that is none of the above and a
/// GSD_REQUEST_LIMIT that cannot be. Why it failed: wyx_get_ffdc_id.
WYX_ENTRY wyx_rc_t wyx_setup(int version, int count, wyx_descriptor_t* descriptor,
                             wyx_socket_ctrl_t socket_control, const wyx_responsiveness_t* responsiveness,
                             const char* deactivate_path, wyx_responsiveness_cb_t* responsiveness_routine,
                             wyx_delayed_error_cb_t* delayed_error_routine, wyx_query_cb_t* query_routine, ...);

/// Closes the session: its providers fail, its subscriptions end, its descriptor is closed. A callback that is
/// running on another thread runs to its end, and none begins after it; a dispatch that waits returns WYX_NO_INIT.
WYX_ENTRY wyx_rc_t wyx_quit();

/// Hands notifications to their callbacks, in order, on this thread. WYX_NON_BLOCKING: everything that is there
/// (at most 4096, then the descriptor is still readable), then returns WYX_OK. WYX_BLOCKING: the same, but first
/// waits until at least one callback has been called. WYX_NO_INIT: no session, or group services are gone and
/// every client has been told. One thread hands out at a time: while it does, WYX_NON_BLOCKING on another returns
/// at once and WYX_BLOCKING waits. From inside a callback it hands out what follows, nested; the outer callback's
/// records stay as they are. The responsiveness routine is called here, too, and its result answers the daemon's
/// ping.
WYX_ENTRY wyx_rc_t wyx_dispatch(wyx_dispatch_flag_t flag);

/// Only WYX_NO_RESPONSIVENESS and WYX_PING_RESPONSIVENESS are supported, the latter with the modifiers
/// WYX_KEEP_CHECK_RESPONSIVENESS, WYX_ANNOUNCEMENT_WHEN_SLOW and, with a daemon, WYX_CLOSE_CLIENT_SOCKET; other
/// flags: WYX_NOT_SUPPORTED. A ping wants an interval of at least 1 second.
WYX_ENTRY wyx_rc_t wyx_change_responsiveness(const wyx_responsiveness_t* settings);

// Requests. A WYX_OK is followed by notifications, the last an approval, a rejection, a delayed error or the end
// of the session. `*token` is set only with WYX_OK. A source group: WYX_NOT_SUPPORTED.
WYX_ENTRY wyx_rc_t wyx_join(wyx_token_t* token, const wyx_proposal_info_t* request);
WYX_ENTRY wyx_rc_t wyx_change_state_value(wyx_token_t provider, const wyx_proposal_info_t* request);
WYX_ENTRY wyx_rc_t wyx_send_message(wyx_token_t provider, const wyx_proposal_info_t* request);
WYX_ENTRY wyx_rc_t wyx_leave(wyx_token_t provider, const wyx_proposal_info_t* request);
WYX_ENTRY wyx_rc_t wyx_expel(wyx_token_t provider, const wyx_proposal_info_t* request);
WYX_ENTRY wyx_rc_t wyx_change_attributes(wyx_token_t provider, const wyx_proposal_info_t* request);
/// The provider is forgotten at once; the group sees a failure leave.
WYX_ENTRY wyx_rc_t wyx_goodbye(wyx_token_t provider);
/// `proposed_state` and `message` may be null: none.
WYX_ENTRY wyx_rc_t wyx_vote(wyx_token_t provider, wyx_vote_value_t vote, const wyx_state_value_t* proposed_state,
                            const wyx_provider_message_t* message, wyx_vote_value_t default_vote);
WYX_ENTRY wyx_rc_t wyx_subscribe(wyx_token_t* token, const wyx_proposal_info_t* request);
WYX_ENTRY wyx_rc_t wyx_unsubscribe(wyx_token_t subscriber);

// Queries. They need no session; the first two, and that of an address that is not this host's, then ask the
// daemon over a connection of their own. The first two answer WYX_CONNECT_FAILED when there is none.
WYX_ENTRY wyx_rc_t wyx_get_node_number(int* node_number);
WYX_ENTRY wyx_rc_t wyx_get_domain_master_node_number(int* node_number);
WYX_ENTRY wyx_rc_t wyx_get_limits(wyx_limits* limits);
/// The versions of the installed product. `quick_version` packs them, 8 bits each, the version highest.
WYX_ENTRY wyx_rc_t wyx_get_zelt_active_version(wyx_zelt_version_t* version);
WYX_ENTRY wyx_rc_t wyx_get_zelt_installed_version(wyx_zelt_version_t* version);
/// Names the last failure that the library met in this process, in the form that wyx_api.h gives; empty: none.
/// `buffer` has room for 64 characters.
WYX_ENTRY wyx_rc_t wyx_get_ffdc_id(char* buffer);

/// This host's adapter: the first interface that is up and not the loopback, else the loopback. `node_number` is
/// -1 when no daemon can be asked, the member id has all bits set, names that are not known are empty. The names
/// live as long as the process. WYX_NULL_ADAPTER_INFO: `info` is null. WYX_ADAPTER_INFO_NOT_FOUND: no such
/// interface.
WYX_ENTRY wyx_rc_t wyx_get_adapter_info(wyx_adapter_info* info);
/// The adapter with this address (IPv4: a filler of zeros, or IPv6-mapped), of this host or of another one of the
/// domain. WYX_BAD_INPUT_IP_FORMAT: null, or no address that an interface can have.
WYX_ENTRY wyx_rc_t wyx_get_adapter_info_by_addr(const wyx_ip_addr* address, wyx_adapter_info* info);
/// The adapter of a provider's host, chosen as this host's, but never a loopback of another; `token` is any
/// provider of this session. WYX_ADAPTER_INFO_NOT_FOUND: the host is not in the domain, or none of it is known.
WYX_ENTRY wyx_rc_t wyx_get_adapter_info_by_id(wyx_token_t token, const wyx_provider_t* provider,
                                              wyx_adapter_info* info);
/// The IPv4 address of the same. WYX_NO_IPV4_ADDRESS_FOR_THE_ID: none is known.
WYX_ENTRY wyx_rc_t wyx_get_ipaddr_by_id(wyx_token_t token, const wyx_provider_t* provider, wyx_ip_addr* address);

// Not supported: each answers WYX_NOT_SUPPORTED, whatever it is given.
WYX_ENTRY wyx_rc_t wyx_dissolve_domain(const wyx_domain_spec_t* domain);
WYX_ENTRY wyx_rc_t wyx_dissolve_site(const wyx_site_spec_t* site, wyx_site_dissolve_action_t action);
WYX_ENTRY wyx_rc_t wyx_dissolve_subcluster(const wyx_subcluster_dissolution_info_t* info);
WYX_ENTRY wyx_rc_t wyx_migrate_to_pell_prep();
WYX_ENTRY wyx_rc_t wyx_migrate_to_pell_commit();
WYX_ENTRY wyx_rc_t wyx_migrate_to_pell_abort();
WYX_ENTRY wyx_rc_t wyx_migrate_vote(wyx_migration_vote_t vote);

/// With WYX_PRIV_MSG_OPQUORUM: answers the quorum notification whose sequence is in `data`, a wyx_quorum_resp_t of
/// `length` bytes. Refused: WYX_BAD_QUORUM_MSG_SEQNUM, another one waits for its answer;
/// WYX_UNEXPECTED_QUORUM_RESP, none does; WYX_NOT_REGISTERED_FOR_SYNC_QUORUM, the session has not asked for such.
/// A session that is told of quorum gets the refusal also as WYX_DOMAINCB_RESP_ERR_INFO. Nothing waits for an
/// answer. Other messages: WYX_NOT_SUPPORTED.
WYX_ENTRY wyx_rc_t wyx_internal_send_domain_msg_to_gsd(wyx_priv_channel_msg_type_t type, void* data,
                                                       uint64_t length);

#endif
