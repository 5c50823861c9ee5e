// kplmstr and kplctl as they are used, each test with a master of its own.
#include <signal.h>
#include <sys/ipc.h>
#include <sys/msg.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <nlohmann/json.hpp>
#include <sstream>

#include "common/descriptor.h"
#include "ctl/client.h"
#include "kpl/private_master.h"

namespace kpl_test {
namespace {

using nlohmann::json;
using testing::EndsWith;
using testing::HasSubstr;
using testing::MatchesRegex;
using testing::Not;

constexpr int kOk = 0;
constexpr int kFailed = 1;
constexpr int kBadUse = 2;
constexpr int kNotReached = 3;
constexpr int kWrongState = 4;
constexpr int kNoAnswer = 5;
constexpr int kNotSupported = 6;

class Kplmstr : public testing::Test {
 protected:
  void SetUp() override {
    const std::string obstacle = PrivateMaster::obstacle();
    if (!obstacle.empty()) GTEST_SKIP() << obstacle;
  }
  /// Whatever a test has done to it, the master ends well.
  void TearDown() override {
    if (!master.is_started()) return;
    EXPECT_EQ(master.stop(), kOk) << master.master_log();
  }
  Outcome ctl(const std::vector<std::string>& arguments) const { return master.ctl(arguments); }
  json status_of(const std::string& name) const {
    return json::parse(ctl({"status", name, "--json"}).out)["subsystems"][0];
  }

  PrivateMaster master;
};

/// Where requests are messages.
class KplmstrRequests : public Kplmstr, public testing::WithParamInterface<const char*> {
 protected:
  void SetUp() override {
    Kplmstr::SetUp();
    if (IsSkipped()) return;
    const std::string keys = std::string(GetParam()) == "queue=77,5" ? "queue-key = 77\nqueue-type = 5\n" : "";
    master.define_probe("probe", GetParam(), "group = \"tests\"\n" + keys);
    master.start();
    start();
  }
  void start() const {
    const Outcome started = ctl({"start", "probe"});
    ASSERT_EQ(started.status, kOk) << started.err << master.master_log();
  }
};
INSTANTIATE_TEST_SUITE_P(Over, KplmstrRequests, testing::Values("socket", "queue=77,5"),
                         [](const auto& each) { return std::string(each.param, strcspn(each.param, "=")); });

TEST_P(KplmstrRequests, TheDaemon_KnowsItsMasterAndItsName) {
  EXPECT_TRUE(master.wait_for_log("probe", "started as probe\n"));
}

TEST_P(KplmstrRequests, TraceAndRefresh_ReachTheirHandlers) {
  EXPECT_EQ(ctl({"trace", "on", "probe"}).status, kOk);
  EXPECT_EQ(ctl({"trace", "on", "--long", "probe"}).status, kOk);
  EXPECT_EQ(ctl({"trace", "off", "probe"}).status, kOk);
  EXPECT_EQ(ctl({"refresh", "--group", "tests"}).status, kOk);
  EXPECT_THAT(master.log("probe"), EndsWith("\ntrace on\ntrace on long\ntrace off\nrefresh\n"));
}

TEST_P(KplmstrRequests, OwnRequests_AreEchoedFailedOrNotSupported) {
  const Outcome echoed = ctl({"request", "probe", "257", "100% of it", "--parm1", "7", "--parm2", "-32768"});
  EXPECT_EQ(echoed.status, kOk) << echoed.err;
  EXPECT_EQ(echoed.out, "7 -32768 100% of it\n");
  const Outcome failed = ctl({"request", "probe", "258"});
  EXPECT_EQ(failed.status, kFailed);
  EXPECT_EQ(failed.err, "kplctl: 50% failed\n");
  EXPECT_EQ(ctl({"request", "probe", "259"}).status, kNotSupported);

  const json result = json::parse(ctl({"--json", "request", "probe", "258"}).out)["results"][0];
  EXPECT_EQ(result["subsystem"], "probe");
  EXPECT_EQ(result["result"], "failed");
  EXPECT_EQ(result["code"], -1);
  EXPECT_EQ(result["text"], "50% failed");
}

TEST_P(KplmstrRequests, OwnRequest_CarriesAsMuchDataAsADaemonTakes) {
  const std::string longest(kpl::control::kMaxData, 'x');
  EXPECT_EQ(ctl({"request", "probe", "300", longest}).status, kOk);
  EXPECT_EQ(ctl({"request", "probe", "300", longest + "x"}).status, kBadUse);
}

TEST_P(KplmstrRequests, LongStatus_Of200LinesArrivesWhole) {
  ASSERT_EQ(ctl({"request", "probe", "300", "--parm1", "200"}).status, kOk);
  const Outcome status = ctl({"status", "--long", "probe"});
  EXPECT_EQ(status.status, kOk) << status.err;
  std::string expected = "lines   200 are 100%\n";
  for (int i = 1; i < 200; ++i) expected += "        line " + std::to_string(i) + "\n";
  EXPECT_EQ(status.out, expected);
}

TEST_P(KplmstrRequests, Stops_EndTheDaemonByEachOfTheirWays) {
  EXPECT_EQ(ctl({"stop", "probe"}).status, kOk);
  EXPECT_THAT(master.log("probe"), EndsWith("\nstop normal\n"));
  start();
  EXPECT_EQ(ctl({"stop", "--forced", "probe"}).status, kOk);
  EXPECT_THAT(master.log("probe"), EndsWith("\nstop forced\n"));
  start();
  EXPECT_TRUE(master.wait_for_log("probe", "stop forced\nstarted as probe"));
  const Outcome cancelled = ctl({"stop", "--cancel", "probe"});
  EXPECT_EQ(cancelled.status, kOk);
  EXPECT_EQ(cancelled.out, "probe ended: exit status 0\n");
  EXPECT_THAT(master.log("probe"), EndsWith("\ncancel\n"));
  EXPECT_EQ(ctl({"stop", "probe"}).status, kWrongState);
  EXPECT_EQ(ctl({"refresh", "probe"}).status, kWrongState);
}

TEST_P(KplmstrRequests, ADaemonThatDiesServing_EndsTheRequest) {
  const Outcome crashed = ctl({"request", "probe", "256"});
  EXPECT_EQ(crashed.status, kFailed);
  EXPECT_THAT(crashed.err, HasSubstr("probe ended before it answered"));
  EXPECT_TRUE(master.wait_for_status("inactive"));
}

TEST_F(Kplmstr, Signals_StopAndNothingElse) {
  master.define_probe("probe", "signals", "normal-signal = \"SIGUSR1\"\nforced-signal = \"USR2\"\n");
  master.start();
  const char* const expected[][2] = {{"", "stop normal"}, {"--forced", "stop forced"}, {"--cancel", "cancel"}};
  for (const auto& [option, line] : expected) {
    ASSERT_EQ(ctl({"start", "probe"}).status, kOk) << master.master_log();
    EXPECT_TRUE(master.wait_for_log("probe", "started as probe\n"));
    EXPECT_EQ(ctl({"refresh", "probe"}).status, kNotSupported);
    std::vector<std::string> stop = {"stop", "probe"};
    if (*option != '\0') stop.emplace_back(option);
    EXPECT_EQ(ctl(stop).status, kOk);
    EXPECT_EQ(master.log("probe"), "started as probe\n" + std::string(line) + "\n");
    unlink(master.log_path("probe").c_str());
  }
}

TEST_F(Kplmstr, ACrashedDaemon_IsStartedAgainAndAStoppedOneIsNot) {
  master.define_probe("probe", "socket", "restart = true\nautostart = true\nrestart-delay = 0.01\n");
  master.start();
  EXPECT_TRUE(master.wait_for_status("active"));
  const int first = status_of("probe")["pid"];
  ctl({"request", "probe", "256"});
  EXPECT_TRUE(master.wait_for_log("probe", "started as probe\nstarted as probe\n"));
  EXPECT_TRUE(master.wait_for_status("active"));
  const json status = status_of("probe");
  EXPECT_NE(status["pid"], first);
  EXPECT_EQ(status["restarts"], 1);
  EXPECT_EQ(status["last_end"], "signal Killed");
  EXPECT_EQ(ctl({"refresh", "probe"}).status, kOk);

  EXPECT_EQ(ctl({"stop", "probe"}).status, kOk);
  EXPECT_EQ(status_of("probe")["state"], "inactive");
}

TEST_F(Kplmstr, ACrashLoop_SlowsDownAndCanBeStopped) {
  master.define("loop.toml",
                "name = \"loop\"\nprogram = \"/bin/false\"\nrestart = true\nrestart-delay = 0.05\n"
                "restart-delay-max = 80000\ntransport = \"signals\"\n");
  master.start();
  EXPECT_EQ(ctl({"start", "loop"}).status, kOk);
  for (const char* delay : {"0.05 s", "0.1 s", "0.2 s"}) {
    EXPECT_TRUE(master.wait_for_master_log("exit status 1; restart in " + std::string(delay)));
  }
  // With each crash the wait is longer, so this comes while one is under way, or soon will.
  EXPECT_TRUE(master.wait_for_status("waiting"));
  EXPECT_THAT(ctl({"stop", "loop"}).status, testing::AnyOf(kOk, kWrongState));
  EXPECT_TRUE(master.wait_for_status("inactive"));
}

TEST_F(Kplmstr, StartThatCannotBe_IsAnsweredWithTheReason) {
  const auto define = [&](const std::string& name, const std::string& rest) {
    master.define(name + ".toml", "name = \"" + name + "\"\ntransport = \"signals\"\nprogram = " + rest);
  };
  define("missing", "\"/nowhere/daemon\"\n");
  define("no-program", "\"/etc/passwd\"\n");
  define("no-user", "\"/bin/true\"\nuser = \"nobody-knows\"\n");
  define("no-output", "\"/bin/true\"\noutput = \"/nowhere/log\"\n");
  master.start();
  const char* const expected[][2] = {
      {"missing", "kplctl: cannot run /nowhere/daemon: No such file or directory\n"},
      {"no-program", "kplctl: cannot run /etc/passwd: Permission denied\n"},
      {"no-user", "kplctl: there is no user 'nobody-knows'\n"},
      {"no-output", "kplctl: cannot open /nowhere/log: No such file or directory\n"}};
  for (const auto& [name, reason] : expected) {
    const Outcome started = ctl({"start", name});
    EXPECT_EQ(started.status, kFailed);
    EXPECT_EQ(started.err, reason);
    EXPECT_EQ(status_of(name)["state"], "inactive");
  }
  EXPECT_EQ(ctl({"start", "never-heard-of"}).status, kWrongState);
}

TEST_F(Kplmstr, ADaemonThatDoesNotAnswer_CostsItsRequesterOnly) {
  master.define_probe("silent", "socket", "request-time = 0.2\nstop-time = 0.3\n", "silent");
  master.define_probe("other", "socket");
  master.start();
  ASSERT_EQ(ctl({"start", "silent"}).status, kOk);
  ASSERT_EQ(ctl({"start", "other"}).status, kOk);
  EXPECT_TRUE(master.wait_for_log("silent", "started as silent\n"));

  const Outcome refreshed = ctl({"refresh", "silent"});
  EXPECT_EQ(refreshed.status, kNoAnswer);
  EXPECT_EQ(refreshed.err, "kplctl: silent has not answered within 0.2 s\n");
  for (int i = 0; i < 15; ++i)
    EXPECT_EQ(ctl({"trace", "on", "silent"}).status, kNoAnswer);  // its channel fills up
  EXPECT_EQ(ctl({"stop", "silent"}).status, kNoAnswer);
  EXPECT_EQ(ctl({"refresh", "other"}).status, kOk);

  EXPECT_EQ(ctl({"stop", "--cancel", "silent"}).status, kOk);
  EXPECT_THAT(master.log("silent"), EndsWith("\ncancel\n"));
}

TEST_F(Kplmstr, ADaemonThatIgnoresSigterm_IsKilledInTheEnd) {
  master.define("deaf.toml",
                "name = \"deaf\"\nprogram = \"/bin/sh\"\ntransport = \"signals\"\nstop-time = 0.2\n"
                "arguments = [\"-c\", \"trap '' TERM; echo deaf; while :; do sleep 1000; done\"]\n"
                "output = \"" +
                    master.log_path("deaf") + "\"\n");
  master.start();
  ASSERT_EQ(ctl({"start", "deaf"}).status, kOk);
  EXPECT_TRUE(master.wait_for_log("deaf", "deaf\n"));
  EXPECT_EQ(ctl({"stop", "deaf"}).status, kNoAnswer);
  const Outcome cancelled = ctl({"stop", "--cancel", "deaf"});
  EXPECT_EQ(cancelled.status, kOk);
  EXPECT_EQ(cancelled.out, "deaf ended: signal Killed\n");
}

TEST_F(Kplmstr, BrokenDefinitions_AreToldWithTheirPlaceAndTheOthersServed) {
  master.define("a-good.toml", "name = \"good\"\nprogram = \"/bin/true\"\ntransport = \"signals\"\n");
  master.define("b-broken.toml", "name = \"broken\"\nprogram = \n");
  master.define("c-same.toml", "name = \"good\"\nprogram = \"/bin/false\"\n");
  master.define("ignored.txt", "what?");
  master.start();
  const Outcome list = ctl({"list"});
  EXPECT_EQ(list.status, kOk);
  EXPECT_THAT(list.out, HasSubstr("/bin/true"));
  EXPECT_THAT(list.out, Not(HasSubstr("/bin/false")));
  EXPECT_THAT(list.err, HasSubstr("b-broken.toml:2: "));
  EXPECT_THAT(list.err, HasSubstr("c-same.toml: name: 'good' is taken by "));
  EXPECT_THAT(master.master_log(), HasSubstr("b-broken.toml:2: "));
  EXPECT_EQ(ctl({"start", "good"}).status, kOk);

  const Outcome checked = run("kplmstr", {"--check", "--definitions", master.path("definitions")});
  EXPECT_EQ(checked.status, 1);
  EXPECT_THAT(checked.err, HasSubstr("b-broken.toml:2: "));
}

TEST_F(Kplmstr, Hangup_ReadsTheDefinitionsAgain) {
  master.define("old.toml", "name = \"old\"\nprogram = \"/bin/true\"\n");
  master.define("kept.toml",
                "name = \"kept\"\nprogram = \"/bin/sleep\"\narguments = [\"9\"]\ntransport = \"signals\"\n");
  master.start();
  ASSERT_EQ(ctl({"start", "kept"}).status, kOk);
  unlink(master.path("definitions/old.toml").c_str());
  unlink(master.path("definitions/kept.toml").c_str());
  master.define("new.toml", "name = \"new\"\nprogram = \"/bin/true\"\n");
  master.signal("HUP");
  EXPECT_TRUE(master.wait_for_status("new "));
  EXPECT_THAT(ctl({"list"}).out, Not(HasSubstr("old ")));
  EXPECT_EQ(ctl({"stop", "kept"}).status, kOk);  // as long as it runs it is known
}

TEST_F(Kplmstr, Stop_EndsAllSubsystemsAndRemovesTheSockets) {
  master.define_probe("one", "socket", "autostart = true\nrestart = true\n");
  master.define_probe("two", "queue=78,1", "autostart = true\nqueue-key = 78\n");
  master.start();
  EXPECT_TRUE(master.wait_for_log("one", "started as one\n"));
  EXPECT_TRUE(master.wait_for_log("two", "started as two\n"));
  EXPECT_EQ(master.stop(), 0);
  EXPECT_THAT(master.log("one"), EndsWith("cancel\n"));
  EXPECT_THAT(master.log("two"), EndsWith("cancel\n"));
  EXPECT_NE(access(master.socket_path().c_str(), F_OK), 0);
  EXPECT_NE(access((master.socket_path() + ".status").c_str(), F_OK), 0);
  EXPECT_EQ(ctl({"list"}).status, kNotReached);
}

TEST_F(Kplmstr, AWrongPeer_IsRefusedAndTheAccessGroupServed) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root, to become other users";
  constexpr User kStranger{65534, 65534};
  constexpr User kMember{65534, 54321};
  chmod(master.path("").c_str(), 0755);
  master.start({"--access-group", "54321"});
  EXPECT_EQ(master.ctl({"list"}, kStranger).status, kNotReached);
  EXPECT_EQ(master.ctl({"list"}, kMember).status, kOk);

  chmod(master.socket_path().c_str(), 0666);  // what the file lets in, the kernel's word keeps out
  const Outcome refused = master.ctl({"list"}, kStranger);
  EXPECT_EQ(refused.status, kNotReached);
  EXPECT_THAT(refused.err, HasSubstr("not permitted"));
  EXPECT_TRUE(master.wait_for_master_log("uid 65534): closed: not permitted"));
}

TEST_F(Kplmstr, MalformedPackets_AreRefusedAndTheConnectionGoesOn) {
  master.start();
  const platform::Descriptor raw(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  master.socket_path().copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(connect(raw.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  for (const std::string& packet :
       {std::string("not JSON"), std::string("[]"), std::string("{\"action\":\"fly\"}"), std::string(1000, '['),
        std::string("{\"action\":\"request\",\"code\":65536}"), std::string(kpl::control::kMaxPacket, ' ')}) {
    ASSERT_GT(send(raw.get(), packet.data(), packet.size(), 0), 0);
    char answer[512] = {};
    ASSERT_GT(recv(raw.get(), answer, sizeof answer - 1, 0), 0);
    EXPECT_THAT(answer, HasSubstr("malformed request: "));
  }
  EXPECT_EQ(ctl({"list"}).status, kOk);
}

TEST_F(Kplmstr, SeveralRequestsAtOnce_AllGetTheirOwnAnswer) {
  master.define_probe("probe", "socket", "autostart = true\n");
  master.start();
  EXPECT_TRUE(master.wait_for_log("probe", "started as probe\n"));
  constexpr int kConnections = 20;
  std::vector<platform::Descriptor> connections;
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  master.socket_path().copy(address.sun_path, sizeof address.sun_path - 1);
  for (int i = 0; i < kConnections; ++i) {
    connections.emplace_back(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    ASSERT_EQ(connect(connections.back().get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    kpl::control::Request request;
    request.action = kpl::control::Action::kRequest;
    request.subsystem = "probe";
    request.code = 257;
    request.data = "from " + std::to_string(i);
    const std::string packet = kpl::control::encode(request);
    ASSERT_GT(send(connections.back().get(), packet.data(), packet.size(), 0), 0);
  }
  for (int i = 0; i < kConnections; ++i) {
    std::string all;
    while (all.find("\"end\":\"ok\"") == std::string::npos) {
      char packet[512];
      const ssize_t length = recv(connections[static_cast<std::size_t>(i)].get(), packet, sizeof packet, 0);
      ASSERT_GT(length, 0);
      all.append(packet, static_cast<std::size_t>(length));
    }
    EXPECT_THAT(all, HasSubstr("from " + std::to_string(i) + "\""));
  }
}

TEST_F(Kplmstr, Daemon_ReturnsWhenItServesAndTellsWhyItDoesNot) {
  std::vector<std::string> options = {"--daemon", "--log-file", master.path("daemon.log")};
  master.define_probe("probe", "socket", "autostart = true\n");
  master.start(options);
  EXPECT_TRUE(master.wait_for_log("probe", "started as probe\n"));
  EXPECT_EQ(ctl({"refresh", "probe"}).status, kOk);

  const Outcome second = run("kplmstr", {"--daemon", "--socket-path", master.socket_path()});
  EXPECT_EQ(second.status, kFailed);
  EXPECT_THAT(second.err, testing::StartsWith("kplmstr: "));
}

TEST(KplmstrProgram, WrongUse_IsToldAndTheExitStatusSaysSo) {
  EXPECT_EQ(run("kplmstr", {"--help"}).status, 0);
  EXPECT_THAT(run("kplmstr", {"--version"}).out, MatchesRegex("kplmstr [0-9.]+\n"));
  EXPECT_EQ(run("kplmstr", {"--what"}).status, kBadUse);
  EXPECT_EQ(run("kplmstr", {"--log-level", "loud"}).status, kBadUse);
  const Outcome outside = run("kplmstr", {"--definitions", "/nowhere", "--socket-path", "/nowhere/socket"});
  EXPECT_EQ(outside.status, kFailed);
  EXPECT_THAT(outside.err, HasSubstr("cannot serve subsystems: "));
}

TEST(KplctlProgram, WrongUse_IsToldAndTheExitStatusSaysSo) {
  EXPECT_THAT(run("kplctl", {"--help"}).out, HasSubstr("Exit status"));
  EXPECT_THAT(run("kplctl", {"--version"}).out, MatchesRegex("kplctl [0-9.]+\n"));
  const std::vector<std::vector<std::string>> wrong = {{},
                                                       {"fly"},
                                                       {"start"},
                                                       {"status", "--long"},
                                                       {"trace", "loud", "x"},
                                                       {"request", "x", "255"},
                                                       {"stop", "--forced", "--cancel", "x"},
                                                       {"start", "x", "--group", "y"}};
  for (const auto& arguments : wrong) EXPECT_EQ(run("kplctl", arguments).status, kBadUse);
  EXPECT_EQ(run("kplctl", {"--socket-path", "/nowhere", "list"}).status, kNotReached);
}

}  // namespace
}  // namespace kpl_test
