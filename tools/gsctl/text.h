// How groups' ids, values, changes and times are written and read, for people and in JSON.
#pragma once

#include <chrono>
#include <nlohmann/json.hpp>
#include <string>
#include <string_view>
#include <vector>

#include "gscl/gscl.h"

namespace gsctl {

using Json = nlohmann::ordered_json;
using WallTime = std::chrono::system_clock::time_point;
using Members = std::vector<wyx_provider_t>;

/// Copies; none for null.
Members members_of(const wyx_membership_t* members);
std::string bytes_of(const wyx_state_value_t* value);
std::string bytes_of(const wyx_provider_message_t* message);

/// "INSTANCE/NODE".
std::string to_text(const wyx_provider_t& id);
/// Ids with a blank between them; "none".
std::string to_text(const Members& members);
/// {"instance": I, "node": N}
Json to_json(const wyx_provider_t& id);
Json to_json(const Members& members);

/// What this is the base 64 of; nothing where it is none.
std::optional<std::string> from_base64(std::string_view text);
/// Sets object[name] where the bytes are UTF-8, else object[name + "_base64"].
void set_bytes(Json& object, const std::string& name, std::string_view bytes);
/// In quotation marks, for a line; what is long is cut and its length said.
std::string quoted(std::string_view bytes);

/// "INSTANCE/NODE", or "INSTANCE" on `this_node`. Throws Error: no such thing.
wyx_provider_t id_from(const std::string& text, short this_node);

/// RFC 3339, UTC, milliseconds.
std::string utc_text(WallTime time = std::chrono::system_clock::now());
/// The time of day of the same, local: for lines.
std::string clock_text(WallTime time);

/// What became of a request: a few words without capitals, and what to do where something can be done.
std::string explain(wyx_rc_t rc);
/// "join", "failure", "state" ...: protocols, as the daemon's reports, JSON and the environment name them.
std::string protocol_name(wyx_request_t protocol);
/// Why a provider is gone: "left", "failed", "host_failed", "said_goodbye", "expelled", "gone".
std::string leave_reason(unsigned leave_codes);

}  // namespace gsctl
