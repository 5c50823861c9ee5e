// Names private members of the controller, for what has no public way in. An explicit instantiation may do that.
#ifndef TESTS_GSCL_PRIVATE_ACCESS_H
#define TESTS_GSCL_PRIVATE_ACCESS_H

#include "gscl/gscl.h"

namespace private_access {

template <class Tag, auto Member>
struct Reveal {
  friend constexpr auto reveal(Tag) { return Member; }
};

#define REVEAL(Tag, member)            \
  struct Tag {                         \
    friend constexpr auto reveal(Tag); \
  };                                   \
  template struct Reveal<Tag, member>

REVEAL(AddClient, &zelt_gscl_V1::GSController::addClient);
REVEAL(RemoveClient, &zelt_gscl_V1::GSController::removeClient);
REVEAL(FindClient, &zelt_gscl_V1::GSController::findClient);
#undef REVEAL

}  // namespace private_access

#endif
