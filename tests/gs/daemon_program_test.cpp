#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <iterator>

#include "common/sanitizers.h"
#include "daemon/options.h"
#include "support/gsd_process.h"
#include "support/raw_client.h"

namespace gs::daemon {
namespace {

using namespace test_support;
using testing::HasSubstr;

JoinRequest join_as(std::size_t instance) {
  JoinRequest join;
  join.token = 1;
  join.instance = static_cast<std::int16_t>(instance);
  join.attributes.group_name = "group";
  return join;
}

/// A session with a provider.
struct Member : RawSession {
  Member(const GsdProcess& gsd, std::size_t instance) : RawSession(gsd.socket_path()) {
    if (request.call(join_as(instance)) != WYX_OK) throw std::runtime_error("join");
  }
  wyx_rc_t send(const Bytes& message) { return request.call(MessageRequest{1, {}, message}); }
  /// Reads events until one of this protocol has come; a failure on the way: its id.
  std::optional<ProviderId> read_until(wyx_request_t protocol) {
    std::optional<ProviderId> failed;
    for (wyx_request_t seen = WYX_MERGE; seen != protocol;) {
      const auto notify = event.receive<wire::Notify>();
      const auto& n = std::get<ProtocolNotification>(*notify.what);
      if (n.protocol == WYX_FAILURE_LEAVE) failed = n.proposal.changing_providers->at(0);
      seen = n.protocol;
    }
    return failed;
  }
  void expect_failure_of(std::int16_t instance) {
    EXPECT_EQ(read_until(WYX_FAILURE_LEAVE), (ProviderId{instance, 1}));
  }
};

bool exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

// ----------------------------------------------------------------------------------------- clients, good and bad

TEST(DaemonProgram, HostileAndDyingClients_AreClosedWithAReasonAndMembersGoOn) {
  GsdProcess gsd;
  Member member(gsd, 1);
  const std::pair<std::string, const char*> first_packets[] = {
      {"GSDP", "closed: malformed: a packet that is cut off"},
      {std::string(wire::kMaxPacket + 1, 'x'), "closed: malformed: a packet over the limit"}};
  for (const auto& [bytes, reason] : first_packets) {
    RawConnection hostile(gsd.socket_path());
    hostile.send_bytes(bytes);
    hostile.wait_for_close();
    EXPECT_TRUE(gsd.wait_for_log(reason));
  }
  Member broken(gsd, 2);
  broken.event.send_bytes("rubbish");
  broken.request.wait_for_close();
  member.expect_failure_of(2);
  for (const auto channel : {&RawSession::event, &RawSession::request}) {
    Member dying(gsd, 3);
    (dying.*channel).close();
    member.expect_failure_of(3);
  }
  EXPECT_EQ(member.send("still here"), WYX_OK);
}

TEST(DaemonProgram, FloodThatIsNotDrained_ClosesTheSlowClientAndHoldsUpNobody) {
  GsdProcess gsd({"--queue-bound", "1000000", "--drain-time", "1"});
  Member sender(gsd, 1), slow(gsd, 2);
  std::optional<ProviderId> failed;
  for (int i = 0; i < 1000 && !failed; ++i) {
    ASSERT_EQ(sender.send(Bytes(kMaxProviderMessage, 'm')), WYX_OK);
    failed = sender.read_until(WYX_PROVIDER_MESSAGE);
  }
  if (!failed) sender.expect_failure_of(2);
  EXPECT_TRUE(gsd.wait_for_log("does not drain its notifications"));
  slow.event.wait_for_close();
}

// As the kernel closes no socket that a child still holds.
TEST(DaemonProgram, ProcessThatEndsWhileItsChildHoldsTheSockets_IsLostOnceItsLastRequestIsDone) {
  GsdProcess gsd;
  Member survivor(gsd, 1);
  int child_may_end[2];
  ASSERT_EQ(pipe(child_may_end), 0);
  const pid_t parent = fork();
  if (parent == 0) {
    Member dying(gsd, 2);
    close(child_may_end[1]);
    char byte;
    if (fork() == 0) _exit(static_cast<int>(read(child_may_end[0], &byte, 1)));
    dying.request.send(wire::Call{MessageRequest{1, {}, "last words"}});
    _exit(0);
  }
  ASSERT_EQ(waitpid(parent, nullptr, 0), parent);
  survivor.read_until(WYX_PROVIDER_MESSAGE);
  survivor.expect_failure_of(2);
  EXPECT_TRUE(gsd.wait_for_log("closed: its process has ended"));
  close(child_may_end[0]);
  close(child_may_end[1]);
}

TEST(DaemonProgram, IdleClients_CostAtMost64KiBEach) {
  if (ZN_ADDRESS_SANITIZER || ZN_THREAD_SANITIZER) GTEST_SKIP() << "sanitizers have memory of their own";
  GsdProcess gsd;
  const auto resident = [&gsd] {
    std::ifstream statm("/proc/" + std::to_string(gsd.pid()) + "/statm");
    std::size_t size = 0, pages = 0;
    statm >> size >> pages;
    return pages * static_cast<std::size_t>(sysconf(_SC_PAGESIZE));
  };
  const RawSession first(gsd.socket_path());
  const std::size_t before = resident();
  std::vector<Member> clients;
  for (std::size_t i = 0; i < 200; ++i) {
    clients.emplace_back(gsd, i);
    ASSERT_EQ(clients.back().request.call(StateChangeRequest{1, {}, Bytes(1000, 's')}), WYX_OK);
  }
  EXPECT_LE(resident() - before, clients.size() * 64 * 1024);
}

TEST(DaemonProgram, DescriptorsThatRunOut_DelayNewClientsAndHurtNoOldOnes) {
  GsdProcess gsd;
  RawSession old_client(gsd.socket_path());
  // The undefined-behaviour sanitizer needs descriptors of its own when it first sees a class: let it see them
  // now.
  { Member first(gsd, 0); }
  ASSERT_TRUE(gsd.wait_for_log("closed: the peer is gone"));
  const rlimit few = {64, 64};
  ASSERT_EQ(prlimit(gsd.pid(), RLIMIT_NOFILE, &few, nullptr), 0);
  std::vector<RawConnection> crowd;
  for (int i = 0; i < 80; ++i) crowd.emplace_back(gsd.socket_path());
  ASSERT_TRUE(gsd.wait_for_log("cannot accept more connections for now"));
  EXPECT_EQ(old_client.request.call(join_as(1)), WYX_OK);
  crowd.clear();
  Member late(gsd, 2);
}

// ------------------------------------------------------------------------------------------------ start and stop

TEST(DaemonProgram, Sigterm_TellsClientsRemovesTheSocketAndExitsWithZero_ThoughOneTakesNothing) {
  for (const bool stalled : {false, true}) {
    GsdProcess gsd;
    Member client(gsd, 1);
    client.read_until(WYX_JOIN);
    std::optional<Member> slow;
    if (stalled) slow.emplace(gsd, 2);
    for (int i = 0; stalled && i < 100; ++i) {
      ASSERT_EQ(client.send(Bytes(kMaxProviderMessage, 'm')), WYX_OK);
      client.read_until(WYX_PROVIDER_MESSAGE);
    }
    gsd.kill(SIGTERM);
    client.event.receive<wire::Farewell>();
    client.event.wait_for_close();
    client.request.wait_for_close();
    EXPECT_EQ(gsd.wait(), 0);
    EXPECT_FALSE(exists(gsd.socket_path()));
  }
}

TEST(DaemonProgram, SecondInstanceOrPathOfSomethingElse_IsRefusedWithAClearLineAndAllIsLeftAsItWas) {
  GsdProcess gsd;
  const std::string socket = gsd.socket_path(), file = socket + ".precious";
  std::ofstream(file) << "data";
  const std::pair<std::string, std::string> cases[] = {
      {socket, "gsd: another gsd (pid " + std::to_string(gsd.pid()) + ") already serves " + socket + "\n"},
      {file, "gsd: " + file + " exists and is not a socket\n"}};
  for (const auto& [path, line] : cases) {
    const GsdRun second = run_gsd({"--socket-path", path});
    EXPECT_EQ(second.status, 1);
    EXPECT_EQ(second.err, line);
  }
  EXPECT_TRUE(std::ifstream(file).good());
  Member client(gsd, 1);
}

TEST(DaemonProgram, SocketOfAKilledDaemon_IsReplaced) {
  GsdProcess gsd;
  gsd.kill(SIGKILL);
  EXPECT_EQ(gsd.wait(), -1);
  ASSERT_TRUE(exists(gsd.socket_path())) << "a stale socket is what this test is about";
  gsd.restart();
  Member client(gsd, 1);
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

// ------------------------------------------------------------------------------------------------- configuration

TEST(DaemonOptions, HelpAndVersion_AreAnsweredOnStandardOutput) {
  const GsdRun version = run_gsd({"--version"}), help = run_gsd({"--help"});
  EXPECT_EQ(version.status, 0);
  EXPECT_THAT(version.out, testing::MatchesRegex("gsd [0-9]+\\.[0-9]+\\.[0-9]+\n"));
  EXPECT_EQ(help.status, 0);
  for (const char* option : {"--config", "--socket-path", "--access-group", "--node-number", "--queue-bound",
                             "--log-level", "--log-file", "--daemon"})
    EXPECT_THAT(help.out, HasSubstr(option));
}

class DaemonConfig : public testing::Test {
 protected:
  std::string write(const std::string& content) {
    std::ofstream(path_) << content;
    return path_;
  }
  static auto values(const Options& o) {
    return std::tuple(o.socket_path, o.access_group, o.node_number, o.corosync, o.safe, o.member_timeout,
                      o.require_quorum, o.queue_bound, o.drain_time, o.user_queue_bound, o.total_queue_bound,
                      o.max_sessions, o.user_sessions, o.root_sessions, o.log_level, o.log_file,
                      o.engine.session_bytes, o.engine.user_bytes, o.engine.total_bytes, o.engine.max_phase_time);
  }

  TempDir dir_;
  const std::string path_ = dir_ / "gsd.toml";
};

TEST_F(DaemonConfig, WrongOptionOrFile_IsOneLineAndStatusTwo) {
  const std::string range = "node-number: must be a whole number from 0 to 32767, not ";
  const std::pair<std::vector<std::string>, std::string> options[] = {
      {{"--colour"}, "--colour"},
      {{"--config"}, "--config"},
      {{"--node-number", "32768"}, "--" + range + "'32768'"},
      {{"--queue-bound", "1k"}, "--queue-bound: must be"},
      {{"--daemon", "--ready-fd", "1"}, "--daemon excludes --ready-fd"},
      {{"--ordering", "zookeeper"}, "--ordering: must be local or corosync, not 'zookeeper'"},
      {{"--log-level", "loud"}, "--log-level: must be error, warning, info or debug"},
      {{"--access-group", "no such group"}, "--access-group: there is no group 'no such group'"},
      {{"--socket-path", std::string(108, 's')}, "--socket-path: must be a path of 1 to 107 characters"},
      {{"--config", "/nonexistent/gsd.toml"}, "/nonexistent/gsd.toml: cannot be read: No such file or directory"}};
  const std::pair<std::string, std::string> files[] = {
      {"\nsocket-path = 3\n", ":2: socket-path: must be a text in quotes"},
      {"node-number = \"3\"\n", ":1: node-number: must be a whole number"},
      {"\n\nnode-number = -1\n", ":3: " + range + "'-1'"},
      {"colour = 3\n", ":1: unknown setting 'colour'"},
      {"socket-path = \"/x\"\nsocket-path = \"/y\"\n", ":2: "},
      {"log-level = \"info\"\nnode-number = = 3\n", ":2: "}};
  const auto expect_refused = [](const std::vector<std::string>& arguments, const std::string& what) {
    const GsdRun run = run_gsd(arguments);
    EXPECT_EQ(run.status, 2) << run.err;
    EXPECT_THAT(run.err, testing::StartsWith("gsd: "));
    EXPECT_THAT(run.err, HasSubstr(what));
    EXPECT_EQ(run.err.find('\n'), run.err.size() - 1) << run.err;
  };
  for (const auto& [arguments, what] : options) expect_refused(arguments, what);
  for (const auto& [content, what] : files) expect_refused({"--config", write(content)}, path_ + what);
}

TEST_F(DaemonConfig, EverySetting_IsReadAndTheCommandLineOverridesIt) {
  const std::string path = write(
      "socket-path = \"/tmp/x\"\naccess-group = \"0\"\nnode-number = 12\nqueue-bound = 100_000\n"
      "ordering = \"corosync\"\ndelivery = \"agreed\"\nmember-timeout = 7\nrequire-quorum = \"no\"\n"
      "drain-time = 3\nuser-queue-bound = 200_000\ntotal-queue-bound = 300_000\n"
      "max-sessions = 4\nuser-sessions = 5\nroot-sessions = 6\n"
      "log-level = \"debug\"\nlog-file = \"/tmp/log\"\nsession-state-bound = 2_000_000\n"
      "user-state-bound = 3_000_000\nstate-bound = 4_000_000\nmax-phase-time = 300\n");
  const char* argv[] = {"gsd", "--config", path.c_str(), "--node-number", "13"};
  const auto options = parse_options(5, argv);
  ASSERT_TRUE(options);
  EXPECT_EQ(values(*options),
            std::tuple("/tmp/x", "0", 13u, true, false, std::chrono::seconds(7), false, 100'000u,
                       std::chrono::seconds(3), 200'000u, 300'000u, 4u, 5u, 6u, spdlog::level::debug, "/tmp/log",
                       2'000'000u, 3'000'000u, 4'000'000u, 300));
}

TEST_F(DaemonConfig, SampleAndManPage_SayTheDefaults) {
  Options changed;
  changed.socket_path = changed.access_group = changed.log_file = "changed";
  changed.node_number = 99;
  changed.corosync = true;
  changed.safe = changed.require_quorum = false;
  changed.member_timeout = {};
  changed.engine = {1, 1, 1, 1, 1};
  changed.queue_bound = changed.user_queue_bound = changed.total_queue_bound = 0;
  changed.drain_time = {};
  changed.max_sessions = changed.user_sessions = changed.root_sessions = 99;
  changed.log_level = spdlog::level::off;
  const Options defaults;
  EXPECT_EQ(values(read_config(SAMPLE_CONFIG, changed)), values(defaults));

  std::ifstream file(MAN_PAGE);
  const std::string page{std::istreambuf_iterator<char>(file), {}};
  const std::string level = spdlog::level::to_string_view(defaults.log_level).data();
  const std::pair<const char*, std::string> entries[] = {
      {"config", "TOML"},
      {"ready\\-fd", "ready"},
      {"socket\\-path", "Default:\n.IR " + defaults.socket_path + " "},
      {"access\\-group", "Default: none"},
      {"node\\-number", "Default: " + std::to_string(defaults.node_number) + "."},
      {"ordering", std::string("Default:\n.BR ") + (defaults.corosync ? "corosync" : "local") + " ."},
      {"delivery", std::string("Default:\n.BR ") + (defaults.safe ? "safe" : "agreed") + " ."},
      {"member\\-timeout", "Default: " + std::to_string(defaults.member_timeout.count()) + "."},
      {"require\\-quorum", std::string("Default:\n.BR ") + (defaults.require_quorum ? "yes" : "no") + " ."},
      {"queue\\-bound", "Default: " + std::to_string(defaults.queue_bound) + "."},
      {"session\\-state\\-bound", "Default: " + std::to_string(defaults.engine.session_bytes) + "."},
      {"user\\-state\\-bound", "Default: " + std::to_string(defaults.engine.user_bytes) + "."},
      {"state\\-bound", "Default: " + std::to_string(defaults.engine.total_bytes) + "."},
      {"max\\-phase\\-time", "Default: " + std::to_string(defaults.engine.max_phase_time) + ";"},
      {"drain\\-time", "Default: " + std::to_string(defaults.drain_time.count()) + "."},
      {"user\\-queue\\-bound", "Default: " + std::to_string(defaults.user_queue_bound) + "."},
      {"total\\-queue\\-bound", "Default: " + std::to_string(defaults.total_queue_bound) + "."},
      {"max\\-sessions", "Default: " + std::to_string(defaults.max_sessions) + "."},
      {"user\\-sessions", "Default: " + std::to_string(defaults.user_sessions) + "."},
      {"root\\-sessions", "Default: " + std::to_string(defaults.root_sessions) + "."},
      {"log\\-file", "Default: none"},
      {"log\\-level", "Default: " + level + "."}};
  for (const auto& [option, text] : entries) {
    const auto start = page.find(std::string(".BI \\-\\-") + option + " ");
    ASSERT_NE(start, std::string::npos) << option;
    EXPECT_THAT(page.substr(start, page.find(".TP", start) - start), HasSubstr(text));
  }
}

}  // namespace
}  // namespace gs::daemon
