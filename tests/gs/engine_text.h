// What is said to whom, as short lines, for comparing and for reading failures.
#pragma once

#include <regex>

#include "engine/text.h"

namespace gs::test {

inline constexpr Token kSubscriberToken = 100;

/// Providers are named by their session's number, subscribers by "s" and their session's number.
inline std::string name_of(const Endpoint& endpoint) {
  return (endpoint.token >= kSubscriberToken ? "s" : "") + std::to_string(endpoint.session.number);
}

/// The line of the trace, less what the model checks in each notification: its number and what has changed.
inline std::string brief(const Notification& notification) {
  static const std::regex kNumber(", #[0-9]+$"), kChanges(" \\{[^}]*\\}, members");
  const std::string line = std::regex_replace(text(notification), kNumber, "");
  const bool protocol = std::holds_alternative<ProtocolNotification>(notification);
  return protocol ? std::regex_replace(line, kChanges, ", members") : line;
}

/// One line for each run of deliveries with the same text: "1 2: ...".
inline std::string text(const std::vector<Delivery>& deliveries) {
  std::string all, line;
  for (const Delivery& d : deliveries) {
    const std::string next = ": " + brief(*d.what) + "\n";
    if (next == line) all.erase(all.size() - line.size());
    all += (next == line ? " " : "") + name_of(d.to) + next;
    line = next;
  }
  return all;
}

}  // namespace gs::test
