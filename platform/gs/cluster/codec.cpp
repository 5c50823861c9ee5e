#include "cluster/codec.h"

#include <algorithm>

#include "engine/enumerations.h"
#include "wire/codec.h"

namespace gs::cluster {
namespace {

bool is_node(std::uint32_t number) { return number >= 1 && number <= kMaxNodeNumber; }
bool has_nul(const std::string& text) { return text.find('\0') != std::string::npos; }

constexpr char kNoNode[] = "a number that no node has";
constexpr char kTooManyNodes[] = "more nodes than there may be";
constexpr char kNoLeaveCode[] = "a leave code that does not exist";
constexpr char kNotSent[] = "an event that follows from an exchange, and is not sent";

std::string problem(const RingId& ring) { return is_node(ring.node) ? "" : kNoNode; }

std::string problem(const std::vector<Process>& processes) {
  if (processes.empty()) return "nobody is named";
  if (processes.size() > kMaxNodes) return kTooManyNodes;
  const auto fits = [](const Process& process) { return is_node(process.node); };
  return std::ranges::all_of(processes, fits) ? "" : kNoNode;
}

std::string problem(const std::map<Node, std::uint32_t>& values, bool (*fits)(std::uint32_t),
                    const char* otherwise) {
  if (values.size() > kMaxNodes) return kTooManyNodes;
  for (const auto& [node, value] : values) {
    if (!is_node(node)) return kNoNode;
    if (!fits(value)) return otherwise;
  }
  return {};
}

bool is_leave_code(std::uint32_t code) { return (code & ~kLeaveCodeBits) == 0; }
bool are_votes(std::uint32_t votes) { return votes <= kMaxVotes; }

// -------------------------------------------------------------------------------------------------- events

std::string problem(const SessionId& session) { return is_node(session.node) ? "" : kNoNode; }

std::string problem(const RequestEvent& e) {
  const std::string found = problem(e.session);
  if (!found.empty()) return found;
  const char* wrong = wire::problem_with(e.request);
  return wrong == nullptr ? std::string() : wrong;
}
std::string problem(const SessionGoneEvent& e) { return problem(e.session); }
std::string problem(const TimerExpiredEvent& e) {
  const std::string& group = e.timer.group;
  return group.size() > kMaxGroupName || has_nul(group) ? "a name that no group has" : "";
}
std::string problem(const ResponsivenessEvent& e) { return problem(e.session); }
std::string problem(const ContinueEvent&) { return {}; }
std::string problem(const AdaptersEvent& e) {
  if (!is_node(e.node)) return kNoNode;
  if (e.adapters.size() > kMaxAdapters) return "more adapters than there may be";
  const auto fits = [](const Adapter& adapter) { return is_adapter_name(adapter.name); };
  return std::ranges::all_of(e.adapters, fits) ? "" : "a name that no adapter has";
}
std::string problem(const HostGoneEvent&) { return kNotSent; }
std::string problem(const HostCameEvent&) { return kNotSent; }
std::string problem(const NumbersEvent&) { return kNotSent; }

// ------------------------------------------------------------------------------------------------ messages

std::string problem(const Begin& m) {
  std::string found = problem(m.ring);
  if (found.empty()) found = problem(m.asked);
  if (found.empty()) found = problem(m.votes, are_votes, "more votes than a host may have");
  return found;
}
std::string problem(const Word& m) {
  if (m.address.size() > kMaxAddress || has_nul(m.address)) return "an address over the limit or with a NUL in it";
  return m.key.size() > kMaxAddress ? "a key over the limit" : problem(m.left, is_leave_code, kNoLeaveCode);
}
std::string problem(const Ordered& m) {
  if (!m.event) return "no event";
  return std::visit([](const auto& event) { return problem(event); }, *m.event);
}
std::string problem(const Piece& m) {
  if (m.index >= m.count) return "a piece beyond the last";
  return m.bytes.size() > kMaxPiece ? "a piece over the limit" : "";
}
std::string problem(const Confirmed& m) {
  if (m.ask.size() > kMaxNodes) return kTooManyNodes;
  return std::ranges::all_of(m.ask, is_node) ? "" : kNoNode;
}
std::string problem(const Evict& m) {
  const std::string found = problem(m.ring);
  return found.empty() ? problem(m.who) : found;
}

}  // namespace

std::string problem_with(const Message& message) {
  return std::visit([](const auto& m) { return problem(m); }, message);
}

}  // namespace gs::cluster
