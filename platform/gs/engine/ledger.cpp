#include "engine/ledger.h"

#include <algorithm>
#include <utility>

namespace gs {
namespace {

template <typename Key>
std::size_t bytes_of(const std::map<Key, std::size_t>& accounts, const Key& who) {
  const auto found = accounts.find(who);
  return found == accounts.end() ? 0 : found->second;
}

template <typename Key>
void lower(std::map<Key, std::size_t>& accounts, const Key& who, std::size_t bytes) {
  const auto found = accounts.find(who);
  found->second -= bytes;
  if (found->second == 0) accounts.erase(found);
}

bool fits(std::size_t used, std::size_t bytes, std::size_t limit) {
  return used <= limit && bytes <= limit - used;
}

}  // namespace

Ledger::Charge::Charge(Ledger& ledger, const Payer& payer, std::size_t bytes)
    : ledger_(&ledger), payer_(payer), bytes_(bytes) {
  if (bytes == 0) return;
  ledger.sessions_[payer.session] += bytes;
  ledger.users_[payer.user] += bytes;
  ledger.total_ += bytes;
}

Ledger::Charge::Charge(Charge&& other) noexcept
    : ledger_(other.ledger_), payer_(other.payer_), bytes_(std::exchange(other.bytes_, 0)) {}

Ledger::Charge& Ledger::Charge::operator=(Charge&& other) noexcept {
  std::swap(ledger_, other.ledger_);
  std::swap(payer_, other.payer_);
  std::swap(bytes_, other.bytes_);
  return *this;
}

Ledger::Charge::~Charge() {
  if (bytes_ != 0) ledger_->take_back(payer_, bytes_);
}

/// The last eighth of the total is root's: the host's own services go on when the users' programs have the rest.
bool Ledger::has_room(const Payer& payer, std::size_t bytes) const {
  const bool root = payer.user == 0;
  const std::size_t total = root ? limits_.total_bytes : limits_.total_bytes - limits_.total_bytes / 8;
  return fits(bytes_of(sessions_, payer.session), bytes, limits_.session_bytes) &&
         (root || fits(bytes_of(users_, payer.user), bytes, limits_.user_bytes)) && fits(total_, bytes, total);
}

bool Ledger::within_limits() const {
  const auto over = [](std::size_t limit) {
    return [limit](const auto& account) { return account.second > limit; };
  };
  const auto over_for_user = [&](const auto& account) {
    return account.first != 0 && account.second > limits_.user_bytes;
  };
  return total_ <= limits_.total_bytes &&
         std::none_of(sessions_.begin(), sessions_.end(), over(limits_.session_bytes)) &&
         std::none_of(users_.begin(), users_.end(), over_for_user);
}

void Ledger::take_back(const Payer& payer, std::size_t bytes) {
  lower(sessions_, payer.session, bytes);
  lower(users_, payer.user, bytes);
  total_ -= bytes;
}

}  // namespace gs
