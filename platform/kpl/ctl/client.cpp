#include "ctl/client.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cmath>
#include <cstring>

namespace kpl::ctl {
namespace {

using control::Answer;
using control::End;
using control::Result;

constexpr double kMaxWait = 1e6;                        // seconds
constexpr std::size_t kMaxAnswer = 16UL * 1024 * 1024;  // bytes, for one request

bool is_readable(int fd, double seconds) {
  pollfd wanted{fd, POLLIN, 0};
  const int timeout = static_cast<int>(std::fmin(std::fmax(seconds, 0), kMaxWait) * 1000);
  int ready = 0;
  do {
    ready = poll(&wanted, 1, timeout);
  } while (ready < 0 && errno == EINTR);
  return ready == 1;
}

}  // namespace

bool Client::connect_to_master() {
  if (socket_) return true;
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path_.size() >= sizeof address.sun_path) {
    errno = ENAMETOOLONG;
    return false;
  }
  memcpy(address.sun_path, path_.c_str(), path_.size() + 1);
  platform::Descriptor made(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  if (!made || connect(made.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return false;
  socket_ = std::move(made);
  return true;
}

End Client::not_reached() const {
  return {Result::kNotReached, 0, "cannot reach kplmstr at " + path_ + ": " + strerror(errno)};
}

End Client::ask(const control::Request& request, const Interim& interim) {
  const std::string question = control::encode(request);
  if (!connect_to_master()) return not_reached();
  bool ended = false;
  const End end = [&]() -> End {
    try {
      return exchange(question, interim, &ended);
    } catch (const control::Malformed& error) {
      return {Result::kNotReached, 0, path_ + " is no kplmstr's: " + error.what()};
    }
  }();
  if (!ended) socket_ = platform::Descriptor();  // what comes late would be taken for the next answer
  return end;
}

End Client::exchange(const std::string& question, const Interim& interim, bool* ended) {
  if (send(socket_.get(), question.data(), question.size(), MSG_NOSIGNAL) < 0 && errno != EPIPE)
    return not_reached();
  double patience = 0;
  std::string packet;
  std::size_t bytes = 0;
  for (;;) {
    if (!is_readable(socket_.get(), patience + control::kPatience)) {
      return {Result::kNoAnswer, 0, "kplmstr does not answer"};
    }
    packet.resize(control::kMaxPacket + 1);
    const ssize_t length = recv(socket_.get(), packet.data(), packet.size(), 0);
    if (length < 0 && errno != ECONNRESET) return not_reached();
    if (length <= 0)
      return {Result::kNotReached, 0, "kplmstr has closed the connection: not permitted, too many, or it ended"};
    packet.resize(static_cast<std::size_t>(length));
    bytes += packet.size();
    if (bytes > kMaxAnswer) throw control::Malformed("its answer has no end");
    const Answer answer = control::decode_answer(packet);
    if (const End* end = std::get_if<End>(&answer)) {
      *ended = true;
      return *end;
    }
    if (const auto* wait = std::get_if<control::Wait>(&answer)) patience = wait->seconds;
    interim(answer);
  }
}

}  // namespace kpl::ctl
