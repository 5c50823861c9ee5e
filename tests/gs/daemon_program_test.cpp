#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <iterator>

#include "daemon/options.h"
#include "support/gsd_process.h"
#include "support/raw_client.h"

namespace gs::daemon {
namespace {

using test_support::GsdProcess;
using test_support::GsdRun;
using test_support::RawConnection;
using test_support::RawSession;
using test_support::run_gsd;
using test_support::TempDir;
using testing::HasSubstr;
using testing::MatchesRegex;

constexpr Token kToken = 1;

JoinRequest join_as(std::int16_t instance) {
  JoinRequest join;
  join.token = kToken;
  join.instance = instance;
  join.attributes.group_name = "group";
  return join;
}

/// Reads events until `instance` has failed.
void expect_failure_of(RawSession& survivor, std::int16_t instance) {
  for (;;) {
    const auto notify = survivor.event.receive<wire::Notify>();
    const auto* n = std::get_if<ProtocolNotification>(&*notify.what);
    if (n == nullptr || n->protocol != WYX_FAILURE_LEAVE) continue;
    EXPECT_EQ(n->proposal.changing_providers->at(0).instance, instance);
    return;
  }
}

// ---------------------------------------------------------------------------------------------- clients, good and
// bad

TEST(DaemonProgram, HostileConnections_AreClosedWithAReasonAndMembersGoOn) {
  GsdProcess gsd;
  RawSession member(gsd.socket_path());
  ASSERT_EQ(member.request.call(join_as(1)), WYX_OK);

  RawConnection truncated(gsd.socket_path());
  truncated.send_bytes("GSDP", 4);
  truncated.wait_for_close();
  EXPECT_TRUE(gsd.wait_for_log("closed: malformed: a packet that is cut off"));

  RawConnection oversized(gsd.socket_path());
  const std::string large(wire::kMaxPacket + 1, 'x');
  oversized.send_bytes(large.data(), large.size());
  oversized.wait_for_close();
  EXPECT_TRUE(gsd.wait_for_log("closed: malformed: a packet over the limit"));

  RawConnection out_of_order(gsd.socket_path());
  out_of_order.send(wire::ClientMessage(wire::Quit{}));
  out_of_order.wait_for_close();
  EXPECT_TRUE(gsd.wait_for_log("closed: out of order"));

  RawSession broken(gsd.socket_path());
  ASSERT_EQ(broken.request.call(join_as(2)), WYX_OK);
  broken.event.send_bytes("rubbish", 7);
  broken.request.wait_for_close();
  expect_failure_of(member, 2);
  EXPECT_EQ(member.request.call(MessageRequest{kToken, {}, "still here"}), WYX_OK);
}

TEST(DaemonProgram, ClientThatDies_IsSeenOnEitherChannel) {
  GsdProcess gsd;
  RawSession survivor(gsd.socket_path());
  ASSERT_EQ(survivor.request.call(join_as(1)), WYX_OK);
  RawSession a(gsd.socket_path());
  ASSERT_EQ(a.request.call(join_as(2)), WYX_OK);
  a.event.close();
  expect_failure_of(survivor, 2);
  RawSession b(gsd.socket_path());
  ASSERT_EQ(b.request.call(join_as(3)), WYX_OK);
  b.request.close();
  expect_failure_of(survivor, 3);
}

TEST(DaemonProgram, FloodThatIsNotDrained_ClosesTheSlowClientAndHoldsUpNobody) {
  GsdProcess gsd({"--queue-bound", "1000000"});
  RawSession sender(gsd.socket_path());
  RawSession slow(gsd.socket_path());
  ASSERT_EQ(sender.request.call(join_as(1)), WYX_OK);
  ASSERT_EQ(slow.request.call(join_as(2)), WYX_OK);
  bool failed = false;
  for (int i = 0; i < 1000 && !failed; ++i) {
    ASSERT_EQ(sender.request.call(MessageRequest{kToken, {}, Bytes(kMaxProviderMessage, 'm')}), WYX_OK);
    for (bool own = false; !own;) {
      const auto notify = sender.event.receive<wire::Notify>();
      const auto& n = std::get<ProtocolNotification>(*notify.what);
      own = n.protocol == WYX_PROVIDER_MESSAGE;
      failed = failed || n.protocol == WYX_FAILURE_LEAVE;
    }
  }
  if (!failed) expect_failure_of(sender, 2);
  EXPECT_TRUE(gsd.wait_for_log("does not drain its notifications"));
  slow.event.wait_for_close();
}

TEST(DaemonProgram, IdleClients_CostAtMost64KiBEach) {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
  GTEST_SKIP() << "sanitizers have memory of their own";
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
  GTEST_SKIP() << "sanitizers have memory of their own";
#endif
#endif
  GsdProcess gsd;
  const auto resident = [&gsd] {
    std::ifstream statm("/proc/" + std::to_string(gsd.pid()) + "/statm");
    std::size_t size = 0;
    std::size_t pages = 0;
    statm >> size >> pages;
    return pages * static_cast<std::size_t>(sysconf(_SC_PAGESIZE));
  };
  RawSession first(gsd.socket_path());
  const std::size_t before = resident();
  constexpr std::size_t kClients = 200;
  std::vector<RawSession> clients;
  clients.reserve(kClients);
  for (std::size_t i = 0; i < kClients; ++i) {
    clients.emplace_back(gsd.socket_path());
    ASSERT_EQ(clients.back().request.call(join_as(static_cast<std::int16_t>(i))), WYX_OK);
    ASSERT_EQ(clients.back().request.call(StateChangeRequest{kToken, {}, Bytes(1000, 's')}), WYX_OK);
  }
  EXPECT_LE(resident() - before, kClients * 64 * 1024);
}

TEST(DaemonProgram, DescriptorsThatRunOut_DelayNewClientsAndHurtNoOldOnes) {
  GsdProcess gsd;
  RawSession old_client(gsd.socket_path());
  {
    // The undefined-behaviour sanitizer needs descriptors of its own when it first sees a class: let it see them
    // now.
    RawSession first(gsd.socket_path());
    EXPECT_EQ(first.request.call(join_as(0)), WYX_OK);
  }
  ASSERT_TRUE(gsd.wait_for_log("closed: the peer is gone"));
  struct rlimit few {
    64, 64
  };
  ASSERT_EQ(prlimit(gsd.pid(), RLIMIT_NOFILE, &few, nullptr), 0);
  std::vector<RawConnection> crowd;
  for (int i = 0; i < 80; ++i) crowd.emplace_back(gsd.socket_path());
  ASSERT_TRUE(gsd.wait_for_log("cannot accept more connections for now"));
  EXPECT_EQ(old_client.request.call(join_as(1)), WYX_OK);
  crowd.clear();
  RawSession late(gsd.socket_path());
  EXPECT_EQ(late.request.call(join_as(2)), WYX_OK);
}

// ---------------------------------------------------------------------------------------------------- start and
// stop

TEST(DaemonProgram, Sigterm_TellsClientsRemovesTheSocketAndExitsWithZero) {
  GsdProcess gsd;
  RawSession client(gsd.socket_path());
  ASSERT_EQ(client.request.call(join_as(1)), WYX_OK);
  client.event.receive<wire::Notify>();
  gsd.kill(SIGTERM);
  client.event.receive<wire::Farewell>();
  client.event.wait_for_close();
  client.request.wait_for_close();
  EXPECT_EQ(gsd.wait(), 0);
  struct stat found {};
  EXPECT_NE(stat(gsd.socket_path().c_str(), &found), 0);
}

TEST(DaemonProgram, SigtermWithAClientThatTakesNothing_StillEnds) {
  GsdProcess gsd;
  RawSession sender(gsd.socket_path());
  RawSession slow(gsd.socket_path());
  ASSERT_EQ(sender.request.call(join_as(1)), WYX_OK);
  ASSERT_EQ(slow.request.call(join_as(2)), WYX_OK);
  for (int i = 0; i < 100; ++i) {
    ASSERT_EQ(sender.request.call(MessageRequest{kToken, {}, Bytes(kMaxProviderMessage, 'm')}), WYX_OK);
    while (std::get<ProtocolNotification>(*sender.event.receive<wire::Notify>().what).protocol !=
           WYX_PROVIDER_MESSAGE) {
    }
  }
  gsd.kill(SIGTERM);
  EXPECT_EQ(gsd.wait(), 0);
}

TEST(DaemonProgram, SecondInstance_IsRefusedWithAClearLineAndTheFirstServesOn) {
  GsdProcess gsd;
  const GsdRun second = run_gsd({"--socket-path", gsd.socket_path()});
  EXPECT_EQ(second.status, 1);
  EXPECT_EQ(second.err,
            "gsd: another gsd (pid " + std::to_string(gsd.pid()) + ") already serves " + gsd.socket_path() + "\n");
  RawSession client(gsd.socket_path());
  EXPECT_EQ(client.request.call(join_as(1)), WYX_OK);
}

TEST(DaemonProgram, SocketOfAKilledDaemon_IsReplaced) {
  GsdProcess gsd;
  gsd.kill(SIGKILL);
  EXPECT_EQ(gsd.wait(), -1);
  struct stat found {};
  ASSERT_EQ(stat(gsd.socket_path().c_str(), &found), 0) << "a stale socket is what this test is about";
  gsd.restart();
  RawSession client(gsd.socket_path());
  EXPECT_EQ(client.request.call(join_as(1)), WYX_OK);
}

TEST(DaemonProgram, PathOfSomethingElse_IsLeftAlone) {
  TempDir dir;
  std::ofstream(dir / "precious") << "data";
  const GsdRun run = run_gsd({"--socket-path", dir / "precious"});
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.err, "gsd: " + (dir / "precious") + " exists and is not a socket\n");
  EXPECT_TRUE(std::ifstream(dir / "precious").good());
}

TEST(DaemonProgram, Socket_IsForItsOwnerAndTheAccessGroupOnly) {
  const auto mode_of = [](const GsdProcess& gsd) {
    struct stat found {};
    stat(gsd.socket_path().c_str(), &found);
    return found.st_mode & 0777;
  };
  EXPECT_EQ(mode_of(GsdProcess()), 0600u);
  EXPECT_EQ(mode_of(GsdProcess({"--access-group", std::to_string(getgid())})), 0660u);
}

// -------------------------------------------------------------------------------------------------- configuration

TEST(DaemonOptions, HelpAndVersion_AreAnsweredOnStandardOutput) {
  const GsdRun version = run_gsd({"--version"});
  EXPECT_EQ(version.status, 0);
  EXPECT_THAT(version.out, MatchesRegex("gsd [0-9]+\\.[0-9]+\\.[0-9]+\n"));
  const GsdRun help = run_gsd({"--help"});
  EXPECT_EQ(help.status, 0);
  for (const char* option :
       {"--config", "--socket-path", "--access-group", "--node-number", "--queue-bound", "--log-level", "--log-file", "--daemon"}) {
    EXPECT_THAT(help.out, HasSubstr(option));
  }
}

TEST(DaemonOptions, WrongOption_IsOneLineAndStatusTwo) {
  const std::pair<std::vector<std::string>, std::string> cases[] = {
      {{"--colour"}, "--colour"},
      {{"--config"}, "--config"},
      {{"--node-number", "32768"}, "--node-number: must be a whole number from 0 to 32767, not '32768'"},
      {{"--queue-bound", "1k"}, "--queue-bound: must be"},
      {{"--log-level", "loud"}, "--log-level: must be error, warning, info or debug"},
      {{"--access-group", "no such group"}, "--access-group: there is no group 'no such group'"},
      {{"--socket-path", std::string(108, 's')}, "--socket-path: must be a path of 1 to 107 characters"},
      {{"--config", "/nonexistent/gsd.toml"}, "/nonexistent/gsd.toml: cannot be read: No such file or directory"},
  };
  for (const auto& [arguments, what] : cases) {
    const GsdRun run = run_gsd(arguments);
    EXPECT_EQ(run.status, 2) << run.err;
    EXPECT_THAT(run.err, testing::StartsWith("gsd: "));
    EXPECT_THAT(run.err, HasSubstr(what));
    EXPECT_EQ(run.err.find('\n'), run.err.size() - 1) << run.err;
  }
}

class DaemonConfig : public testing::Test {
 protected:
  std::string write(const std::string& content) {
    std::ofstream(path_) << content;
    return path_;
  }
  std::string error_of(const std::string& content) {
    try {
      read_config(write(content), Options());
    } catch (const OptionError& error) {
      return std::string(error.what()).substr(path_.size());
    }
    return "accepted";
  }

  TempDir dir_;
  const std::string path_ = dir_ / "gsd.toml";
};

TEST_F(DaemonConfig, EverySetting_IsReadAndTheCommandLineOverridesIt) {
  const std::string path = write(
      "socket-path = \"/tmp/x\"\naccess-group = \"0\"\nnode-number = 12\nqueue-bound = 100_000\nlog-level = "
      "\"debug\"\nlog-file = \"/tmp/log\"\n");
  const char* argv[] = {"gsd", "--config", path.c_str(), "--node-number", "13"};
  const auto options = parse_options(5, argv);
  ASSERT_TRUE(options);
  EXPECT_EQ(options->socket_path, "/tmp/x");
  EXPECT_EQ(options->access_group, "0");
  EXPECT_EQ(options->node_number, 13u);
  EXPECT_EQ(options->queue_bound, 100'000u);
  EXPECT_EQ(options->log_level, spdlog::level::debug);
  EXPECT_EQ(options->log_file, "/tmp/log");
}

TEST_F(DaemonConfig, WrongFile_IsNamedWithItsLine) {
  EXPECT_EQ(error_of("\nsocket-path = 3\n"), ":2: socket-path: must be a text in quotes");
  EXPECT_EQ(error_of("node-number = \"3\"\n"), ":1: node-number: must be a whole number");
  EXPECT_EQ(error_of("\n\nnode-number = -1\n"),
            ":3: node-number: must be a whole number from 0 to 32767, not '-1'");
  EXPECT_EQ(error_of("colour = 3\n"), ":1: unknown setting 'colour'");
  EXPECT_THAT(error_of("socket-path = \"/x\"\nsocket-path = \"/y\"\n"), HasSubstr(":2: "));
  EXPECT_THAT(error_of("log-level = \"info\"\nnode-number = = 3\n"), HasSubstr(":2: "));
  EXPECT_EQ(run_gsd({"--config", write("node-number = 99999\n")}).status, 2);
}

TEST_F(DaemonConfig, Sample_SaysTheDefaults) {
  Options changed;
  changed.socket_path.clear();
  changed.access_group = "changed";
  changed.node_number = 99;
  changed.queue_bound = 0;
  changed.log_level = spdlog::level::off;
  changed.log_file = "changed";
  const Options sample = read_config(SAMPLE_CONFIG, changed);
  const Options defaults;
  EXPECT_EQ(sample.socket_path, defaults.socket_path);
  EXPECT_EQ(sample.access_group, defaults.access_group);
  EXPECT_EQ(sample.node_number, defaults.node_number);
  EXPECT_EQ(sample.queue_bound, defaults.queue_bound);
  EXPECT_EQ(sample.log_level, defaults.log_level);
  EXPECT_EQ(sample.log_file, defaults.log_file);
}

TEST(DaemonManPage, EveryOption_IsThereWithItsDefault) {
  std::ifstream file(MAN_PAGE);
  const std::string page{std::istreambuf_iterator<char>(file), {}};
  const auto entry_of = [&page](const std::string& option) {
    const auto start = page.find(".BI \\-\\-" + option + " ");
    return start == std::string::npos ? "" : page.substr(start, page.find(".TP", start) - start);
  };
  const Options defaults;
  EXPECT_THAT(entry_of("config"), HasSubstr("TOML"));
  EXPECT_THAT(entry_of("ready\\-fd"), HasSubstr("ready"));
  EXPECT_THAT(entry_of("socket\\-path"), HasSubstr("Default:\n.IR " + defaults.socket_path + " "));
  EXPECT_THAT(entry_of("access\\-group"), HasSubstr("Default: none"));
  EXPECT_THAT(entry_of("node\\-number"), HasSubstr("Default: " + std::to_string(defaults.node_number) + "."));
  EXPECT_THAT(entry_of("queue\\-bound"), HasSubstr("Default: " + std::to_string(defaults.queue_bound) + "."));
  EXPECT_THAT(entry_of("log\\-file"), HasSubstr("Default: none"));
  EXPECT_THAT(entry_of("log\\-level"), HasSubstr(std::string("Default: ") +
                                                 spdlog::level::to_string_view(defaults.log_level).data() + "."));
}

}  // namespace
}  // namespace gs::daemon
