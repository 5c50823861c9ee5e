// gsd as a subsystem of kplmstr, and started from a shell.
#include <signal.h>
#include <unistd.h>

#include <fstream>

#include "kpl/private_master.h"
#include "support/raw_client.h"

namespace kpl_test {
namespace {

using gs::JoinRequest;
using test_support::RawSession;
using testing::ContainsRegex;
using testing::HasSubstr;

class GsdUnderKplmstr : public testing::Test {
 protected:
  void SetUp() override {
    const std::string obstacle = PrivateMaster::obstacle();
    if (!obstacle.empty()) GTEST_SKIP() << obstacle;
    configure("log-level = \"warning\"\n");
    master.define("gsd.toml", "name = \"gsd\"\nprogram = \"" + program_path("gsd") + "\"\noutput = \"" +
                                  master.log_path("gsd") + "\"\narguments = [\"--daemon\", \"--config\", \"" +
                                  master.path("gsd.conf") + "\", \"--socket-path\", \"" + socket() + "\"]\n");
    master.start();
    const Outcome started = master.ctl({"start", "gsd"});
    ASSERT_EQ(started.status, 0) << started.err;
    ASSERT_EQ(master.ctl({"refresh", "gsd"}).status, 0) << master.log("gsd");  // answered once it serves
  }
  void TearDown() override {
    if (!master.is_started()) return;
    EXPECT_EQ(master.stop(), 0) << master.master_log();
  }
  void configure(const std::string& text) const { std::ofstream(master.path("gsd.conf")) << text; }
  std::string socket() const { return master.path("gsd.sock"); }

  PrivateMaster master;
};

TEST_F(GsdUnderKplmstr, LongStatus_ShowsGroupsSessionsAndTotals) {
  RawSession session(socket());
  JoinRequest join;
  join.token = 1;
  join.instance = 7;
  join.attributes.group_name = "painters";
  ASSERT_EQ(session.request.call(join), WYX_OK);
  const Outcome status = master.ctl({"status", "--long", "gsd"});
  EXPECT_EQ(status.status, 0) << status.err;
  EXPECT_THAT(status.out, ContainsRegex("gsd +- +[0-9]+ +active"));
  EXPECT_THAT(status.out, ContainsRegex("group +painters\n +members +1: 7@1\n +state +0 bytes, event [0-9]+\n"));
  EXPECT_THAT(status.out, ContainsRegex("session +1 raw \\(pid [0-9]+, uid [0-9]+\\)\n +queued +0 bytes"));
  EXPECT_THAT(status.out, ContainsRegex("total +1 groups, 1 sessions, node 1\n"));
}

TEST_F(GsdUnderKplmstr, Trace_SwitchesTheLogLevel) {
  EXPECT_EQ(master.ctl({"trace", "on", "gsd"}).status, 0);
  { RawSession session(socket()); }
  EXPECT_TRUE(master.wait_for_log("gsd", " info "));
  EXPECT_EQ(master.ctl({"trace", "off", "gsd"}).status, 0);
  const std::string before = master.log("gsd");
  { RawSession session(socket()); }
  EXPECT_EQ(master.ctl({"refresh", "gsd"}).status, 0);
  EXPECT_EQ(master.log("gsd"), before);
}

TEST_F(GsdUnderKplmstr, Refresh_ReadsTheConfigurationAndTellsItsMistakes) {
  configure("log-level = \"debug\"\nnode-number = 9\n");
  const Outcome refreshed = master.ctl({"refresh", "gsd"});
  EXPECT_EQ(refreshed.status, 0);
  EXPECT_EQ(refreshed.out, "node-number: changes with the next start\n");
  { RawSession session(socket()); }
  EXPECT_TRUE(master.wait_for_log("gsd", " info "));

  configure("\nlog-level = 3\n");
  const Outcome broken = master.ctl({"refresh", "gsd"});
  EXPECT_EQ(broken.status, 1);
  EXPECT_THAT(broken.err, HasSubstr("gsd.conf:2: log-level: must be a text"));
}

TEST_F(GsdUnderKplmstr, Stops_TellTheClientsAndEndWell) {
  for (const char* how : {"", "--forced", "--cancel"}) {
    RawSession session(socket());
    std::vector<std::string> stop = {"stop", "gsd"};
    if (*how != '\0') stop.emplace_back(how);
    const Outcome stopped = master.ctl(stop);
    EXPECT_EQ(stopped.status, 0) << stopped.err;
    EXPECT_EQ(stopped.out, "gsd ended: exit status 0\n");
    session.event.wait_for_close();
    EXPECT_NE(access(socket().c_str(), F_OK), 0);
    ASSERT_EQ(master.ctl({"start", "gsd"}).status, 0);
    ASSERT_EQ(master.ctl({"refresh", "gsd"}).status, 0);
  }
}

}  // namespace
}  // namespace kpl_test
