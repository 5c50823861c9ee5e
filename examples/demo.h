// The acts of the demonstration, and how they print. Each act throws Failure when anything is not as it must be.
#pragma once

#include <string>

namespace zn {

/// Processes join a group, vote, talk, are watched and die.
void demo_group();

/// The master runs daemons and an operator asks them, with namespaces of its own around all of it. Says why and
/// comes back where it may not have those.
void demo_master();

/// First argument of the demonstration when it is to run demo_inside; the second is the folder.
inline constexpr const char* kInside = "--inside";

/// The part of demo_master that runs inside of the namespaces, as process 1. `folder` is for its files.
void demo_inside(const std::string& folder);

/// What switches a colour of the terminal on and off; empty where the output is no terminal or NO_COLOR is set.
const char* colour(const char* code);
const char* colour_off();

}  // namespace zn
