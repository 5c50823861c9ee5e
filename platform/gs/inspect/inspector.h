// Asks a daemon about itself and its groups, on a connection that needs no session. tools/gsctl shows how it is
// used.
#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

#include "common/descriptor.h"
#include "inspect/messages.h"
#include "wire/codec.h"

namespace gs::inspect {

class InspectError : public std::runtime_error {
 public:
  enum class Kind {
    kNoDaemon,   // nobody takes connections at the path
    kLost,       // the connection has ended
    kTimeOver,   // no answer in time
    kMalformed,  // what it says makes no sense
  };
  InspectError(Kind kind, const std::string& text) : std::runtime_error(text), kind_(kind) {}
  Kind kind() const { return kind_; }

 private:
  const Kind kind_;
};

/// Not safe for concurrent use. All that it is told is verified; texts are as clients gave them, any bytes. Each
/// call that asks throws InspectError, after which only the destructor may be called.
class Inspector {
 public:
  template <typename T>
  using List = std::vector<std::unique_ptr<T>>;

  /// Connects to the daemon's socket. `patience`: of this and of each answer.
  explicit Inspector(const std::string& path, std::chrono::milliseconds patience = std::chrono::seconds(10));

  DaemonT daemon();
  // Lists are asked for in pages: each is as it was when its page was made.
  /// By name; of `names` those that are there, all where there are none. `contents`: their state values too.
  List<GroupT> groups(const std::vector<std::string>& names = {}, bool contents = false);
  /// All of them, without their attributes.
  List<GroupT> groups_in_brief();
  /// Oldest first, those who join last. Empty: the group is not there.
  List<MemberT> members(const std::string& group);
  List<SubscriberT> subscribers(const std::vector<std::string>& groups = {});
  List<SessionT> sessions();
  List<NodeT> nodes();

  /// From now on this connection brings what happens, in `groups` or in all, of `kinds` or of all, and nothing is
  /// asked on it any more. When this returns nothing is left out. A daemon that stops serving ends the connection.
  void tap(const std::vector<std::string>& groups = {}, bool contents = false, std::vector<Kind> kinds = {});
  /// Asks without waiting for the answer: `next` has it once it is there.
  void send(const AskT& ask);
  /// Readable when `next` has something to say.
  int fd() const { return socket_.get(); }
  /// What has come: an answer, or happenings and how many are missing before them; nothing: no more for now.
  std::optional<ReportT> next();

 private:
  ReportT ask(const AskT& ask);
  template <typename T>
  List<T> all(AskT ask, List<T> ReportT::*list);
  void await(short events, const char* what) const;
  std::optional<ReportT> receive();

  const std::chrono::milliseconds patience_;
  platform::Descriptor socket_;
  wire::Assembler assembler_{wire::kMaxServerMessage};
  std::vector<std::byte> packet_;
};

}  // namespace gs::inspect
