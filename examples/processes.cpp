#include "examples/processes.h"

#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>

namespace zn {
namespace {

constexpr auto kStartLimit = std::chrono::seconds(20);  // a bound on a hang; starting takes milliseconds

int interrupts = -1;  // readable after SIGINT or SIGTERM

int milliseconds_to(Clock::time_point deadline) {
  auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now()).count();
  return left < 0 ? 0 : static_cast<int>(left);
}

void wait_a_little() { ::poll(nullptr, 0, 2); }

// The child's side of Process: never returns.
[[noreturn]] void run(const std::vector<std::string>& command, const Process::Environment& environment, int in,
                      int out, const std::string& stderr_file) {
  ::prctl(PR_SET_PDEATHSIG, SIGKILL);
  sigset_t none;
  sigemptyset(&none);
  sigprocmask(SIG_SETMASK, &none, nullptr);
  ::dup2(in, STDIN_FILENO);
  ::dup2(out, STDOUT_FILENO);
  if (!stderr_file.empty()) {
    int file = ::open(stderr_file.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    if (file >= 0) ::dup2(file, STDERR_FILENO);
  }
  for (const auto& [name, value] : environment) ::setenv(name.c_str(), value.c_str(), 1);
  std::vector<char*> arguments;
  for (const std::string& word : command) arguments.push_back(const_cast<char*>(word.c_str()));
  arguments.push_back(nullptr);
  ::execv(arguments[0], arguments.data());
  ::perror(arguments[0]);
  ::_exit(127);
}

}  // namespace

void catch_interrupts() {
  ::signal(SIGPIPE, SIG_IGN);
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  sigprocmask(SIG_BLOCK, &set, nullptr);
  interrupts = ::signalfd(-1, &set, SFD_CLOEXEC);
}

TempFolder::TempFolder() {
  path_ = (std::filesystem::temp_directory_path() / "zn-XXXXXX").string();
  if (!::mkdtemp(path_.data())) throw Failure{"cannot make a temporary folder " + path_};
}

TempFolder::~TempFolder() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

std::string program(const std::string& name) {
  std::error_code missing;
  const auto here = std::filesystem::read_symlink("/proc/self/exe", missing).parent_path();
  if (missing) throw Failure{"there is no /proc here; as root: mount -t proc proc /proc"};
  if (std::filesystem::exists(here / name)) return (here / name).string();
  return (here.parent_path() / name).string();
}

std::vector<std::string> in_namespaces(std::vector<std::string> command) {
  std::vector<std::string> whole = {"/usr/bin/unshare", "--pid", "--fork",
                                    "--mount-proc",     "--ipc", "--kill-child"};
  if (::geteuid() != 0) whole.insert(whole.end(), {"--user", "--map-root-user"});
  whole.insert(whole.end(), command.begin(), command.end());
  return whole;
}

std::string namespaces_obstacle() {
  const TempFolder folder;
  const std::string errors = folder.path() + "/errors";
  Process tried(in_namespaces({"/bin/true"}), {}, errors);
  if (tried.wait_end(Clock::now() + kStartLimit) == 0) return "";
  std::string why = content_of(errors);
  while (!why.empty() && why.back() == '\n') why.pop_back();
  return why.empty() ? "unshare failed" : why;
}

std::string content_of(const std::string& path) {
  std::ifstream file(path);
  return {std::istreambuf_iterator<char>(file), {}};
}

Process::Process(const std::vector<std::string>& command, const Environment& environment,
                 const std::string& stderr_file) {
  int to_child[2], from_child[2];
  if (::pipe2(to_child, O_CLOEXEC) != 0) throw Failure{"no pipe"};
  if (::pipe2(from_child, O_CLOEXEC) != 0) {
    ::close(to_child[0]);
    ::close(to_child[1]);
    throw Failure{"no pipe"};
  }
  pid_ = ::fork();
  if (pid_ == 0) run(command, environment, to_child[0], from_child[1], stderr_file);
  ::close(to_child[0]);
  ::close(from_child[1]);
  in_ = to_child[1];
  out_ = from_child[0];
  if (pid_ < 0) {
    ::close(in_);
    ::close(out_);
    throw Failure{"cannot start " + command[0]};
  }
  ::fcntl(out_, F_SETFL, O_NONBLOCK);
}

Process::~Process() {
  if (pid_ > 0) {
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
  }
  close_input();
  ::close(out_);
}

void Process::write_line(const std::string& line) {
  const std::string text = line + '\n';
  if (::write(in_, text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
    throw Failure{"a child does not take its input"};
  }
}

void Process::close_input() {
  if (in_ >= 0) ::close(in_);
  in_ = -1;
}

void Process::signal(int number) {
  if (pid_ > 0) ::kill(pid_, number);
}

bool Process::read_some() {
  char bytes[4096];
  ssize_t count = ::read(out_, bytes, sizeof bytes);
  if (count > 0) text_.append(bytes, static_cast<size_t>(count));
  return count != 0;
}

std::optional<std::string> Process::next_line() {
  const size_t end = text_.find('\n');
  if (end == std::string::npos) return std::nullopt;
  std::string line = text_.substr(0, end);
  text_.erase(0, end + 1);
  return line;
}

std::string Process::wait_line(Clock::time_point deadline) {
  for (;;) {
    if (auto line = next_line()) return *line;
    wait_readable({out_}, deadline);
    if (!read_some()) throw Failure{"a child ended before it said what was expected"};
  }
}

int Process::wait_end(Clock::time_point deadline) {
  int status = 0;
  while (pid_ > 0 && ::waitpid(pid_, &status, WNOHANG) != pid_) {
    if (Clock::now() > deadline) throw Failure{"a child does not end"};
    pollfd interrupt{interrupts, POLLIN, 0};
    if (interrupts >= 0 && ::poll(&interrupt, 1, 0) > 0) throw Failure{"interrupted"};
    wait_a_little();
  }
  pid_ = -1;
  return status;
}

std::vector<bool> wait_readable(const std::vector<int>& descriptors, Clock::time_point deadline) {
  std::vector<pollfd> polled;
  for (int descriptor : descriptors) polled.push_back({descriptor, POLLIN, 0});
  polled.push_back({interrupts, POLLIN, 0});
  const int ready = ::poll(polled.data(), polled.size(), milliseconds_to(deadline));
  if (ready == 0) throw Failure{"waited in vain"};
  if (polled.back().revents) throw Failure{"interrupted"};
  polled.pop_back();
  std::vector<bool> result;
  for (const pollfd& p : polled) result.push_back(p.revents != 0);
  return result;
}

void pause_for(std::chrono::milliseconds time) {
  pollfd interrupt{interrupts, POLLIN, 0};
  if (::poll(&interrupt, 1, static_cast<int>(time.count())) > 0) throw Failure{"interrupted"};
}

PrivateDaemon::PrivateDaemon(const std::vector<std::string>& options) {
  socket_ = folder_.path() + "/gsd.sock";
  std::vector<std::string> command{program("gsd"), "--socket-path", socket_, "--ready-fd", "1"};
  command.insert(command.end(), options.begin(), options.end());
  process_ = std::make_unique<Process>(command, Process::Environment{}, folder_.path() + "/gsd.log");
  try {
    process_->wait_line(Clock::now() + kStartLimit);
  } catch (const Failure& failure) {
    throw Failure{"the daemon does not start (" + failure.text + "): " + log()};
  }
}

std::string PrivateDaemon::log() const { return content_of(folder_.path() + "/gsd.log"); }

bool PrivateDaemon::stop(Clock::time_point deadline) {
  process_->signal(SIGTERM);
  return process_->wait_end(deadline) == 0;
}

}  // namespace zn
