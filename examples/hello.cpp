#include <cstdio>

#include "gscl/gscl.h"

struct Member : zelt_gscl_V1::GSProvider {
  using GSProvider::GSProvider;
  void nPhaseCb(const wyx_n_phase_notification_t*) override {
    std::printf("%s votes\n", getLocalName());
    vote(WYX_VOTE_APPROVE, WYX_NULL_VOTE, nullptr, nullptr);
  }
  void approvedCb(const wyx_approved_notification_t* n) override {
    const char* what = zelt_gscl::gscl_request_type_name(n->gs_protocol_type);
    std::printf("%s: %s approved, %d in the group\n", getLocalName(), what, getMemberCount());
  }
};

int main() {
  zelt_gscl_V1::GSController controller;
  Member ann("crew", 1, "ann"), ben("crew", 2, "ben");
  if (controller.initialize() != WYX_OK) return 1;
  ann.joinGroup();
  ben.joinGroup();
  char ready[] = "ready";
  controller.dispatch(WYX_NON_BLOCKING);
  ann.changeStateValue(wyx_state_value_t{5, ready}, WYX_N_PHASE, 10);
  controller.dispatch(WYX_NON_BLOCKING);
}
