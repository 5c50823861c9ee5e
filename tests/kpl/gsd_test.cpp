// gsd as a daemon: under kplmstr, and started from a shell.
#include <sys/file.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "common/descriptor.h"
#include "kpl/private_master.h"
#include "support/raw_client.h"

namespace kpl_test {
namespace {

using test_support::RawSession;
using testing::ContainsRegex;
using testing::HasSubstr;

class GsdDaemon : public WithMaster {
 protected:
  void SetUp() override {
    WithMaster::SetUp();
    if (IsSkipped()) return;
    configure("log-level = \"warning\"\n");
    master.define("gsd", "program = \"" + program_path("gsd") + "\"\noutput = \"" + master.log_path("gsd") +
                             "\"\narguments = [\"--daemon\", \"--config\", \"" + master.path("gsd.conf") +
                             "\", \"--socket-path\", \"" + socket() + "\"]\n");
    master.start();
  }
  void start() const {
    const Outcome started = ctl({"start", "gsd"});
    ASSERT_EQ(started.status, 0) << started.err;
    ASSERT_EQ(ctl({"refresh", "gsd"}).status, 0) << master.log("gsd");  // answered once it serves
  }
  void configure(const std::string& text) const { std::ofstream(master.path("gsd.conf")) << text; }
  std::string socket() const { return master.path("gsd.sock"); }
  void connect_once() const { RawSession session(socket()); }
};

TEST_F(GsdDaemon, LongStatus_ShowsGroupsSessionsAndTotals) {
  start();
  RawSession session(socket());
  gs::JoinRequest join;
  join.token = 1;
  join.instance = 7;
  join.attributes.group_name = "pain\nters";
  ASSERT_EQ(session.request.call(join), WYX_OK);
  const Outcome status = ctl({"status", "--long", "gsd"});
  EXPECT_EQ(status.status, 0) << status.err;
  EXPECT_THAT(status.out, ContainsRegex("gsd +- +[0-9]+ +active"));
  EXPECT_THAT(status.out,
              ContainsRegex("group +pain\\?ters\n +members +1: 7@1\n +state +0 bytes, event [0-9]+\n"));
  EXPECT_THAT(status.out, ContainsRegex("session +1 raw \\(pid [0-9]+, uid [0-9]+\\)\n +queued +0 bytes"));
  EXPECT_THAT(status.out, ContainsRegex("total +1 groups, 1 sessions, node 1\n"));
}

TEST_F(GsdDaemon, TraceAndRefresh_SwitchTheLogReadTheConfigurationAndTellItsMistakes) {
  start();
  EXPECT_EQ(ctl({"trace", "on", "gsd"}).status, 0);
  configure("log-level = \"warning\"\nnode-number = 9\n");
  EXPECT_EQ(ctl({"refresh", "gsd"}).out, "node-number: changes with the next start\n");  // and the trace goes on
  connect_once();
  EXPECT_TRUE(master.wait_for_log("gsd", " info "));
  EXPECT_TRUE(master.wait_for_log("gsd", "closed: "));
  EXPECT_EQ(ctl({"trace", "off", "gsd"}).status, 0);
  const std::string before = master.log("gsd");
  connect_once();
  EXPECT_EQ(ctl({"refresh", "gsd"}).status, 0);
  EXPECT_EQ(master.log("gsd"), before);

  configure("log-level = \"info\"\nlog-file = \"" + master.log_path("moved") + "\"\n");
  EXPECT_EQ(ctl({"refresh", "gsd"}).status, 0);
  std::filesystem::rename(master.log_path("moved"), master.log_path("older"));
  EXPECT_EQ(ctl({"refresh", "gsd"}).status, 0);
  connect_once();
  EXPECT_TRUE(master.wait_for_log("moved", " info "));
  EXPECT_EQ(master.log("gsd"), before);

  for (const auto& [mistake, told] : {std::pair("\nlog-level = 3\n", "gsd.conf:2: log-level: must be a text"),
                                      std::pair("log-file = \"/nowhere/log\"\n", "/nowhere/log: No such file")}) {
    configure(mistake);
    const Outcome broken = ctl({"refresh", "gsd"});
    EXPECT_EQ(broken.status, 1);
    EXPECT_THAT(broken.err, HasSubstr(told));
    EXPECT_TRUE(master.wait_for_log("moved", told));
  }
}

TEST_F(GsdDaemon, Stops_TellTheClientsAndEndWell) {
  for (const char* how : {"", "--forced", "--cancel"}) {
    start();
    RawSession session(socket());
    std::vector<std::string> stop = {"stop", "gsd"};
    if (*how != '\0') stop.emplace_back(how);
    EXPECT_EQ(ctl(stop).out, "gsd ended: exit status 0\n");
    session.event.receive<gs::wire::Farewell>();
    session.event.wait_for_close();
    EXPECT_NE(access(socket().c_str(), F_OK), 0);
  }
}

TEST_F(GsdDaemon, FromAShell_ItComesBackServesAndLeavesNothing) {
  const std::string socket = master.path("shell.sock");
  const std::string gsd = program_path("gsd") + " --daemon --log-file " + master.log_path("shell");
  master.tell_shell("(" + gsd + " --socket-path " + socket + "; echo came back with $? > " +
                    master.log_path("shell.status") + ")");
  EXPECT_TRUE(master.wait_for_log("shell.status", "came back with 0\n"));
  EXPECT_TRUE(master.wait_for_log("shell", " serves "));
  RawSession session(socket);
  master.tell_shell("(" + gsd + " --socket-path " + socket + ")");
  EXPECT_TRUE(master.wait_for_log("shell", "gsd: another gsd "));
  master.tell_shell("kill -TERM $(cat " + socket + ".lock)");
  session.event.receive<gs::wire::Farewell>();
  session.event.wait_for_close();
  const platform::Descriptor lock(open((socket + ".lock").c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_TRUE(wait_until([&] { return flock(lock.get(), LOCK_EX | LOCK_NB) == 0; }));  // the process is gone
  EXPECT_NE(access(socket.c_str(), F_OK), 0);
}

}  // namespace
}  // namespace kpl_test
