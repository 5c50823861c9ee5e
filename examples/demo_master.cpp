// The second act: the master runs the group-services daemon and an example daemon; an operator asks them, one of
// them crashes, and both are stopped. What is printed is what the programs say.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <regex>
#include <string>
#include <vector>

#include "examples/demo.h"
#include "examples/processes.h"

namespace {

using zn::Clock;
using zn::content_of;
using zn::Failure;
using zn::kStepLimit;
using zn::Process;
using Texts = std::vector<std::string>;

struct Outcome {
  int status = 0;  // as of waitpid
  Texts lines;
};

class Host {
 public:
  explicit Host(const std::string& folder) : folder_(folder), socket_(folder + "/gsd.sock") {}
  void run();

 private:
  void define() const;
  void start_master();
  Outcome ask(const Texts& arguments) const;
  /// Runs `kplctl` as told, prints what it says, and holds each of its lines against an expression.
  void step(const std::string& words, const Texts& expected, int exit_status = 0);
  void join_crew();
  void tell_member(const std::string& line);
  void expect_from_member(const std::string& expected);
  void expect_in_log(const std::string& expression) const;
  void crash(const std::string& subsystem);
  void wait_for_restart(const std::string& subsystem) const;
  void operate();

  const std::string folder_;
  const std::string socket_;
  std::unique_ptr<Process> master_;
  std::unique_ptr<Process> member_;
};

void Host::define() const {
  const std::string definitions = folder_ + "/definitions";
  std::filesystem::create_directory(definitions);
  std::ofstream(folder_ + "/lock") << "";
  const auto write = [&](const std::string& name, const std::string& program, const std::string& arguments) {
    std::ofstream(definitions + "/" + name + ".toml")
        << "name = \"" << name << "\"\ngroup = \"demo\"\nprogram = \"" << zn::program(program)
        << "\"\narguments = [" << arguments << "]\nrestart = true\nrestart-delay = 0.1\n";
  };
  write("gsd", "gsd",
        "\"--daemon\", \"--socket-path\", \"" + socket_ + "\", \"--log-file\", \"" + folder_ + "/gsd.log\"");
  write("tiny", "tiny_daemon", "\"" + folder_ + "/lock\"");
}

void Host::start_master() {
  const std::string log = folder_ + "/kplmstr.log";
  master_ = std::make_unique<Process>(Texts{"/usr/bin/setsid", zn::program("kplmstr"), "--definitions",
                                            folder_ + "/definitions", "--socket-path", folder_ + "/control"},
                                      Process::Environment{}, log);
  const auto deadline = Clock::now() + kStepLimit;
  while (ask({"list"}).status != 0) {
    if (Clock::now() > deadline) throw Failure{"the master does not come up: " + content_of(log)};
  }
}

Outcome Host::ask(const Texts& arguments) const {
  Texts command{zn::program("kplctl"), "--socket-path", folder_ + "/control"};
  command.insert(command.end(), arguments.begin(), arguments.end());
  const std::string errors = folder_ + "/errors";
  std::filesystem::remove(errors);
  Process process(command, {}, errors);
  Outcome outcome;
  outcome.status = process.wait_end(Clock::now() + kStepLimit);
  while (process.read_some()) {
  }
  while (auto line = process.next_line()) outcome.lines.push_back(*line);
  std::ifstream file(errors);
  for (std::string line; std::getline(file, line);) outcome.lines.push_back(line);
  return outcome;
}

void Host::step(const std::string& words, const Texts& expected, int exit_status) {
  std::printf("$ kplctl %s\n", words.c_str());
  const std::regex blanks(" +");
  const Outcome outcome =
      ask({std::sregex_token_iterator(words.begin(), words.end(), blanks, -1), std::sregex_token_iterator()});
  for (const std::string& line : outcome.lines) std::printf("%s\n", line.c_str());
  std::fflush(stdout);
  const std::string what = "\"kplctl " + words + "\" ";
  if (!WIFEXITED(outcome.status) || WEXITSTATUS(outcome.status) != exit_status) {
    throw Failure{what + "ended with status " + std::to_string(outcome.status)};
  }
  if (outcome.lines.size() != expected.size()) {
    throw Failure{what + "said " + std::to_string(outcome.lines.size()) + " lines where " +
                  std::to_string(expected.size()) + " were expected"};
  }
  for (size_t i = 0; i < expected.size(); i++) {
    if (std::regex_match(outcome.lines[i], std::regex(expected[i]))) continue;
    throw Failure{what + "said \"" + outcome.lines[i] + "\" where \"" + expected[i] + "\" was expected"};
  }
}

void Host::join_crew() {
  ask({"status", "--long", "gsd"});  // answered once clients can connect
  std::printf("  a client of gsd joins the group \"crew\"\n");
  member_ = std::make_unique<Process>(Texts{zn::program("member"), "crew", "1"},
                                      Process::Environment{{"GSD_ENDPOINT", "unix:" + socket_}});
  expect_from_member("1 joins; members: 1");
  expect_from_member("1 leads");
}

void Host::tell_member(const std::string& line) {
  std::printf("  the client is told: %s\n", line.c_str());
  member_->write_line(line);
}

void Host::expect_from_member(const std::string& expected) {
  const std::string line = member_->wait_line(Clock::now() + kStepLimit);
  const std::string text = std::regex_replace(line, std::regex("^[0-9.]+ [0-9.-]+ "), "");
  std::printf("  the client: %s\n", text.c_str());
  if (text != expected) throw Failure{"the client said \"" + text + "\" where \"" + expected + "\" was expected"};
}

/// The last line that gsd has logged; it is written behind what it tells its clients.
void Host::expect_in_log(const std::string& expression) const {
  const std::regex expected("[-0-9T:.+]+ " + expression);
  const auto deadline = Clock::now() + kStepLimit;
  std::string last;
  while (!std::regex_match(last, expected)) {
    if (Clock::now() > deadline) {
      throw Failure{"gsd logged \"" + last + "\" where \"" + expression + "\" was expected"};
    }
    zn::pause_for(std::chrono::milliseconds(2));
    std::ifstream file(folder_ + "/gsd.log");
    for (std::string line; std::getline(file, line);) last = line;
  }
  std::printf("  gsd's log: %s\n", last.c_str());
}

void Host::crash(const std::string& subsystem) {
  std::smatch found;
  std::string table;
  for (const std::string& line : ask({"status", subsystem}).lines) table += line + '\n';
  if (!std::regex_search(table, found, std::regex(subsystem + " +demo +([0-9]+) +active"))) {
    throw Failure{subsystem + " is not active: " + table};
  }
  std::printf("$ kill -9 %s\n", found.str(1).c_str());
  ::kill(std::stoi(found.str(1)), SIGKILL);
}

void Host::wait_for_restart(const std::string& subsystem) const {
  const std::regex restarted(subsystem + " +demo +[0-9]+ +active +[0-9:]+ +1 .*");
  const auto deadline = Clock::now() + kStepLimit;
  for (;;) {
    for (const std::string& line : ask({"status", subsystem}).lines) {
      if (std::regex_match(line, restarted)) return;
    }
    if (Clock::now() > deadline)
      throw Failure{subsystem + " is not started again: " + content_of(folder_ + "/kplmstr.log")};
  }
}

void Host::operate() {
  const std::string short_head = "Subsystem +Group +PID +State +Time +Restarts +Last end";
  const std::string long_head = "Subsystem +Group +PID +State";
  step("start gsd", {"gsd started, pid [0-9]+"});
  step("start tiny", {"tiny started, pid [0-9]+"});
  join_crew();
  step("status", {short_head, "gsd +demo +[0-9]+ +active .*", "tiny +demo +[0-9]+ +active .*"});
  step("status --long gsd",
       {long_head, "gsd +demo +[0-9]+ +active", "group +crew", "  members +1: 1@1",
        "  state +0 bytes, event [0-9]+", "  protocol +none", "  subscribers +0",
        "session +1 member \\(pid [0-9]+, uid 0\\)", "  queued .*", "total +1 groups, 1 sessions, node 1"});
  step("trace on --long gsd", {});
  tell_member("say hello");
  expect_from_member("1 says \"hello\"");
  expect_in_log("trace   to session 1, token [0-9]+: approved message by 1 <approve> .*, msg 'hello', #[0-9]+");
  step("trace on --long tiny", {"tracing everything"});
  step("request tiny 256 five!", {});
  step("status --long tiny", {long_head, "tiny +demo +[0-9]+ +active", "ticks +[0-9]+, 6 at a time"});
  step("request tiny 256", {"kplctl: nothing to add"}, 1);
  step("refresh tiny", {});
  step("status --long tiny", {long_head, "tiny +demo +[0-9]+ +active", "ticks +[0-9]+, 1 at a time"});

  crash("gsd");
  expect_from_member("announcement: WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY");
  wait_for_restart("gsd");
  step("status gsd", {short_head, "gsd +demo +[0-9]+ +active +[0-9:]+ +1 +signal Killed"});
  join_crew();
  step("stop tiny", {"tiny ended: exit status 0"});
  step("stop gsd", {"gsd ended: exit status 0"});
  expect_from_member("announcement: WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY");
  step("status", {short_head, "gsd +demo +- +inactive .*", "tiny +demo +- +inactive .*"});
}

void Host::run() {
  define();
  start_master();
  operate();
  master_->signal(SIGTERM);
  if (master_->wait_end(Clock::now() + kStepLimit) != 0) {
    throw Failure{"the master did not stop in order: " + content_of(folder_ + "/kplmstr.log")};
  }
}

}  // namespace

void zn::demo_inside(const std::string& folder) {
  Host host(folder);
  host.run();
}

void zn::demo_master() {
  std::printf("\n%sDaemons under their master: gsd, and tiny_daemon as \"tiny\"%s\n", colour("1"), colour_off());
  const std::string obstacle = namespaces_obstacle();
  if (!obstacle.empty()) {
    say_skipped("here this act cannot be kept apart from your other processes, as root it might: " + obstacle);
    return;
  }
  const auto start = Clock::now();
  const TempFolder folder;
  Process inside(in_namespaces({program("demo"), kInside, folder.path()}), {});
  relay(inside, start + 3 * kStepLimit);
  if (inside.wait_end(Clock::now() + kStepLimit) != 0) throw Failure{"the second act went wrong"};
  std::printf("\nStarted, asked, crashed, started again, stopped: %.0f ms in all.\n",
              std::chrono::duration<double, std::milli>(Clock::now() - start).count());
}
