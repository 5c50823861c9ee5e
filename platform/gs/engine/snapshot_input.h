// What the readers of a snapshot's parts have in common.
#pragma once

#include <algorithm>
#include <span>
#include <string>
#include <utility>

#include "engine/checks.h"
#include "engine/enumerations.h"
#include "engine/snapshot_bytes.h"
#include "engine/state.h"
#include "snapshot_generated.h"

namespace gs {

/// A verified FlatBuffer that is being read. A reader's calls return false when something is wrong, having said
/// what; nothing is read after that.
class SnapshotInput {
 public:
  SnapshotInput(const SnapshotBytes& from, std::string* error)
      : left_(from.head().size()), values_(from.values()), error_(error) {}

  bool fail(const std::string& what) {
    *error_ = "snapshot: " + (where_.empty() ? what : "group " + where_ + ": " + what);
    return false;
  }
  bool require(bool holds, const char* otherwise) { return holds || fail(otherwise); }
  /// Of which group the next errors are; empty: of none.
  void set_where(std::string where) { where_ = std::move(where); }

  /// Parts of a FlatBuffer may lie in one another, and little could grow to more than there is memory. True: the
  /// parts read so far are no larger than the snapshot.
  bool take(std::size_t size) {
    const bool fits = size <= left_;
    left_ -= std::min(size, left_);
    return require(fits, "parts that lie in one another");
  }
  /// The least that a table is: its offset in a vector, its own to its layout.
  bool take_table() { return take(2 * sizeof(flatbuffers::uoffset_t)); }

  template <typename E>
  bool enumeration(int value, E& into) {
    if (!known(static_cast<E*>(nullptr), value)) return fail("a number that is no value of its enumeration");
    into = static_cast<E>(value);
    return true;
  }
  bool bytes(const flatbuffers::Vector<std::uint8_t>* from, std::size_t limit, Bytes& into) {
    if (!take(from->size()) || !require(from->size() <= limit, "a value over the limit")) return false;
    into.assign(reinterpret_cast<const char*>(from->data()), from->size());
    return true;
  }
  /// The next one of those behind the FlatBuffer.
  bool value(SharedBytes& into) {
    if (!require(!values_.empty(), "a value that is missing")) return false;
    into = values_.front();
    values_ = values_.subspan(1);
    return true;
  }
  bool no_more_values() { return require(values_.empty(), "a value that is nobody's"); }
  bool name(const flatbuffers::String* from, std::size_t limit, std::string& into) {
    if (!take(from->size()) || !require(from->size() <= limit, "a name over the limit")) return false;
    into = from->str();
    return true;
  }
  bool attributes(const snapshot::fb::Attributes* from, const std::string& group, GroupAttributes& into);

 private:
  std::size_t left_;                     // bytes that no part has taken
  std::span<const SharedBytes> values_;  // that have not been read
  std::string where_;
  std::string* error_;
};

inline SessionId value_of(const snapshot::fb::Session* s) { return {s->node(), s->number()}; }
inline ProviderId value_of(const snapshot::fb::ProviderId* id) { return {id->instance(), id->node()}; }

/// One group and its providers' entries in the client table. `group` is as new.
class GroupReader {
 public:
  GroupReader(SnapshotInput& in, const snapshot::fb::Group& from, EngineState& state, Group& group)
      : in_(in), from_(from), state_(state), group_(group) {}
  bool read();

 private:
  using Indices = flatbuffers::Vector<std::uint32_t>;

  bool read_values();
  bool read_providers();
  bool read_provider(const snapshot::fb::Provider& from);
  bool read_ballot(const snapshot::fb::Ballot& from, Ballot& into);
  bool read_members();
  bool read_run(const snapshot::fb::Run& from);
  bool read_proposal(const snapshot::fb::Run& from, Group::Run& run);
  bool read_expel(const snapshot::fb::Expel& from, Group::Run& run);
  bool read_changing(const snapshot::fb::Run& from, Group::Run& run);
  bool read_voters(const snapshot::fb::Run& from, Group::Run& run);
  bool read_failures();
  bool read_queue();
  bool read_queued(const snapshot::fb::Queued& from);
  bool read_announcements();

  bool check_changing(const Group::Run& run);
  bool check_voter(const Member& voter);
  bool check_providers();
  bool check_provider(const Member& m, bool has_failed);
  bool enter_clients();

  bool value_at(std::uint32_t reference, Value& into);
  bool provider_at(std::uint32_t index, MemberPtr& into);
  /// Each at most once.
  template <typename List>
  bool providers_at(const Indices& indices, List& into);

  SnapshotInput& in_;
  const snapshot::fb::Group& from_;
  EngineState& state_;
  Group& group_;
  std::vector<Value> values_;
  std::vector<MemberPtr> providers_;
};

/// Enters it; false: a client like this cannot be.
bool enter_client(SnapshotInput& in, EngineState& state, const Endpoint& who, Client client);

}  // namespace gs
