// Controllers of programs that are compiled without runtime type information: every version is current, is asked
// for as the third one and is told of a domain event.
#include <cstdio>

#include "gscl/gscl.h"

namespace {

struct First : zelt_gscl_V1::GSController {};

struct Third : zelt_gscl_V3::GSController {
  using GSController::GSController;
  void domainControlCb(const wyx_domain_control_notification_t*) override { ++told; }
  int told = 0;
};

void tell() {
  const wyx_domain_control_notification_t event = {};
  zelt_gscl_V3::GSController::theController();
  stub_domain_controlCb(&event);
}

}  // namespace

int main() {
  {
    const First first;
    tell();
  }
  {
    const zelt_gscl_V2::GSController second(0x0003001C);
    tell();
  }
  const Third third(0x0003001C);
  tell();
  std::printf("told %d\n", third.told);
  return third.told == 1 ? 0 : 1;
}
