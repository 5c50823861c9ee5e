// The KPL service controller's interface for the subsystems that it starts: records on the wire, and the calls
// with which a subsystem answers requests and asks the master for its short status.
//
// How a request travels. The master (kplmstr) hands each subsystem one request channel: a datagram socket on
// descriptor 0, or a System V message queue. A request is a `kplreq`: on the socket the bytes from `kplreq.kplhdr`
// on (156 of them, then extra data), on the queue the type word first. Whoever asks, the master itself or a
// command for which it forwards, waits on a local datagram socket and names it in the header as the return
// address. The subsystem answers straight to that address, with any number of interim packets and one last one.
// The master keeps the address until the subsystem has answered or ended, so that nobody else gets what comes
// late. A process that has got another parent since it read the request has lost its master, and answers nobody.
//
// The return address (`kplhdr.retaddr`) is a local-socket address that needs no length beside it:
//   - `sun_family` is AF_UNIX; any other value means that no answer is wanted;
//   - an abstract name: a NUL in `sun_path[0]`, then the name up to the next NUL or the end of the array. Abstract
//     names that hold a NUL cannot be used; the names that the kernel chooses (binding with the family alone) can.
//   - a NUL in the first two bytes: no address, no answer wanted.
//   - a path is not answered: whoever may write in its folders could lead the answer elsewhere.
// `retaddr` is trusted as the request channel is: who may write into that channel is the master's business.
//
// Reply packets, each one datagram that begins with a `kplhdr`. Its `retaddr` and `dversion` are the request's,
// and `cont` tells what follows:
//   KPL_CONT_END     a `kplrep`, the last packet: `rtncode` is the result, `rtnmsg` its text. The datagram ends
//                    behind the text's NUL, so it may be shorter than the record.
//   KPL_CONT_MESSAGE a `kplrep` whose `rtnmsg` is text for the requester; more follows
//   KPL_CONT_STATUS  a `statrep`: the datagram's length tells how many `statcode` records; more follows
//
// All calls have C linkage, throw nothing and take no lock; each thread serves and asks on its own.
#ifndef KPL_H
#define KPL_H

#include <stddef.h>
#include <sys/types.h>
#include <sys/un.h>

#ifdef __cplusplus
extern "C" {
#endif

/// The version word of records made by this release.
#define KPL_VERSION 1

/// Where the master answers kplstat: the path in this environment variable (a leading '@' stands for the NUL of an
/// abstract name), which the master sets for every subsystem; without it, the default path.
#define KPL_MASTER_ENV "KPL_MASTER_SOCKET"
#define KPL_MASTER_DEFAULT "/run/kplmstr/status"

enum {
  KPL_OBJECT_SUBSYSTEM = 17  ///< `subreq.object`: a subsystem, the only object that subsystems serve
};

/// `subreq.action`
enum {
  KPL_ACTION_PING = 0,        ///< asks for nothing: whatever the answer, the subsystem serves its requests
  KPL_ACTION_STOP = 1,        ///< `parm1`: 0 normal, 1 forced
  KPL_ACTION_STATUS = 2,      ///< `parm1`: 0 short (answered by the master), 1 long
  KPL_ACTION_TRACE = 4,       ///< `parm2`: 1 on, 0 off; `parm1`: 1 long trace
  KPL_ACTION_REFRESH = 5,     ///< reads the configuration again
  KPL_ACTION_SUBSYSTEM = 256  ///< this and above: the subsystem's own requests, with extra data
};

/// `svrreply.rtncode`
enum {
  KPL_RC_OK = 0,
  KPL_RC_ERROR = -1,            ///< the subsystem reported an error; `rtnmsg` is its text
  KPL_RC_BAD_REQUEST = -9087,   ///< no such action or parameter
  KPL_RC_NOT_SUPPORTED = -9129  ///< this subsystem does not serve it
};

/// `kplhdr.cont` of a reply packet
enum { KPL_CONT_END = 0, KPL_CONT_MESSAGE = 1, KPL_CONT_STATUS = 2, KPL_CONT_FIRST = 3 };

/// Header of requests and replies.
struct kplhdr {
  struct sockaddr_un retaddr;  ///< return address, as above
  char pad[4];
  short dversion;  ///< record version
  short cont;      ///< continuation marker; 0 in a request
};

/// What is asked.
struct subreq {
  short object;
  short action;
  short parm1;
  short parm2;
  char objname[30];  ///< object name; may fill the field without a NUL
};

/// A request. Extra data follows the record.
#pragma pack(push, 4)
struct kplreq {
  long mtype;  ///< message-queue type word; not sent over a socket
  struct kplhdr kplhdr;
  struct subreq subreq;
};
#pragma pack(pop)

/// Body of a reply.
struct svrreply {
  short rtncode;
  short objtype;
  char objtext[65];
  char objname[30];
  char rtnmsg[256];
};

/// A reply, or an interim message.
struct kplrep {
  struct kplhdr kplhdr;
  struct svrreply svrreply;
};

/// One line of status: `objname` is its margin column, `objtext` its body.
struct statcode {
  short objtype;
  short status;
  char objtext[65];
  char objname[30];
};

/// A status packet: as many records as its length says, (length - 118) / 100.
struct statrep {
  struct kplhdr kplhdr;
  struct statcode statcode[1];
};

#ifdef __cplusplus
#define KPL_CHECK(what) static_assert(what, "KPL record layout")
#else
#define KPL_CHECK(what) _Static_assert(what, "KPL record layout")
#endif
KPL_CHECK(sizeof(struct sockaddr_un) == 110);
KPL_CHECK(sizeof(struct kplhdr) == 118);
KPL_CHECK(offsetof(struct kplhdr, dversion) == 114 && offsetof(struct kplhdr, cont) == 116);
KPL_CHECK(sizeof(struct subreq) == 38 && offsetof(struct subreq, objname) == 8);
KPL_CHECK(sizeof(struct kplreq) == 164 && offsetof(struct kplreq, kplhdr) == 8);
KPL_CHECK(offsetof(struct kplreq, subreq) == 126);
KPL_CHECK(sizeof(struct svrreply) == 356 && offsetof(struct svrreply, objtext) == 4);
KPL_CHECK(offsetof(struct svrreply, objname) == 69 && offsetof(struct svrreply, rtnmsg) == 99);
KPL_CHECK(sizeof(struct kplrep) == 474 && offsetof(struct kplrep, svrreply) == 118);
KPL_CHECK(sizeof(struct statcode) == 100 && offsetof(struct statcode, objtext) == 4);
KPL_CHECK(offsetof(struct statcode, objname) == 69);
KPL_CHECK(offsetof(struct statrep, statcode) == 118);
#undef KPL_CHECK

#define KPL_EXPORT __attribute__((visibility("default")))

/// Starts the answer to a request. `request_header` points at the 118 header bytes of the request just received,
/// at any alignment. Returns the header to quote in every reply: the library's copy, good until this thread's next
/// call of kplrrqs. A reply that the thread never ended is given up.
KPL_EXPORT struct kplhdr* kplrrqs(char* request_header);

/// Sends one packet of the answer that `header` (a result of kplrrqs) names: `reply_len` bytes at `reply`,
/// beginning with a `kplhdr` that the caller need not fill and that stays as it is; the library sends its own in
/// its place. `cont` says what the packet is and goes into the header; KPL_CONT_END ends the answer.
///
/// The socket used is opened with the first packet and closed with the last: between requests the library holds no
/// descriptor. Packets arrive in order and none is dropped while the requester reads: the call waits while its
/// queue is full, but 2 seconds in all for one answer; then, or when nobody has the return address (any more), or
/// when the process has got another parent since kplrrqs before the first packet (ECONNREFUSED), the requester
/// counts as gone, and this and all later packets of the answer are dropped at no cost.
///
/// Returns 0 when the packet was handed over, -1 otherwise, with `errno`: EINVAL for a `reply_len` under 118,
/// EDESTADDRREQ without return address or for a path, ETIMEDOUT or the socket's error when the requester is gone.
KPL_EXPORT int kplsrpy(struct kplhdr* header, char* reply, int reply_len, int cont);

/// Asks the master for short status: a heading line, then a line for each subsystem that matches, whose margin
/// column begins with the subsystem's name. `host` names the master's host; null and "" mean this one, the only
/// one served. `subsystem` names a subsystem; when null or "", the one whose process is `pid`.
///
/// A query is a run of calls: `*cont` is KPL_CONT_FIRST at its first, and each call fills `reply` (a `statrep` of
/// at most `*reply_len` bytes, at least 218) with the next records, stores the bytes used in `*reply_len`, and
/// sets `*cont` to KPL_CONT_END with the last records, to KPL_CONT_STATUS before. The first call asks and waits
/// for the whole answer, 5 seconds in all; the others only hand out what came, and free it with the last.
///
/// On the wire it is a connection to the master's SOCK_SEQPACKET socket and one packet in it: a request with
/// KPL_ACTION_STATUS, no return address, `parm1` 0, `objname` the subsystem (at most 29 characters) and, as extra
/// data, `pid` as a 32-bit integer. The answer comes back in the connection: status packets and a last one.
///
/// Returns 0; -1 with `errno` when the master could not be asked (EINVAL for the arguments, ETIMEDOUT, EPERM when
/// who listens there is neither root nor this process's user, EBADMSG for an answer that makes no sense, or the
/// socket's error); otherwise the result code of the master's answer. After a failure the query is over.
KPL_EXPORT int kplstat(char* host, char* subsystem, pid_t pid, short* reply_len, char* reply, int* cont);

#undef KPL_EXPORT

#ifdef __cplusplus
}
#endif

#endif
