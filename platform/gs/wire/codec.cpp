#include "wire/codec.h"

#include <algorithm>
#include <bit>
#include <cstring>

#include "engine/enumerations.h"
#include "wire/fb_codec.h"

namespace gs::wire {
namespace {

static_assert(std::endian::native == std::endian::little, "packet headers are written as they lie in memory");

constexpr std::uint32_t kMagic = 0x50445347;  // "GSDP"
constexpr std::uint16_t kPacketVersion = 1;   // of header and slicing; the schema has kProtocolVersion
constexpr std::uint16_t kFirst = 1;           // flag: first packet of its message
constexpr std::uint16_t kLast = 2;            // flag: last packet of its message

struct Header {
  std::uint32_t magic = kMagic;
  std::uint16_t version = kPacketVersion;
  std::uint16_t flags = 0;
  Token token = -1;
  std::uint32_t length = 0;  // bytes of the whole FlatBuffer
};
static_assert(sizeof(Header) == kHeaderSize);

constexpr std::size_t kKeptBuffer = 4096;      // bytes that an idle Assembler holds on to
constexpr std::size_t kShort = 512;            // bytes of a payload
constexpr std::size_t kKeptBuilder = 1 << 20;  // bytes that a thread's builder holds on to

/// Every thread builds in its own buffer, which grows to what it needs and stays, so that encoding allocates the
/// finished payload and nothing else.
class ThreadBuilder {
 public:
  flatbuffers::FlatBufferBuilder& fresh() {
    if (builder_.GetSize() > kKeptBuilder) {
      builder_.Reset();
    } else {
      builder_.Clear();
    }
    return builder_;
  }

 private:
  flatbuffers::FlatBufferBuilder builder_;
};
thread_local ThreadBuilder thread_builder;

std::size_t bulk(const SharedBytes& bytes) { return bytes ? bytes->size() : 0; }
std::size_t bulk(const std::optional<Bytes>& bytes) { return bytes ? bytes->size() : 0; }
std::size_t bulk(const SharedMembership& members) { return members ? members->size() * sizeof(ProviderId) : 0; }

std::size_t bulk(const SharedVoteResults& results) {
  if (!results) return 0;
  std::size_t total = 0;
  for (const VoteResult& r : *results) total += 64 + bulk(r.proposed_state) + bulk(r.message);
  return total;
}

std::size_t bulk(const Request& request);

/// Bytes of the parts that can be large: enough to keep FlatBuffers from ever being given more than it can hold.
std::size_t bulk(const Notification& notification) {
  if (const auto* n = std::get_if<ProtocolNotification>(&notification)) {
    const Proposal& p = n->proposal;
    return bulk(p.current_providers) + 3 * bulk(p.changing_providers) + bulk(p.current_state) +
           bulk(p.proposed_state) + bulk(p.message) + bulk(p.current_vote_results) + bulk(p.changing_vote_results);
  }
  if (const auto* n = std::get_if<SubscriptionNotification>(&notification)) {
    return bulk(n->state) + bulk(n->full_membership) + 3 * bulk(n->changing_membership);
  }
  if (const auto* n = std::get_if<AnnouncementNotification>(&notification)) return bulk(n->providers);
  return bulk(std::get<DelayedErrorNotification>(notification).failing_request);
}

// -------------------------------------------------------------------------------- what a request must keep to

/// The number in `value`, also when it is none of the enumeration's.
template <typename E>
bool known_value(const E& value) {
  static_assert(sizeof(E) == sizeof(int));
  int number = 0;
  std::memcpy(&number, &value, sizeof number);
  return known(static_cast<E*>(nullptr), number);
}

bool fits(const std::string& name) { return name.size() <= kMaxWireName && name.find('\0') == std::string::npos; }
bool names_fit(const GroupAttributes& a) { return fits(a.group_name) && fits(a.source_group_name); }
bool enumerations_known(const GroupAttributes& a) {
  return known_value(a.batch_control) && known_value(a.num_phases) &&
         known_value(a.source_reflection_num_phases) && known_value(a.default_vote) &&
         known_value(a.merge_control);
}

bool names_fit(const JoinRequest& r) { return names_fit(r.attributes) && fits(r.local_name); }
bool names_fit(const AttributeChangeRequest& r) { return names_fit(r.attributes); }
bool names_fit(const SubscribeRequest& r) { return fits(r.group_name); }
template <typename R>
bool names_fit(const R&) {
  return true;
}

bool enumerations_known(const JoinRequest& r) { return enumerations_known(r.attributes); }
bool enumerations_known(const AttributeChangeRequest& r) {
  return enumerations_known(r.attributes) && known_value(r.terms.num_phases);
}
bool enumerations_known(const VoteRequest& r) { return known_value(r.vote) && known_value(r.default_vote); }
template <typename R>
bool enumerations_known(const R& r) {
  if constexpr (requires { r.terms; }) return known_value(r.terms.num_phases);
  return true;
}

std::size_t bulk_of(const StateChangeRequest& r) { return r.new_state.size(); }
std::size_t bulk_of(const MessageRequest& r) { return r.message.size(); }
std::size_t bulk_of(const ExpelRequest& r) {
  return r.expelled.size() * sizeof(ProviderId) + r.deactivate_flag.size();
}
std::size_t bulk_of(const VoteRequest& r) { return bulk(r.proposed_state) + bulk(r.message); }
template <typename R>
std::size_t bulk_of(const R&) {
  return 0;
}
std::size_t bulk(const Request& request) {
  return std::visit([](const auto& r) { return bulk_of(r); }, request);
}

constexpr std::size_t kRequestFrame = 1024;  // bytes, more than a request needs beside its bulk
constexpr const char* kBulkProblem = "a payload that does not fit a message";
bool bulk_fits(const Request& request) { return bulk(request) <= kMaxClientMessage - kRequestFrame; }
constexpr std::size_t kNotificationFrame = 512;  // bytes, what a notification mostly needs beside its bulk

}  // namespace

std::size_t estimated_size(const Notification& notification) { return bulk(notification) + kNotificationFrame; }

const char* problem_with(const Request& request) {
  if (!bulk_fits(request)) return kBulkProblem;
  return std::visit(
      [](const auto& r) -> const char* {
        if (!names_fit(r)) return "a name over the limit or with a NUL in it";
        if (!enumerations_known(r)) return "a number that is no value of its enumeration";
        return nullptr;
      },
      request);
}

// ------------------------------------------------------------------------------------------------ sending

Encoded::Encoded(const std::uint8_t* payload, std::size_t length, std::size_t limit) {
  if (length > limit) return;
  // Not cleared. Short ones lie together with their counters, and stay while somebody may look for them again.
  std::shared_ptr<std::byte[]> bytes = length <= kShort ? std::make_shared_for_overwrite<std::byte[]>(length)
                                                        : std::shared_ptr<std::byte[]>(new std::byte[length]);
  std::memcpy(bytes.get(), payload, length);
  payload_ = std::move(bytes);
  length_ = length;
}

std::span<const std::byte> Encoded::packet_for(std::size_t index, Token token,
                                               std::span<std::byte, kHeaderSize> header) const {
  const std::size_t start = index * kMaxSlice;
  const std::size_t size = std::min(kMaxSlice, length_ - start);
  Header fields;
  fields.token = token;
  fields.length = static_cast<std::uint32_t>(length_);
  if (index == 0) fields.flags |= kFirst;
  if (start + size == length_) fields.flags |= kLast;
  std::memcpy(header.data(), &fields, sizeof fields);
  return {payload_.get() + start, size};
}

Encoded Encoded::view(const std::uint8_t* payload, std::size_t length, std::size_t limit) {
  Encoded packets;
  if (length > limit) return packets;
  packets.payload_ = {packets.payload_, reinterpret_cast<const std::byte*>(payload)};  // of nobody's
  packets.length_ = length;
  return packets;
}

Encoded encode_for_now(const ClientMessage& message) {
  const auto* call = std::get_if<Call>(&message);
  if (call != nullptr && problem_with(call->request) != nullptr) return {};
  auto& builder = thread_builder.fresh();
  detail::build(builder, message);
  return Encoded::view(builder.GetBufferPointer(), builder.GetSize(), kMaxClientMessage);
}

Encoded encode(const ClientMessage& message) {
  const Encoded packets = encode_for_now(message);
  if (!packets) return packets;
  return {reinterpret_cast<const std::uint8_t*>(packets.payload_.get()), packets.length_, kMaxClientMessage};
}

Encoded encode(const ServerMessage& message) {
  const auto* notify = std::get_if<Notify>(&message);
  if (notify != nullptr && bulk(*notify->what) > kMaxServerMessage) return {nullptr, 1, 0};
  auto& builder = thread_builder.fresh();
  detail::build(builder, message);
  return {builder.GetBufferPointer(), builder.GetSize(), kMaxServerMessage};
}

// ---------------------------------------------------------------------------------------------- receiving

bool Assembler::fail(std::string* error, const char* why) {
  failed_ = true;
  reset();
  *error = why;
  return false;
}

void Assembler::reset() {
  expected_ = 0;
  buffer_.clear();
  if (buffer_.capacity() > kKeptBuffer) buffer_.shrink_to_fit();
}

bool Assembler::add(std::span<const std::byte> packet, std::string* error) {
  if (failed_) return fail(error, "a packet after a malformed one");
  if (complete()) return fail(error, "a packet while a message waits to be taken");
  if (packet.size() > kMaxPacket) return fail(error, "a packet over the limit");
  if (packet.size() <= kHeaderSize) return fail(error, "a packet that is cut off");
  Header header;
  std::memcpy(&header, packet.data(), sizeof header);
  const auto slice = packet.subspan(kHeaderSize);
  if (header.magic != kMagic) return fail(error, "a packet that does not begin with the magic number");
  if (header.version != kPacketVersion) return fail(error, "a packet of another version");
  if ((header.flags & ~(kFirst | kLast)) != 0) return fail(error, "a packet with unknown flags");
  if (header.length > max_message_) return fail(error, "a message over the limit");

  const bool first = (header.flags & kFirst) != 0;
  if (first != (expected_ == 0)) return fail(error, "a packet out of order");
  if (!first && (header.length != expected_ || header.token != token_)) {
    return fail(error, "a packet that does not belong to its message");
  }
  const std::size_t left = header.length - buffer_.size();
  const bool last = (header.flags & kLast) != 0;
  if (slice.size() != std::min(left, kMaxSlice) || last != (slice.size() == left)) {
    return fail(error, "a packet whose length is not what its header says");
  }
  expected_ = header.length;
  token_ = header.token;
  buffer_.insert(buffer_.end(), slice.begin(), slice.end());
  return true;
}

std::optional<ClientMessage> Assembler::take_client_message(std::string* error) {
  if (!complete() || token_ != -1) {
    fail(error, complete() ? "a token on a message that has none" : "no whole message");
    return std::nullopt;
  }
  auto message = detail::parse_client_message(buffer_, error);
  const auto* call = message ? std::get_if<Call>(&*message) : nullptr;
  if (call != nullptr && !bulk_fits(call->request)) {
    fail(error, kBulkProblem);
    message.reset();
  }
  if (!message) failed_ = true;
  reset();
  return message;
}

std::optional<ServerMessage> Assembler::take_server_message(std::string* error) {
  if (!complete()) {
    fail(error, "no whole message");
    return std::nullopt;
  }
  auto message = detail::parse_server_message(buffer_, token_, error);
  if (!message) failed_ = true;
  reset();
  return message;
}

}  // namespace gs::wire
