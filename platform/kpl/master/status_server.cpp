#include "master/status_server.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <cstring>

#include "common/listener.h"
#include "kpl.h"

namespace kpl::master {
namespace {

constexpr mode_t kForAll = 0666;
constexpr int kQuestionsAtOnce = 16;  // before others are served again

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

StatusServer::StatusServer(const Loop& loop, const std::string& path, Lookup lookup)
    : loop_(loop), path_(path), lookup_(std::move(lookup)), look_again_(loop, [this] { look_at_path(); }) {
  listen_at_path();
  look_again_.arm(platform::Listener::kLookAgain);
}

void StatusServer::listen_at_path() {
  auto bound = std::make_unique<platform::NamedSocket>(platform::socket_place(path_), SOCK_DGRAM,
                                                       platform::NamedSocket::Access{kForAll});
  readable_.reset();
  socket_ = std::move(bound);
  readable_.emplace(loop_, socket_->fd(), EV_READ | EV_PERSIST, [this] { on_readable(); });
}

/// What stands in the way is the control socket's to tell, which lies beside it.
void StatusServer::look_at_path() {
  look_again_.arm(platform::Listener::kLookAgain);
  if (socket_->in_place()) return;
  try {
    listen_at_path();
  } catch (const platform::ListenError&) {
    return;
  }
}

/// The answer goes to where the question came from, not where it says: nobody can have root write elsewhere.
void StatusServer::on_readable() {
  for (int i = 0; i < kQuestionsAtOnce; ++i) {
    Question question{};
    sockaddr_un from{};
    socklen_t from_length = sizeof from;
    auto* address = reinterpret_cast<sockaddr*>(&from);
    const ssize_t got =
        recvfrom(socket_->fd(), &question, sizeof question, MSG_DONTWAIT | MSG_TRUNC, address, &from_length);
    if (got < 0) return;
    if (got != sizeof question || from_length <= sizeof(sa_family_t)) continue;
    const auto answer = [&](const std::string& packet) {
      sendto(socket_->fd(), packet.data(), packet.size(), MSG_DONTWAIT | MSG_NOSIGNAL, address, from_length);
    };
    kplhdr header = question.header;
    header.cont = KPL_CONT_STATUS;
    const subreq& request = question.request;
    const bool known = request.object == KPL_OBJECT_SUBSYSTEM && request.action == KPL_ACTION_STATUS;
    const std::string name(request.objname, strnlen(request.objname, sizeof request.objname));
    const auto lines = known ? lookup_(name, question.pid) : std::nullopt;
    if (lines) answer(status_packet(header, *lines));
    header.cont = KPL_CONT_END;
    answer(end_packet(header, lines ? KPL_RC_OK : known ? KPL_RC_ERROR : KPL_RC_BAD_REQUEST));
  }
}

}  // namespace kpl::master
