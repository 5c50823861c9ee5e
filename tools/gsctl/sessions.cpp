// gsctl sessions: the programs that are connected, and what they have not read yet.
#include "tools/gsctl/listing.h"
#include "tools/gsctl/reports.h"

namespace gsctl {
namespace {

void sessions(gs::inspect::Inspector& inspector, Listing& listing) {
  listing.rows = {
      {"Session", "Program", "PID", "User", "Members", "Subscribers", "To read", "Answers", "Age", "Responsive"}};
  for (const auto& session : inspector.sessions()) {
    const auto row = [&]() -> platform::Row {
      const inspect::ProcessT* process = session->process.get();
      return {std::to_string(session->number),
              process ? process->program : "-",
              process ? std::to_string(process->pid) : "-",
              process ? user_text(process->uid) : "-",
              std::to_string(session->providers),
              std::to_string(session->subscribers),
              size_text(session->notification_bytes),
              size_text(session->answer_bytes),
              duration_text(session->age_ms),
              session->responsive ? "yes" : "no"};
    };
    listing.add(row, [&] { return to_json(*session); });
  }
}

}  // namespace

Run add_sessions(CLI::App& command) {
  auto repetition = std::make_shared<Repetition>();
  add_repetition(command, *repetition);
  return [repetition](const Settings& settings) { return print_listing(settings, *repetition, sessions); };
}

}  // namespace gsctl
