// What waits for one connection to take it: messages in order.
#pragma once

#include <deque>
#include <memory>

#include "daemon/outgoing.h"
#include "daemon/transport.h"

namespace gs::daemon {

class OutQueue {
 public:
  /// A message that is encoded already, or a notification, whose turn comes.
  struct Item {
    wire::Encoded packets;
    std::shared_ptr<Outgoing> notification = nullptr;
    Token token = -1;
  };
  enum class Sent {
    kAll,
    kFull,      // the connection takes no more, or has had its share
    kGone,      // the peer is gone
    kTooLarge,  // what comes next is over the limit of a message
  };

  OutQueue(Account& account, RecentPackets& recent) : account_(account), recent_(recent) {}
  ~OutQueue() {
    while (!waiting_.empty()) pop();
  }
  OutQueue(const OutQueue&) = delete;
  OutQueue& operator=(const OutQueue&) = delete;

  void push(Item&& item) {
    waiting_.emplace_back();
    if (item.notification) {
      try {
        item.notification->add_waiting(account_);
      } catch (...) {
        waiting_.pop_back();
        throw;
      }
    }
    account_.add_waiting(own_bytes(item));
    bytes_ += size_of(item);
    waiting_.back() = std::move(item);
  }

  /// What does not wait is sent without being queued; what cannot be sent is.
  Sent send(Item&& item, Transport& transport, ConnectionId to) {
    if (!empty()) {
      push(std::move(item));
      return Sent::kFull;
    }
    const Sent sent = send_packets(item, transport, to);
    if (sent != Sent::kAll) push(std::move(item));
    return sent;
  }

  /// Sends in order until about `share` bytes are sent.
  Sent flush(Transport& transport, ConnectionId to, std::size_t share) {
    while (!waiting_.empty()) {
      const Sent sent = send_packets(waiting_.front(), transport, to);
      if (sent != Sent::kAll) return sent;
      const std::size_t size = waiting_.front().packets.size();
      pop();
      if (size >= share) return waiting_.empty() ? Sent::kAll : Sent::kFull;
      share -= size;
    }
    return Sent::kAll;
  }

  bool empty() const { return waiting_.empty(); }
  /// Of the messages that are not yet sent to their last packet.
  std::size_t bytes() const { return bytes_; }
  /// Packets, ever.
  std::uint64_t sent() const { return sent_; }

 private:
  static std::size_t size_of(const Item& item) {
    return item.notification ? item.notification->size() : item.packets.size();
  }
  /// What is this connection's alone.
  static std::size_t own_bytes(const Item& item) {
    return sizeof(Item) + (item.notification ? 0 : item.packets.size());
  }

  /// From `next_packet_` on, which is 0 again after the last.
  Sent send_packets(Item& item, Transport& transport, ConnectionId to) {
    if (!item.packets && item.notification) item.packets = item.notification->encoded();
    if (!item.packets) return Sent::kTooLarge;
    if (item.notification) recent_.hold(item.packets);
    while (next_packet_ < item.packets.packets()) {
      std::byte header[wire::kHeaderSize];
      const auto slice = item.packets.packet_for(next_packet_, item.token, header);
      const auto sent = transport.send_packet(to, header, slice);
      if (sent != Transport::Sent::kDone) return sent == Transport::Sent::kFull ? Sent::kFull : Sent::kGone;
      ++next_packet_;
      ++sent_;
    }
    next_packet_ = 0;
    return Sent::kAll;
  }

  void pop() {
    const Item& item = waiting_.front();
    account_.remove_waiting(own_bytes(item));
    if (item.notification) item.notification->remove_waiting(account_);
    bytes_ -= size_of(item);
    waiting_.pop_front();
    // A deque keeps space for as many as there ever were.
    if (waiting_.empty()) std::deque<Item>().swap(waiting_);
  }

  Account& account_;
  RecentPackets& recent_;
  std::deque<Item> waiting_;
  std::size_t next_packet_ = 0;  // of the first
  std::size_t bytes_ = 0;
  std::uint64_t sent_ = 0;
};

}  // namespace gs::daemon
