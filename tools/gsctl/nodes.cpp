// gsctl nodes: the hosts that serve the same groups.
#include "tools/gsctl/listing.h"
#include "tools/gsctl/reports.h"

namespace gsctl {
namespace {

void nodes(gs::inspect::Inspector& inspector, Listing& listing) {
  listing.rows = {{"Node", "Epoch", "Here", "Master", "Adapters"}};
  for (const auto& node : inspector.nodes()) {
    const auto row = [&]() -> platform::Row {
      std::string adapters;
      for (const std::string& adapter : node->adapters) adapters += (adapters.empty() ? "" : ", ") + adapter;
      return {std::to_string(node->number), std::to_string(node->epoch), node->here ? "yes" : "no",
              node->master ? "yes" : "no", adapters.empty() ? "-" : adapters};
    };
    listing.add(row, [&] { return to_json(*node); });
  }
}

}  // namespace

Run add_nodes(CLI::App& command) {
  auto repetition = std::make_shared<Repetition>();
  add_repetition(command, *repetition);
  return [repetition](const Settings& settings) { return print_listing(settings, *repetition, nodes); };
}

}  // namespace gsctl
