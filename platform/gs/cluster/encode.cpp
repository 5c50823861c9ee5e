#include <algorithm>

#include "cluster/codec.h"
#include "cluster_generated.h"
#include "wire/fb_codec.h"

namespace gs::cluster {
namespace {

using Builder = flatbuffers::FlatBufferBuilder;
using EventBody = wire::detail::Body<fb::Event>;
using MessageBody = wire::detail::Body<fb::Body>;

fb::BeginId pack(const BeginId& id) { return {id.life, id.number}; }
fb::RingId pack(const RingId& ring) { return {ring.sequence, ring.node}; }
fb::Process pack(const Process& process) { return {process.node, process.pid}; }
fb::OfNode pack(const std::pair<const Node, std::uint32_t>& entry) { return {entry.first, entry.second}; }
fb::SessionId pack(const SessionId& session) { return {session.node, session.number}; }

template <typename Packed, typename List>
flatbuffers::Offset<flatbuffers::Vector<const Packed*>> put(Builder& b, const List& list) {
  Packed* out = nullptr;
  const auto offset = b.CreateUninitializedVectorOfStructs<Packed>(list.size(), &out);
  std::transform(list.begin(), list.end(), out, [](const auto& value) { return pack(value); });
  return offset;
}

template <typename Content>
flatbuffers::Offset<flatbuffers::Vector<std::uint8_t>> put_bytes(Builder& b, const Content& bytes) {
  return b.CreateVector(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
}

// -------------------------------------------------------------------------------------------------- events

EventBody body(Builder& b, const RequestEvent& e) {
  const auto session = pack(e.session);
  const auto request = wire::detail::put_request(b, e.request);
  return {fb::Event::Asked, fb::CreateAsked(b, &session, e.user, e.answered, request.kind, request.value).Union()};
}
EventBody body(Builder& b, const SessionGoneEvent& e) {
  const auto session = pack(e.session);
  return {fb::Event::SessionGone, fb::CreateSessionGone(b, &session).Union()};
}
EventBody body(Builder& b, const TimerExpiredEvent& e) {
  const auto group = b.CreateString(e.timer.group);
  return {fb::Event::TimerExpired, fb::CreateTimerExpired(b, group, e.timer.protocol, e.timer.phase).Union()};
}
EventBody body(Builder& b, const ResponsivenessEvent& e) {
  const auto session = pack(e.session);
  return {fb::Event::Responsiveness, fb::CreateResponsiveness(b, &session, e.responding).Union()};
}
EventBody body(Builder& b, const ContinueEvent&) { return {fb::Event::Continue, fb::CreateContinue(b).Union()}; }
EventBody body(Builder& b, const AdaptersEvent& e) {
  const auto adapters = wire::detail::put_adapters(b, e.adapters);
  return {fb::Event::HasAdapters, fb::CreateHasAdapters(b, e.node, adapters).Union()};
}

// Refused by problem_with.
EventBody body(Builder&, const HostGoneEvent&) { return {}; }
EventBody body(Builder&, const HostCameEvent&) { return {}; }
EventBody body(Builder&, const NumbersEvent&) { return {}; }

// ------------------------------------------------------------------------------------------------ messages

MessageBody body(Builder& b, const Begin& m) {
  const auto id = pack(m.id);
  const auto ring = pack(m.ring);
  const auto asked = put<fb::Process>(b, m.asked);
  const auto votes = put<fb::OfNode>(b, m.votes);
  return {fb::Body::Begin, fb::CreateBegin(b, &id, &ring, asked, votes, m.needed, m.clock).Union()};
}
MessageBody body(Builder& b, const Word& m) {
  const auto begin = pack(m.begin);
  const History own = m.history.value_or(History());
  const fb::History history(own.ring, own.exchanges, own.messages, own.digest);
  const auto address = b.CreateString(m.address);
  const auto key = put_bytes(b, m.key);
  const auto left = put<fb::OfNode>(b, m.left);
  return {fb::Body::Word, fb::CreateWord(b, &begin, m.version, m.life, m.history ? &history : nullptr, address,
                                         key, m.limits, left)
                              .Union()};
}
MessageBody body(Builder& b, const Ordered& m) {
  const auto event = std::visit([&b](const auto& e) { return body(b, e); }, *m.event);
  return {fb::Body::Ordered, fb::CreateOrdered(b, m.life, m.number, event.kind, event.value).Union()};
}
MessageBody body(Builder& b, const Piece& m) {
  const auto bytes = put_bytes(b, m.bytes);
  return {fb::Body::Piece, fb::CreatePiece(b, m.index, m.count, bytes).Union()};
}
MessageBody body(Builder& b, const Confirmed& m) {
  const auto begin = pack(m.begin);
  const auto ask = b.CreateVector(m.ask);
  return {fb::Body::Confirmed, fb::CreateConfirmed(b, &begin, m.position, ask).Union()};
}
MessageBody body(Builder& b, const Evict& m) {
  const auto ring = pack(m.ring);
  const auto who = put<fb::Process>(b, m.who);
  return {fb::Body::Evict, fb::CreateEvict(b, &ring, who).Union()};
}

}  // namespace

std::vector<std::byte> encode(const Message& message) {
  if (!problem_with(message).empty()) return {};
  Builder builder;
  const auto whole = std::visit([&builder](const auto& m) { return body(builder, m); }, message);
  builder.Finish(fb::CreateMessage(builder, whole.kind, whole.value), fb::MessageIdentifier());
  const auto bytes = std::as_bytes(builder.GetBufferSpan());
  return {bytes.begin(), bytes.end()};
}

}  // namespace gs::cluster
