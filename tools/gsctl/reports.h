// What a daemon reports, as texts for people and as JSON for scripts. Texts of clients are as they gave them.
#pragma once

#include "inspect/messages.h"
#include "tools/gsctl/text.h"

namespace gsctl {

namespace inspect = gs::inspect;

bool same(const inspect::Id& a, const inspect::Id& b);
wyx_provider_t provider_of(const inspect::Id& id);
Members members_of(const std::vector<inspect::Id>& ids);
/// "INSTANCE/NODE"; "-" where there is none.
std::string to_text(const std::unique_ptr<inspect::Id>& id);
/// "ben 2/1"; the id alone where the name is empty.
std::string to_text(const inspect::VoterT& voter);
/// With commas between them; "-" for none.
std::string to_text(const std::vector<std::unique_ptr<inspect::VoterT>>& voters);

/// "350 ms", "2.1 s", "85 s", "34 min", "12 h", "3 d"; "-" for less than 0.
std::string duration_text(std::int64_t milliseconds);
/// "0 B", "12 KiB" ...
std::string size_text(std::uint64_t bytes);
/// A user's name; the number where it has none.
std::string user_text(std::uint32_t user);
/// "state_value_change, phase 2, 1 of 3 voted, 2.1 s"; "-" for null.
std::string to_text(const std::unique_ptr<inspect::ProtocolT>& running);

/// Whether members go by this protocol.
bool is_departure(std::string_view protocol);

/// The value of one of the daemon's counts; 0 where it has none of this name.
std::uint64_t count_of(const inspect::DaemonT& daemon, std::string_view name);

Json to_json(const inspect::DaemonT& daemon);
Json to_json(const inspect::CountT& count);
Json to_json(const inspect::GroupT& group);
Json to_json(const inspect::MemberT& member);
Json to_json(const inspect::SessionT& session);
Json to_json(const inspect::NodeT& node);

}  // namespace gsctl
