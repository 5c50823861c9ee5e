// Where a daemon and its clients meet when nobody says otherwise.
#pragma once

namespace gs::wire {

inline constexpr char kDefaultSocketPath[] = "/run/gsd/gsd.sock";

}  // namespace gs::wire
