// What daemons say to one another, as short lines for reading failures.
#pragma once

#include "gs/cluster_network.h"

namespace gs::cluster::test {

inline std::string text(const RingId& ring) {
  return std::to_string(ring.sequence) + "/" + std::to_string(ring.node);
}
inline std::string text(const Process& p) { return std::to_string(p.node) + ":" + std::to_string(p.pid); }
inline std::string text(const BeginId& id) {
  return std::to_string(id.life % 1'000) + "." + std::to_string(id.number);
}
template <typename List>
std::string list(const List& processes) {
  std::string all;
  for (const Process& p : processes) all += " " + text(p);
  return all;
}

inline std::string text(const Begin& m) {
  return "begin " + text(m.id) + " in " + text(m.ring) + " of" + list(m.asked) +
         (m.needed ? " by " + std::to_string(m.needed) : "");
}
inline std::string text(const Word& m) {
  const std::string said = "word to " + text(m.begin) + " life " + std::to_string(m.life % 1'000);
  if (!m.history) return said + " no state";
  return said + " " + std::to_string(m.history->ring) + "." + std::to_string(m.history->exchanges) + "." +
         std::to_string(m.history->messages) + "." + std::to_string(m.history->digest % 1'000);
}
inline std::string text(const Ordered& m) {
  return "event " + std::to_string(m.number) + " of life " + std::to_string(m.life % 1'000);
}
inline std::string text(const Piece& m) {
  return "piece " + std::to_string(m.index) + " of " + std::to_string(m.count);
}
inline std::string text(const Confirmed& m) {
  std::string said = "confirmed " + std::to_string(m.position) + " of " + text(m.begin);
  if (!m.ask.empty()) said += " asks";
  for (const Node node : m.ask) said += " " + std::to_string(node);
  return said;
}
inline std::string text(const Evict& m) { return "evict in " + text(m.ring) + list(m.who); }
inline std::string text(const Message& message) {
  return std::visit([](const auto& m) { return text(m); }, message);
}

inline std::string text(const View& view) {
  std::string said = "view" + list(view.members);
  for (const Process& p : view.joined) said += " +" + text(p);
  for (const auto& [p, code] : view.left) said += " -" + text(p);
  return said;
}
inline std::string text(const Received& m) { return "from " + text(m.from) + " " + text(*m.message); }
inline std::string text(const Input& input) {
  if (const auto* ring = std::get_if<RingId>(&input)) return "ring " + text(*ring);
  return std::holds_alternative<View>(input) ? text(std::get<View>(input)) : text(std::get<Received>(input));
}

}  // namespace gs::cluster::test
