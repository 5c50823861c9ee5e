// What member and watcher print: one line for each thing they are told, with the time and the group's own number
// of the event, so that lines of several processes can be put side by side.
#pragma once

#include <time.h>

#include <cstdint>
#include <cstdio>
#include <string>

#include "gscl/wyx_api.h"

/// The number in two parts, for people: the daemon numbers on from the microseconds since 1970 at its start.
inline std::string event_text(std::uint64_t event) {
  constexpr std::uint64_t kPart = 1000000;
  char text[32];
  std::snprintf(text, sizeof text, "%llu.%06llu", static_cast<unsigned long long>(event / kPart),
                static_cast<unsigned long long>(event % kPart));
  return event == 0 ? "-" : text;
}

/// Prints "SECONDS.MICROSECONDS EVENT TEXT"; the time is the host's, the same clock in every process.
inline void say(std::uint64_t event, const std::string& text) {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  std::printf("%lld.%06ld %s %s\n", static_cast<long long>(now.tv_sec), now.tv_nsec / 1000,
              event_text(event).c_str(), text.c_str());
  std::fflush(stdout);
}

/// "1 2 3": the instance numbers, oldest member first; "none".
inline std::string to_text(const wyx_membership_t* members) {
  std::string text;
  for (unsigned i = 0; members && i < members->gs_count; i++) {
    if (i > 0) text += ' ';
    text += std::to_string(members->gs_providers[i]._gs_provider_info._gs_instance_number);
  }
  return text.empty() ? "none" : text;
}

/// The bytes in quotation marks; "" for none.
inline std::string to_text(const wyx_state_value_t* state) {
  return '"' + (state ? std::string(state->gs_state, static_cast<size_t>(state->gs_length)) : "") + '"';
}
inline std::string to_text(const wyx_provider_message_t* message) {
  return '"' + (message ? std::string(message->gs_message, static_cast<size_t>(message->gs_length)) : "") + '"';
}
