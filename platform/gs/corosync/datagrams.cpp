#include "corosync/datagrams.h"

#include <netdb.h>

#include <array>
#include <cstring>
#include <utility>

namespace gs::cluster {
namespace {

/// Of numbers, so that no name service is asked. False: it is none.
bool parse_address(const std::string& host, const std::string& port, sockaddr_storage* address,
                   socklen_t* length) {
  addrinfo wanted{};
  wanted.ai_flags = AI_NUMERICHOST | AI_NUMERICSERV;
  wanted.ai_socktype = SOCK_DGRAM;
  addrinfo* found = nullptr;
  if (getaddrinfo(host.c_str(), port.c_str(), &wanted, &found) != 0) return false;
  *length = found->ai_addrlen;
  std::memcpy(address, found->ai_addr, found->ai_addrlen);
  freeaddrinfo(found);
  return true;
}

std::string port_of(int socket) {
  sockaddr_storage bound{};
  socklen_t length = sizeof bound;
  char port[NI_MAXSERV] = "";
  if (getsockname(socket, reinterpret_cast<sockaddr*>(&bound), &length) != 0) return {};
  getnameinfo(reinterpret_cast<sockaddr*>(&bound), length, nullptr, 0, port, sizeof port, NI_NUMERICSERV);
  return port;
}

}  // namespace

Datagrams::Datagrams(event_base* base, Around around, Receive receive)
    : base_(base), around_(std::move(around)), receive_(std::move(receive)) {}

void Datagrams::open(Node self, const std::string& host) {
  self_ = self;
  address_.clear();
  readable_.reset();
  sockaddr_storage address{};
  socklen_t length = 0;
  if (host.empty() || !parse_address(host, "0", &address, &length)) return;
  socket_ = platform::Descriptor(socket(address.ss_family, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (bind(socket_.get(), reinterpret_cast<sockaddr*>(&address), length) != 0) return;
  const auto callback = [](evutil_socket_t, short, void* datagrams) {
    auto* receiver = static_cast<Datagrams*>(datagrams);
    receiver->around_([receiver] { receiver->read(); });
  };
  readable_.reset(event_new(base_, socket_.get(), EV_READ | EV_PERSIST, callback, this));
  if (!readable_ || event_add(readable_.get(), nullptr) != 0) return;
  address_ = host + " " + port_of(socket_.get());
}

void Datagrams::set_peers(const std::map<Node, Word>& words) {
  peers_.clear();
  for (const auto& [node, word] : words) {
    if (node == self_) continue;
    Peer& peer = peers_[node];
    peer.key = word.key;
    const std::size_t space = word.address.find(' ');
    if (space == std::string::npos) continue;
    parse_address(word.address.substr(0, space), word.address.substr(space + 1), &peer.address, &peer.length);
  }
  if (readable_ && !kept_.empty()) event_active(readable_.get(), EV_READ, 0);
}

void Datagrams::send(const Confirmed& confirmed) {
  if (address_.empty()) return;
  const auto bytes = seal(confirmed, self_, key_);
  for (const auto& [node, peer] : peers_) {
    if (peer.length == 0) continue;
    const auto* to = reinterpret_cast<const sockaddr*>(&peer.address);
    sendto(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL, to, peer.length);
  }
}

void Datagrams::read() {
  for (auto& packet : std::exchange(kept_, {})) take(std::move(packet));
  std::array<std::byte, 2048> packet;
  for (int i = 0; i < kAtOnce; ++i) {
    const ssize_t size = recv(socket_.get(), packet.data(), packet.size(), 0);
    if (size < 0) return;
    take({packet.begin(), packet.begin() + size});
  }
}

void Datagrams::take(std::vector<std::byte> packet) {
  const auto key_of = [this](Node node) -> const std::string* {
    const auto found = peers_.find(node);
    return found == peers_.end() ? nullptr : &found->second.key;
  };
  if (const auto opened = gs::cluster::open(packet, key_of)) return receive_(opened->first, opened->second);
  if (kept_.size() == kMostKept) kept_.pop_front();
  kept_.push_back(std::move(packet));
}

}  // namespace gs::cluster
