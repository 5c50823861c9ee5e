#include <cstdio>

#include "gscl/gscl.h"

struct Member : zelt_gscl_V1::GSProvider {
  using GSProvider::GSProvider;
  void nPhaseCb(const wyx_n_phase_notification_t*) override { vote(WYX_VOTE_APPROVE, WYX_NULL_VOTE, nullptr, nullptr); }
  void approvedCb(const wyx_approved_notification_t* n) override {
    const wyx_state_value_t* state = n->gs_proposal->gs_current_state_value;
    std::printf("%s, event %d: %d in the group, state \"%.*s\"\n", getLocalName(), static_cast<int>(n->gs_event_seqnum),
                getMemberCount(), state ? state->gs_length : 0, state ? state->gs_state : "");
  }
};

int main() {
  zelt_gscl_V1::GSController controller;
  if (controller.initialize() != WYX_OK) return 1;
  Member ann("crew", 1, "ann"), ben("crew", 2, "ben");
  ann.joinGroup();
  ben.joinGroup();
  controller.dispatch(WYX_NON_BLOCKING);
  char ready[] = "ready";
  ann.changeStateValue(wyx_state_value_t{5, ready}, WYX_N_PHASE, 10);
  controller.dispatch(WYX_NON_BLOCKING);
}
