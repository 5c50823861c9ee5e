// The providers and subscribers of a session, by token.
#pragma once

#include <map>
#include <optional>
#include <utility>

#include "client/mutex.h"
#include "engine/types.h"

namespace gs::client {

/// Where a client's notifications go. Any routine may be null: what it would get is dropped.
struct Client {
  enum class Kind { kProvider, kSubscriber };
  Kind kind = Kind::kProvider;
  wyx_n_phase_cb_t* n_phase = nullptr;
  wyx_approved_cb_t* approved = nullptr;
  wyx_rejected_cb_t* rejected = nullptr;
  wyx_announcement_cb_t* announcement = nullptr;
  wyx_merge_cb_t* merge = nullptr;
  wyx_subscription_cb_t* subscription = nullptr;
  ProviderId id;  // of a provider
};

/// Any thread.
class Registry {
 public:
  /// Before the request goes out, so that no notification can come before it. Tokens count up through the sessions
  /// of a process, so that one from before the session is nobody's. Nothing: the registry is closed.
  std::optional<Token> add(const Client& client);
  /// The request was answered WYX_OK. False: the registry has been closed since, and the client is forgotten.
  bool accept(Token token);
  void remove(Token token);

  bool has(Token token, Client::Kind kind);
  std::optional<Client> find(Token token);
  /// Whom a notification goes to, unless it is unknown or of a kind that is told other things; a client whose last
  /// notification this is, is forgotten.
  std::optional<Client> addressee(Token token, const Notification& notification);

  /// Group services are gone: no client is added or accepted any more.
  void close();
  /// Of a closed registry: forgets the accepted client with the lowest token and returns it.
  std::optional<std::pair<Token, Client>> take_oldest();
  /// Of a closed registry: whether take_oldest has another one.
  bool drained();

 private:
  struct Entry {
    Client client;
    bool accepted = false;
    bool joined = false;  // of a provider: its join was approved
  };
  std::map<Token, Entry>::iterator oldest_accepted() GS_REQUIRES(mutex_);

  Mutex mutex_;
  std::map<Token, Entry> entries_ GS_GUARDED_BY(mutex_);
  bool closed_ GS_GUARDED_BY(mutex_) = false;
};

}  // namespace gs::client
