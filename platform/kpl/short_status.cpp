// The subsystem's side: asking the master for short status.
#include <errno.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <new>
#include <vector>

#include "kpl.h"
#include "local_socket.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr std::chrono::seconds kPatience{5};
constexpr size_t kMaxLines = 10000;  ///< an answer of more is not believed
constexpr size_t kMaxPacket = sizeof(kplhdr) + 80 * sizeof(statcode);

/// The lines of a thread's query that kplstat has still to hand out.
struct Query {
  std::vector<statcode> lines;
  size_t next = 0;

  void forget() {
    lines = {};
    next = 0;
  }
};

thread_local Query query;

/// The question as it travels: a request without its type word, and the process id as extra data.
struct Question {
  kplhdr header;
  subreq request;
  int32_t pid;
};
static_assert(sizeof(Question) == 160);

/// What is left of the time for a call that waits; false: nothing.
bool set_patience(int fd, int option, Clock::time_point deadline) {
  const auto left = std::chrono::ceil<std::chrono::microseconds>(deadline - Clock::now()).count();
  const timeval patience = {left / 1000000, left % 1000000};
  return left > 0 && setsockopt(fd, SOL_SOCKET, option, &patience, sizeof patience) == 0;
}

/// An interrupted call is made again; one whose time is over says so.
template <class Call>
ssize_t in_time(int fd, int option, Clock::time_point deadline, Call call) {
  for (;;) {
    if (!set_patience(fd, option, deadline)) return -ETIMEDOUT;
    const ssize_t result = call();
    if (result >= 0) return result;
    if (errno != EINTR && errno != EAGAIN) return -errno;
  }
}

/// Whether root or this process's own user answers there: anybody may take the address of a master that is gone.
bool is_trusted(int fd) {
  ucred peer;
  socklen_t length = sizeof peer;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) return false;
  return peer.uid == 0 || peer.uid == geteuid();
}

/// Connects to the master and asks; returns an error number.
int ask(const char* subsystem, pid_t pid, Clock::time_point deadline, platform::Descriptor* socket) {
  sockaddr_un master;
  const char* place = getenv(KPL_MASTER_ENV);
  if (!kpl::address_from_text(place != nullptr ? place : KPL_MASTER_DEFAULT, &master)) return EINVAL;
  *socket = kpl::open_local_socket(SOCK_SEQPACKET);
  if (!*socket) return errno;
  const int fd = socket->get();
  const auto* to = reinterpret_cast<const sockaddr*>(&master);
  const ssize_t connected =
      in_time(fd, SO_SNDTIMEO, deadline, [&] { return connect(fd, to, kpl::address_length(master)); });
  if (connected < 0) return static_cast<int>(-connected);
  if (!is_trusted(fd)) return EPERM;

  Question question = {};
  question.header.dversion = KPL_VERSION;
  question.request.object = KPL_OBJECT_SUBSYSTEM;
  question.request.action = KPL_ACTION_STATUS;
  strncpy(question.request.objname, subsystem, sizeof question.request.objname - 1);
  question.pid = pid;
  const ssize_t sent =
      in_time(fd, SO_SNDTIMEO, deadline, [&] { return send(fd, &question, sizeof question, MSG_NOSIGNAL); });
  return sent < 0 ? static_cast<int>(-sent) : 0;
}

/// Receives one packet of the answer; returns its length, or the negative of an error number.
ssize_t receive(int fd, Clock::time_point deadline, char* packet) {
  const ssize_t got = in_time(fd, SO_RCVTIMEO, deadline, [&] { return recv(fd, packet, kMaxPacket, MSG_TRUNC); });
  if (got == 0) return -ECONNRESET;
  return got > static_cast<ssize_t>(kMaxPacket) ? -EBADMSG : got;
}

int add_lines(const char* packet, size_t length) {
  const size_t bytes = length - sizeof(kplhdr);
  const size_t count = bytes / sizeof(statcode);
  if (bytes % sizeof(statcode) != 0 || query.lines.size() + count > kMaxLines) return EBADMSG;
  const size_t had = query.lines.size();
  query.lines.resize(had + count);
  if (count != 0) memcpy(&query.lines[had], packet + sizeof(kplhdr), bytes);
  return 0;
}

/// Collects the answer. Returns an error number; *rtncode becomes the master's result.
int collect(int fd, Clock::time_point deadline, short* rtncode) {
  char packet[kMaxPacket];
  for (;;) {
    const ssize_t got = receive(fd, deadline, packet);
    if (got < 0) return static_cast<int>(-got);
    if (got < static_cast<ssize_t>(sizeof(kplhdr))) return EBADMSG;
    kplhdr header;
    memcpy(&header, packet, sizeof header);
    if (header.cont == KPL_CONT_STATUS) {
      if (const int error = add_lines(packet, got); error != 0) return error;
    }
    if (header.cont != KPL_CONT_END) continue;
    if (got < static_cast<ssize_t>(sizeof header + sizeof *rtncode)) return EBADMSG;
    memcpy(rtncode, packet + sizeof header, sizeof *rtncode);
    return 0;
  }
}

int fail(int error) {
  query.forget();
  errno = error;
  return -1;
}

void hand_out(size_t room, short* reply_len, char* reply, int* cont) {
  const size_t count = std::min(room, query.lines.size() - query.next);
  memset(reply, 0, sizeof(kplhdr));
  if (count != 0) memcpy(reply + sizeof(kplhdr), &query.lines[query.next], count * sizeof(statcode));
  query.next += count;
  *reply_len = static_cast<short>(sizeof(kplhdr) + count * sizeof(statcode));
  *cont = query.next == query.lines.size() ? KPL_CONT_END : KPL_CONT_STATUS;
  if (*cont == KPL_CONT_END) query.forget();
}

}  // namespace

int kplstat(char* host, char* subsystem, pid_t pid, short* reply_len, char* reply, int* cont) try {
  if (host != nullptr && *host != '\0') return fail(EINVAL);
  if (*reply_len < static_cast<int>(sizeof(statrep))) return fail(EINVAL);
  const size_t room = (*reply_len - sizeof(kplhdr)) / sizeof(statcode);
  if (*cont == KPL_CONT_FIRST) {
    query.forget();
    platform::Descriptor socket;
    short rtncode = KPL_RC_OK;
    const auto deadline = Clock::now() + kPatience;
    int error = ask(subsystem != nullptr ? subsystem : "", pid, deadline, &socket);
    if (error == 0) error = collect(socket.get(), deadline, &rtncode);
    if (error != 0) return fail(error);
    if (rtncode != KPL_RC_OK) {
      query.forget();
      return rtncode;
    }
  } else if (query.lines.empty()) {
    return fail(EINVAL);
  }
  hand_out(room, reply_len, reply, cont);
  return 0;
} catch (const std::bad_alloc&) {
  return fail(ENOMEM);
}
