// Between the values of messages.h and FlatBuffers; the two halves of codec.h.
#pragma once

#include <flatbuffers/flatbuffers.h>

#include <optional>
#include <span>
#include <string>

#include "wire/messages.h"

namespace gs::wire::detail {

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

}  // namespace gs::wire::detail
