// Between the values of messages.h and FlatBuffers; the two halves of codec.h, and what other codecs share of it.
#pragma once

#include <flatbuffers/flatbuffers.h>

#include <optional>
#include <span>
#include <string>

#include "wire/messages.h"

namespace gs::wire::fb {
enum class Request : std::uint8_t;
struct Adapter;
}  // namespace gs::wire::fb

namespace gs::wire::detail {

/// A union's two fields: which member, and where it is.
template <typename Kind>
struct Body {
  Kind kind;
  flatbuffers::Offset<void> value;
};

// A client's message is never taken for a daemon's or the other way round.
inline constexpr char kClientMessageId[] = "GSCM";
inline constexpr char kServerMessageId[] = "GSSM";

/// Leaves the finished FlatBuffer in `builder`.
void build(flatbuffers::FlatBufferBuilder& builder, const ClientMessage& message);
void build(flatbuffers::FlatBufferBuilder& builder, const ServerMessage& message);

std::optional<ClientMessage> parse_client_message(std::span<const std::byte> payload, std::string* error);
/// `token` is the packet header's: a Notify's own, -1 for every other message.
std::optional<ServerMessage> parse_server_message(std::span<const std::byte> payload, Token token,
                                                  std::string* error);

// A request in a message of any schema that includes gs.fbs.

/// To be encoded only where problem_with finds nothing.
Body<fb::Request> put_request(flatbuffers::FlatBufferBuilder& builder, const Request& request);
/// `table` is the union's member, of the type that `kind` says, verified, in a message of `message_size` bytes.
std::optional<Request> read_request(fb::Request kind, const void* table, std::size_t message_size,
                                    std::string* error);

using FbAdapters = flatbuffers::Vector<flatbuffers::Offset<fb::Adapter>>;

/// The same for adapters, at most kMaxAdapters of them.
flatbuffers::Offset<FbAdapters> put_adapters(flatbuffers::FlatBufferBuilder& builder, const Adapters& adapters);
std::optional<Adapters> read_adapters(const FbAdapters& from, std::size_t message_size, std::string* error);

/// The root table of `payload` once it is verified; null: it is not one. Flat, since it is many small functions
/// that every message goes through.
template <typename Table>
[[gnu::flatten]] const Table* verified_root(std::span<const std::byte> payload, const char* id,
                                            std::string* error) {
  constexpr flatbuffers::uoffset_t kMaxDepth = 16;  // of tables in tables; the schemas need six
  const auto* data = reinterpret_cast<const std::uint8_t*>(payload.data());
  flatbuffers::Verifier verifier(data, payload.size(), kMaxDepth);
  if (verifier.VerifyBuffer<Table>(id)) return flatbuffers::GetRoot<Table>(data);
  *error = "not a well-formed message";
  return nullptr;
}

}  // namespace gs::wire::detail
