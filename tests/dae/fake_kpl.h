// A KPL library that writes down what it is asked to send. A program that links fake_kpl.cpp uses it in place of
// libkpl.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "kpl.h"

namespace fake_kpl {

/// The interim packets sent: "[MARGIN|BODY;...]" for one of status, "(TEXT)" for one of message text.
extern std::string sent;
extern std::vector<std::string> replies;  ///< the last packets, behind their headers

/// One call of kplstat: its result, and margin and body of each line that it hands out.
struct ShortStatus {
  int result;
  std::vector<std::pair<std::string, std::string>> lines;
};
extern std::vector<ShortStatus> short_status;  ///< the answers to come

void reset();

}  // namespace fake_kpl
