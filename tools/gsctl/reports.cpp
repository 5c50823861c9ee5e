#include "tools/gsctl/reports.h"

#include <pwd.h>

#include <algorithm>
#include <array>
#include <cstdio>

namespace gsctl {
namespace {

/// A number with one digit behind the point where it is small.
std::string short_number(double number) {
  std::array<char, 32> text{};
  snprintf(text.data(), text.size(), number < 10 ? "%.1f" : "%.0f", number);
  return text.data();
}

Json age_json(std::int64_t age) { return age < 0 ? Json(nullptr) : Json(age); }

Json id_json(const std::unique_ptr<inspect::Id>& id) {
  if (!id) return nullptr;
  return to_json(provider_of(*id));
}

/// For scripts that read it: what is no UTF-8 is in the field with "_base64" behind its name.
void set_process(Json& object, const std::unique_ptr<inspect::ProcessT>& process) {
  if (!process) {
    for (const char* name : {"program", "pid", "uid"}) object[name] = nullptr;
    return;
  }
  set_bytes(object, "program", process->program);
  object["pid"] = process->pid;
  object["uid"] = process->uid;
}

Json voters_json(const std::vector<std::unique_ptr<inspect::VoterT>>& voters) {
  Json list = Json::array();
  for (const auto& voter : voters) {
    Json entry = id_json(voter->id);
    set_bytes(entry, "name", voter->name);
    list.push_back(std::move(entry));
  }
  return list;
}

Json protocol_json(const std::unique_ptr<inspect::ProtocolT>& running) {
  if (!running) return nullptr;
  return {{"protocol", running->kind},
          {"number", running->number},
          {"proposed_by", id_json(running->proposed_by)},
          {"n_phase", running->n_phase},
          {"phase", running->phase},
          {"time_limit", running->time_limit},
          {"age_ms", age_json(running->age_ms)},
          {"phase_age_ms", age_json(running->phase_age_ms)},
          {"voted", voters_json(running->voted)},
          {"missing", voters_json(running->missing)},
          {"changing", to_json(members_of(running->changing))}};
}

Json attributes_json(const std::unique_ptr<inspect::AttributesT>& attributes) {
  if (!attributes) return nullptr;
  const inspect::AttributesT& a = *attributes;
  Json object = {
      {"client_version", a.client_version}, {"batch_control", a.batch_control},
      {"num_phases", a.num_phases},         {"source_reflection_num_phases", a.source_reflection_num_phases},
      {"default_vote", a.default_vote},     {"merge_control", a.merge_control},
      {"time_limit", a.time_limit},         {"source_reflection_time_limit", a.source_reflection_time_limit}};
  set_bytes(object, "source_group", a.source_group);
  return object;
}

}  // namespace

bool same(const inspect::Id& a, const inspect::Id& b) {
  return a.instance() == b.instance() && a.node() == b.node();
}

wyx_provider_t provider_of(const inspect::Id& id) {
  wyx_provider_t provider{};
  provider._gs_provider_info._gs_instance_number = id.instance();
  provider._gs_provider_info._gs_node_number = id.node();
  return provider;
}

Members members_of(const std::vector<inspect::Id>& ids) {
  Members members;
  for (const inspect::Id& id : ids) members.push_back(provider_of(id));
  return members;
}

std::string to_text(const std::unique_ptr<inspect::Id>& id) { return id ? to_text(provider_of(*id)) : "-"; }

std::string to_text(const inspect::VoterT& voter) {
  return (voter.name.empty() ? "" : voter.name + " ") + to_text(voter.id);
}

std::string to_text(const std::vector<std::unique_ptr<inspect::VoterT>>& voters) {
  std::string text;
  for (const auto& voter : voters) text += (text.empty() ? "" : ", ") + to_text(*voter);
  return text.empty() ? "-" : text;
}

std::string duration_text(std::int64_t milliseconds) {
  constexpr std::int64_t kSecond = 1000;
  constexpr std::int64_t kMinute = 60 * kSecond;
  constexpr std::int64_t kHour = 60 * kMinute;
  if (milliseconds < 0) return "-";
  if (milliseconds < kSecond) return std::to_string(milliseconds) + " ms";
  if (milliseconds < 2 * kMinute) return short_number(static_cast<double>(milliseconds) / kSecond) + " s";
  if (milliseconds < 2 * kHour) return std::to_string(milliseconds / kMinute) + " min";
  if (milliseconds < 48 * kHour) return std::to_string(milliseconds / kHour) + " h";
  return std::to_string(milliseconds / (24 * kHour)) + " d";
}

std::string size_text(std::uint64_t bytes) {
  constexpr std::array<const char*, 4> kUnits = {" KiB", " MiB", " GiB", " TiB"};
  constexpr double kStep = 1024;
  if (bytes < 1024) return std::to_string(bytes) + " B";
  double size = static_cast<double>(bytes) / kStep;
  std::size_t unit = 0;
  for (; size >= kStep && unit + 1 < kUnits.size(); ++unit) size /= kStep;
  return short_number(size) + kUnits[unit];
}

std::string user_text(std::uint32_t user) {
  const passwd* entry = getpwuid(user);
  return entry == nullptr ? std::to_string(user) : entry->pw_name;
}

std::string to_text(const std::unique_ptr<inspect::ProtocolT>& running) {
  if (!running) return "-";
  std::string text = running->kind;
  if (running->n_phase) {
    const std::size_t voters = running->voted.size() + running->missing.size();
    text += ", phase " + std::to_string(running->phase) + ", " + std::to_string(running->voted.size()) + " of " +
            std::to_string(voters) + " voted";
  }
  return running->age_ms < 0 ? text : text + ", " + duration_text(running->age_ms);
}

bool is_departure(std::string_view protocol) {
  return protocol == "leave" || protocol == "failure" || protocol == "expel";
}

std::uint64_t count_of(const inspect::DaemonT& daemon, std::string_view name) {
  const auto found = std::find_if(daemon.counts.begin(), daemon.counts.end(),
                                  [&](const auto& count) { return count->name == name; });
  return found == daemon.counts.end() ? 0 : (*found)->value;
}

Json to_json(const inspect::DaemonT& daemon) {
  Json counts = Json::object();
  for (const auto& count : daemon.counts) counts[count->name] = count->value;
  return {{"version", daemon.version},
          {"pid", daemon.pid},
          {"node", daemon.node},
          {"ordering", daemon.ordering},
          {"serving", daemon.serving},
          {"will_serve", daemon.will_serve},
          {"quorum", daemon.quorum},
          {"nodes", daemon.nodes},
          {"age_ms", age_json(daemon.age_ms)},
          {"counts", counts}};
}

Json to_json(const inspect::CountT& count) {
  return {{"name", count.name},
          {"value", count.value},
          {"unit", count.unit},
          {"type", count.gauge ? "gauge" : "counter"},
          {"help", count.help}};
}

Json to_json(const inspect::GroupT& group) {
  Json object = Json::object();
  set_bytes(object, "group", group.name);
  object["members"] = to_json(members_of(group.members));
  object["subscribers"] = group.subscribers;
  object["waiting"] = group.waiting;
  object["event"] = group.event_number;
  object["age_ms"] = age_json(group.age_ms);
  object["length"] = group.state_size;
  object["attributes"] = attributes_json(group.attributes);
  object["running"] = protocol_json(group.running);
  return object;
}

Json to_json(const inspect::MemberT& member) {
  Json object = Json::object();
  object["id"] = id_json(member.id);
  set_bytes(object, "name", member.name);
  object["state"] = member.state;
  object["session"] = member.session;
  set_process(object, member.process);
  object["responsive"] = member.responsive;
  object["age_ms"] = age_json(member.age_ms);
  return object;
}

Json to_json(const inspect::SessionT& session) {
  Json object = {{"session", session.number}};
  set_process(object, session.process);
  object["providers"] = session.providers;
  object["subscribers"] = session.subscribers;
  object["answer_bytes"] = session.answer_bytes;
  object["notification_bytes"] = session.notification_bytes;
  object["responsive"] = session.responsive;
  object["age_ms"] = age_json(session.age_ms);
  return object;
}

Json to_json(const inspect::NodeT& node) {
  return {{"node", node.number},
          {"epoch", node.epoch},
          {"here", node.here},
          {"master", node.master},
          {"adapters", node.adapters}};
}

}  // namespace gsctl
