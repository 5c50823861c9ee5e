// A test of the base API's entry points over one kind of endpoint, with a session open at its start.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <memory>
#include <string>

#include "support/group_requests.h"
#include "support/gsd_process.h"

namespace test_support {

enum class EndpointKind { kEmbedded, kDaemon };

inline const auto kEndpoints = testing::Values(EndpointKind::kEmbedded, EndpointKind::kDaemon);

inline std::string endpoint_name(const testing::TestParamInfo<EndpointKind>& info) {
  return info.param == EndpointKind::kEmbedded ? "Embedded" : "Daemon";
}

class ClientTest : public testing::TestWithParam<EndpointKind> {
 protected:
  void SetUp() override {
    if (GetParam() == EndpointKind::kDaemon) daemon_ = std::make_unique<GsdProcess>();
    setenv("GSD_ENDPOINT", daemon_ ? daemon_->endpoint().c_str() : "embedded:", 1);
    recorder().reset();
    const SetupResult opened = setup();
    ASSERT_EQ(opened.rc, WYX_OK);
    descriptor_ = opened.descriptor;
  }
  void TearDown() override {
    recorder().set_hook(nullptr);
    wyx_quit();
  }

  static Recorder& recorder() { return Recorder::get(); }
  int fd() const { return descriptor_; }

 private:
  std::unique_ptr<GsdProcess> daemon_;
  int descriptor_ = -1;
};

}  // namespace test_support
