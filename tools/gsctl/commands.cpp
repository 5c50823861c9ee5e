#include "tools/gsctl/command.h"

namespace gsctl {
namespace {

constexpr Command kCommands[] = {
    {"status", "Tell how the daemon is, in five lines", add_status},
    {"groups", "List the groups", add_groups},
    {"members", "List the members of a group", add_members},
    {"nodes", "List the hosts that serve the same groups", add_nodes},
    {"sessions", "List the programs that are connected", add_sessions},
    {"stats", "Tell the daemon's counts", add_stats},
    {"top", "Show groups live on a full screen", add_top},
    {"record", "Record what happens in groups", add_record},
    {"chart", "Draw a recording as a sequence chart", add_chart},
    {"get", "Print a group's state value", add_get},
    {"watch", "Print a line for each change of groups", add_watch},
    {"wait", "Wait until a group is as wanted", add_wait},
    {"join", "Be a member of a group, and vote", add_join},
    {"set", "Propose a group a new state value", add_set},
    {"send", "Propose a group a message", add_send},
    {"expel", "Propose a group that members are put out", add_expel},
    {"lead", "Run a program while this is the leader of a group", add_lead},
    {"lock", "Run a program when it is its turn, once", add_lock},
};

}  // namespace

std::span<const Command> commands() { return kCommands; }

}  // namespace gsctl
