#include "client/registry.h"

#include <algorithm>
#include <atomic>
#include <limits>

namespace gs::client {
namespace {

bool changes(const Proposal& proposal, ProviderId id) {
  const auto& changing = proposal.changing_providers;
  return changing && std::find(changing->begin(), changing->end(), id) != changing->end();
}

/// Whether a protocol's notification is the last that provider `id` gets. (An expelled one is told that its group
/// is dissolved after the approval.)
bool ends_membership(const ProtocolNotification& n, ProviderId id, bool joined) {
  if (n.type == WYX_REJECTED_NOTIFICATION) return n.protocol == WYX_JOIN && !joined;
  if (n.type != WYX_APPROVED_NOTIFICATION) return false;
  return (n.protocol == WYX_LEAVE || n.protocol == WYX_FAILURE_LEAVE) && changes(n.proposal, id);
}

bool is_last(const Notification& notification, const Client& client, bool joined) {
  if (const auto* protocol = std::get_if<ProtocolNotification>(&notification)) {
    return ends_membership(*protocol, client.id, joined);
  }
  if (const auto* announcement = std::get_if<AnnouncementNotification>(&notification)) {
    return (announcement->summary & WYX_GROUP_DISSOLVED) != 0;
  }
  if (const auto* subscription = std::get_if<SubscriptionNotification>(&notification)) {
    return (subscription->type & WYX_SUBSCRIPTION_DISSOLVED) != 0;
  }
  const auto& error = std::get<DelayedErrorNotification>(notification);
  return error.protocol == WYX_JOIN || error.protocol == WYX_SUBSCRIPTION;
}

/// From 1, and after the highest from 1 again.
Token next_token() {
  static std::atomic<std::uint32_t> count = 0;
  return static_cast<Token>(count.fetch_add(1) % std::numeric_limits<Token>::max()) + 1;
}

/// Whether a client of this kind can be told it at all.
bool fits(const Notification& notification, Client::Kind kind) {
  bool subscribers = std::holds_alternative<SubscriptionNotification>(notification);
  if (const auto* error = std::get_if<DelayedErrorNotification>(&notification)) {
    subscribers = std::holds_alternative<SubscribeRequest>(error->failing_request) ||
                  std::holds_alternative<UnsubscribeRequest>(error->failing_request);
  }
  return subscribers == (kind == Client::Kind::kSubscriber);
}

bool is_own_join(const Notification& notification, ProviderId id) {
  const auto* n = std::get_if<ProtocolNotification>(&notification);
  return n != nullptr && n->type == WYX_APPROVED_NOTIFICATION && n->protocol == WYX_JOIN &&
         changes(n->proposal, id);
}

}  // namespace

std::optional<Token> Registry::add(const Client& client) {
  MutexLock lock(mutex_);
  if (closed_) return std::nullopt;
  Token token;
  do {
    token = next_token();
  } while (entries_.contains(token));
  entries_.emplace(token, Entry{client, false, false});
  return token;
}

bool Registry::accept(Token token) {
  MutexLock lock(mutex_);
  const auto entry = entries_.find(token);
  if (closed_) {
    if (entry != entries_.end()) entries_.erase(entry);
    return false;
  }
  if (entry != entries_.end()) entry->second.accepted = true;
  return true;
}

void Registry::remove(Token token) {
  MutexLock lock(mutex_);
  entries_.erase(token);
}

bool Registry::has(Token token, Client::Kind kind) {
  MutexLock lock(mutex_);
  const auto entry = entries_.find(token);
  return entry != entries_.end() && entry->second.client.kind == kind;
}

std::optional<Client> Registry::find(Token token) {
  MutexLock lock(mutex_);
  const auto entry = entries_.find(token);
  if (entry == entries_.end()) return std::nullopt;
  return entry->second.client;
}

std::optional<Client> Registry::addressee(Token token, const Notification& notification) {
  MutexLock lock(mutex_);
  const auto entry = entries_.find(token);
  if (entry == entries_.end()) return std::nullopt;
  const Client client = entry->second.client;
  if (!fits(notification, client.kind)) return std::nullopt;
  if (is_own_join(notification, client.id)) entry->second.joined = true;
  if (is_last(notification, client, entry->second.joined)) entries_.erase(entry);
  return client;
}

void Registry::close() {
  MutexLock lock(mutex_);
  closed_ = true;
}

std::map<Token, Registry::Entry>::iterator Registry::oldest_accepted() {
  return std::find_if(entries_.begin(), entries_.end(), [](const auto& entry) { return entry.second.accepted; });
}

std::optional<std::pair<Token, Client>> Registry::take_oldest() {
  MutexLock lock(mutex_);
  const auto oldest = oldest_accepted();
  if (oldest == entries_.end()) return std::nullopt;
  const std::pair<Token, Client> taken(oldest->first, oldest->second.client);
  entries_.erase(oldest);
  return taken;
}

bool Registry::drained() {
  MutexLock lock(mutex_);
  return oldest_accepted() == entries_.end();
}

}  // namespace gs::client
