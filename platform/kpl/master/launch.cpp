#include "master/launch.h"

#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <csignal>
#include <cstring>
#include <set>
#include <vector>

#include "common/log.h"
#include "kpl.h"
#include "master/left_behind.h"

namespace kpl::master {
namespace {

using platform::Descriptor;

constexpr int kExitNotRun = 127;
constexpr std::size_t kPidDigits = 11;

/// What the new process tells when it cannot become the program.
struct Failure {
  enum Step : int { kSession, kDescriptors, kUser, kProgram } step;
  int error;
};

/// Made before the fork: between fork and exec nothing may allocate.
struct Plan {
  std::vector<std::string> arguments;
  std::vector<std::string> environment;
  std::vector<char*> argv;
  std::vector<char*> envp;
  char* pid_text = nullptr;  // where the new process puts its id
  bool change_user = false;
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;
  Descriptor null;
  Descriptor output;  // the definition's file
};

/// Null: there is none. Good until the next call.
const passwd* user_of(const Definition& definition) {
  std::uint64_t number = 0;
  const bool is_number = platform::set_number(definition.user, 0, UINT32_MAX - 1, &number).empty();
  return is_number ? getpwuid(static_cast<uid_t>(number)) : getpwnam(definition.user.c_str());
}

void plan_user(const Definition& definition, Plan& plan) {
  const passwd* user = user_of(definition);
  if (user == nullptr) throw LaunchError("there is no user '" + definition.user + "'");
  if (user->pw_uid == geteuid()) return;
  plan.change_user = true;
  plan.uid = user->pw_uid;
  plan.gid = definition.transport == Transport::kSignals ? user->pw_gid : 0;
  int count = 64;
  plan.groups.resize(static_cast<std::size_t>(count));
  while (getgrouplist(user->pw_name, user->pw_gid, plan.groups.data(), &count) < 0) {
    plan.groups.resize(static_cast<std::size_t>(count));
  }
  plan.groups.resize(static_cast<std::size_t>(count));
}

/// PATH and LANG are the master's, unless the definition says otherwise.
std::vector<std::string> environment_of(const Definition& definition) {
  std::vector<std::string> texts;
  for (const auto& [name, value] : definition.environment) texts.push_back(name + "=" + value);
  std::vector<std::string> passed = definition.pass_environment;
  passed.insert(passed.end(), {"PATH", "LANG"});
  std::set<std::string> done;
  for (const std::string& name : passed) {
    const char* value = getenv(name.c_str());
    if (value == nullptr || definition.environment.contains(name) || !done.insert(name).second) continue;
    texts.push_back(name + "=" + value);
  }
  return texts;
}

void plan_texts(const Definition& definition, const std::string& status_socket, Plan& plan) {
  plan.environment = environment_of(definition);
  plan.environment.push_back(KPL_MASTER_ENV "=" + status_socket);
  plan.environment.push_back(std::string(kIdentityVariable) + "=" + definition.name + ":");
  std::string& identity = plan.environment.back();
  identity.append(kPidDigits, '\0');
  for (std::string& text : plan.environment) plan.envp.push_back(text.data());
  plan.envp.push_back(nullptr);
  plan.pid_text = identity.data() + identity.size() - kPidDigits;
  plan.arguments = definition.arguments;
  plan.arguments.insert(plan.arguments.begin(), definition.program);
  for (std::string& text : plan.arguments) plan.argv.push_back(text.data());
  plan.argv.push_back(nullptr);
}

void plan_files(const Definition& definition, Plan& plan) {
  struct stat found {};
  if (stat(definition.program.c_str(), &found) != 0) {
    throw LaunchError("cannot run " + definition.program + ": " + strerror(errno));
  }
  plan.null = Descriptor(open("/dev/null", O_RDWR | O_CLOEXEC));
  if (!plan.null) throw LaunchError(std::string("cannot open /dev/null: ") + strerror(errno));
  if (definition.output.empty()) return;
  try {
    plan.output = platform::open_log_file(definition.output);
  } catch (const std::runtime_error& error) {
    throw LaunchError(std::string("cannot open ") + error.what());
  }
}

[[noreturn]] void give_up(int report, Failure::Step step) {
  const Failure failure{step, errno};
  if (write(report, &failure, sizeof failure) < 0) _exit(kExitNotRun + 1);
  _exit(kExitNotRun);
}

/// The handlers of the master's loop would write into what it shares with this process. What is written to a
/// master that is dead must not kill: see OutputLog.
void reset_signals(const sigset_t& mask, bool output_to_master) {
  struct sigaction by_default {};
  by_default.sa_handler = SIG_DFL;
  for (int number = 1; number < NSIG; ++number) sigaction(number, &by_default, nullptr);
  if (output_to_master) signal(SIGPIPE, SIG_IGN);
  sigprocmask(SIG_SETMASK, &mask, nullptr);
}

[[noreturn]] void become(const Plan& plan, const Given& given, int report, const sigset_t& mask) {
  std::to_chars(plan.pid_text, plan.pid_text + kPidDigits - 1, getpid());
  if (setsid() < 0) give_up(report, Failure::kSession);
  const int output = plan.output ? plan.output.get() : given.output_end;
  if (dup2(given.request_end >= 0 ? given.request_end : plan.null.get(), STDIN_FILENO) < 0 ||
      dup2(output, STDOUT_FILENO) < 0 || dup2(output, STDERR_FILENO) < 0) {
    give_up(report, Failure::kDescriptors);
  }
  // For what the master itself was given; its own are closed on exec anyway, so a kernel without this is no
  // obstacle.
  close_range(STDERR_FILENO + 1, ~0U, CLOSE_RANGE_CLOEXEC);
  if (plan.change_user &&
      (setgroups(plan.groups.size(), plan.groups.data()) != 0 || setgid(plan.gid) != 0 || setuid(plan.uid) != 0)) {
    give_up(report, Failure::kUser);
  }
  reset_signals(mask, !plan.output);
  execve(plan.argv[0], plan.argv.data(), plan.envp.data());
  give_up(report, Failure::kProgram);
}

}  // namespace

std::optional<uid_t> user_id(const Definition& definition) {
  const passwd* user = user_of(definition);
  if (user == nullptr) return std::nullopt;
  return user->pw_uid;
}

Launched launch(const Definition& definition, const Given& given) {
  Plan plan;
  plan_user(definition, plan);
  plan_texts(definition, given.status_socket, plan);
  plan_files(definition, plan);
  std::array<int, 2> report{};
  if (pipe2(report.data(), O_CLOEXEC) != 0)
    throw LaunchError(std::string("cannot make a pipe: ") + strerror(errno));
  Descriptor reader(report[0]);
  const Descriptor writer(report[1]);
  fcntl(reader.get(), F_SETFL, O_NONBLOCK);

  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  sigprocmask(SIG_SETMASK, &all, &before);
  const pid_t pid = fork();
  if (pid == 0) become(plan, given, writer.get(), before);
  const int error = errno;
  sigprocmask(SIG_SETMASK, &before, nullptr);
  if (pid < 0) throw LaunchError(std::string("cannot make a process: ") + strerror(error));
  return {pid, std::move(reader)};
}

std::optional<std::string> launch_result(const Definition& definition, int report) {
  Failure failure{};
  const ssize_t got = read(report, &failure, sizeof failure);
  if (got < 0 && (errno == EAGAIN || errno == EINTR)) return std::nullopt;
  if (got != sizeof failure) return "";
  const std::string why = std::string(": ") + strerror(failure.error);
  switch (failure.step) {
    case Failure::kSession:
      return "cannot make a session" + why;
    case Failure::kDescriptors:
      return "cannot set up descriptors" + why;
    case Failure::kUser:
      return "cannot become user '" + definition.user + "'" + why;
    case Failure::kProgram:
      break;
  }
  return "cannot run " + definition.program + why;
}

}  // namespace kpl::master
