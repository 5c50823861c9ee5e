#include "tools/gsctl/change.h"

#include "tools/gsctl/output.h"

namespace gsctl {

Json to_json(const Change& change) {
  Json object = {{"time", utc_text(change.time)}};
  set_bytes(object, "group", change.group);
  object["change"] = change.what;
  if (change.event) object["event"] = *change.event;
  if (!change.who.empty()) object["who"] = to_json(change.who);
  if (!change.why.empty()) object["why"] = change.why;
  if (change.members) object["members"] = to_json(*change.members);
  if (change.bytes) set_bytes(object, "value", *change.bytes);
  return object;
}

std::string to_line(const Change& change) {
  std::string text = clock_text(change.time) + " " + change.group + " ";
  text += change.event ? "#" + std::to_string(*change.event) : "-";
  text += " " + change.what;
  if (!change.who.empty()) text += " " + to_text(change.who);
  if (!change.why.empty()) text += " (" + change.why + ")";
  if (change.bytes) text += " " + gsctl::quoted(*change.bytes);
  if (change.members) text += "; members: " + to_text(*change.members);
  return text;
}

Job job_of(const Change& change, const std::string& command) {
  std::vector<std::string> environment = {
      "GS_GROUP=" + change.group,
      "GS_CHANGE=" + change.what,
      "GS_EVENT=" + (change.event ? std::to_string(*change.event) : ""),
      "GS_WHO=" + (change.who.empty() ? "" : to_text(change.who)),
      "GS_WHY=" + change.why,
      "GS_MEMBERS=" + (change.members && !change.members->empty() ? to_text(*change.members) : "")};
  return {command, std::move(environment), change.bytes.value_or("")};
}

void print(const Change& change, bool as_json) {
  if (as_json) {
    print_json(to_json(change));
  } else {
    print_line(to_line(change));
  }
}

}  // namespace gsctl
