#include "tools/gsctl/inspection.h"

#include <cstdlib>
#include <string_view>

#include "tools/gsctl/session.h"
#include "wire/endpoint.h"

namespace gsctl {

std::string daemon_path() {
  constexpr std::string_view kUnix = "unix:";
  const char* value = getenv("GSD_ENDPOINT");
  const std::string_view endpoint = value == nullptr ? "" : value;
  if (endpoint.empty()) return gs::wire::kDefaultSocketPath;
  if (endpoint.starts_with("unix:/")) return std::string(endpoint.substr(kUnix.size()));
  throw Error(kNoDaemon, "no daemon at '" + std::string(endpoint) + "': give its socket with --endpoint");
}

gs::inspect::Inspector connected(const Settings& settings) {
  if (!settings.timeout) return gs::inspect::Inspector(daemon_path());
  const std::chrono::duration<double> limit(*settings.timeout);
  return gs::inspect::Inspector(daemon_path(), std::chrono::ceil<std::chrono::milliseconds>(limit));
}

void check_groups(const std::vector<std::string>& groups, const std::string& instead) {
  for (const std::string& group : groups) check_group(group);
  if (groups.size() > gs::inspect::kMaxGroupsAsked) {
    throw Error(kWrongUse, "at most " + std::to_string(gs::inspect::kMaxGroupsAsked) + " groups, " + instead);
  }
}

Error explained(const gs::inspect::InspectError& error) {
  const std::string text = error.what();
  using Kind = gs::inspect::InspectError::Kind;
  switch (error.kind()) {
    case Kind::kNoDaemon:
      return Error(kNoDaemon, text + ": start gsd, or give its socket with --endpoint");
    case Kind::kTimeOver:
      return Error(kTimeOver, text + ": see its log, or give it longer with --timeout");
    case Kind::kLost:
      return Error(kLost, text + ", or does not let this user in: see its log");
    default:
      return Error(kLost, text + ": is gsctl of another version?");
  }
}

}  // namespace gsctl
