#include <algorithm>
#include <cstring>

#include "cluster/codec.h"
#include "cluster_generated.h"
#include "wire/fb_codec.h"

namespace gs::cluster {
namespace {

BeginId value(const fb::BeginId* id) { return {id->life(), id->number()}; }
RingId value(const fb::RingId* ring) { return {ring->sequence(), ring->node()}; }
Process value(const fb::Process* process) { return {process->node(), process->pid()}; }
SessionId value(const fb::SessionId* session) { return {session->node(), session->number()}; }
History value(const fb::History* h) { return {h->ring(), h->exchanges(), h->messages(), h->digest()}; }

template <typename Content>
Content bytes_of(const flatbuffers::Vector<std::uint8_t>* bytes) {
  const auto* data = reinterpret_cast<const typename Content::value_type*>(bytes->data());
  return Content(data, data + bytes->size());
}

constexpr const char* kUnordered = "nodes that do not ascend";

/// Turns a verified FlatBuffer into values; whether they are within the limits is not looked at yet. No part is
/// read more often than a few times, so that no more is made of a message than a few times its size.
class Reader {
 public:
  Reader(std::size_t message_size, std::string* error) : message_size_(message_size), error_(error) {}

  std::optional<Message> message(const fb::Message& m);

 private:
  std::optional<Message> fail(const char* why) {
    *error_ = why;
    return std::nullopt;
  }

  std::vector<Process> processes(const flatbuffers::Vector<const fb::Process*>* from) {
    std::vector<Process> result;
    result.reserve(from->size());
    for (const fb::Process* process : *from) result.push_back(value(process));
    return result;
  }

  /// False: not each node once, in order.
  bool read(const flatbuffers::Vector<const fb::OfNode*>* from, std::map<Node, std::uint32_t>& into) {
    for (const fb::OfNode* entry : *from) {
      if (!into.empty() && entry->node() <= into.rbegin()->first) return false;
      into.emplace_hint(into.end(), entry->node(), entry->value());
    }
    return true;
  }

  std::optional<Message> value_of(const fb::Begin* m) {
    Begin result{value(m->id()), value(m->ring()), processes(m->asked()), {}, m->needed(), m->clock()};
    if (!read(m->votes(), result.votes)) return fail(kUnordered);
    return result;
  }
  std::optional<Message> value_of(const fb::Word* m) {
    Word result{value(m->begin()),   m->version(),
                m->life(),           {},
                m->address()->str(), bytes_of<std::string>(m->key()),
                m->limits(),         {}};
    if (m->history() != nullptr) result.history = value(m->history());
    if (!read(m->left(), result.left)) return fail(kUnordered);
    return result;
  }
  std::optional<Message> value_of(const fb::Ordered* m) {
    auto read = event(*m);
    if (!read) return std::nullopt;
    return Ordered{m->life(), m->number(), std::make_shared<const Event>(std::move(*read)), message_size_};
  }
  std::optional<Message> value_of(const fb::Piece* m) {
    return Piece{m->index(), m->count(), bytes_of<std::vector<std::byte>>(m->bytes())};
  }
  std::optional<Message> value_of(const fb::Confirmed* m) {
    return Confirmed{value(m->begin()), m->position(), {m->ask()->begin(), m->ask()->end()}};
  }
  std::optional<Message> value_of(const fb::Evict* m) { return Evict{value(m->ring()), processes(m->who())}; }

  std::optional<Event> event(const fb::Ordered& m);
  std::optional<Event> request_event(const fb::Asked& e) {
    auto request = wire::detail::read_request(e.request_type(), e.request(), message_size_, error_);
    if (!request) return std::nullopt;
    return RequestEvent{value(e.session()), std::move(*request), e.answered(), e.user()};
  }

  std::optional<Event> adapters_event(const fb::HasAdapters& e) {
    auto adapters = wire::detail::read_adapters(*e.adapters(), message_size_, error_);
    if (!adapters) return std::nullopt;
    return AdaptersEvent{e.node(), std::move(*adapters)};
  }

  const std::size_t message_size_;
  std::string* const error_;
};

std::optional<Event> Reader::event(const fb::Ordered& m) {
  switch (m.event_type()) {
    case fb::Event::Asked:
      return request_event(*m.event_as_Asked());
    case fb::Event::SessionGone:
      return SessionGoneEvent{value(m.event_as_SessionGone()->session())};
    case fb::Event::TimerExpired: {
      const auto* expired = m.event_as_TimerExpired();
      return TimerExpiredEvent{{expired->group()->str(), expired->protocol(), expired->phase()}};
    }
    case fb::Event::Responsiveness:
      return ResponsivenessEvent{value(m.event_as_Responsiveness()->session()),
                                 m.event_as_Responsiveness()->responding()};
    case fb::Event::Continue:
      return ContinueEvent{};
    case fb::Event::HasAdapters:
      return adapters_event(*m.event_as_HasAdapters());
    case fb::Event::NONE:
      break;
  }
  *error_ = "an event of an unknown kind";
  return std::nullopt;
}

std::optional<Message> Reader::message(const fb::Message& m) {
  switch (m.body_type()) {
    case fb::Body::Begin:
      return value_of(m.body_as_Begin());
    case fb::Body::Word:
      return value_of(m.body_as_Word());
    case fb::Body::Ordered:
      return value_of(m.body_as_Ordered());
    case fb::Body::Piece:
      return value_of(m.body_as_Piece());
    case fb::Body::Confirmed:
      return value_of(m.body_as_Confirmed());
    case fb::Body::Evict:
      return value_of(m.body_as_Evict());
    case fb::Body::NONE:
      break;
  }
  return fail("a message of an unknown kind");
}

std::optional<Message> decode_aligned(std::span<const std::byte> bytes, std::string* error) {
  const auto* root = wire::detail::verified_root<fb::Message>(bytes, fb::MessageIdentifier(), error);
  if (root == nullptr) return std::nullopt;
  auto message = Reader(bytes.size(), error).message(*root);
  if (!message) return std::nullopt;
  std::string problem = problem_with(*message);
  if (problem.empty()) return message;
  *error = std::move(problem);
  return std::nullopt;
}

}  // namespace

std::optional<Message> decode(std::span<const std::byte> bytes, std::string* error) {
  if (bytes.size() > kMaxMessage) {
    *error = "a message over the limit";
    return std::nullopt;
  }
  // A FlatBuffer is read where it lies, its numbers where they are aligned.
  if (reinterpret_cast<std::uintptr_t>(bytes.data()) % alignof(std::uint64_t) == 0) {
    return decode_aligned(bytes, error);
  }
  return decode_aligned(std::vector<std::byte>(bytes.begin(), bytes.end()), error);
}

}  // namespace gs::cluster
