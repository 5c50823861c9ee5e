// The daemon and the host it lives on: its log, its paths, signals and the service manager.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "common/descriptor.h"
#include "dae/datagram.h"
#include "gs/daemon_memory.h"
#include "support/gsd_process.h"
#include "support/raw_client.h"

namespace gs::daemon {
namespace {

using namespace test_support;
using testing::HasSubstr;
using testing::Not;

// ------------------------------------------------------------------------------------------------------- the log

/// A pipe that takes the log, and whose reader reads when the test wants it.
struct LogPipe {
  LogPipe() {
    if (mkfifo(path.c_str(), 0600) != 0) throw std::runtime_error("mkfifo");
    pipe = platform::Descriptor(open(path.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC));
  }
  bool read_until(const std::string& wanted) {
    std::string text;
    return wait_until([&] {
      std::string piece(65536, '\0');
      const ssize_t got = read(pipe.get(), piece.data(), piece.size());
      if (got > 0) text.append(piece, 0, static_cast<std::size_t>(got));
      return text.find(wanted) != std::string::npos;
    });
  }

  TempDir dir;
  const std::string path = dir / "log";
  platform::Descriptor pipe;
};

TEST(DaemonLog, ALogThatNobodyReads_HoldsUpNobodyAndTheLossIsToldOnceItIsRead) {
  LogPipe log;
  GsdProcess gsd({"--log-file", log.path, "--log-level", "debug"});
  RawSession client(gsd.socket_path());
  SubscribeRequest refused;
  refused.token = 1;
  refused.control = WYX_SUBSCRIBE_STATE;
  refused.group_name = std::string(32, 'g');
  for (int i = 0; i < 30'000; ++i) ASSERT_EQ(client.request.call(refused), WYX_UNKNOWN_GROUP);
  EXPECT_TRUE(log.read_until(" lines were lost"));
  EXPECT_EQ(client.request.call(refused), WYX_UNKNOWN_GROUP);
  gsd.kill(SIGTERM);
  EXPECT_TRUE(log.read_until(" info stopped"));
  EXPECT_EQ(gsd.wait(), 0);
}

TEST(DaemonLog, OneUsersFlood_IsCutAndCountedAndOthersAreStillHeard) {
  MemoryDaemon daemon;
  const auto misbehave = [&](std::uint32_t user) { daemon.say(daemon.open(user), wire::PingAnswer{}); };
  const auto lines = [&] {
    const std::string text = daemon.log.str();
    return std::count(text.begin(), text.end(), '\n');
  };
  daemon.logger->set_level(spdlog::level::info);
  for (int i = 0; i < 1000; ++i) misbehave(1000);
  misbehave(1001);
  EXPECT_EQ(lines(), platform::ClientLog::kBurst + 1);
  EXPECT_TRUE(daemon.logged("uid 1001"));
  daemon.pass(platform::ClientLog::kTellAfter);
  EXPECT_TRUE(daemon.logged("900 lines about clients were left out: 900 of uid 1000"));
  const auto before = lines();
  misbehave(1000);
  EXPECT_EQ(lines(), before + 1);
  daemon.logger->set_level(spdlog::level::debug);
  for (int i = 0; i < 1000; ++i) misbehave(1000);
  EXPECT_EQ(lines(), before + 1001);
}

TEST(DaemonLog, AFileThatOthersCanExchange_IsRefused) {
  const TempDir dir;
  std::ofstream(dir / "real") << "precious";
  std::filesystem::create_symlink(dir / "real", dir / "link");
  std::filesystem::create_directory(dir / "open");
  chmod((dir / "open").c_str(), 0777);
  for (const auto& [file, why] :
       {std::pair("link", "is a link"), std::pair("open/log", "can be written by others")}) {
    const GsdRun run = run_gsd({"--socket-path", dir / "sock", "--log-file", dir / file});
    EXPECT_EQ(run.status, 1);
    EXPECT_THAT(run.err, HasSubstr(why));
  }
  EXPECT_EQ(content_of(dir / "real"), "precious");
}

// ------------------------------------------------------------------------------------------------------ the paths

TEST(DaemonPaths, SocketOrLockThatIsRemovedOrReplaced_IsMadeAnewAndOnesOwnOnlyIsRemoved) {
  GsdProcess gsd;
  const std::string socket = gsd.socket_path(), lock = socket + ".lock";
  RawSession client(socket);
  const auto logged_times = [&](const std::string& text, int times) {
    return wait_until([&] {
      int found = 0;
      const std::string log = gsd.log();
      for (auto at = log.find(text); at != std::string::npos; at = log.find(text, at + 1)) ++found;
      return found == times;
    });
  };
  unlink(socket.c_str());
  EXPECT_TRUE(logged_times("bound anew", 1));
  {
    const RawSession late(socket);
    unlink(socket.c_str());
    std::ofstream(socket) << "precious";
    EXPECT_TRUE(logged_times("exists and is not a socket", 1));
  }
  unlink(lock.c_str());
  EXPECT_TRUE(logged_times("locked anew", 1));
  EXPECT_THAT(run_gsd({"--socket-path", socket}).err, HasSubstr("another gsd (pid " + std::to_string(gsd.pid())));
  gsd.kill(SIGTERM);
  client.event.receive<wire::Farewell>();
  EXPECT_EQ(gsd.wait(), 0);
  EXPECT_EQ(content_of(socket), "precious");
}

TEST(DaemonPaths, FolderThatOthersCanWriteAndLockOfSomebodyElse_AreToldAndNothingIsFollowed) {
  const TempDir dir;
  const std::string open_folder = dir / "open", lock = dir / "sock.lock", target = dir / "target";
  std::filesystem::create_directory(open_folder);
  chmod(open_folder.c_str(), 0777);
  EXPECT_THAT(run_gsd({"--socket-path", open_folder + "/sock"}).err, HasSubstr("chmod go-w"));
  EXPECT_FALSE(std::filesystem::exists(open_folder + "/sock.lock"));

  std::ofstream(lock) << "1\x1b[2J forged";
  const platform::Descriptor held(open(lock.c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_EQ(flock(held.get(), LOCK_EX), 0);
  EXPECT_EQ(run_gsd({"--socket-path", dir / "sock"}).err,
            "gsd: another gsd already serves " + dir / "sock" + "\n");

  std::ofstream(target) << "precious";
  std::filesystem::remove(lock);
  std::filesystem::create_hard_link(target, lock);
  EXPECT_EQ(run_gsd({"--socket-path", dir / "sock"}).status, 1);
  std::filesystem::remove(lock);
  std::filesystem::create_symlink(target, lock);
  EXPECT_EQ(run_gsd({"--socket-path", dir / "sock"}).status, 1);
  EXPECT_EQ(content_of(target), "precious");
}

// ---------------------------------------------------------------------------------- signals and service manager

TEST(DaemonManager, HangupAndStates_AreToldAndAMistakeChangesNothing) {
  const TempDir dir;
  const std::string config = dir / "gsd.toml", log = dir / "log";
  const Datagram manager;
  const auto told = [&](const std::string& what) {
    return wait_until([&] { return manager.receive().find(what) != std::string::npos; });
  };
  const auto log_has = [&](const std::string& text) {
    return wait_until([&] { return content_of(log).find(text) != std::string::npos; });
  };
  setenv("NOTIFY_SOCKET", ("@" + manager.name()).c_str(), 1);
  setenv("WATCHDOG_USEC", "20000", 1);
  GsdProcess gsd({"--config-if-exists", config, "--log-file", log});
  unsetenv("NOTIFY_SOCKET");
  unsetenv("WATCHDOG_USEC");
  EXPECT_TRUE(told("READY=1"));
  EXPECT_TRUE(told("WATCHDOG=1"));

  std::ofstream(config) << "log-level = 3\n";
  std::filesystem::rename(log, dir / "old");
  gsd.kill(SIGHUP);
  EXPECT_TRUE(told("RELOADING=1\nMONOTONIC_USEC="));
  EXPECT_TRUE(told("READY=1"));
  EXPECT_TRUE(
      wait_until([&] { return content_of(dir / "old").find("gsd.toml:1: log-level") != std::string::npos; }));
  EXPECT_FALSE(std::filesystem::exists(log));
  std::ofstream(config) << "log-level = \"debug\"\nnode-number = 7\n";
  gsd.kill(SIGHUP);
  EXPECT_TRUE(log_has("node-number: changes with the next start"));
  EXPECT_TRUE(log_has("the configuration was read again"));
  { const RawConnection asks(gsd.socket_path()); }
  EXPECT_TRUE(log_has(" debug "));
  gsd.kill(SIGTERM);
  EXPECT_TRUE(told("STOPPING=1"));
  EXPECT_EQ(gsd.wait(), 0);
}

}  // namespace
}  // namespace gs::daemon
