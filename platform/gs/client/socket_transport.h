// A session with the daemon on this host: two connections to its socket, one for requests and their answers, one
// whose descriptor is the session's, so that no answer waits behind notifications.
#pragma once

#include <atomic>
#include <string>

#include "client/channel.h"
#include "client/mutex.h"
#include "client/transport.h"

namespace gs::client {

class SocketTransport : public Transport {
 public:
  /// Connects and greets. `request_limit`: seconds that a daemon may take for an answer; one that takes longer
  /// counts as gone. Null: `rc` says why.
  static std::unique_ptr<SocketTransport> open(const std::string& path, const wire::Hello& hello,
                                               int request_limit, wyx_rc_t* rc);
  // Ask the daemon without a session.
  static wyx_rc_t query_node_of(const std::string& path, wire::NodeInfo* info);
  static wyx_rc_t query_adapters_of(const std::string& path, const wire::QueryAdapters& query,
                                    wire::NodeAdapters* found);

  SocketTransport(std::unique_ptr<Channel> requests, std::unique_ptr<Channel> events, std::uint32_t node_number);

  std::uint32_t node_number() const override { return node_number_; }
  wyx_rc_t call(Request request) override;
  wyx_rc_t set_responsiveness(const wire::SetResponsiveness& settings) override;
  wyx_rc_t query_node(wire::NodeInfo* info) override;
  wyx_rc_t query_adapters(const wire::QueryAdapters& query, wire::NodeAdapters* found) override;
  wyx_rc_t answer_quorum(std::uint64_t sequence) override;
  Incoming take() override;
  void answer_ping(std::uint64_t number, bool ok) override;
  void wait() override;
  int descriptor() const override { return events_->fd(); }
  void silence() override;
  bool gone() override;
  void quit() override;

 private:
  template <typename T>
  wyx_rc_t exchange(const wire::ClientMessage& message, T* answer);
  template <typename T>
  wyx_rc_t exchange_locked(const wire::ClientMessage& message, T* answer) GS_REQUIRES(exchange_mutex_);
  void lose(const std::string& what, int error, const std::string& why);
  void lose_without_answer(const char* step, Channel::Got got, int limit);
  void hang_up();
  Incoming malformed();
  Incoming accept(wire::ServerMessage&& message);

  const std::uint32_t node_number_;
  const std::unique_ptr<Channel> requests_;
  const std::unique_ptr<Channel> events_;
  Mutex exchange_mutex_;  // one exchange at a time on requests_
  Mutex answer_mutex_;    // one sender at a time on events_
  std::atomic<bool> gone_ = false;

  // Of the thread that takes: a notification for several clients. Its end stays in the socket until all have it.
  std::vector<Token> fanout_;  // empty: none is under way
  std::size_t handed_out_ = 0;
  std::shared_ptr<const Notification> shared_;  // null: it is still to come
};

}  // namespace gs::client
