#include "inspect/inspector.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <utility>

#include "common/clock.h"

namespace gs::inspect {
namespace {

using Failed = InspectError::Kind;

sockaddr_un address_of(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path)
    throw InspectError(Failed::kNoDaemon, "the path of the daemon's socket is too long: " + path);
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  return address;
}

platform::Descriptor connected(const std::string& path, std::chrono::milliseconds patience) {
  const sockaddr_un address = address_of(path);
  platform::Descriptor made(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  const timeval limit = {patience.count() / 1000, patience.count() % 1000 * 1000};
  setsockopt(made.get(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
  if (!made || connect(made.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
    throw InspectError(Failed::kNoDaemon, "no daemon at " + path + ": " + strerrordesc_np(errno));
  return made;
}

}  // namespace

Inspector::Inspector(const std::string& path, std::chrono::milliseconds patience)
    : patience_(patience), socket_(connected(path, patience)), packet_(wire::kMaxPacket + 1) {}

void Inspector::await(short events, const char* what) const {
  const auto until = platform::now() + patience_;
  for (;;) {
    const auto left = std::max<std::int64_t>((until - platform::now()).count(), 0);
    pollfd watched = {fd(), events, 0};
    if (poll(&watched, 1, static_cast<int>(std::min<std::int64_t>(left, INT32_MAX))) > 0) return;
    if (left == 0) throw InspectError(Failed::kTimeOver, std::string("the daemon ") + what + " in time");
  }
}

void Inspector::send(const AskT& ask) {
  const wire::Encoded message = wire::encode(wire::ClientMessage(wire::Inspect{write(ask)}));
  for (std::size_t index = 0; index < message.packets(); ++index) {
    std::array<std::byte, wire::kHeaderSize> header;
    const auto slice = message.packet_for(index, -1, header);
    std::array<iovec, 2> parts = {iovec{header.data(), header.size()},
                                  iovec{const_cast<std::byte*>(slice.data()), slice.size()}};
    msghdr packet{};
    packet.msg_iov = parts.data();
    packet.msg_iovlen = parts.size();
    while (sendmsg(fd(), &packet, MSG_NOSIGNAL | MSG_DONTWAIT) < 0) {
      if (errno == EAGAIN)
        await(POLLOUT, "does not take the question");
      else if (errno != EINTR)
        throw InspectError(Failed::kLost, "the daemon is gone");
    }
  }
}

std::optional<ReportT> Inspector::receive() {
  std::string error;
  for (;;) {
    const ssize_t length = recv(fd(), packet_.data(), packet_.size(), MSG_DONTWAIT);
    if (length < 0 && (errno == EINTR || errno == ECONNRESET)) continue;
    if (length < 0 && errno == EAGAIN) return std::nullopt;
    if (length <= 0) throw InspectError(Failed::kLost, "the daemon is gone");
    if (!assembler_.add({packet_.data(), static_cast<std::size_t>(length)}, &error)) break;
    if (!assembler_.complete()) continue;
    const auto message = assembler_.take_server_message(&error);
    if (!message) break;
    const auto* report = std::get_if<wire::Report>(&*message);
    if (report == nullptr) throw InspectError(Failed::kLost, "the daemon refuses to be asked");
    auto read = read_report(std::as_bytes(std::span(report->report)), &error);
    if (!read) break;
    return read;
  }
  throw InspectError(Failed::kMalformed, "what the daemon says makes no sense: " + error);
}

ReportT Inspector::ask(const AskT& ask) {
  send(ask);
  for (;;) {
    await(POLLIN, "does not answer");
    if (auto report = receive()) return std::move(*report);
  }
}

/// Page after page.
template <typename T>
Inspector::List<T> Inspector::all(AskT ask, List<T> ReportT::*list) {
  List<T> all;
  for (;;) {
    ReportT page = this->ask(ask);
    std::move((page.*list).begin(), (page.*list).end(), std::back_inserter(all));
    if (!page.more) return all;
    const bool goes_on = page.next > ask.from || page.next_group > ask.after;
    if (!goes_on) throw InspectError(Failed::kMalformed, "the daemon repeats itself");
    ask.from = page.next;
    ask.after = page.next_group;
  }
}

DaemonT Inspector::daemon() {
  const ReportT report = ask({});
  return report.daemon ? *report.daemon : DaemonT();
}

Inspector::List<GroupT> Inspector::groups_in_brief() {
  AskT ask;
  ask.what = What::Groups;
  ask.brief = true;
  return all(std::move(ask), &ReportT::groups);
}

Inspector::List<GroupT> Inspector::groups(const std::vector<std::string>& names, bool contents) {
  AskT ask;
  ask.what = What::Groups;
  ask.groups = names;
  ask.contents = contents;
  return all(std::move(ask), &ReportT::groups);
}

Inspector::List<MemberT> Inspector::members(const std::string& group) {
  AskT ask;
  ask.what = What::Members;
  ask.groups = {group};
  return all(std::move(ask), &ReportT::members);
}

Inspector::List<SubscriberT> Inspector::subscribers(const std::vector<std::string>& groups) {
  AskT ask;
  ask.what = What::Subscribers;
  ask.groups = groups;
  return all(std::move(ask), &ReportT::subscribers);
}

Inspector::List<SessionT> Inspector::sessions() {
  AskT ask;
  ask.what = What::Sessions;
  return all(std::move(ask), &ReportT::sessions);
}

Inspector::List<NodeT> Inspector::nodes() {
  AskT ask;
  ask.what = What::Nodes;
  return all(std::move(ask), &ReportT::nodes);
}

void Inspector::tap(const std::vector<std::string>& groups, bool contents, std::vector<Kind> kinds) {
  AskT request;
  request.what = What::Tap;
  request.groups = groups;
  request.contents = contents;
  request.kinds = std::move(kinds);
  ask(request);  // the first report is empty
}

std::optional<ReportT> Inspector::next() { return receive(); }

}  // namespace gs::inspect
