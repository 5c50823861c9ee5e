// kplmstr and kplctl as they are used, each test with a master of its own.
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>

#include "control/control.h"
#include "dae/datagram.h"
#include "kpl.h"
#include "kpl/private_master.h"
#include "support/raw_client.h"

namespace kpl_test {
namespace {

using nlohmann::json;
using test_support::RawConnection;
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
constexpr uid_t kNobody = 65534;

class Kplmstr : public WithMaster {
 protected:
  json status_of(const std::string& name) const {
    return json::parse(ctl({"status", name, "--json"}).out)["subsystems"][0];
  }
};

/// A subsystem with each transport; as root it is another user's.
class KplmstrTransport : public Kplmstr, public testing::WithParamInterface<const char*> {
 protected:
  void SetUp() override {
    Kplmstr::SetUp();
    if (IsSkipped()) return;
    chmod(master.path("").c_str(), 01777);
    const std::string transport = GetParam();
    std::string more = "group = \"tests\"\n";
    if (transport == "queue=77,5") more += "queue-key = 77\nqueue-type = 5\n";
    if (transport == "signals") more += "normal-signal = \"SIGUSR1\"\nforced-signal = \"USR2\"\n";
    if (geteuid() == 0) more += "user = \"" + std::to_string(kNobody) + "\"\n";
    master.define_probe("probe", transport, more);
    master.start();
  }
  void start() const {
    const Outcome started = ctl({"start", "probe"});
    ASSERT_EQ(started.status, kOk) << started.err << master.log("master");
    EXPECT_TRUE(master.wait_for_log("probe", "started as probe\n"));
  }
};
class KplmstrMessages : public KplmstrTransport {};
constexpr auto kUpToEquals = [](const auto& each) { return std::string(each.param, strcspn(each.param, "=")); };
INSTANTIATE_TEST_SUITE_P(Over, KplmstrTransport, testing::Values("socket", "queue=77,5", "signals"), kUpToEquals);
INSTANTIATE_TEST_SUITE_P(Over, KplmstrMessages, testing::Values("socket", "queue=77,5"), kUpToEquals);

TEST_P(KplmstrTransport, TheDaemon_IsServedAndStoppedInEachWay) {
  const bool signals = std::string(GetParam()) == "signals";
  const std::string served = signals ? "" : "trace on\ntrace on long\ntrace off\nrefresh\n";
  const int status = signals ? kNotSupported : kOk;
  const std::pair<std::vector<std::string>, std::string> stops[] = {
      {{"stop", "probe"}, "stop normal\n"},
      {{"stop", "--forced", "probe"}, "stop forced\n"},
      {{"stop", "--cancel", "--group", "tests"}, "cancel\n"}};
  for (const auto& [stop, line] : stops) {
    start();
    EXPECT_EQ(ctl({"trace", "on", "probe"}).status, status);
    EXPECT_EQ(ctl({"trace", "on", "--long", "probe"}).status, status);
    EXPECT_EQ(ctl({"trace", "off", "probe"}).status, status);
    EXPECT_EQ(ctl({"refresh", "--group", "tests"}).status, status);
    EXPECT_THAT(ctl(stop).out, EndsWith("probe ended: exit status 0\n"));
    EXPECT_EQ(master.log("probe"), "started as probe\n" + served + line);
    struct stat log {};
    stat(master.log_path("probe").c_str(), &log);
    EXPECT_EQ(log.st_uid, geteuid() == 0 ? kNobody : geteuid());
    unlink(master.log_path("probe").c_str());
    EXPECT_EQ(ctl({"stop", "probe"}).status, kWrongState);
    EXPECT_EQ(ctl({"refresh", "probe"}).status, kWrongState);
  }
}

TEST_P(KplmstrMessages, OwnRequestsAndLongStatus_CarryTheirDataOrFail) {
  start();
  const Outcome echoed = ctl({"request", "probe", "257", "100% of\x1bit", "--parm1", "7", "--parm2", "-32768"});
  EXPECT_EQ(echoed.status, kOk) << echoed.err;
  EXPECT_EQ(echoed.out, "7 -32768 100% of?it\n");  // nothing to steer a terminal with
  EXPECT_EQ(ctl({"request", "probe", "258"}).err, "kplctl: 50% failed\n");
  EXPECT_EQ(ctl({"request", "probe", "259"}).status, kNotSupported);
  const std::string longest(kpl::control::kMaxData, 'x');
  EXPECT_EQ(ctl({"request", "probe", "300", longest}).status, kOk);
  EXPECT_EQ(ctl({"request", "probe", "300", longest + "x"}).status, kBadUse);

  const Outcome failed = ctl({"--json", "request", "probe", "258"});
  EXPECT_EQ(failed.status, kFailed);
  const json result = json::parse(failed.out)["results"][0];
  EXPECT_EQ(result["subsystem"], "probe");
  EXPECT_EQ(result["result"], "failed");
  EXPECT_EQ(result["code"], -1);
  EXPECT_EQ(result["text"], "50% failed");

  ASSERT_EQ(ctl({"request", "probe", "300", "--parm1", "200"}).status, kOk);
  const Outcome status = ctl({"status", "--long", "probe"});
  EXPECT_EQ(status.status, kOk) << status.err;
  std::string expected = "lines   200 are 100%\n";
  for (int i = 1; i < 200; ++i) expected += "        line " + std::to_string(i) + "\n";
  EXPECT_EQ(status.out, expected);

  ASSERT_EQ(ctl({"request", "probe", "300", "--parm1", "2"}).status, kOk);
  const json told = json::parse(ctl({"--json", "status", "--long", "probe"}).out)["results"][0];
  EXPECT_EQ(told["fields"], json::parse(R"([{"name": "lines", "value": "2 are 100%\nline 1"}])"));
  EXPECT_EQ(told["entry"]["state"], "active");
  EXPECT_THAT(ctl({"restart", "probe"}).out,
              MatchesRegex("probe ended: exit status 0\nprobe started, pid [0-9]+\n"));

  const Outcome crashed = ctl({"request", "probe", "256"});
  EXPECT_EQ(crashed.status, kFailed);
  EXPECT_THAT(crashed.err, HasSubstr("probe ended before it answered"));
}

TEST_F(Kplmstr, ACrashedDaemon_IsStartedAgainEverMoreSlowlyAndAStoppedOneIsNot) {
  master.define_probe("probe", "socket", "restart = true\nautostart = true\nrestart-delay = 0.01\n");
  master.define("loop",
                "program = \"/bin/false\"\nrestart = true\nrestart-delay = 0.05\n"
                "restart-delay-max = 80000\ntransport = \"signals\"\n");
  master.start();
  EXPECT_TRUE(master.wait_for_log("probe", "started as probe\n"));
  const int first = status_of("probe")["pid"];
  ctl({"request", "probe", "256"});
  EXPECT_TRUE(master.wait_for_log("probe", "started as probe\nstarted as probe\n"));
  const json status = status_of("probe");
  EXPECT_NE(status["pid"], first);
  EXPECT_EQ(status["restarts"], 1);
  EXPECT_EQ(status["last_end"], "signal Killed");
  EXPECT_EQ(ctl({"stop", "probe"}).status, kOk);
  EXPECT_EQ(status_of("probe")["state"], "inactive");

  EXPECT_EQ(ctl({"start", "loop"}).status, kOk);
  for (const char* delay : {"0.05 s", "0.1 s", "0.2 s"}) {
    EXPECT_TRUE(master.wait_for_log("master", "exit status 1; restart in " + std::string(delay)));
  }
  // With each crash the wait is longer, so this comes while one is under way, or soon will.
  EXPECT_TRUE(master.wait_for_status("waiting"));
  EXPECT_THAT(ctl({"stop", "loop"}).status, testing::AnyOf(kOk, kWrongState));
  EXPECT_TRUE(wait_until([&] { return status_of("loop")["state"] == "inactive"; }));
}

TEST_F(Kplmstr, AHungDaemon_IsKilledAndStartedAgainWhereTheDefinitionAsksForPings) {
  const std::string pings =
      "restart = true\nping-interval = 0.05\nrestart-delay = 0.01\nstop-time = 0.2\nping-limit = ";
  master.define_probe("hung", "socket", pings + "0.2\n", "silent");
  master.define_probe("well", "socket", pings + "60\n");
  master.start({"--log-level", "debug"});
  for (const char* name : {"hung", "well"}) ASSERT_EQ(ctl({"start", name}).status, kOk);
  EXPECT_TRUE(master.wait_for_log("hung", "started as hung\ncancel\nstarted as hung\n"));
  EXPECT_THAT(master.log("master"), HasSubstr("hung: hung (ping: hung has not answered within 0.2 s); SIGTERM"));
  const std::string answered = "well: ping: not-supported\n";
  const auto count = [&] {
    const std::string log = master.log("master");
    int found = 0;
    for (std::size_t at = 0; (at = log.find(answered, at)) != std::string::npos; ++at) ++found;
    return found;
  };
  EXPECT_TRUE(wait_until([&] { return count() >= 2; }));

  master.tell_shell("prlimit --pid $master --nofile=3:");  // a master without descriptors cannot ask
  EXPECT_TRUE(master.wait_for_log("master", "well: ping: no socket for the answer"));
  master.tell_shell("prlimit --pid $master --nofile=1024:");
  const auto before = count();
  EXPECT_TRUE(wait_until([&] { return count() > before; }));
  EXPECT_EQ(status_of("well")["restarts"], 0);
}

TEST_F(Kplmstr, WhatASubsystemWrites_IsLoggedSafelyAndItsEnvironmentIsItsOwn) {
  const auto shell = [&](const std::string& name, const std::string& script, const std::string& more) {
    master.define(
        name, "program = \"/bin/sh\"\ntransport = \"signals\"\narguments = [\"-c\", '" + script + "']\n" + more);
  };
  shell("own",
        "env; : > /dev/stderr; printf \"a\\033b%01000d\\n\" 0; ls /proc/self/fd | xargs echo descriptors; exec "
        "sleep 999",
        "environment = { COLOUR = \"red\" }\npass-environment = [\"TAKEN\"]\n");
  shell("flood", "yes | head -100000", "");
  setenv("TAKEN", "along", 1);
  setenv("SECRET", "kept", 1);
  master.start();
  ASSERT_EQ(ctl({"start", "own"}).status, kOk);
  ASSERT_EQ(ctl({"start", "flood"}).status, kOk);
  EXPECT_TRUE(master.wait_for_log("master", "own says: descriptors 0 1 2 3\n"));  // 3: of ls itself
  EXPECT_TRUE(master.wait_for_log("master", "lines of its output are left out"));
  EXPECT_TRUE(wait_until([&] { return status_of("flood")["last_end"] == "exit status 0"; }));
  const std::string log = master.log("master");
  EXPECT_THAT(log, HasSubstr("serves"));  // nothing has truncated it
  for (const char* line : {"own says: COLOUR=red\n", "own says: TAKEN=along\n", "own says: a?b000"}) {
    EXPECT_THAT(log, HasSubstr(line));
  }
  EXPECT_THAT(log, Not(HasSubstr("SECRET")));
}

TEST_F(Kplmstr, StartThatCannotBe_IsAnsweredWithTheReason) {
  ASSERT_EQ(mkfifo(master.path("pipe").c_str(), 0600), 0);
  struct {
    const char* name;
    std::string rest;
    std::string reason;
  } const cases[] = {{"missing", "\"/nowhere/daemon\"\n", "cannot run /nowhere/daemon: No such file or directory"},
                     {"no-program", "\"/etc/passwd\"\n", "cannot run /etc/passwd: Permission denied"},
                     {"no-user", "\"/bin/true\"\nuser = \"nobody-knows\"\n", "there is no user 'nobody-knows'"},
                     {"no-output", "\"/bin/true\"\noutput = \"/nowhere/log\"\n",
                      "cannot open /nowhere/log: No such file or directory"},
                     {"nobody-reads", "\"/bin/true\"\noutput = \"" + master.path("pipe") + "\"\n",
                      "cannot open " + master.path("pipe") + ": No such device or address"}};
  for (const auto& one : cases) master.define(one.name, "transport = \"signals\"\nprogram = " + one.rest);
  master.start();
  for (const auto& one : cases) {
    const Outcome started = ctl({"start", one.name});
    EXPECT_EQ(started.status, kFailed);
    EXPECT_EQ(started.err, "kplctl: " + one.reason + "\n");
    EXPECT_EQ(status_of(one.name)["state"], "inactive");
  }
  EXPECT_EQ(ctl({"start", "never-heard-of"}).status, kWrongState);
  EXPECT_EQ(ctl({"status", "--group", "never-heard-of"}).status, kWrongState);
}

TEST_F(Kplmstr, ADaemonThatDoesNotAnswerOrStop_CostsItsRequesterOnlyAndIsKilledInTheEnd) {
  master.define_probe("silent", "socket", "request-time = 0.2\nstop-time = 0.3\n", "silent");
  master.define_probe("other", "socket");
  master.define("deaf",
                "program = \"/bin/sh\"\ntransport = \"signals\"\nstop-time = 0.2\n"
                "arguments = [\"-c\", \"trap '' TERM; echo deaf; while :; do sleep 1000; done\"]\n"
                "output = \"" +
                    master.log_path("deaf") + "\"\n");
  master.start();
  for (const char* name : {"silent", "other", "deaf"}) ASSERT_EQ(ctl({"start", name}).status, kOk);
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

  EXPECT_TRUE(master.wait_for_log("deaf", "deaf\n"));
  EXPECT_EQ(ctl({"stop", "deaf"}).status, kNoAnswer);
  const Outcome cancelled = ctl({"stop", "--cancel", "deaf"});
  EXPECT_EQ(cancelled.status, kOk);
  EXPECT_EQ(cancelled.out, "deaf ended: signal Killed\n");
}

TEST_F(Kplmstr, BrokenDefinitions_AreToldWithTheirPlaceAndTheOthersServed) {
  master.define("good", "program = \"/bin/true\"\ntransport = \"signals\"\n");
  master.define("holed", "program = \n");
  std::ofstream(master.path("definitions/same.toml")) << "name = \"good\"\nprogram = \"/bin/false\"\n";
  std::ofstream(master.path("definitions/deep.toml")) << "name = " << std::string(20'000, '[');
  std::ofstream(master.path("definitions/ignored.txt")) << "what?";
  std::filesystem::create_directory(master.path("definitions/folder.toml"));
  std::filesystem::create_symlink("loop.toml", master.path("definitions/loop.toml"));
  ASSERT_EQ(mkfifo(master.path("definitions/pipe.toml").c_str(), 0600), 0);
  master.start();
  const Outcome list = ctl({"list"});
  EXPECT_EQ(list.status, kOk);
  EXPECT_THAT(list.out, HasSubstr("/bin/true"));
  EXPECT_THAT(list.out, Not(HasSubstr("/bin/false")));
  const Outcome checked = run("kplmstr", {"--check", "--definitions", master.path("definitions")});
  EXPECT_EQ(checked.status, kFailed);
  for (const char* problem : {"holed.toml:2: ", "same.toml: name: 'good' is taken by ",
                              "deep.toml: has more than ", "folder.toml: is no regular file",
                              "loop.toml: cannot be read: Too many levels", "pipe.toml: is no regular file"}) {
    EXPECT_THAT(list.err, HasSubstr(problem));
    EXPECT_THAT(master.log("master"), HasSubstr(problem));
    EXPECT_THAT(checked.err, HasSubstr(problem));
  }
  EXPECT_EQ(ctl({"start", "good"}).status, kOk);
}

TEST_F(Kplmstr, Hangup_ReadsTheDefinitionsAgainAndEndsNothing) {
  const std::string sleeper =
      "program = \"/bin/sleep\"\narguments = [\"999\"]\ntransport = \"signals\"\nrestart = true\n"
      "restart-delay = 0.01\nautostart = true\n";
  master.define("removed", sleeper);
  master.define("broken", sleeper);
  master.define("old", "program = \"/bin/true\"\n");
  master.define("environment",
                "program = \"/usr/bin/env\"\ntransport = \"signals\"\nautostart = true\noutput = \"" +
                    master.log_path("environment") + "\"\n");
  const Datagram manager;
  setenv("NOTIFY_SOCKET", ("@" + manager.name()).c_str(), 1);
  master.start({"--log-file", master.log_path("file")});
  unsetenv("NOTIFY_SOCKET");
  EXPECT_THAT(manager.receive(), HasSubstr("READY=1"));
  EXPECT_TRUE(master.wait_for_log("environment", "KPL_SUBSYSTEM="));
  EXPECT_THAT(master.log("environment"), Not(HasSubstr("NOTIFY_SOCKET")));
  EXPECT_TRUE(
      wait_until([&] { return status_of("removed").contains("pid") && status_of("broken").contains("pid"); }));
  const auto file_of = [&](const std::string& name) { return master.path("definitions/" + name + ".toml"); };
  unlink(file_of("old").c_str());
  unlink(file_of("removed").c_str());
  std::ofstream(file_of("broken")) << "what?";
  master.define("new", "program = \"/bin/true\"\n");
  std::filesystem::rename(master.log_path("file"), master.log_path("older"));
  master.tell_shell("kill -HUP $master");
  EXPECT_TRUE(master.wait_for_status("new "));
  EXPECT_THAT(manager.receive(), HasSubstr("RELOADING=1"));
  EXPECT_TRUE(master.wait_for_log("file", "subsystems defined"));
  EXPECT_EQ(ctl({"status", "old"}).status, kWrongState);
  for (const char* name : {"removed", "broken"}) {
    master.tell_shell("kill -KILL " + status_of(name)["pid"].dump());
  }
  EXPECT_TRUE(wait_until([&] { return status_of("broken")["restarts"] == 1; }));
  EXPECT_EQ(ctl({"status", "removed"}).status, kWrongState);

  std::filesystem::rename(master.path("definitions"), master.path("gone"));
  master.tell_shell("kill -HUP $master");
  EXPECT_TRUE(master.wait_for_log("file", "nothing changes"));
  EXPECT_EQ(status_of("broken")["restarts"], 1);
}

TEST_F(Kplmstr, AMasterThatIsKilled_LeavesWhatTheNextOneNamesAndAStoppedOneLeavesNothing) {
  master.define_probe("probe", "socket", "autostart = true\n");
  master.start();
  EXPECT_TRUE(master.wait_for_log("probe", "started as probe\n"));
  const std::string pid = status_of("probe")["pid"].dump();
  // Writes more than a pipe holds once nobody reads it.
  const std::string pipe = master.path("pipe");
  ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
  master.define("talker", "program = \"/bin/sh\"\ntransport = \"signals\"\narguments = [\"-c\", 'read line < " +
                              pipe + "; for i in $(seq 9999); do echo $i times; done; echo over > " +
                              master.log_path("talker") + "']\n");
  master.tell_shell("kill -HUP $master");
  EXPECT_TRUE(wait_until([&] { return ctl({"start", "talker"}).status == kOk; }));
  if (geteuid() == 0) {  // one that only says so: another user's, which takes no subsystem's place
    master.define_probe("free", "socket");
    master.tell_shell(
        "KPL_MASTER_SOCKET=" + master.socket_path() + ".status setpriv --reuid 65534 --clear-groups " +
        "sh -c 'KPL_SUBSYSTEM=free:$$ exec sleep 1000' & " + "until grep -q free:$! /proc/$!/environ; do :; done");
  }
  master.tell_shell("kill -KILL $master; wait $master; start \"$@\"");
  EXPECT_TRUE(master.wait_for_log("master", "probe: not started"));
  const Outcome started = ctl({"start", "probe"});
  EXPECT_EQ(started.status, kWrongState);
  EXPECT_THAT(started.err, HasSubstr("probe runs as process " + pid + ", left behind by an earlier kplmstr"));
  EXPECT_THAT(ctl({"status"}).err, HasSubstr("probe runs as process " + pid));
  if (geteuid() == 0) {
    EXPECT_EQ(ctl({"start", "free"}).status, kOk);
  }
  std::fstream(pipe) << "go\n" << std::flush;
  EXPECT_TRUE(master.wait_for_log("talker", "over\n"));
  master.tell_shell("kill " + pid);
  EXPECT_TRUE(wait_until([&] { return ctl({"start", "probe"}).status == kOk; }));
  EXPECT_TRUE(wait_until([&] { return ctl({"status"}).err.empty(); }));
  EXPECT_TRUE(master.wait_for_log("probe", "cancel\nstarted as probe\n"));

  EXPECT_EQ(master.stop(), 0);
  EXPECT_THAT(master.log("probe"), EndsWith("\ncancel\n"));
  EXPECT_NE(access(master.socket_path().c_str(), F_OK), 0);
  EXPECT_NE(access((master.socket_path() + ".status").c_str(), F_OK), 0);
  EXPECT_EQ(ctl({"list"}).status, kNotReached);
}

TEST_F(Kplmstr, AWrongPeer_IsRefusedAndTheAccessGroupServed) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root, to become other users";
  const auto as_nobody_of = [](const std::string& group) -> std::vector<std::string> {
    return {"setpriv", "--reuid", std::to_string(kNobody), "--regid", group, "--clear-groups"};
  };
  chmod(master.path("").c_str(), 0755);
  master.start({"--access-group", "54321"});
  EXPECT_EQ(master.ctl({"list"}, as_nobody_of("65534")).status, kNotReached);
  EXPECT_EQ(master.ctl({"list"}, as_nobody_of("54321")).status, kOk);

  chmod(master.socket_path().c_str(), 0666);  // what the file lets in, the kernel's word keeps out
  const Outcome refused = master.ctl({"list"}, as_nobody_of("65534"));
  EXPECT_EQ(refused.status, kNotReached);
  EXPECT_THAT(refused.err, HasSubstr("not permitted"));
  EXPECT_TRUE(master.wait_for_log("master", "uid 65534): closed: not permitted"));
}

TEST_F(Kplmstr, ManyConnections_GetTheirOwnAnswersAmongMalformedPacketsAndVanishedOnes) {
  master.define_probe("probe", "socket", "autostart = true\n");
  master.start();
  EXPECT_TRUE(master.wait_for_log("probe", "started as probe\n"));
  std::vector<RawConnection> connections;
  for (int i = 0; i < 20; ++i) {
    connections.emplace_back(master.socket_path());
    const std::string malformed(static_cast<std::size_t>(1 + i * 3000), '[');
    connections.back().send_bytes(malformed);
    const std::string packet =
        R"({"action":"request","subsystem":"probe","code":257,"data":"from )" + std::to_string(i) + "\"}";
    connections.back().send_bytes(packet);
    RawConnection(master.socket_path()).send_bytes(packet);
  }
  for (std::size_t i = 0; i < connections.size(); ++i) {
    std::string all;
    while (all.find("\"end\":\"ok\"") == std::string::npos) {
      const auto packet = connections[i].next_packet();
      ASSERT_FALSE(packet.empty());
      all.append(reinterpret_cast<const char*>(packet.data()), packet.size());
    }
    EXPECT_THAT(all, HasSubstr("malformed request: "));
    EXPECT_THAT(all, HasSubstr("from " + std::to_string(i) + "\""));
  }

  const std::string status_path = master.socket_path() + ".status";
  for (const std::string& removed : {status_path, master.socket_path()}) unlink(removed.c_str());
  EXPECT_TRUE(wait_until([&] { return ctl({"refresh", "probe"}).status == kOk; }));
  kplreq question{};
  question.subreq = {KPL_OBJECT_SUBSYSTEM, KPL_ACTION_STATUS, 0, 0, "probe"};
  RawConnection asks(status_path);
  asks.send_bytes(std::string(reinterpret_cast<const char*>(&question.kplhdr), 156) + std::string(4, '\0'));
  const auto told = asks.next_packet();
  EXPECT_THAT(std::string(reinterpret_cast<const char*>(told.data()), told.size()), HasSubstr("active"));
}

TEST_F(Kplmstr, Daemon_ReturnsWhenItServesAndTellsWhyItDoesNot) {
  master.define_probe("probe", "socket", "autostart = true\n");
  master.define("broken", "");
  master.start({"--daemon", "--log-file", master.log_path("daemon")});
  EXPECT_THAT(master.log("master"), HasSubstr("'program' is missing"));
  EXPECT_TRUE(wait_until([&] { return master.log("daemon").find("'program' is missing") != std::string::npos; }));
  EXPECT_TRUE(master.wait_for_log("probe", "started as probe\n"));
  EXPECT_EQ(ctl({"refresh", "probe"}).status, kOk);

  const Outcome second = run("kplmstr", {"--daemon", "--socket-path", master.socket_path()});
  EXPECT_EQ(second.status, kFailed);
  EXPECT_THAT(second.err, HasSubstr("kplmstr: "));
}

TEST(KplPrograms, WrongUse_IsToldAndTheExitStatusSaysSo) {
  EXPECT_EQ(run("kplmstr", {"--help"}).status, 0);
  EXPECT_THAT(run("kplctl", {"--help"}).out, HasSubstr("Exit status"));
  for (const std::string program : {"kplmstr", "kplctl"}) {
    EXPECT_THAT(run(program, {"--version"}).out, MatchesRegex(program + " [0-9.]+\n"));
  }
  const std::vector<std::vector<std::string>> wrong = {{"kplmstr", "--what"},
                                                       {"kplmstr", "--log-level", "loud"},
                                                       {"kplctl"},
                                                       {"kplctl", "fly"},
                                                       {"kplctl", "start"},
                                                       {"kplctl", "status", "--long"},
                                                       {"kplctl", "trace", "x"},
                                                       {"kplctl", "request", "x", "255"},
                                                       {"kplctl", "request", "x", "256", "\xff"},
                                                       {"kplctl", "start", "x", "-g", "y"},
                                                       {"kplctl", "stop", "--forced", "--cancel", "x"}};
  for (const auto& words : wrong) {
    const Outcome told = run(words[0], {words.begin() + 1, words.end()});
    EXPECT_EQ(told.status, kBadUse);
    EXPECT_THAT(told.err, MatchesRegex(words[0] + ": [^\n]+\n"));
  }
  const Outcome outside = run("kplmstr", {"--definitions", "/nowhere", "--socket-path", "/nowhere/socket"});
  EXPECT_EQ(outside.status, kFailed);
  EXPECT_THAT(outside.err, HasSubstr("cannot serve subsystems: "));
  EXPECT_EQ(run("kplctl", {"--socket-path", "/nowhere", "list"}).status, kNotReached);
}

}  // namespace
}  // namespace kpl_test
