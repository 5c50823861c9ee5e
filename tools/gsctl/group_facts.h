// What a member of a short while needs to know of a group, and the library does not tell: the daemon does.
#pragma once

#include <memory>
#include <string>

#include "gscl/gscl.h"
#include "tools/gsctl/text.h"

namespace gs::inspect {
class Inspector;
}

namespace gsctl {

/// Gives the provider the attributes of its group, which a join must have. False: they cannot be had.
bool take_attributes(zelt_gscl_V1::GSProvider& provider);

struct Rejecter {
  wyx_provider_t id;
  std::string name;
};

/// Who rejects in a group, from the time that it is made. It knows of nothing where the daemon does not let it
/// look.
class VoteWatch {
 public:
  explicit VoteWatch(const std::string& group) noexcept;
  ~VoteWatch();
  VoteWatch(const VoteWatch&) = delete;
  VoteWatch& operator=(const VoteWatch&) = delete;

  /// Of the protocol that ended with this event. Waits for it a little.
  std::vector<Rejecter> rejecters(std::uint64_t event) noexcept;

 private:
  std::vector<Rejecter> look_for(std::uint64_t event);

  std::unique_ptr<gs::inspect::Inspector> tap_;
};

}  // namespace gsctl
