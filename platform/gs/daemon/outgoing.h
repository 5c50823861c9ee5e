// A notification on its way to any number of clients.
#pragma once

#include <algorithm>
#include <deque>
#include <memory>
#include <utility>
#include <vector>

#include "daemon/accounts.h"
#include "wire/codec.h"

namespace gs::daemon {

/// What waits is the notification itself, which shares its large parts with the engine. Its packets are made when
/// the first client has room for them, and are gone when the last one that is sent them at the time has them.
class Outgoing {
 public:
  explicit Outgoing(std::shared_ptr<const Notification> what)
      : what_(std::move(what)), size_(wire::estimated_size(*what_)) {}
  Outgoing(const Outgoing&) = delete;
  Outgoing& operator=(const Outgoing&) = delete;

  const Notification* what() const { return what_.get(); }

  /// About the bytes of its packets.
  std::size_t size() const { return size_; }

  /// The packets; false where they are over the limit of a message.
  wire::Encoded encoded() {
    wire::Encoded packets = packets_.lock();
    if (!packets) {
      packets = wire::encode(wire::Notify{-1, what_});
      packets_ = wire::Encoded::Weak(packets);
    }
    return packets;
  }

  /// It waits for one more client of this user, or for one less.
  void add_waiting(Account& account) {
    for (auto& [user, clients] : waiting_) {
      if (user == &account) return void(++clients);
    }
    waiting_.emplace_back(&account, 1);
    account.add_waiting(size_);
  }
  void remove_waiting(Account& account) {
    const auto of_user =
        std::find_if(waiting_.begin(), waiting_.end(), [&](const auto& w) { return w.first == &account; });
    if (--of_user->second != 0) return;
    waiting_.erase(of_user);
    account.remove_waiting(size_);
  }

 private:
  const std::shared_ptr<const Notification> what_;
  const std::size_t size_;
  wire::Encoded::Weak packets_;
  std::vector<std::pair<Account*, std::size_t>> waiting_;  // for how many clients of whom
};

/// Holds the packets that were sent last for a while: who is sent the same a moment later finds them.
class RecentPackets {
 public:
  void hold(const wire::Encoded& packets) {
    if (!held_.empty() && held_.back() == packets) return;
    held_.push_back(packets);
    bytes_ += packets.size();
    while (bytes_ > kBytes) {
      bytes_ -= held_.front().size();
      held_.pop_front();
    }
  }
  void drop() {
    held_.clear();
    bytes_ = 0;
  }

 private:
  static constexpr std::size_t kBytes = 4 * 1024 * 1024;

  std::deque<wire::Encoded> held_;
  std::size_t bytes_ = 0;
};

}  // namespace gs::daemon
