// What kplmstr reads from those who connect, and kplctl from whatever it connects to: any bytes are taken or
// malformed, and what is taken can be sent on and is then taken for the same.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <optional>

#include "control/control.h"

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

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string packet(reinterpret_cast<const char*>(data), size);
  try_packet(packet, kpl::control::decode_request);
  try_packet(packet, kpl::control::decode_answer);
  return 0;
}
