// The subsystem's side: asking the master for short status.
#include <errno.h>
#include <poll.h>
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

/// Sends the question, which waits while the master's queue is full; returns an error number.
int send_question(int fd, const Question& question, const sockaddr_un& master, Clock::time_point deadline) {
  const auto* to = reinterpret_cast<const sockaddr*>(&master);
  for (;;) {
    const auto left = std::chrono::ceil<std::chrono::microseconds>(deadline - Clock::now()).count();
    if (left <= 0) return ETIMEDOUT;
    const timeval patience = {left / 1000000, left % 1000000};
    if (setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience) != 0) return errno;
    if (sendto(fd, &question, sizeof question, MSG_NOSIGNAL, to, kpl::address_length(master)) >= 0) return 0;
    if (errno != EINTR && errno != EAGAIN) return errno;
  }
}

/// Opens a socket with an address that the kernel chooses and asks from it; returns an error number.
int ask(const char* subsystem, pid_t pid, Clock::time_point deadline, platform::Descriptor* socket) {
  sockaddr_un master;
  const char* place = getenv(KPL_MASTER_ENV);
  if (!kpl::address_from_text(place != nullptr ? place : KPL_MASTER_DEFAULT, &master)) return EINVAL;
  *socket = kpl::open_datagram_socket();
  if (!*socket) return errno;

  const int on = 1;
  if (setsockopt(socket->get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on) != 0) return errno;
  Question question = {};
  socklen_t own_length = sizeof question.header.retaddr;
  question.header.retaddr.sun_family = AF_UNIX;
  auto* own = reinterpret_cast<sockaddr*>(&question.header.retaddr);
  if (bind(socket->get(), own, sizeof(sa_family_t)) != 0) return errno;
  if (getsockname(socket->get(), own, &own_length) != 0) return errno;

  question.header.dversion = KPL_VERSION;
  question.request.object = KPL_OBJECT_SUBSYSTEM;
  question.request.action = KPL_ACTION_STATUS;
  strncpy(question.request.objname, subsystem, sizeof question.request.objname - 1);
  question.pid = pid;
  return send_question(socket->get(), question, master, deadline);
}

/// Whether the datagram came from root or from this process's own user: anybody may write to the socket's address.
bool is_trusted(msghdr* message) {
  for (cmsghdr* c = CMSG_FIRSTHDR(message); c != nullptr; c = CMSG_NXTHDR(message, c)) {
    if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_CREDENTIALS) continue;
    ucred sender;
    memcpy(&sender, CMSG_DATA(c), sizeof sender);
    return sender.uid == 0 || sender.uid == geteuid();
  }
  return false;
}

/// Receives one packet of the answer; returns its length, or the negative of an error number.
ssize_t receive(int fd, Clock::time_point deadline, char* packet) {
  for (;;) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() <= 0) return -ETIMEDOUT;
    pollfd entry = {fd, POLLIN, 0};
    if (poll(&entry, 1, static_cast<int>(left.count())) < 0 && errno != EINTR) return -errno;

    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))];
    iovec part = {packet, kMaxPacket};
    msghdr message = {};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    const ssize_t got = recvmsg(fd, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    if (got < 0 && errno != EAGAIN && errno != EINTR) return -errno;
    if (got < 0 || !is_trusted(&message)) continue;
    return (message.msg_flags & MSG_TRUNC) != 0 ? -EBADMSG : got;
  }
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
