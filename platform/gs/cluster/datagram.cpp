#include "cluster/datagram.h"

#include <sodium.h>

#include <array>
#include <bit>
#include <cstring>
#include <stdexcept>

#include "cluster/codec.h"
#include "engine/enumerations.h"

namespace gs::cluster {
namespace {

static_assert(std::endian::native == std::endian::little, "datagrams are written as they lie in memory");

struct Head {
  std::uint32_t magic = 0x43445347;  // "GSDC"
  std::uint16_t version = kProtocolVersion;
  std::uint16_t from = 0;
  std::uint64_t begin_life = 0;
  std::uint64_t begin_number = 0;
  std::uint64_t position = 0;
};
static_assert(sizeof(Head) == 32);

using Tag = std::array<unsigned char, 2 * crypto_shorthash_BYTES>;
static_assert(kKeySize == 2 * crypto_shorthash_KEYBYTES);
constexpr std::size_t kSize = sizeof(Head) + sizeof(Tag);

void require_sodium() {
  static const bool works = sodium_init() >= 0;
  if (!works) throw std::runtime_error("libsodium cannot be used");
}

Tag tag_of(std::span<const std::byte> bytes, const std::string& key) {
  require_sodium();
  const auto* data = reinterpret_cast<const unsigned char*>(bytes.data());
  const auto* halves = reinterpret_cast<const unsigned char*>(key.data());
  Tag tag;
  crypto_shorthash(tag.data(), data, bytes.size(), halves);
  crypto_shorthash(tag.data() + crypto_shorthash_BYTES, data, bytes.size(), halves + crypto_shorthash_KEYBYTES);
  return tag;
}

/// False: not what its sender sealed.
bool is_genuine(std::span<const std::byte> content, std::span<const std::byte> tag, const std::string* key) {
  if (key == nullptr || key->size() != kKeySize) return false;
  const Tag right = tag_of(content, *key);
  return sodium_memcmp(right.data(), tag.data(), right.size()) == 0;
}

}  // namespace

std::string new_key() {
  require_sodium();
  std::string key(kKeySize, '\0');
  randombytes_buf(key.data(), key.size());
  return key;
}

std::vector<std::byte> seal(const Confirmed& confirmed, Node from, const std::string& key) {
  const bool asks = !confirmed.ask.empty();
  if (asks || from < 1 || from > kMaxNodeNumber || key.size() != kKeySize || !problem_with(confirmed).empty())
    return {};
  Head head;
  head.from = static_cast<std::uint16_t>(from);
  head.begin_life = confirmed.begin.life;
  head.begin_number = confirmed.begin.number;
  head.position = confirmed.position;
  std::vector<std::byte> bytes(kSize);
  std::memcpy(bytes.data(), &head, sizeof head);
  const Tag tag = tag_of(std::span(bytes).first(sizeof head), key);
  std::memcpy(bytes.data() + sizeof head, tag.data(), tag.size());
  return bytes;
}

std::optional<std::pair<Node, Confirmed>> open(std::span<const std::byte> bytes, const KeyOfNode& key_of_node) {
  if (bytes.size() != kSize) return std::nullopt;
  Head head;
  std::memcpy(&head, bytes.data(), sizeof head);
  if (head.magic != Head().magic || head.version != kProtocolVersion) return std::nullopt;
  const auto content = bytes.first(sizeof head);
  if (!is_genuine(content, bytes.last(sizeof(Tag)), key_of_node(head.from))) return std::nullopt;

  Confirmed confirmed{{head.begin_life, head.begin_number}, head.position, {}};
  if (!problem_with(confirmed).empty()) return std::nullopt;
  return std::pair(Node{head.from}, std::move(confirmed));
}

}  // namespace gs::cluster
