// What daemons read from one another: any bytes are refused with a word, or are a message that can be sent on and
// is then taken for the same.
#include <cstdio>
#include <cstdlib>

#include "cluster/codec.h"
#include "cluster/datagram.h"
#include "gs/cluster_samples.h"

using namespace gs::cluster;

namespace {

void require(bool condition, const char* otherwise) {
  if (condition) return;
  fprintf(stderr, "%s\n", otherwise);
  abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto bytes = std::as_bytes(std::span(data, size));
  const std::string key(kKeySize, 'k');
  const auto key_of_node = [&key](Node) { return &key; };
  require(!open(bytes, key_of_node), "a datagram that nobody has sealed");
  std::string error;
  const auto message = decode(bytes, &error);
  require(message || !error.empty(), "refused without a word");
  if (!message) return 0;
  const auto again = decode(encode(*message), &error);
  require(again && gs::same(*message, *again), "another message after the way");
  const auto* confirmed = std::get_if<Confirmed>(&*message);
  if (confirmed && !confirmed->ask.empty()) return 0;
  const auto opened = confirmed ? open(seal(*confirmed, 1, key), key_of_node) : std::nullopt;
  require(!confirmed || (opened && gs::same(*confirmed, opened->second)), "another datagram after the way");
  return 0;
}
