// A test of the base API's entry points over one kind of endpoint, with a session open at its start.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <memory>
#include <string>

#include "support/group_requests.h"

namespace zn_test {

enum class EndpointKind { kEmbedded };

inline const auto kEndpoints = testing::Values(EndpointKind::kEmbedded);

inline std::string endpoint_name(const testing::TestParamInfo<EndpointKind>&) { return "Embedded"; }

class ClientTest : public testing::TestWithParam<EndpointKind> {
 protected:
  void SetUp() override {
    setenv("GSD_ENDPOINT", "embedded:", 1);
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
  static std::string unique(const std::string& name) { return name; }

 private:
  int descriptor_ = -1;
};

}  // namespace zn_test
