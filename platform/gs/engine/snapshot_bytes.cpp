#include "engine/snapshot_bytes.h"

#include <algorithm>

#include "engine/checks.h"
#include "flatbuffers/flatbuffers.h"

namespace gs {
namespace {

template <typename Length>
std::vector<std::byte> bytes_of(Length length) {
  std::vector<std::byte> bytes(sizeof length);
  flatbuffers::WriteScalar(bytes.data(), length);
  return bytes;
}

}  // namespace

SnapshotBytes::SnapshotBytes(std::vector<std::byte> head, std::vector<SharedBytes> values)
    : head_(std::move(head)), values_(std::move(values)), begins_{sizeof(std::uint64_t) + head_.size()} {
  for (const SharedBytes& value : values_)
    begins_.push_back(begins_.back() + sizeof(std::uint32_t) + value->size());
}

std::vector<std::byte> SnapshotBytes::part(std::uint64_t from, std::uint64_t length) const {
  std::vector<std::byte> part;
  const std::uint64_t to = std::min(size(), from + std::min(length, size()));
  if (from >= to) return part;
  part.reserve(to - from);
  std::uint64_t at = 0;  // where the next bytes are in the whole
  const auto add = [&](std::span<const std::byte> bytes) {
    const std::uint64_t end = at + bytes.size();
    if (from < end && at < to) {
      const auto first = bytes.begin() + static_cast<std::ptrdiff_t>(std::max(from, at) - at);
      part.insert(part.end(), first, bytes.begin() + static_cast<std::ptrdiff_t>(std::min(to, end) - at));
    }
    at = end;
  };
  add(bytes_of(std::uint64_t{head_.size()}));
  add(head_);
  const auto after = std::ranges::upper_bound(begins_, from);  // the first that begins behind `from`
  for (auto i = after == begins_.begin() ? 0 : after - begins_.begin() - 1; begins_[i] < to; ++i) {
    at = begins_[i];
    add(bytes_of(static_cast<std::uint32_t>(values_[i]->size())));
    add(std::as_bytes(std::span(*values_[i])));
  }
  return part;
}

bool SnapshotReceiver::add(std::span<const std::byte> bytes) {
  while (!bytes.empty()) {
    const bool in_length = length_.size() < size_of_length();
    const std::size_t wanted = in_length ? size_of_length() - length_.size() : missing_;
    const auto next = bytes.first(std::min(wanted, bytes.size()));
    bytes = bytes.subspan(next.size());
    if (in_length) {
      length_.insert(length_.end(), next.begin(), next.end());
      if (next.size() == wanted && !begin_part()) return false;
      continue;
    }
    if (has_head_) {
      value_.append(reinterpret_cast<const char*>(next.data()), next.size());
    } else {
      head_.insert(head_.end(), next.begin(), next.end());
    }
    missing_ -= next.size();
    if (missing_ == 0) end_part();
  }
  return true;
}

bool SnapshotReceiver::begin_part() {
  constexpr std::uint64_t kMostOfValue = std::max(kMaxStateValue, kMaxProviderMessage);
  missing_ = has_head_ ? flatbuffers::ReadScalar<std::uint32_t>(length_.data())
                       : flatbuffers::ReadScalar<std::uint64_t>(length_.data());
  if (missing_ > (has_head_ ? kMostOfValue : FLATBUFFERS_MAX_BUFFER_SIZE)) return false;
  if (has_head_) value_.reserve(missing_);
  if (missing_ == 0) end_part();
  return true;
}

void SnapshotReceiver::end_part() {
  if (std::exchange(has_head_, true)) values_.push_back(std::make_shared<const Bytes>(std::exchange(value_, {})));
  length_.clear();
}

}  // namespace gs
