// Free helpers of every layer: printable names of codes, membership records, buffers per thread, time-outs.
//
// All functions may be called from any thread; none takes a lock or stands on an operation of the base API.
// What zelt_gscl_V1 repeats forwards to zelt_gscl and adds nothing.
#ifndef GSCL_GSUTILS_H
#define GSCL_GSUTILS_H

#include <pthread.h>
#include <time.h>

#include "gscl/GSString.h"
#include "gscl/GSTypes.h"
#include "gscl/export.h"
#include "gscl/wyx_api.h"

namespace zelt_gscl {

/// The platform's thread handle.
typedef pthread_t gscl_thread_t;

// Names. Each returns a text that the caller never frees. A value with a name gives a constant text. Any other
// value gives either a constant (as noted) or a text made of the number, in a buffer that belongs to the function
// and to the calling thread: it stays as it is until this thread asks the same function for another value without
// a name, and ends with the thread. Values are compared whole: a combination of flags has a name only when it is
// listed.

/// As trace lines have it: else "rc_code[%d]"; codes from 23 on have no name.
ZN_GSCL_EXPORT const char* gscl_rc_name(wyx_rc_t rc);
/// All codes have their name; else "rc_code[%d]".
ZN_GSCL_EXPORT const char* gscl_return_code_name(wyx_rc_t rc);
/// -1 is "empty-notification"; else "notification-type[%d]".
ZN_GSCL_EXPORT const char* gscl_notification_type_name(wyx_notification_type_t type);
/// -1 is "empty-request"; else "request-type[%d]".
ZN_GSCL_EXPORT const char* gscl_request_type_name(wyx_request_t type);
/// One table under three names. 0 is the empty text; else "summary-code[0x%x]".
ZN_GSCL_EXPORT const char* gscl_summary_a_code_name(wyx_summary_code_t code);
ZN_GSCL_EXPORT const char* gscl_summary_code_name(wyx_summary_code_t code);
ZN_GSCL_EXPORT const char* gscl_summary_code_names(wyx_summary_code_t code);
/// One table under three names. Else "subscription_type[0x%x]".
ZN_GSCL_EXPORT const char* gscl_subscription_a_type_name(wyx_subscription_type_t type);
ZN_GSCL_EXPORT const char* gscl_subscription_type_name(wyx_subscription_type_t type);
ZN_GSCL_EXPORT const char* gscl_subscription_type_names(wyx_subscription_type_t type);
/// Else "subscribe_ctrl[0x%x]".
ZN_GSCL_EXPORT const char* gscl_subscription_ctrl_name(wyx_subscription_ctrl_t control);
/// Else the constant "UNKNWON_VOTE", spelled so.
ZN_GSCL_EXPORT const char* gscl_vote_value_name(wyx_vote_value_t vote);
/// Else the constant "UNKNOWN_PHASE".
ZN_GSCL_EXPORT const char* gscl_num_phase_name(wyx_num_phases_t phases);
/// Else the constant "GS_UNKNCLIENT".
ZN_GSCL_EXPORT const char* gscl_GSClientTypeName(GSClientType type);
/// Else "client-state[%d]".
ZN_GSCL_EXPORT const char* gscl_GSClientStateName(GSClientState state);
/// 0, 1 and 2 print as GS_PROTOCOL_NOT_REQUESTED, GS_NOTIFICATION_PENDING and GS_NOTIFICATION_RECEIVED; else
/// "WaitForRC[%d]".
ZN_GSCL_EXPORT const char* gscl_GSWaitForRCName(GSWaitForRC rc);

// Membership records. The record and its ids stay the caller's; a record that others change meanwhile needs their
// lock.

/// The index of the first provider equal to `id`, -1 when there is none or the record is null.
ZN_GSCL_EXPORT int gscl_find_membership(const wyx_membership_t* mbrship, const wyx_provider_t& id);
/// A new record with copies of the ids, an empty one for null. The caller owns it: gscl_delete_membership, then
/// delete. Throws when there is no memory.
ZN_GSCL_EXPORT wyx_membership_t* gscl_clone_membership(const wyx_membership_t* mbrship);
/// Frees the record's array of ids, made with array new, and leaves the record empty. The record itself is not
/// freed. Null is allowed.
ZN_GSCL_EXPORT void gscl_delete_membership(wyx_membership_t* mbrship);

// Buffers per thread, numbered from 0. They are freed when their thread ends.

/// Sets how many buffers each thread may have and creates the key for them. To be called once in a process, before
/// any thread uses a buffer. Returns 1, or 0 when no key could be had or max_entries is negative; then nothing
/// changes. A second call starts anew: buffers from before stay valid until their thread ends but are no longer
/// found.
ZN_GSCL_EXPORT int gscl_thr_specific_init_buffer(int max_entries);
/// The calling thread's buffer `idx`, at least `size` bytes; its contents are kept when it grows, and it never
/// shrinks. Size 0 frees it and gives null. Null also when there is no such buffer (idx too large, or no
/// initialisation) or no memory; a buffer from before is kept then. The library owns it.
ZN_GSCL_EXPORT char* gscl_thr_specific_realloc_buffer(unsigned int idx, unsigned int size);
/// Frees the calling thread's buffer `idx`. Returns 0, or -1 when idx is not below the number of buffers.
ZN_GSCL_EXPORT int gscl_thr_specific_free_buffer(unsigned int idx);
/// What the thread library runs at the end of a thread that used buffers; not for applications.
ZN_GSCL_EXPORT void gscl_thr_buf_cleanup(void* area);

/// The calling thread's handle.
ZN_GSCL_EXPORT gscl_thread_t gscl_thread_self();

/// Turns a relative time-out into the absolute wall-clock time that the timed waits take. Returns `abstime`, or
/// null for secs -1: no limit, and *abstime is 4294967295 s then. Any usecs is allowed, also negative or over a
/// second: the nanoseconds come out between 0 and 999999999.
ZN_GSCL_EXPORT timespec* GSGetAbsTime(timespec* abstime, int secs, int usecs);

}  // namespace zelt_gscl

namespace zelt_gscl_V1 {

class GSClient;

ZN_GSCL_EXPORT const char* gscl_rc_name(wyx_rc_t rc);
ZN_GSCL_EXPORT const char* gscl_notification_type_name(wyx_notification_type_t type);
ZN_GSCL_EXPORT const char* gscl_request_type_name(wyx_request_t type);
ZN_GSCL_EXPORT const char* gscl_summary_a_code_name(wyx_summary_code_t code);
ZN_GSCL_EXPORT const char* gscl_summary_code_name(wyx_summary_code_t code);
ZN_GSCL_EXPORT const char* gscl_summary_code_names(wyx_summary_code_t code);
ZN_GSCL_EXPORT const char* gscl_subscription_a_type_name(wyx_subscription_type_t type);
ZN_GSCL_EXPORT const char* gscl_subscription_type_name(wyx_subscription_type_t type);
ZN_GSCL_EXPORT const char* gscl_subscription_type_names(wyx_subscription_type_t type);
ZN_GSCL_EXPORT const char* gscl_subscription_ctrl_name(wyx_subscription_ctrl_t control);
ZN_GSCL_EXPORT const char* gscl_vote_value_name(wyx_vote_value_t vote);
ZN_GSCL_EXPORT const char* gscl_num_phase_name(wyx_num_phases_t phases);
ZN_GSCL_EXPORT const char* gscl_GSClientTypeName(GSClientType type);
ZN_GSCL_EXPORT const char* gscl_GSClientStateName(GSClientState state);
ZN_GSCL_EXPORT const char* gscl_GSWaitForRCName(GSWaitForRC rc);
ZN_GSCL_EXPORT int gscl_find_membership(const wyx_membership_t* mbrship, const wyx_provider_t& id);
ZN_GSCL_EXPORT wyx_membership_t* gscl_clone_membership(const wyx_membership_t* mbrship);
ZN_GSCL_EXPORT void gscl_delete_membership(wyx_membership_t* mbrship);
ZN_GSCL_EXPORT timespec* GSGetAbsTime(timespec* abstime, int secs, int usecs);

/// How trace lines name a client: "Prov[<group>,Id=<instance>/<node>,T=<token>]" or "Subs[G=<group>,T=<token>]",
/// as it stands now. Allocates; build it only for a line that will be written.
ZN_GSCL_EXPORT GSString getTraceIdStr(GSClient* client);

}  // namespace zelt_gscl_V1

#endif
