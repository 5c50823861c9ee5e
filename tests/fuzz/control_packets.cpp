// What kplmstr reads from those who connect, and kplctl from whatever it connects to: any bytes are taken or
// malformed, and what is taken can be sent on and is then taken for the same. What kplctl prints of an answer
// steers no terminal.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <sstream>

#include "common/printable.h"
#include "control/control.h"
#include "ctl/output.h"

namespace {

template <class Message>
void try_packet(const std::string& packet, Message (*decode)(const std::string&)) {
  std::optional<Message> message;
  try {
    message = decode(packet);
  } catch (const kpl::control::Malformed&) {
    return;
  }
  const std::string sent = kpl::control::encode(*message);
  if (kpl::control::encode(decode(sent)) == sent) return;
  fprintf(stderr, "another message after the way: %s\n", sent.c_str());
  abort();
}

/// As kplctl prints them: whatever the packets between line ends are, all is text.
void print_answers(const std::string& packets) {
  kpl::ctl::Outcome outcome;
  outcome.long_form = true;
  std::istringstream all(packets);
  for (std::string packet; std::getline(all, packet);) {
    try {
      outcome.add(kpl::control::decode_answer(packet));
    } catch (const kpl::control::Malformed&) {
      continue;
    }
  }
  std::string printed = kpl::ctl::json_text(kpl::ctl::to_json(outcome));
  printed += platform::printable(kpl::ctl::status_table(outcome.entries), "\n");
  printed += platform::printable(kpl::ctl::definition_table(outcome.entries), "\n");
  printed += platform::printable(kpl::ctl::long_status(outcome.lines), "\n");
  for (std::size_t i = 0; i < printed.size(); ++i) {
    const auto c = static_cast<unsigned char>(printed[i]);
    const bool c1 = c == 0xc2 && static_cast<unsigned char>(printed[i + 1]) < 0xa0;
    if ((c >= 0x20 || c == '\n') && c != 0x7f && !c1) continue;
    fprintf(stderr, "would steer a terminal: byte %d\n", c);
    abort();
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string packet(reinterpret_cast<const char*>(data), size);
  try_packet(packet, kpl::control::decode_request);
  try_packet(packet, kpl::control::decode_answer);
  print_answers(packet);
  return 0;
}
