// Who pays for what the engine keeps: providers, subscribers, state values, proposals, the values of votes.
//
// Each is charged to the session that brought it and to that session's user, from the request on until the engine
// lets go of it. So a program can only use up its own room, whatever the groups are that it shares with others.
// What outlives its session, as a state value may, stays charged to the user.
#pragma once

#include <cstdint>
#include <map>
#include <memory>

#include "engine/limits.h"
#include "engine/types.h"

namespace gs {

/// Whose request it is.
struct Payer {
  SessionId session;
  std::uint32_t user = 0;  // 0: root, whom only the session's and the total limit bind
};

class Ledger {
 public:
  /// Bytes that are paid for until this is destroyed. The ledger outlives it.
  class Charge {
   public:
    Charge() = default;
    Charge(Ledger& ledger, const Payer& payer, std::size_t bytes);
    Charge(Charge&& other) noexcept;
    Charge& operator=(Charge&& other) noexcept;
    ~Charge();
    const Payer& payer() const { return payer_; }

   private:
    Ledger* ledger_ = nullptr;
    Payer payer_;
    std::size_t bytes_ = 0;
  };

  explicit Ledger(const Limits& limits) : limits_(limits) {}
  Ledger(const Ledger&) = delete;
  Ledger& operator=(const Ledger&) = delete;

  /// Whether `bytes` more are within all limits.
  bool has_room(const Payer& payer, std::size_t bytes) const;
  std::size_t total() const { return total_; }
  /// Whether what is charged could have come about under the limits.
  bool within_limits() const;

 private:
  void take_back(const Payer& payer, std::size_t bytes);

  const Limits& limits_;
  std::map<SessionId, std::size_t> sessions_;  // bytes of those who have any
  std::map<std::uint32_t, std::size_t> users_;
  std::size_t total_ = 0;
};

/// Bytes that a group keeps, and the charge for them, which ends with the last copy. Notifications carry the bytes
/// alone.
struct Value {
  SharedBytes bytes;  // null: there is none
  std::shared_ptr<const Ledger::Charge> charge;
  explicit operator bool() const { return bytes != nullptr; }
};

}  // namespace gs
