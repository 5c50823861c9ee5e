#include "daemon/accounts.h"

#include <algorithm>

#include "wire/codec.h"

namespace gs::daemon {

ConnectionShare::ConnectionShare(Accounts& accounts, std::uint32_t uid)
    : accounts_(accounts),
      account_(accounts.accounts_
                   .try_emplace(uid, uid, uid == 0 ? accounts.waiting_of_root_ : accounts.waiting_of_others_)
                   .first->second) {
  ++account_.connections;
  ++account_.fresh;
  ++accounts_.connections_;
}

ConnectionShare::~ConnectionShare() {
  settle();
  set_half_received(0);
  --accounts_.connections_;
  if (--account_.connections == 0) accounts_.accounts_.erase(account_.uid());
}

void ConnectionShare::settle() {
  if (fresh_) --account_.fresh;
  fresh_ = false;
}

void ConnectionShare::set_half_received(std::size_t bytes) {
  account_.half_received = account_.half_received - half_received_ + bytes;
  half_received_ = bytes;
}

SessionShare::SessionShare(Accounts& accounts, Account& account) : accounts_(accounts), account_(account) {
  ++account_.sessions;
  ++accounts_.sessions_;
}

SessionShare::~SessionShare() {
  --account_.sessions;
  --accounts_.sessions_;
}

std::size_t Accounts::most_sessions() const {
  return std::min(limits_.max_sessions, limits_.descriptors / kPerSession);
}

/// Where there is room for few, not all of them are root's.
std::size_t Accounts::sessions_for_root() const { return std::min(limits_.root_sessions, most_sessions() / 4); }

const char* Accounts::problem_with_connection(const Account& account) const {
  if (account.is_root()) return nullptr;
  if (account.fresh > kMaxFresh) return "its user has too many connections without a whole session";
  const std::size_t in_use = connections_ + sessions_;
  const std::size_t for_root = kPerSession * sessions_for_root();
  return in_use + for_root > limits_.descriptors ? "the descriptors left are root's" : nullptr;
}

const char* Accounts::problem_with_session(const Account& account) const {
  if (sessions_ >= most_sessions()) return "max-sessions are there";
  if (account.is_root()) return nullptr;
  const std::size_t of_user = limits_.user_sessions != 0 ? limits_.user_sessions : most_sessions() / 4;
  if (account.sessions >= of_user) return "its user has user-sessions";
  return sessions_ + sessions_for_root() >= most_sessions() ? "the sessions left are root's" : nullptr;
}

/// One message always has room.
const char* Accounts::problem_with_half_received(const Account& account) const {
  if (account.is_root()) return nullptr;
  const std::size_t bound = std::max(limits_.user_queue_bound / kInputPart, wire::kMaxClientMessage);
  return account.half_received > bound ? "its user has too many messages half sent" : nullptr;
}

Accounts::Overdraft Accounts::overdraft(std::size_t times) const {
  using Of = Overdraft::Of;
  const std::size_t for_root = limits_.total_queue_bound / kRootPart;
  const std::size_t for_others = limits_.total_queue_bound - for_root;
  if (waiting() <= times * std::min(limits_.user_queue_bound, for_others)) return {};
  const Account* most = nullptr;
  for (const auto& [uid, account] : accounts_) {
    if (!account.is_root() && (most == nullptr || account.waiting() > most->waiting())) most = &account;
  }
  if (most != nullptr && most->waiting() > times * limits_.user_queue_bound) return {Of::kUser, most};
  if (waiting_of_others_ > times * for_others) return {Of::kAllButRoot, most};
  return waiting() > times * limits_.total_queue_bound ? Overdraft{Of::kRoot} : Overdraft{};
}

}  // namespace gs::daemon
