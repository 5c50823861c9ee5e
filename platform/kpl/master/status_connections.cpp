#include "master/status_connections.h"

#include <sys/socket.h>

#include <cerrno>
#include <cstring>

#include "kpl.h"

namespace kpl::master {
namespace {

using platform::Descriptor;

constexpr std::size_t kMaxSilent = 128;  // one more pushes out the oldest, so that nobody can lock others out

/// A request without its type word, and the process id as extra data.
struct Question {
  kplhdr header;
  subreq request;
  std::int32_t pid;
};
static_assert(sizeof(Question) == 160);

std::string status_packet(const kplhdr& header, const std::vector<control::Line>& lines) {
  std::string packet(reinterpret_cast<const char*>(&header), sizeof header);
  for (const control::Line& line : lines) {
    statcode record{};
    record.objtype = KPL_OBJECT_SUBSYSTEM;
    line.margin.copy(record.objname, sizeof record.objname - 1);
    line.body.copy(record.objtext, sizeof record.objtext - 1);
    packet.append(reinterpret_cast<const char*>(&record), sizeof record);
  }
  return packet;
}

std::string end_packet(const kplhdr& header, short code) {
  kplrep reply{};
  reply.kplhdr = header;
  reply.svrreply.rtncode = code;
  return {reinterpret_cast<const char*>(&reply), offsetof(kplrep, svrreply) + offsetof(svrreply, rtnmsg) + 1};
}

}  // namespace

bool StatusConnections::accept_from(int listening, int most) {
  for (int i = 0; i < most; ++i) {
    Descriptor socket(accept4(listening, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (!socket && (errno == ECONNABORTED || errno == EINTR)) continue;
    if (!socket && (errno == EMFILE || errno == ENFILE) && !silent_.empty()) {
      silent_.erase(silent_.begin());
      continue;
    }
    if (!socket) return errno == EAGAIN;
    if (serve(socket.get())) continue;
    if (silent_.size() == kMaxSilent) silent_.erase(silent_.begin());
    const Id id = ++last_;
    Connection& connection = silent_[id];
    connection.socket = std::move(socket);
    connection.readable.emplace(loop_, connection.socket.get(), EV_READ | EV_PERSIST, [this, id] {
      if (serve(silent_.at(id).socket.get())) silent_.erase(id);
    });
  }
  return true;
}

/// An answer is two packets, for which a new connection has room.
bool StatusConnections::serve(int socket) const {
  Question question{};
  const ssize_t got = recv(socket, &question, sizeof question, MSG_DONTWAIT | MSG_TRUNC);
  if (got < 0 && (errno == EAGAIN || errno == EINTR)) return false;
  if (got != sizeof question) return true;
  const auto answer = [&](const std::string& packet) {
    return send(socket, packet.data(), packet.size(), MSG_DONTWAIT | MSG_NOSIGNAL) >= 0;
  };
  kplhdr header = question.header;
  header.cont = KPL_CONT_STATUS;
  const subreq& request = question.request;
  const bool known = request.object == KPL_OBJECT_SUBSYSTEM && request.action == KPL_ACTION_STATUS;
  const std::string name(request.objname, strnlen(request.objname, sizeof request.objname));
  const auto lines = known ? lookup_(name, question.pid) : std::nullopt;
  if (lines && !answer(status_packet(header, *lines))) return true;
  header.cont = KPL_CONT_END;
  answer(end_packet(header, lines ? KPL_RC_OK : known ? KPL_RC_ERROR : KPL_RC_BAD_REQUEST));
  return true;
}

}  // namespace kpl::master
