// What waits for one connection to take it: messages in order, their bytes bounded.
#pragma once

#include <deque>

#include "daemon/transport.h"
#include "wire/codec.h"

namespace gs::daemon {

class OutQueue {
 public:
  /// False: nothing was queued, since the waiting bytes would exceed `bound`. An empty queue takes any one
  /// message.
  bool push(const wire::Encoded& message, Token token, std::size_t bound) {
    if (!waiting_.empty() && bytes_ + message.size() > bound) return false;
    waiting_.push_back({message, token, 0});
    bytes_ += message.size();
    return true;
  }

  /// Sends packets in order until all are gone or the transport says kFull or kGone.
  Transport::Sent flush(Transport& transport, ConnectionId to) {
    while (!waiting_.empty()) {
      Item& item = waiting_.front();
      while (item.next_packet < item.message.packets()) {
        std::byte header[wire::kHeaderSize];
        const auto slice = item.message.packet_for(item.next_packet, item.token, header);
        const auto sent = transport.send_packet(to, header, slice);
        if (sent != Transport::Sent::kDone) return sent;
        ++item.next_packet;
      }
      bytes_ -= item.message.size();
      waiting_.pop_front();
    }
    return Transport::Sent::kDone;
  }

  bool empty() const { return waiting_.empty(); }
  /// Of the messages that are not yet sent to their last packet.
  std::size_t bytes() const { return bytes_; }

 private:
  struct Item {
    wire::Encoded message;
    Token token;
    std::size_t next_packet;
  };
  std::deque<Item> waiting_;
  std::size_t bytes_ = 0;
};

}  // namespace gs::daemon
