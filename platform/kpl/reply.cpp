// The subsystem's side: answering the request being served.
#include <errno.h>
#include <poll.h>
#include <string.h>
#include <sys/uio.h>
#include <unistd.h>

#include <chrono>

#include "kpl.h"
#include "local_socket.h"

namespace {

using Clock = std::chrono::steady_clock;

/// How long one answer may wait for a requester that does not read.
constexpr Clock::duration kPatience = std::chrono::seconds(2);

/// The answer that a thread is giving.
struct Answer {
  kplhdr header;
  pid_t parent;  ///< when the request was read
  platform::Descriptor socket;
  Clock::duration patience = kPatience;  ///< what is left of it
  int gone = 0;                          ///< the error that told that the requester is gone; 0 while it is there

  void restart() {
    socket = platform::Descriptor();
    patience = kPatience;
    gone = 0;
  }
};

thread_local Answer answer;

/// Not to a path: where that leads is up to whoever may write in its folders, and the answer would go there with
/// this process's rights. Whoever holds an abstract name keeps it for as long as it lives: then anybody may take
/// it, so what was connected to counts only while the master that held the name is there.
int connect_to(const sockaddr_un& retaddr) {
  const socklen_t length = kpl::address_length(retaddr);
  if (length == 0 || retaddr.sun_path[0] != '\0') return EDESTADDRREQ;
  answer.socket = kpl::open_local_socket(SOCK_DGRAM);
  if (!answer.socket) return errno;
  const auto* address = reinterpret_cast<const sockaddr*>(&retaddr);
  if (connect(answer.socket.get(), address, length) != 0) return errno;
  return getppid() == answer.parent ? 0 : ECONNREFUSED;
}

/// Waits until the requester has room or the patience is used up; returns an error number.
int wait_for_room() {
  const auto start = Clock::now();
  pollfd entry = {answer.socket.get(), POLLOUT, 0};
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(answer.patience);
  const int ready = poll(&entry, 1, static_cast<int>(left.count()));
  answer.patience -= Clock::now() - start;
  if (answer.patience.count() <= 0) return ETIMEDOUT;
  return ready >= 0 || errno == EINTR ? 0 : errno;
}

int send_packet(kplhdr* header, char* body, size_t body_len) {
  iovec parts[] = {{header, sizeof *header}, {body, body_len}};
  msghdr message = {};
  message.msg_iov = parts;
  message.msg_iovlen = 2;
  for (;;) {
    if (sendmsg(answer.socket.get(), &message, MSG_DONTWAIT | MSG_NOSIGNAL) >= 0) return 0;
    if (errno == EINTR) continue;
    if (errno != EAGAIN) return errno;
    if (const int error = wait_for_room(); error != 0) return error;
  }
}

}  // namespace

kplhdr* kplrrqs(char* request_header) {
  answer.restart();
  memcpy(&answer.header, request_header, sizeof answer.header);
  answer.parent = getppid();
  return &answer.header;
}

int kplsrpy(kplhdr* header, char* reply, int reply_len, int cont) {
  if (reply_len < static_cast<int>(sizeof(kplhdr))) {
    errno = EINVAL;
    return -1;
  }
  kplhdr own = {};
  own.retaddr = header->retaddr;
  own.dversion = header->dversion;
  own.cont = static_cast<short>(cont);
  if (answer.gone == 0 && !answer.socket) answer.gone = connect_to(own.retaddr);
  if (answer.gone == 0) answer.gone = send_packet(&own, reply + sizeof own, reply_len - sizeof own);
  const int error = answer.gone;
  if (cont == KPL_CONT_END) answer.restart();
  if (error == 0) return 0;
  errno = error;
  return -1;
}
