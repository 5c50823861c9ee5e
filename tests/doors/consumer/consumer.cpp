// A program of somebody who has only the installed tree.
#include <gscl/gscl.h>

#include <cstdio>

class Member : public zelt_gscl_V1::GSProvider {
 public:
  Member() : GSProvider("installed", 1, nullptr) {}
  void approvedCb(const wyx_approved_notification_t* n) override {
    std::printf("%s: %s approved, %d member\n", getGroupName(),
                zelt_gscl::gscl_request_type_name(n->gs_protocol_type), getMemberCount());
  }
};

int main() {
  zelt_gscl_V1::GSController controller;
  if (controller.initialize() != WYX_OK) return 1;
  Member member;
  if (member.joinGroup() != WYX_OK) return 1;
  return controller.dispatch(WYX_NON_BLOCKING) == WYX_OK ? 0 : 1;
}
