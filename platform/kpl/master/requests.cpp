#include "master/requests.h"

#include <spdlog/fmt/fmt.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <optional>

namespace kpl::master {
namespace {

using control::End;
using control::Result;
using platform::Descriptor;

constexpr std::size_t kMaxWaiting = 100;
constexpr std::size_t kMaxLate = 64;
constexpr std::size_t kMaxPacket = sizeof(kplhdr) + 80 * sizeof(statcode);
constexpr int kPacketsAtOnce = 32;        // before others are served again
constexpr Duration kSendAgain{100};       // to a channel that has had no room for a ping
constexpr Duration kPingOvertime{1'000};  // at most, and no more than the ping's limit

/// A socket with an address that the kernel chooses, for one answer.
Descriptor open_reply_socket(sockaddr_un* address) {
  Descriptor made(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  const int on = 1;
  *address = {};
  address->sun_family = AF_UNIX;
  socklen_t length = sizeof *address;
  auto* generic = reinterpret_cast<sockaddr*>(address);
  if (!made || setsockopt(made.get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on) != 0 ||
      bind(made.get(), generic, sizeof(sa_family_t)) != 0 || getsockname(made.get(), generic, &length) != 0) {
    return {};
  }
  return made;
}

pid_t sender_of(msghdr* message) {
  for (cmsghdr* c = CMSG_FIRSTHDR(message); c != nullptr; c = CMSG_NXTHDR(message, c)) {
    if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_CREDENTIALS) continue;
    ucred sender{};
    memcpy(&sender, CMSG_DATA(c), sizeof sender);
    return sender.pid;
  }
  return -1;
}

/// Subsystems double each "%" of their status and error text.
std::string single_percents(std::string text) {
  for (std::size_t at = 0; (at = text.find("%%", at)) != std::string::npos; ++at) text.erase(at, 1);
  return text;
}

std::string field(const char* text, std::size_t size) { return {text, strnlen(text, size)}; }

control::Lines lines_in(const char* packet, std::size_t length) {
  control::Lines result;
  for (std::size_t at = sizeof(kplhdr); at + sizeof(statcode) <= length; at += sizeof(statcode)) {
    statcode record{};
    memcpy(&record, packet + at, sizeof record);
    result.lines.push_back({field(record.objname, sizeof record.objname),
                            single_percents(field(record.objtext, sizeof record.objtext))});
  }
  return result;
}

std::string message_in(const char* packet, std::size_t length) {
  constexpr std::size_t kAt = offsetof(kplrep, svrreply) + offsetof(svrreply, rtnmsg);
  std::string text = length > kAt ? field(packet + kAt, length - kAt) : "";
  if (text.ends_with('\n')) text.pop_back();
  return text;
}

End end_in(const std::string& name, const char* packet, std::size_t length) {
  short code = 0;
  memcpy(&code, packet + offsetof(kplrep, svrreply), sizeof code);
  std::string text = single_percents(message_in(packet, length));
  switch (code) {
    case KPL_RC_OK:
      return {Result::kOk, code, text};
    case KPL_RC_NOT_SUPPORTED:
      return {Result::kNotSupported, code, name + " does not support this request"};
    case KPL_RC_BAD_REQUEST:
      return {Result::kNotSupported, code, name + " does not know this request"};
    default:
      break;
  }
  if (text.empty()) text = name + " answered with code " + std::to_string(code);
  return {Result::kFailed, code, text};
}

}  // namespace

struct Requests::Pending {
  Pending(const Loop& loop, const Question& what, Reply to, Event::Action on_late)
      : question(what), reply(std::move(to)), late(loop, std::move(on_late)) {}

  Question question;
  Reply reply;
  Event late;
  std::optional<Duration> once_sent;  // a ping's limit, which counts from then
  bool overtime = false;              // of a ping: its limit is over, and this is the rest that it is given
  std::string refused;                // a ping's: why the subsystem could not be asked yet
  bool sent = false;
  Descriptor socket;
  std::optional<Event> readable;  // goes before the socket
};

struct Requests::Late {
  Descriptor socket;
  std::optional<Event> readable;  // goes before the socket
};

Requests::Requests(const Loop& loop, Channel& channel, std::string name, pid_t pid)
    : loop_(loop), channel_(channel), name_(std::move(name)), pid_(pid), send_again_(loop, [this] {
        send_first();
      }) {}

Requests::~Requests() { end_all(); }

void Requests::ask(const Question& question, Duration limit, Reply reply) {
  if (waiting_.size() >= kMaxWaiting) {
    return reply(End{Result::kNoAnswer, 0, "too many requests wait for " + name_});
  }
  const auto place = add(question, std::move(reply), [this, limit](Place late) { finish(late, too_late(limit)); });
  (*place)->late.arm(limit);
  if (waiting_.size() == 1) send_first();
}

void Requests::ping(Duration limit, std::function<void(const End&)> told) {
  const auto reply = [told = std::move(told)](const control::Answer& answer) {
    if (const End* end = std::get_if<End>(&answer)) told(*end);
  };
  const auto place =
      add({KPL_ACTION_PING, 0, 0, {}}, reply, [this, limit](Place late) { on_ping_late(late, limit); });
  (*place)->once_sent = limit;
  if (waiting_.size() == 1) send_first();
}

Requests::Place Requests::add(const Question& question, Reply reply, std::function<void(Place)> on_late) {
  const auto place = waiting_.emplace(waiting_.end());
  *place = std::make_unique<Pending>(loop_, question, std::move(reply),
                                     [place, on_late = std::move(on_late)] { on_late(place); });
  return place;
}

End Requests::too_late(Duration limit) const {
  return {Result::kNoAnswer, 0, fmt::format("{} has not answered within {} s", name_, in_seconds(limit))};
}

/// When the host has stood still, the master's timers are over before the subsystem could run at all.
void Requests::on_ping_late(Place place, Duration limit) {
  Pending& ping = **place;
  if (!std::exchange(ping.overtime, true)) return ping.late.arm(std::min(limit, kPingOvertime));
  finish(place, ping.refused.empty() ? too_late(limit) : End{Result::kNoAnswer, 0, ping.refused});
}

void Requests::end_all() {
  ended_ = true;
  if (!waiting_.empty() && waiting_.front()->sent) on_readable();  // it may have answered with its last breath
  while (!waiting_.empty()) {
    const auto ended = std::move(waiting_.front());
    waiting_.pop_front();
    ended->reply(End{Result::kFailed, 0, name_ + " ended before it answered"});
  }
}

/// Until one is sent: those that cannot be are answered at once. But a ping that the subsystem does not take has
/// its time all the same.
void Requests::send_first() {
  while (!ended_ && !waiting_.empty() && !waiting_.front()->sent) {
    Pending& first = *waiting_.front();
    const End end = send(first);
    if (end.result == Result::kOk) return;
    if (!first.once_sent || end.result != Result::kNoAnswer) {
      drop(waiting_.begin(), end);
      continue;
    }
    if (first.refused.empty()) first.late.arm(*first.once_sent);
    first.refused = end.text;
    if (waiting_.size() == 1) return send_again_.arm(kSendAgain);
    waiting_.splice(waiting_.end(), waiting_, waiting_.begin());  // the others are told now
  }
}

End Requests::send(Pending& first) {
  const auto refused = [](const std::string& why) { return End{Result::kNoAnswer, 0, why}; };
  if (late_.size() >= kMaxLate) {
    return refused(name_ + " has not answered its last " + std::to_string(kMaxLate) + " requests");
  }
  kplreq request{};
  Descriptor socket = open_reply_socket(&request.kplhdr.retaddr);
  if (!socket) return {Result::kFailed, 0, std::string("no socket for the answer: ") + strerror(errno)};
  request.kplhdr.dversion = KPL_VERSION;
  request.subreq.object = KPL_OBJECT_SUBSYSTEM;
  request.subreq.action = first.question.action;
  request.subreq.parm1 = first.question.parm1;
  request.subreq.parm2 = first.question.parm2;
  name_.copy(request.subreq.objname, sizeof request.subreq.objname);
  switch (channel_.send(request, first.question.data)) {
    case Channel::Sent::kDone:
      break;
    case Channel::Sent::kFull:
      return refused(name_ + " does not read its requests");
    case Channel::Sent::kGone:
      return refused(name_ + " has closed its request channel");
  }
  first.sent = true;
  first.refused.clear();
  first.overtime = false;
  if (first.once_sent) first.late.arm(*first.once_sent);
  first.socket = std::move(socket);
  first.readable.emplace(loop_, first.socket.get(), EV_READ | EV_PERSIST, [this] { on_readable(); });
  return {};
}

/// Until the action, which is given each packet of the subsystem's own, says true. The address is known to all who
/// look for it; only the subsystem is listened to.
template <class Action>
void Requests::read_packets(int fd, Action action) const {
  for (int i = 0; i < kPacketsAtOnce; ++i) {
    char packet[kMaxPacket];
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))];
    iovec part = {packet, sizeof packet};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    const ssize_t got = recvmsg(fd, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    if (got < 0) return;
    if ((message.msg_flags & MSG_TRUNC) != 0 || sender_of(&message) != pid_) continue;
    if (action(packet, static_cast<std::size_t>(got))) return;
  }
}

void Requests::on_readable() {
  read_packets(waiting_.front()->socket.get(),
               [this](const char* packet, std::size_t length) { return on_packet(packet, length); });
}

/// It answers in order: what was asked before has been done with. This one too, with its last packet; until then
/// the subsystem is told that nobody reads.
void Requests::on_late_answer(std::list<Late>::iterator which) {
  read_packets(which->socket.get(), [&](const char* packet, std::size_t length) {
    kplhdr header{};
    if (length < sizeof header) return false;
    memcpy(&header, packet, sizeof header);
    late_.erase(late_.begin(), which);
    if (header.cont == KPL_CONT_END) {
      late_.erase(which);
    } else {
      which->readable.reset();
      shutdown(which->socket.get(), SHUT_RD);
    }
    return true;
  });
}

bool Requests::on_packet(const char* packet, std::size_t length) {
  if (length < sizeof(kplhdr)) return false;
  kplhdr header{};
  memcpy(&header, packet, sizeof header);
  Pending& first = *waiting_.front();
  if (header.cont == KPL_CONT_STATUS) first.reply(lines_in(packet, length));
  if (header.cont == KPL_CONT_MESSAGE) first.reply(control::Message{message_in(packet, length)});
  if (header.cont != KPL_CONT_END || length < sizeof(kplhdr) + sizeof(short)) return false;
  late_.clear();  // it answers in order: what was asked before it has done with
  first.readable.reset();
  first.socket = Descriptor();
  finish(waiting_.begin(), end_in(name_, packet, length));
  return true;
}

void Requests::finish(Place which, const End& end) {
  drop(which, end);
  send_first();
}

/// The socket of a request that was sent and not answered keeps its address, or a stranger could take it and be
/// told what comes late.
void Requests::drop(Place which, const End& end) {
  const auto dropped = std::move(*which);
  waiting_.erase(which);
  dropped->readable.reset();
  if (dropped->sent && dropped->socket) {
    const auto late = late_.emplace(late_.end());
    late->socket = std::move(dropped->socket);
    late->readable.emplace(loop_, late->socket.get(), EV_READ | EV_PERSIST,
                           [this, late] { on_late_answer(late); });
  }
  dropped->reply(end);
}

}  // namespace kpl::master
