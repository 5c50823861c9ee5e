#include "kpl/private_master.h"

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <stdexcept>
#include <thread>

namespace kpl_test {
namespace {

// Process 1 of the namespace. Its children live on in the background until it is told otherwise.
constexpr char kInit[] =
    "setsid \"$@\" & master=$!\n"
    "while read -r name; do kill -$name $master; done\n"
    "kill -TERM $master 2>/dev/null; wait $master";

std::vector<std::string> unshare_command() {
  std::vector<std::string> command = {"unshare", "--pid", "--fork", "--mount-proc", "--ipc", "--kill-child"};
  if (geteuid() != 0) command.insert(command.end(), {"--user", "--map-root-user"});
  return command;
}

std::string content_of(const std::string& path) {
  std::ifstream file(path);
  return {std::istreambuf_iterator<char>(file), {}};
}

bool wait_until(const std::function<bool()>& done) {
  const auto give_up = std::chrono::steady_clock::now() + std::chrono::milliseconds(kHangLimitMs);
  while (!done()) {
    if (std::chrono::steady_clock::now() > give_up) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return true;
}

int open_output(const std::string& path) {
  return open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
}

pid_t spawn(std::vector<std::string> command, int in, int out, int err, const std::optional<User>& user) {
  std::vector<char*> argv;
  for (std::string& word : command) argv.push_back(word.data());
  argv.push_back(nullptr);
  const pid_t child = fork();
  if (child != 0) return child;
  dup2(in, 0);
  dup2(out, 1);
  dup2(err, 2);
  if (user && (setgroups(0, nullptr) != 0 || setgid(user->gid) != 0 || setuid(user->uid) != 0)) _exit(126);
  execvp(argv[0], argv.data());
  _exit(127);
}

int wait_for(pid_t pid) {
  const int handle = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
  pollfd wanted{handle, POLLIN, 0};
  if (handle >= 0 && poll(&wanted, 1, kHangLimitMs) != 1) kill(pid, SIGKILL);
  if (handle >= 0) close(handle);
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

Outcome run_command(const std::vector<std::string>& command, const std::optional<User>& user) {
  const test_support::TempDir dir;
  const int null = open("/dev/null", O_RDWR | O_CLOEXEC);
  const int out = open_output(dir / "out");
  const int err = open_output(dir / "err");
  const int status = wait_for(spawn(command, null, out, err, user));
  for (const int fd : {null, out, err}) close(fd);
  return {status, content_of(dir / "out"), content_of(dir / "err")};
}

}  // namespace

std::string program_path(const std::string& program) {
  const auto here = std::filesystem::read_symlink("/proc/self/exe").parent_path();
  return here / (program == "subsystem_probe" ? program : "../" + program);
}

Outcome run(const std::string& program, const std::vector<std::string>& arguments,
            const std::optional<User>& user) {
  std::vector<std::string> command = {program_path(program)};
  command.insert(command.end(), arguments.begin(), arguments.end());
  return run_command(command, user);
}

std::string PrivateMaster::obstacle() {
  std::vector<std::string> command = unshare_command();
  command.emplace_back("true");
  const Outcome tried = run_command(command, std::nullopt);
  return tried.status == 0 ? "" : "namespaces cannot be made here: " + tried.err;
}

PrivateMaster::~PrivateMaster() {
  if (shell_ > 0) stop();
}

void PrivateMaster::define(const std::string& file, const std::string& content) const {
  std::filesystem::create_directory(dir_ / "definitions");
  std::ofstream(dir_ / "definitions/" + file) << content;
}

void PrivateMaster::define_probe(const std::string& name, const std::string& transport, const std::string& more,
                                 const std::string& mode) const {
  define(name + ".toml", "name = \"" + name + "\"\nprogram = \"" + program_path("subsystem_probe") +
                             "\"\narguments = [\"" + log_path(name) + "\", \"" + transport + "\"" +
                             (mode.empty() ? "" : ", \"" + mode + "\"") + "]\ntransport = \"" +
                             transport.substr(0, transport.find('=')) + "\"\n" + more);
}

void PrivateMaster::start(const std::vector<std::string>& options) {
  std::vector<std::string> command = unshare_command();
  command.insert(command.end(), {"sh", "-c", kInit, "sh", program_path("kplmstr"), "--definitions",
                                 dir_ / "definitions", "--socket-path", socket_path()});
  command.insert(command.end(), options.begin(), options.end());
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
  const int out = open_output(dir_ / "master.log");
  shell_ = spawn(command, ends[0], out, out, std::nullopt);
  commands_ = ends[1];
  close(ends[0]);
  close(out);
  if (!wait_until([&] { return ctl({"list"}).status == 0; }))
    throw std::runtime_error("kplmstr did not come up: " + master_log());
}

Outcome PrivateMaster::ctl(std::vector<std::string> arguments, const std::optional<User>& user) const {
  arguments.insert(arguments.begin(), {"--socket-path", socket_path()});
  return run("kplctl", arguments, user);
}

bool PrivateMaster::wait_for_status(const std::string& text) const {
  return wait_until([&] { return ctl({"status"}).out.find(text) != std::string::npos; });
}

std::string PrivateMaster::log_path(const std::string& name) const { return dir_ / name + ".log"; }
std::string PrivateMaster::log(const std::string& name) const { return content_of(log_path(name)); }

bool PrivateMaster::wait_for_log(const std::string& name, const std::string& text) const {
  return wait_until([&] { return log(name).find(text) != std::string::npos; });
}

std::string PrivateMaster::master_log() const { return content_of(dir_ / "master.log"); }

bool PrivateMaster::wait_for_master_log(const std::string& text) const {
  return wait_until([&] { return master_log().find(text) != std::string::npos; });
}

void PrivateMaster::signal(const std::string& name) {
  const std::string line = name + "\n";
  if (write(commands_, line.data(), line.size()) < 0) throw std::runtime_error("the master is gone");
}

int PrivateMaster::stop() {
  close(commands_);
  const int status = wait_for(shell_);
  shell_ = -1;
  return status;
}

}  // namespace kpl_test
