// Draws stories of groups over one axis of time.
#pragma once

#include <string>
#include <vector>

#include "tools/gsctl/chart_story.h"

namespace gsctl {

/// What is drawn of them.
struct Stretch {
  Microseconds zero = 0;  // from where the axis counts
  Microseconds from = 0;
  Microseconds to = 0;
};

/// The picture as SVG. Throws Error: there is nothing in this stretch, or more than a picture can show.
std::string draw(const std::vector<Story>& stories, const std::vector<Recording::Gap>& missed,
                 const Stretch& stretch);

}  // namespace gsctl
