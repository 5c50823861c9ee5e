// A state on its way from one engine to another: the length of a FlatBuffer in 8 bytes, the FlatBuffer, and of
// each value that it leaves out, in its order, the length in 4 bytes and the value. Lengths begin with their
// lowest byte.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

#include "engine/types.h"

namespace gs {

/// Values are shared with the engine that they are from or go to: to take a snapshot, or to become one, costs what
/// the groups are, however large their values.
class SnapshotBytes {
 public:
  SnapshotBytes() = default;
  SnapshotBytes(std::vector<std::byte> head, std::vector<SharedBytes> values);

  const std::vector<std::byte>& head() const { return head_; }
  const std::vector<SharedBytes>& values() const { return values_; }

  bool empty() const { return head_.empty(); }
  /// In all, lengths too.
  std::uint64_t size() const { return begins_.back(); }
  /// These bytes, or those of them that there are.
  std::vector<std::byte> part(std::uint64_t from, std::uint64_t length) const;
  std::vector<std::byte> all() const { return part(0, size()); }

 private:
  std::vector<std::byte> head_;
  std::vector<SharedBytes> values_;
  std::vector<std::uint64_t> begins_{0};  // of each value, and the end
};

/// Takes up parts, in their order.
class SnapshotReceiver {
 public:
  /// False: these are no bytes of a snapshot.
  bool add(std::span<const std::byte> bytes);
  /// Nothing is missing at its end.
  bool complete() const { return has_head_ && length_.empty(); }
  /// What has come so far.
  SnapshotBytes take() { return {std::move(head_), std::move(values_)}; }

 private:
  std::size_t size_of_length() const { return has_head_ ? sizeof(std::uint32_t) : sizeof(std::uint64_t); }
  bool begin_part();
  void end_part();

  bool has_head_ = false;
  std::vector<std::byte> length_;  // of the part that comes now, as far as it has come
  std::uint64_t missing_ = 0;      // of this part, once its length is there
  std::vector<std::byte> head_;
  Bytes value_;
  std::vector<SharedBytes> values_;
};

}  // namespace gs
