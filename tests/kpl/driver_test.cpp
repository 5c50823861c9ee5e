// A KPLDriver, the example daemon, as a subsystem of kplmstr.
#include <fstream>

#include "kpl/private_master.h"

namespace kpl_test {
namespace {

using testing::ContainsRegex;
using testing::EndsWith;

using TinyDaemon = WithMaster;

TEST_F(TinyDaemon, AnswersItsMasterAndRecordsWhyItStops) {
  const auto ask = [&](const std::vector<std::string>& arguments) {
    const Outcome outcome = ctl(arguments);
    return std::to_string(outcome.status) + outcome.out + outcome.err;
  };
  std::ofstream(master.path("lock")) << "";
  for (const std::string name : {"tiny", "twin"}) {
    master.define(name, "program = \"" + program_path("tiny_daemon") + "\"\noutput = \"" + master.log_path(name) +
                            "\"\narguments = [\"" + master.path("lock") + "\"]\n");
  }
  master.start();
  const char* const stops[][2] = {
      {"--cancel", "(-3): stopCancel\n"}, {"--forced", "(-2): stopForced\n"}, {"--json", "(-1): stopNormal\n"}};
  for (const auto& [how, recorded] : stops) {
    EXPECT_EQ(ctl({"start", "tiny"}).status, 0);
    EXPECT_EQ(ask({"refresh", "tiny"}), "0");  // answered once it serves
    EXPECT_EQ(ctl({"stop", how, "tiny"}).status, 0);
    EXPECT_THAT(master.log("tiny"), EndsWith(std::string("stopped ") + recorded));
  }
  EXPECT_EQ(ctl({"start", "tiny"}).status, 0);
  EXPECT_EQ(ask({"trace", "on", "--long", "tiny"}), "0tracing everything\n");
  EXPECT_EQ(ask({"trace", "on", "tiny"}), "0tracing\n");
  EXPECT_EQ(ask({"request", "tiny", "256", "abc"}), "0");
  EXPECT_EQ(ask({"trace", "off", "tiny"}), "0");  // not overridden
  EXPECT_EQ(ask({"request", "tiny", "256"}), "1kplctl: nothing to add\n");
  EXPECT_EQ(ask({"request", "tiny", "300"}), "6kplctl: tiny does not support this request\n");
  EXPECT_THAT(ask({"status", "--long", "tiny"}), ContainsRegex("tiny .* active.*\nticks +[0-9]+, 4 at a time\n"));
  EXPECT_EQ(ask({"refresh", "tiny"}), "0");
  EXPECT_THAT(ask({"status", "--long", "tiny"}), ContainsRegex(" 1 at a time\n"));
  ask({"start", "twin"});
  EXPECT_TRUE(master.wait_for_log("twin", "not started (17): DAE_EM_EXCLBUSY\n"));
}

}  // namespace
}  // namespace kpl_test
