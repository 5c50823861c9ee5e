#include "tools/gsctl/recording.h"

#include <cerrno>
#include <cstring>
#include <limits>

#include "tools/gsctl/status.h"

namespace gsctl {
namespace {

constexpr char kFormat[] = "gsctl recording";
constexpr int kVersion = 1;
constexpr std::int64_t kLatest = 253'402'300'800'000'000;  // microseconds: the year 10000

constexpr const char* kKindNames[] = {"request",  "begin",    "phase",   "vote",  "default_vote",
                                      "approved", "rejected", "failure", "timer", "announcement"};
static_assert(std::size(kKindNames) == static_cast<std::size_t>(inspect::Kind::MAX) + 1);

struct Foreign {
  std::string what;
};

const Json* find(const Json& object, const std::string& field) {
  const auto found = object.find(field);
  return found == object.end() ? nullptr : &*found;
}

std::string text_of(const Json& object, const std::string& field) {
  const Json* value = find(object, field);
  const Json* encoded = find(object, field + "_base64");
  if (value == nullptr && encoded == nullptr) return "";
  if (!(value != nullptr ? value : encoded)->is_string()) throw Foreign{"'" + field + "' is no text"};
  if (value != nullptr) return value->get<std::string>();
  const auto bytes = from_base64(encoded->get<std::string>());
  if (!bytes) throw Foreign{"'" + field + "_base64' is no base 64"};
  return *bytes;
}

template <typename Number>
Number number_of(const Json& object, const std::string& field, Number smallest = 0,
                 Number largest = std::numeric_limits<Number>::max()) {
  const Json* value = find(object, field);
  if (value == nullptr) return Number{};
  const bool negative = value->is_number_integer() && !value->is_number_unsigned();
  const bool fits = negative
                        ? std::cmp_greater_equal(value->get<std::int64_t>(), smallest)
                        : value->is_number_unsigned() && std::cmp_less_equal(value->get<std::uint64_t>(), largest);
  if (!fits) throw Foreign{"'" + field + "' is no number, or out of range"};
  return value->get<Number>();
}

bool flag_of(const Json& object, const std::string& field) {
  const Json* value = find(object, field);
  if (value == nullptr) return false;
  if (!value->is_boolean()) throw Foreign{"'" + field + "' is neither true nor false"};
  return value->get<bool>();
}

const Json& list_of(const Json& object, const std::string& field) {
  static const Json kNone = Json::array();
  const Json* value = find(object, field);
  if (value == nullptr) return kNone;
  if (!value->is_array()) throw Foreign{"'" + field + "' is no list"};
  return *value;
}

inspect::Id id_of(const Json& value) {
  constexpr std::int16_t kSmallest = std::numeric_limits<std::int16_t>::min();
  if (!value.is_object()) throw Foreign{"an id is no object"};
  return {number_of<std::int16_t>(value, "instance", kSmallest),
          number_of<std::int16_t>(value, "node", kSmallest)};
}

std::int64_t time_of(const Json& object) { return number_of<std::int64_t>(object, "time_us", 0, kLatest); }

inspect::HappeningT happening_of(const Json& object, inspect::Kind kind) {
  inspect::HappeningT h;
  h.kind = kind;
  h.time_us = time_of(object);
  h.group = text_of(object, "group");
  h.protocol = text_of(object, "protocol");
  h.number = number_of<std::uint64_t>(object, "number");
  h.phase = number_of<std::uint32_t>(object, "phase");
  h.n_phase = flag_of(object, "n_phase");
  h.event_number = number_of<std::uint64_t>(object, "event");
  if (const Json* who = find(object, "who")) h.who = std::make_unique<inspect::Id>(id_of(*who));
  h.name = text_of(object, "name");
  h.what = text_of(object, "what");
  for (const Json& code : list_of(object, "codes"))
    h.codes.push_back(code.is_string() ? code.get<std::string>() : "");
  for (const Json& id : list_of(object, "changing")) h.changing.push_back(id_of(id));
  h.message = text_of(object, "message");
  return h;
}

void read_header(Recording& recording, const Json& object) {
  if (text_of(object, "format") != kFormat) throw Foreign{"it does not begin as one"};
  const int version = number_of<int>(object, "version");
  if (version != kVersion) throw Foreign{"it is of version " + std::to_string(version) + ", which is not known"};
  recording.started_us = time_of(object);
  for (const Json& group : list_of(object, "groups")) {
    if (!group.is_object()) throw Foreign{"a group is no object"};
    auto& members = recording.groups[text_of(group, "group")];
    for (const Json& member : list_of(group, "members")) {
      members.push_back({id_of(member), text_of(member, "name")});
    }
  }
}

void read_line(Recording& recording, const Json& object) {
  const std::string kind = text_of(object, "kind");
  if (kind == "missed") {
    recording.missed.push_back({number_of<std::uint64_t>(object, "count"), time_of(object)});
    return;
  }
  if (kind == "end") recording.ended_us = time_of(object);
  const auto found = std::find(std::begin(kKindNames), std::end(kKindNames), kind);
  if (found == std::end(kKindNames)) return;  // the end, or of a later gsctl
  const auto number = static_cast<std::uint8_t>(found - std::begin(kKindNames));
  recording.happenings.push_back(happening_of(object, static_cast<inspect::Kind>(number)));
}

Json parsed(const std::string& line) {
  Json object = Json::parse(line, nullptr, false);
  if (!object.is_object()) throw Foreign{"no JSON object"};
  return object;
}

}  // namespace

Json to_json(const inspect::HappeningT& h) {
  Json object = {{"kind", kKindNames[static_cast<std::size_t>(h.kind)]}, {"time_us", h.time_us}};
  set_bytes(object, "group", h.group);
  const auto set = [&](const char* name, const auto& value) {
    if (value != std::decay_t<decltype(value)>{}) object[name] = value;
  };
  set("protocol", h.protocol);
  set("number", h.number);
  set("phase", h.phase);
  set("n_phase", h.n_phase);
  set("event", h.event_number);
  if (h.who) object["who"] = to_json(provider_of(*h.who));
  if (!h.name.empty()) set_bytes(object, "name", h.name);
  set("what", h.what);
  set("codes", h.codes);
  if (!h.changing.empty()) {
    object["changing"] = Json::array();
    for (const inspect::Id& id : h.changing) object["changing"].push_back(to_json(provider_of(id)));
  }
  set("members", h.members);
  set("voters", h.voters);
  set("length", h.state_size);
  if (!h.state.empty()) set_bytes(object, "state", h.state);
  set("message_length", h.message_size);
  if (!h.message.empty()) set_bytes(object, "message", h.message);
  set("state_changed", h.state_changed);
  set("session", h.session);
  set("node", h.node);
  return object;
}

Json missed_json(std::uint64_t count, std::int64_t time_us) {
  return {{"kind", "missed"}, {"time_us", time_us}, {"count", count}};
}

Json end_json(std::int64_t time_us) { return {{"kind", "end"}, {"time_us", time_us}}; }

Json header_json(const Recording& recording) {
  Json groups = Json::array();
  for (const auto& [name, members] : recording.groups) {
    Json group = Json::object();
    set_bytes(group, "group", name);
    group["members"] = Json::array();
    for (const KnownMember& member : members) {
      Json entry = to_json(provider_of(member.id));
      set_bytes(entry, "name", member.name);
      group["members"].push_back(std::move(entry));
    }
    groups.push_back(std::move(group));
  }
  return {{"format", kFormat}, {"version", kVersion}, {"time_us", recording.started_us}, {"groups", groups}};
}

Recording read_recording(std::istream& file, const std::string& name) {
  Recording recording;
  std::string line;
  std::size_t number = 0;
  try {
    while (file.peek() != std::istream::traits_type::eof()) {
      ++number;
      if (file.peek() != '{') throw Foreign{"no JSON object"};  // nor does it need to have an end
      std::getline(file, line);
      if (file.eof() && number > 1) {
        recording.cut = true;
        break;
      }
      const Json object = parsed(line);
      if (number == 1)
        read_header(recording, object);
      else
        read_line(recording, object);
    }
  } catch (const Foreign& foreign) {
    throw Error(kRefused,
                name + " is no recording of gsctl: line " + std::to_string(number) + ": " + foreign.what);
  }
  if (file.bad()) throw Error(kRefused, "cannot read " + name + ": " + strerror(errno));
  if (number == 0) throw Error(kRefused, name + " is empty: make a recording with gsctl record");
  return recording;
}

}  // namespace gsctl
