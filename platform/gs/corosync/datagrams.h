// The way beside the order: confirmations, straight from daemon to daemon.
#pragma once

#include <event2/event.h>
#include <sys/socket.h>

#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "cluster/datagram.h"
#include "common/descriptor.h"
#include "corosync/corosync_link.h"

namespace gs::cluster {

/// Whatever does not arrive is said again by the order: no error here needs to be told. Not safe for concurrent
/// use.
class Datagrams {
 public:
  using Receive = std::function<void(Node from, const Confirmed& confirmed)>;
  /// `receive` is called by the loop, once `open` has been called.
  Datagrams(event_base* base, Around around, Receive receive);

  /// Has an address at `host` from now on; none where `host` is empty or not this host's.
  void open(Node self, const std::string& host);
  /// "host port" as the others are to be told it; empty: there is none.
  const std::string& address() const { return address_; }
  const std::string& key() const { return key_; }
  void set_peers(const std::map<Node, Word>& words);
  /// To all peers but this daemon.
  void send(const Confirmed& confirmed);

 private:
  struct Peer {
    sockaddr_storage address{};
    socklen_t length = 0;  // 0: it has none
    std::string key;
  };
  static constexpr int kAtOnce = 64;            // before others are served
  static constexpr std::size_t kMostKept = 64;  // whose sender may become known

  void read();
  void take(std::vector<std::byte> packet);

  event_base* const base_;
  const Around around_;
  const Receive receive_;
  const std::string key_ = new_key();
  Node self_ = 0;
  std::string address_;
  platform::Descriptor socket_;
  platform::EventPtr readable_;  // goes before its descriptor
  std::map<Node, Peer> peers_;
  std::deque<std::vector<std::byte>> kept_;  // the word with its sender's key may come behind it
};

}  // namespace gs::cluster
