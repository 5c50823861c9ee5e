#include "tools/gsctl/command.h"

namespace gsctl {
namespace {

constexpr Command kCommands[] = {
    {"get", "Print a group's state value", add_get},
};

}  // namespace

std::span<const Command> commands() { return kCommands; }

}  // namespace gsctl
