#include "gs/engine_text.h"

namespace gs::test {

std::string name_of(const Endpoint& endpoint) {
  const std::string number = std::to_string(endpoint.session.number);
  return endpoint.token >= kSubscriberToken ? "s" + number : number;
}

std::string text(const std::vector<Delivery>& deliveries) {
  std::string all, names, line;
  auto flush = [&] {
    if (!names.empty()) all += names + ": " + line + "\n";
  };
  for (const Delivery& d : deliveries) {
    const std::string next = text(*d.what);
    if (next == line && !names.empty()) {
      names += " " + name_of(d.to);
      continue;
    }
    flush();
    names = name_of(d.to);
    line = next;
  }
  flush();
  return all;
}

}  // namespace gs::test
