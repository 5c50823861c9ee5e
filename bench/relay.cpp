#include "bench/relay.h"

#include <poll.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>

#include "bench/process_roles.h"
#include "bench/waits.h"
#include "examples/processes.h"

namespace zn {
namespace {

/// The first byte of a packet.
enum class Kind : char { kOnePhase, kVoting, kVote, kAnswer, kProposal, kApproval };

constexpr int kMostBytes = 512;

/// As many bytes as packets of group services have, for a state of kPayload bytes.
std::size_t bytes_of(Kind kind) {
  switch (kind) {
    case Kind::kOnePhase:
    case Kind::kVoting:
      return 164;
    case Kind::kVote:
      return 76;
    case Kind::kAnswer:
      return 52;
    case Kind::kProposal:
      return 312;
    case Kind::kApproval:
      break;
  }
  return 240;
}

bool send_kind(int socket, Kind kind) {
  const char packet[kMostBytes] = {static_cast<char>(kind)};
  return ::send(socket, packet, bytes_of(kind), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes_of(kind));
}

/// False: nothing came but the end.
bool receive_kind(int socket, Kind* kind, int flags = 0) {
  char packet[kMostBytes];
  if (::recv(socket, packet, sizeof packet, flags) <= 0) return false;
  *kind = static_cast<Kind>(packet[0]);
  return true;
}

/// Sends and waits for the answer, as every request does.
bool ask(int requests, Kind kind) {
  Kind answer;
  return send_kind(requests, kind) && receive_kind(requests, &answer);
}

/// A channel says whose it is and which of the two: that is its first packet.
int open_channel(const std::string& path, int number, int channel) {
  const int socket = connect_to(path);
  const char hello[] = {static_cast<char>(number), static_cast<char>(channel)};
  if (socket < 0 || ::send(socket, hello, sizeof hello, MSG_NOSIGNAL) != sizeof hello) throw Failure{"no relay"};
  return socket;
}

class Relay {
 public:
  explicit Relay(const std::string& path) {
    const int listening = listen_on(path);
    std::puts("listening");
    std::fflush(stdout);
    for (int i = 0; i < 2 * kRelayed; i++) {
      const int socket = ::accept(listening, nullptr, nullptr);
      char hello[2] = {};
      if (::recv(socket, hello, sizeof hello, 0) != sizeof hello) throw Failure{"a client is gone"};
      (hello[1] == 0 ? requests_ : events_)[static_cast<int>(hello[0])] = socket;
    }
    for (int i = 0; i < kRelayed; i++) {
      epoll_event readable{EPOLLIN, {.fd = i}};
      ::epoll_ctl(ready_, EPOLL_CTL_ADD, requests_[i], &readable);
    }
  }

  void run() {
    epoll_event ready[32];
    for (;;) {
      const int count = ::epoll_wait(ready_, ready, 32, -1);
      for (int i = 0; i < count; i++) {
        if (!serve(ready[i].data.fd)) return;
      }
    }
  }

 private:
  bool serve(int from) {
    Kind kind;
    if (!receive_kind(requests_[from], &kind, MSG_DONTWAIT)) return false;
    if (kind == Kind::kVoting) return tell(from, Kind::kProposal);
    if (kind == Kind::kOnePhase) return tell(from, Kind::kApproval);
    if (++votes_ < kRelayed) return send_kind(requests_[from], Kind::kAnswer);
    votes_ = 0;
    return tell(from, Kind::kApproval);
  }

  /// The requester's own notification is there before the answer wakes it.
  bool tell(int requester, Kind kind) {
    if (!send_kind(events_[requester], kind) || !send_kind(requests_[requester], Kind::kAnswer)) return false;
    for (int i = 0; i < kRelayed; i++) {
      if (i != requester && !send_kind(events_[i], kind)) return false;
    }
    return true;
  }

  const int ready_ = ::epoll_create1(EPOLL_CLOEXEC);
  int requests_[kRelayed] = {};
  int events_[kRelayed] = {};
  int votes_ = 0;
};

}  // namespace

int run_relay(const std::string& path) {
  Relay(path).run();
  return 0;
}

int run_relayed(const std::string& path, int number) {
  const int requests = open_channel(path, number, 0), events = open_channel(path, number, 1);
  for (;;) {
    pollfd ready[] = {{events, POLLIN, 0}, {STDIN_FILENO, POLLIN, 0}};
    if (::poll(ready, 2, -1) < 0 || ready[1].revents) return 0;
    Kind kind;
    if (!receive_kind(events, &kind, MSG_DONTWAIT)) return 0;
    if (kind == Kind::kProposal && !ask(requests, Kind::kVote)) return 0;
  }
}

RelayedProposer::RelayedProposer(const std::string& path)
    : requests_(open_channel(path, 0, 0)), events_(open_channel(path, 0, 1)) {}

RelayedProposer::~RelayedProposer() {
  ::close(requests_);
  ::close(events_);
}

void RelayedProposer::agree(bool voting) {
  bool there = ask(requests_, voting ? Kind::kVoting : Kind::kOnePhase);
  for (Kind kind = Kind::kProposal; there && kind != Kind::kApproval;) {
    wait_readable({events_}, Clock::now() + kWaitLimit);
    there = receive_kind(events_, &kind, MSG_DONTWAIT);
    if (there && kind == Kind::kProposal) there = ask(requests_, Kind::kVote);
  }
  if (!there) throw Failure{"the relay is gone"};
}

}  // namespace zn
