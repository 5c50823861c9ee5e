// What the clients of each user have of the daemon, and how much they may have, so that no user can keep the
// others, or root, from being served.
#pragma once

#include <cstddef>
#include <cstdint>
#include <limits>
#include <unordered_map>

namespace gs::daemon {

/// One user's share. Users other than root have bounds of their own and leave part of every total to root.
class Account {
 public:
  Account(std::uint32_t uid, std::size_t& waiting_of_all) : uid_(uid), waiting_of_all_(waiting_of_all) {}
  Account(const Account&) = delete;
  Account& operator=(const Account&) = delete;

  bool is_root() const { return uid_ == 0; }
  std::uint32_t uid() const { return uid_; }

  /// Bytes that wait for the user's clients. A notification counts once, however many of them it waits for.
  std::size_t waiting() const { return waiting_; }
  void add_waiting(std::size_t bytes) {
    waiting_ += bytes;
    waiting_of_all_ += bytes;
  }
  void remove_waiting(std::size_t bytes) {
    waiting_ -= bytes;
    waiting_of_all_ -= bytes;
  }

  std::size_t connections = 0;
  std::size_t fresh = 0;          // those that are no part of a session with both its channels yet
  std::size_t half_received = 0;  // bytes of messages that are not yet there to their last packet
  std::size_t sessions = 0;

 private:
  const std::uint32_t uid_;
  std::size_t waiting_ = 0;
  std::size_t& waiting_of_all_;  // of all users but root, or of root
};

/// Where nothing is said there is no limit.
struct ClientLimits {
  static constexpr std::size_t kNone = std::numeric_limits<std::size_t>::max() / 2;

  std::size_t max_sessions = kNone;
  std::size_t user_sessions = 0;          // of a user but root; 0: a quarter of all
  std::size_t root_sessions = 0;          // of all, for root alone
  std::size_t descriptors = kNone;        // for connections, and one for each session
  std::size_t user_queue_bound = kNone;   // bytes
  std::size_t total_queue_bound = kNone;  // bytes
};

/// Accounts live while a ConnectionShare of theirs does.
class Accounts {
 public:
  explicit Accounts(const ClientLimits& limits) : limits_(limits) {}
  Accounts(const Accounts&) = delete;
  Accounts& operator=(const Accounts&) = delete;

  void set_limits(const ClientLimits& limits) { limits_ = limits; }
  const ClientLimits& limits() const { return limits_; }

  /// Why a connection that is counted already cannot stay; null: it can.
  const char* problem_with_connection(const Account& account) const;
  /// Why this user can have no further session; null: it can.
  const char* problem_with_session(const Account& account) const;
  /// Why what is counted already of a message cannot stay; null: it can.
  const char* problem_with_half_received(const Account& account) const;

  /// Bytes that wait for all clients.
  std::size_t waiting() const { return waiting_of_root_ + waiting_of_others_; }
  /// Whose clients together have more waiting than may: those of one user, of all but root, of root. `user`: the
  /// one, or the one of all but root with the most; null: any.
  struct Overdraft {
    enum class Of { kNobody, kUser, kAllButRoot, kRoot } of = Of::kNobody;
    const Account* user = nullptr;
    bool covers(const Account& account) const {
      return user != nullptr ? &account == user : account.is_root() == (of == Of::kRoot);
    }
  };
  /// Over so many times the bounds.
  Overdraft overdraft(std::size_t times) const;

 private:
  static constexpr std::size_t kMaxFresh = 256;  // of a user
  static constexpr std::size_t kRootPart = 8;    // of what may wait in all, one part is root's
  static constexpr std::size_t kInputPart = 4;   // of user_queue_bound, for messages half received
  static constexpr std::size_t kPerSession = 3;  // descriptors: two channels and the process

  friend class ConnectionShare;
  friend class SessionShare;

  std::size_t most_sessions() const;
  std::size_t sessions_for_root() const;

  ClientLimits limits_;
  std::unordered_map<std::uint32_t, Account> accounts_;
  std::size_t connections_ = 0;
  std::size_t sessions_ = 0;
  std::size_t waiting_of_root_ = 0;
  std::size_t waiting_of_others_ = 0;
};

/// A connection, counted for its user.
class ConnectionShare {
 public:
  ConnectionShare(Accounts& accounts, std::uint32_t uid);
  ~ConnectionShare();
  ConnectionShare(const ConnectionShare&) = delete;
  ConnectionShare& operator=(const ConnectionShare&) = delete;

  Account& account() const { return account_; }
  /// Its session has both channels now.
  void settle();
  void set_half_received(std::size_t bytes);

 private:
  Accounts& accounts_;
  Account& account_;
  bool fresh_ = true;
  std::size_t half_received_ = 0;
};

/// A session, counted for its user.
class SessionShare {
 public:
  SessionShare(Accounts& accounts, Account& account);
  ~SessionShare();
  SessionShare(const SessionShare&) = delete;
  SessionShare& operator=(const SessionShare&) = delete;

 private:
  Accounts& accounts_;
  Account& account_;
};

}  // namespace gs::daemon
