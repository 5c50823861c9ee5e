// Whether what the clients of a storm were told fits together.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace storm {

/// How much there was to compare: a storm in which nothing happened proves nothing.
struct Account {
  std::size_t logs = 0;
  std::size_t group_lives = 0;
  std::size_t events = 0;         // distinct
  std::size_t notifications = 0;  // of events
  std::size_t subscriptions = 0;  // notifications of subscribers
  std::size_t requests = 0;       // answered WYX_OK
};

/// Compares the logs of a round with one another, as board.h describes them. Throws zn::Failure with the first
/// contradiction and the logs that it stands in. `gaps`: there may be some in the numbers of events.
Account judge(const std::vector<std::string>& logs, bool gaps);

}  // namespace storm
