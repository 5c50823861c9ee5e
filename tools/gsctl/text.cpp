#include "tools/gsctl/text.h"

#include <array>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <ctime>

#include "common/printable.h"
#include "tools/gsctl/status.h"

namespace gsctl {
namespace {

constexpr std::size_t kShownBytes = 200;
constexpr std::string_view kBase64 = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

std::string base64(std::string_view bytes) {
  std::string text;
  for (std::size_t i = 0; i < bytes.size(); i += 3) {
    unsigned three = 0;
    for (std::size_t k = 0; k < 3; ++k) {
      three = three << 8 | (i + k < bytes.size() ? static_cast<unsigned char>(bytes[i + k]) : 0U);
    }
    for (std::size_t k = 0; k < 4; ++k) text += i + k <= bytes.size() ? kBase64[three >> (18 - 6 * k) & 63] : '=';
  }
  return text;
}

/// Whether all of the text is a number of that type.
bool parse(std::string_view text, short* number) {
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), *number);
  return error == std::errc() && end == text.data() + text.size();
}

/// A time in this form and, after it, milliseconds.
std::string time_text(WallTime time, const char* form, tm* (*convert)(const time_t*, tm*)) {
  const auto milliseconds = std::chrono::duration_cast<std::chrono::milliseconds>(time.time_since_epoch()).count();
  const time_t seconds = milliseconds / 1000;
  tm fields{};
  convert(&seconds, &fields);
  std::array<char, 32> text{};
  const std::size_t length = strftime(text.data(), text.size(), form, &fields);
  std::array<char, 8> fraction{};
  snprintf(fraction.data(), fraction.size(), ".%03d", static_cast<int>(milliseconds % 1000));
  return std::string(text.data(), length) + fraction.data();
}

}  // namespace

Members members_of(const wyx_membership_t* members) {
  if (members == nullptr) return {};
  return {members->gs_providers, members->gs_providers + members->gs_count};
}

std::string bytes_of(const wyx_state_value_t* value) {
  return value == nullptr ? "" : std::string(value->gs_state, static_cast<std::size_t>(value->gs_length));
}

std::string bytes_of(const wyx_provider_message_t* message) {
  return message == nullptr ? "" : std::string(message->gs_message, static_cast<std::size_t>(message->gs_length));
}

std::string to_text(const wyx_provider_t& id) {
  const auto& parts = id._gs_provider_info;
  return std::to_string(parts._gs_instance_number) + "/" + std::to_string(parts._gs_node_number);
}

std::string to_text(const Members& members) {
  std::string text;
  for (const wyx_provider_t& id : members) text += (text.empty() ? "" : " ") + to_text(id);
  return text.empty() ? "none" : text;
}

Json to_json(const wyx_provider_t& id) {
  const auto& parts = id._gs_provider_info;
  return {{"instance", parts._gs_instance_number}, {"node", parts._gs_node_number}};
}

Json to_json(const Members& members) {
  Json list = Json::array();
  for (const wyx_provider_t& id : members) list.push_back(to_json(id));
  return list;
}

std::optional<std::string> from_base64(std::string_view text) {
  std::string bytes;
  if (text.size() % 4 != 0) return std::nullopt;
  for (; !text.empty(); text.remove_prefix(4)) {
    const std::size_t digits = text.size() > 4 ? 4 : text.substr(0, 4).find_last_not_of('=') + 1;
    unsigned four = 0;
    for (std::size_t k = 0; k < 4; ++k) {
      const std::size_t value = k < digits ? kBase64.find(text[k]) : 0;
      if (value == kBase64.npos) return std::nullopt;
      four = four << 6 | static_cast<unsigned>(value);
    }
    if (digits < 2) return std::nullopt;
    for (std::size_t k = 0; k + 1 < digits; ++k) bytes += static_cast<char>(four >> (16 - 8 * k) & 255);
  }
  return bytes;
}

void set_bytes(Json& object, const std::string& name, std::string_view bytes) {
  if (platform::utf8_length(bytes) == bytes.size()) {
    object[name] = std::string(bytes);
  } else {
    object[name + "_base64"] = base64(bytes);
  }
}

std::string quoted(std::string_view bytes) {
  const std::string shown = "\"" + platform::printable(bytes.substr(0, kShownBytes)) + "\"";
  return bytes.size() <= kShownBytes ? shown : shown + "... (" + std::to_string(bytes.size()) + " bytes)";
}

wyx_provider_t id_from(const std::string& text, short this_node) {
  const std::size_t slash = text.find('/');
  wyx_provider_t id{};
  auto& parts = id._gs_provider_info;
  parts._gs_node_number = this_node;
  const bool good = parse(std::string_view(text).substr(0, slash), &parts._gs_instance_number) &&
                    (slash == std::string::npos || parse(text.substr(slash + 1), &parts._gs_node_number));
  if (!good)
    throw Error(kWrongUse, "'" + text + "' is no member's id: give INSTANCE/NODE, as gsctl members shows");
  return id;
}

std::string utc_text(WallTime time) { return time_text(time, "%Y-%m-%dT%H:%M:%S", gmtime_r) + "Z"; }

std::string clock_text(WallTime time) { return time_text(time, "%H:%M:%S", localtime_r); }

std::string explain(wyx_rc_t rc) {
  switch (rc) {
    case WYX_NO_INIT:
      return "the daemon is gone";
    case WYX_NAME_TOO_LONG:
      return "the name is too long: 32 characters for a group, 256 for a member";
    case WYX_NO_MEMORY:
      return "over what a client may have in the daemon: send less, or see gsd's state bounds";
    case WYX_NOT_A_MEMBER:
      return "not a member of the group: join it first";
    case WYX_UNKNOWN_GROUP:
      return "there is no such group: gsctl groups lists those that there are";
    case WYX_BAD_GROUP_ATTRIBUTES:
      return "the group has other attributes than this join: gsctl groups --json shows them";
    case WYX_DUPLICATE_INSTANCE_NUMBER:
      return "the instance number is taken: choose another with --instance";
    case WYX_COLLIDE:
      return "the group is busy with another change: try again, or use --retry";
    case WYX_UNKNOWN_PROVIDER:
      return "there is no such member: gsctl members lists those that there are";
    case WYX_PROVIDER_APPEARS_TWICE:
      return "a member is named twice: name each once";
    case WYX_VOTE_NOT_EXPECTED:
      return "too late: the vote is over";
    case WYX_BAD_PARAMETER:
      return "a name, value or list that the daemon does not take: values are at most 64 KiB, lists 4,096 ids";
    default:
      return std::string("refused with ") + zelt_gscl::gscl_rc_name(rc);
  }
}

std::string protocol_name(wyx_request_t protocol) {
  switch (protocol) {
    case WYX_JOIN:
      return "join";
    case WYX_LEAVE:
      return "leave";
    case WYX_FAILURE_LEAVE:
      return "failure";
    case WYX_EXPEL:
      return "expel";
    case WYX_STATE_VALUE_CHANGE:
      return "state";
    case WYX_PROVIDER_MESSAGE:
      return "message";
    case WYX_GROUP_ATTRIBUTE_CHANGE:
      return "attributes";
    default:
      return zelt_gscl::gscl_request_type_name(protocol);
  }
}

std::string leave_reason(unsigned leave_codes) {
  constexpr unsigned kHostGone = WYX_HOST_FAILURE | WYX_NETWORK_SUNDERED | WYX_HOST_LEAVE_DUE_TO_LOCAL_SPLIT |
                                 WYX_HOST_LEAVE_DUE_TO_REMOTE_SPLIT | WYX_HOST_LEAVE_DUE_TO_LINK_DOWN;
  constexpr unsigned kHostStopped =
      WYX_HOST_LEAVE_DUE_TO_SHUTDOWN | WYX_HOST_LEAVE_DUE_TO_STOP | WYX_HOST_LEAVE_DUE_TO_FORCE_DOWN;
  if (leave_codes & WYX_PROVIDER_EXPELLED) return "expelled";
  if (leave_codes & WYX_PROVIDER_SAID_GOODBYE) return "said_goodbye";
  if (leave_codes & kHostGone) return "host_failed";
  if (leave_codes & kHostStopped) return "host_stopped";
  if (leave_codes & WYX_PROVIDER_FAILURE) return "failed";
  return leave_codes & WYX_VOLUNTARY_LEAVE ? "left" : "gone";
}

}  // namespace gsctl
