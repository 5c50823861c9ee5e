#include "control/control.h"

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <limits>

namespace kpl::control {
namespace {

using nlohmann::json;

constexpr int kMaxDepth = 8;

template <class Value>
struct Named {
  Value value;
  const char* name;
};

constexpr Named<Action> kActions[] = {
    {Action::kStart, "start"}, {Action::kStop, "stop"},       {Action::kStatus, "status"},
    {Action::kTrace, "trace"}, {Action::kRefresh, "refresh"}, {Action::kRequest, "request"},
    {Action::kList, "list"},
};
constexpr Named<StopKind> kStopKinds[] = {
    {StopKind::kNormal, "normal"},
    {StopKind::kForced, "forced"},
    {StopKind::kCancel, "cancel"},
};
constexpr Named<Result> kResults[] = {
    {Result::kOk, "ok"},
    {Result::kFailed, "failed"},
    {Result::kNotReached, "not-reached"},
    {Result::kWrongState, "wrong-state"},
    {Result::kNoAnswer, "no-answer"},
    {Result::kNotSupported, "not-supported"},
};

template <class Value, std::size_t N>
const char* name_in(const Named<Value> (&table)[N], Value value) {
  const auto* found =
      std::find_if(std::begin(table), std::end(table), [&](auto& row) { return row.value == value; });
  return found != std::end(table) ? found->name : "unknown";
}

template <class Value, std::size_t N>
Value value_in(const Named<Value> (&table)[N], const std::string& name) {
  const auto* found =
      std::find_if(std::begin(table), std::end(table), [&](auto& row) { return name == row.name; });
  if (found == std::end(table)) throw Malformed("'" + name + "' is unknown");
  return found->value;
}

/// Depth costs stack where a value is written again.
bool check_depth(int depth, json::parse_event_t, const json&) {
  if (depth > kMaxDepth) throw Malformed("the packet is nested too deeply");
  return true;
}

json parse(const std::string& packet) {
  if (packet.size() > kMaxPacket) throw Malformed("the packet is too long");
  json message = json::parse(packet, check_depth, false);
  if (!message.is_object()) throw Malformed("the packet is no JSON object");
  return message;
}

/// A member's text; empty when there is none.
std::string text(const json& message, const char* name) {
  const auto found = message.find(name);
  if (found == message.end()) return {};
  if (!found->is_string()) throw Malformed(std::string(name) + " is no text");
  return found->get<std::string>();
}

bool truth(const json& message, const char* name) {
  const auto found = message.find(name);
  if (found == message.end()) return false;
  if (!found->is_boolean()) throw Malformed(std::string(name) + " is neither true nor false");
  return found->get<bool>();
}

/// A member that fits the subsystems' 16 bits; 0 when there is none.
int number(const json& message, const char* name) {
  const auto found = message.find(name);
  if (found == message.end()) return 0;
  constexpr auto kMin = std::numeric_limits<short>::min();
  constexpr std::uint64_t kMax = std::numeric_limits<short>::max();
  const bool fits = found->is_number_unsigned() ? found->get<std::uint64_t>() <= kMax
                                                : found->is_number_integer() && found->get<std::int64_t>() >= kMin;
  if (!fits) throw Malformed(std::string(name) + " is no number that fits in 16 bits");
  return found->get<int>();
}

Lines lines_of(const json& list) {
  Lines result;
  if (!list.is_array()) throw Malformed("lines is no list");
  for (const json& line : list) {
    if (!line.is_array() || line.size() != 2 || !line[0].is_string() || !line[1].is_string()) {
      throw Malformed("a line is no pair of texts");
    }
    result.lines.push_back({line[0], line[1]});
  }
  return result;
}

json to_json(const Wait& wait) { return {{"wait", wait.seconds}}; }
json to_json(const Message& message) { return {{"message", message.text}}; }
json to_json(const Entry& entry) { return {{"entry", entry.subsystem}}; }
json to_json(const Lines& lines) {
  json list = json::array();
  for (const Line& line : lines.lines) list.push_back(json::array({line.margin, line.body}));
  return {{"lines", std::move(list)}};
}
json to_json(const End& end) { return {{"end", name_of(end.result)}, {"code", end.code}, {"text", end.text}}; }

}  // namespace

const char* name_of(Result result) { return name_in(kResults, result); }

std::string encode(const Request& request) {
  json message = {{"action", name_in(kActions, request.action)}};
  if (!request.subsystem.empty()) message["subsystem"] = request.subsystem;
  if (request.action == Action::kStop) message["stop"] = name_in(kStopKinds, request.stop);
  if (request.action == Action::kTrace) message["on"] = request.on;
  if (request.long_form) message["long"] = true;
  if (request.action == Action::kRequest) {
    message["code"] = request.code;
    message["parm1"] = request.parm1;
    message["parm2"] = request.parm2;
    message["data"] = request.data;
  }
  try {
    return message.dump();
  } catch (const json::type_error&) {
    throw Malformed("only UTF-8 text can be sent");
  }
}

std::string encode(const Answer& answer) {
  const json message = std::visit([](const auto& it) { return to_json(it); }, answer);
  return message.dump(-1, ' ', false, json::error_handler_t::replace);
}

Request decode_request(const std::string& packet) {
  const json message = parse(packet);
  Request request;
  request.action = value_in(kActions, text(message, "action"));
  request.subsystem = text(message, "subsystem");
  if (message.contains("stop")) request.stop = value_in(kStopKinds, text(message, "stop"));
  request.long_form = truth(message, "long");
  request.on = truth(message, "on");
  request.code = number(message, "code");
  request.parm1 = number(message, "parm1");
  request.parm2 = number(message, "parm2");
  request.data = text(message, "data");
  return request;
}

Answer decode_answer(const std::string& packet) {
  const json message = parse(packet);
  if (message.contains("wait")) {
    if (!message["wait"].is_number()) throw Malformed("wait is no number");
    return Wait{message["wait"]};
  }
  if (message.contains("message")) return Message{text(message, "message")};
  if (message.contains("lines")) return lines_of(message["lines"]);
  if (message.contains("entry")) {
    if (!message["entry"].is_object()) throw Malformed("entry is no object");
    return Entry{message["entry"]};
  }
  if (!message.contains("end")) throw Malformed("the answer is of no known kind");
  return End{value_in(kResults, text(message, "end")), number(message, "code"), text(message, "text")};
}

}  // namespace kpl::control
