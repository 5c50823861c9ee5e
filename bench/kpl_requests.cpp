// What the KPL master costs: a request and its reply through it, beside a raw datagram ping-pong between two
// processes, and a long status; and how long a daemon that a shell starts takes to its first line of work.
// Needs namespaces of its own for processes and mounts, and says so where it cannot have them.
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <fstream>

#include "bench/figures.h"
#include "ctl/client.h"
#include "dae/dae.h"
#include "examples/processes.h"

namespace {

using kpl::control::Action;
using kpl::control::Result;
using std::chrono::duration;
using std::chrono::seconds;
using zn::Clock;
using zn::Failure;

constexpr int kRequests = 3000;
constexpr int kWarmUp = 200;
constexpr int kLongStatuses = 50;
constexpr int kStatusLines = 1000;
constexpr int kStarts = 10;
constexpr std::size_t kPacket = 156;  // bytes: a request without data
constexpr seconds kLimit{30};

// Process 1 of the namespaces; the master ends with its standard input.
constexpr char kInit[] = "setsid \"$@\" & master=$!; read -r line; kill $master; wait $master";

// ------------------------------------------------------------------------------------------------- the daemons

int request_fd = -1;

void write_lines() {
  for (int i = 0; i < kStatusLines; ++i) dae_status_printf("line %d\n", i);
}

/// Serves requests under the master.
int run_subsystem() {
  dae_req_sock_t routines = {};
  routines.dae_refresh = [] {};
  routines.dae_long_status = write_lines;
  dae_init_KPL_sock(&request_fd, &routines, 1);
  dae_parent_t parent = DAE_P_KPL;
  if (dae_init(&parent, nullptr) != 0) return 1;
  for (;;) {
    pollfd entry{request_fd, POLLIN, 0};
    poll(&entry, 1, -1);
    dae_KPL_req();
  }
}

/// Started by a shell, writes one line to `path`.
int run_from_shell(const std::string& path) {
  dae_parent_t parent = DAE_P_OTHER;
  if (dae_init(&parent, nullptr) != 0) return 1;
  std::ofstream(path) << "working\n";
  return 0;
}

// ----------------------------------------------------------------------------------------------------- figures

double microseconds_since(Clock::time_point start) {
  return duration<double, std::micro>(Clock::now() - start).count();
}

std::vector<double> ping_pongs() {
  std::array<int, 2> ends{};
  if (socketpair(AF_UNIX, SOCK_DGRAM, 0, ends.data()) != 0) throw Failure{"no socket pair"};
  std::array<char, kPacket> packet{};
  const pid_t echo = fork();
  if (echo == 0) {
    close(ends[0]);
    while (recv(ends[1], packet.data(), packet.size(), 0) > 1) send(ends[1], packet.data(), packet.size(), 0);
    _exit(0);
  }
  std::vector<double> samples;
  for (int i = 0; i < kRequests + kWarmUp; ++i) {
    const auto start = Clock::now();
    send(ends[0], packet.data(), packet.size(), 0);
    recv(ends[0], packet.data(), packet.size(), 0);
    if (i >= kWarmUp) samples.push_back(microseconds_since(start));
  }
  send(ends[0], packet.data(), 1, 0);
  waitpid(echo, nullptr, 0);
  close(ends[0]);
  close(ends[1]);
  return samples;
}

/// A master in namespaces of its own, with one subsystem: this program.
class Master {
 public:
  explicit Master(const std::string& folder) : socket_(folder + "/control"), client_(socket_) {
    std::ofstream(folder + "/bench.toml") << "name = \"bench\"\nprogram = \"" << self() << "\"\narguments = "
                                          << "[\"--role=subsystem\"]\n";
    process_ =
        std::make_unique<zn::Process>(zn::in_namespaces({"/bin/sh", "-c", kInit, "sh", zn::program("kplmstr"),
                                                         "--definitions", folder, "--socket-path", socket_}),
                                      zn::Process::Environment{}, folder + "/log");
    const auto give_up = Clock::now() + kLimit;
    while (access(socket_.c_str(), F_OK) != 0) {
      if (Clock::now() > give_up || !process_is_there())
        throw Failure{"kplmstr did not come up:\n" + zn::content_of(folder + "/log")};
      usleep(2000);
    }
    ask({Action::kStart, "bench", {}, false, false, 0, 0, 0, {}});
  }
  ~Master() {
    process_->close_input();
    try {
      process_->wait_end(Clock::now() + kLimit);
    } catch (const Failure& failure) {
      std::fprintf(stderr, "kpl_requests: %s\n", failure.text.c_str());
    }
  }
  Master(const Master&) = delete;
  Master& operator=(const Master&) = delete;

  void ask(const kpl::control::Request& request, std::size_t lines_expected = 0) {
    std::size_t lines = 0;
    const auto end = client_.ask(request, [&](const kpl::control::Answer& answer) {
      if (const auto* some = std::get_if<kpl::control::Lines>(&answer)) lines += some->lines.size();
    });
    if (end.result != Result::kOk) throw Failure{"a request failed: " + end.text};
    if (lines != lines_expected) throw Failure{"lines of the long status are missing"};
  }

  static std::string self() {
    std::array<char, 4096> path{};
    const ssize_t length = readlink("/proc/self/exe", path.data(), path.size() - 1);
    return {path.data(), static_cast<std::size_t>(length > 0 ? length : 0)};
  }

 private:
  bool process_is_there() const {
    siginfo_t ended{};
    waitid(P_PID, static_cast<id_t>(process_->pid()), &ended, WEXITED | WNOHANG | WNOWAIT);
    return ended.si_pid == 0;
  }

  const std::string socket_;
  kpl::ctl::Client client_;
  std::unique_ptr<zn::Process> process_;
};

void requests(zn::Figures& figures) {
  const zn::TempFolder folder;
  Master master(folder.path());
  std::vector<double> samples;
  const kpl::control::Request refresh{Action::kRefresh, "bench", {}, false, false, 0, 0, 0, {}};
  for (int i = 0; i < kRequests + kWarmUp; ++i) {
    const auto start = Clock::now();
    master.ask(refresh);
    if (i >= kWarmUp) samples.push_back(microseconds_since(start));
  }
  std::vector<double> bare = ping_pongs();
  const double p50 = zn::percentile(samples, 0.5);
  const double bare_p50 = zn::percentile(bare, 0.5);
  figures.add("raw datagram ping-pong between two processes, p50", bare_p50, "us");
  figures.add("request and reply through the master, p50", p50, "us", 1000);
  figures.add("  p99", zn::percentile(samples, 0.99), "us");
  figures.add("  in ping-pongs (p50)", p50 / bare_p50, "ping-pongs");

  std::vector<double> statuses;
  for (int i = 0; i < kLongStatuses; ++i) {
    const auto start = Clock::now();
    master.ask({Action::kStatus, "bench", {}, true, false, 0, 0, 0, {}}, kStatusLines);
    statuses.push_back(microseconds_since(start));
  }
  figures.add("long status of 1000 lines through the master, p50", zn::percentile(statuses, 0.5) / 1000, "ms");
}

/// The daemon's detach step looks once a second whether its parent is gone; whole seconds are that sleep.
void starts(zn::Figures& figures) {
  std::vector<double> samples;
  double slept = 0;
  for (int i = 0; i < kStarts; ++i) {
    const zn::TempFolder folder;
    const std::string line = folder.path() + "/line";
    const auto start = Clock::now();
    zn::Process shell({"/bin/sh", "-c", "\"$0\" \"$@\"; exit $?", Master::self(), "--role=daemon", line}, {});
    while (zn::content_of(line).empty()) {
      if (Clock::now() > start + kLimit) throw Failure{"a daemon did not come to its work"};
      usleep(200);
    }
    const double total = duration<double>(Clock::now() - start).count();
    samples.push_back((total - std::floor(total)) * 1000);
    slept += std::floor(total) / kStarts;
    shell.wait_end(Clock::now() + kLimit);
  }
  figures.add("start from a shell to the first line of work, p50", zn::percentile(samples, 0.5), "ms", 50);
  figures.add("  the detach step's own sleep, mean (not in it)", slept, "s");
}

}  // namespace

int main(int argc, char** argv) {
  const std::string role = zn::option(argc, argv, "role");
  if (role == "subsystem") return run_subsystem();
  if (role == "daemon") return run_from_shell(argv[argc - 1]);

  zn::catch_interrupts();
  zn::print_host();
  std::printf("settings: %d requests, %d long statuses of %d lines, %d starts\n", kRequests, kLongStatuses,
              kStatusLines, kStarts);
  try {
    zn::Figures figures;
    const std::string obstacle = zn::namespaces_obstacle();
    if (obstacle.empty()) {
      requests(figures);
    } else {
      std::printf("skipped: the master, which needs namespaces of its own: %s\n", obstacle.c_str());
    }
    starts(figures);
    figures.print();
    return figures.write_json(zn::option(argc, argv, "benchmark_out")) ? 0 : 1;
  } catch (const Failure& failure) {
    std::fprintf(stderr, "kpl_requests: %s\n", failure.text.c_str());
    return 1;
  }
}
