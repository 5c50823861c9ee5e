// A KPL library that keeps what it is asked to send. A program that links fake_kpl.cpp uses it in place of libkpl.
#pragma once

#include <string>
#include <vector>

#include "kpl.h"

namespace fake_kpl {

struct Packet {
  int cont;
  std::string bytes;
};

/// A line of status as it travels.
struct Line {
  std::string margin;
  std::string body;
  bool operator==(const Line&) const = default;
};

/// One call of kplstat: its result, and the lines that it hands out.
struct ShortStatus {
  int result;
  std::vector<Line> lines;
};

extern std::vector<Packet> packets;
extern kplhdr* quoted_header;                  ///< what the last kplrrqs returned
extern std::vector<ShortStatus> short_status;  ///< the answers to come

void reset();

/// All lines of the status packets sent, and how many came in each.
std::vector<Line> status_lines();
std::vector<size_t> status_packet_sizes();
/// The texts of the message packets sent.
std::vector<std::string> messages();

}  // namespace fake_kpl
