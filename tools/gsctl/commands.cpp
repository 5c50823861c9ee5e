#include "tools/gsctl/command.h"

namespace gsctl {
namespace {

constexpr Command kCommands[] = {
    {"get", "Print a group's state value", add_get},
    {"set", "Propose a group a new state value", add_set},
    {"send", "Propose a group a message", add_send},
    {"expel", "Propose a group that members are put out", add_expel},
    {"lead", "Run a program while this is the leader of a group", add_lead},
    {"lock", "Run a program when it is its turn, once", add_lock},
};

}  // namespace

std::span<const Command> commands() { return kCommands; }

}  // namespace gsctl
