#include "tools/gsctl/keeper.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <vector>

#include "tools/gsctl/status.h"

namespace gsctl {
namespace {

using platform::Descriptor;

constexpr std::size_t kMaxOrder = 4096;  // bytes

/// To the keeper; of kStart, texts that each end with a NUL follow.
struct Order {
  enum Kind : int { kStart, kExtend, kStop } kind;
  std::int64_t deadline;  // milliseconds; 0: none
};

int shell_status(int waited) { return WIFSIGNALED(waited) ? 128 + WTERMSIG(waited) : WEXITSTATUS(waited); }

/// The other side: all of the keeper's process.
class KeeperProcess {
 public:
  KeeperProcess(const Keeper::Plan& plan, Descriptor socket) : socket_(std::move(socket)), grace_(plan.grace) {
    for (const std::string& text : plan.command) argv_.push_back(const_cast<char*>(text.c_str()));
    argv_.push_back(nullptr);
    if (plan.give_terminal && tcgetpgrp(STDIN_FILENO) == getpgrp()) terminal_owner_ = getpgrp();
  }

  [[noreturn]] void run();

 private:
  void prepare();
  bool obey();
  void start(const char* texts, std::size_t length);
  [[noreturn]] void become_command(int report);
  void reap();
  void kill_all();
  void command_ended(int status);
  void check_times();
  int poll_timeout() const;
  void tell(KeeperNews::Kind kind, int value) {
    const KeeperNews news{kind, value};
    send(socket_.get(), &news, sizeof news, MSG_NOSIGNAL);
  }

  Descriptor socket_;
  Descriptor child_signal_;
  const std::chrono::duration<double> grace_;
  std::vector<char*> argv_;
  pid_t terminal_owner_ = -1;  // the group to give it back to
  sigset_t mask_{};            // CMD's
  bool hangup_ignored_ = false;
  pid_t command_ = -1;         // CMD's process and group; kept until nothing of it is left
  std::optional<int> status_;  // of CMD, which has ended
  bool over_ = false;          // the deadline has passed
  std::optional<BootTime> deadline_;
  std::optional<BootTime> kill_at_;
};

void KeeperProcess::prepare() {
  setpgid(0, 0);  // what the terminal sends is not for the keeper
  prctl(PR_SET_NAME, "gsctl-keeper");
  prctl(PR_SET_CHILD_SUBREAPER, 1);
  struct sigaction before {};
  sigaction(SIGHUP, nullptr, &before);
  hangup_ignored_ = before.sa_handler == SIG_IGN;
  for (const int number : {SIGINT, SIGTERM, SIGHUP, SIGQUIT, SIGTSTP, SIGTTIN, SIGTTOU}) signal(number, SIG_IGN);
  sigset_t child;
  sigemptyset(&child);
  sigaddset(&child, SIGCHLD);
  sigprocmask(SIG_BLOCK, &child, &mask_);
  child_signal_ = Descriptor(signalfd(-1, &child, SFD_CLOEXEC | SFD_NONBLOCK));
}

void KeeperProcess::run() {
  prepare();
  for (;;) {
    std::array<pollfd, 2> ready = {{{socket_.get(), POLLIN, 0}, {child_signal_.get(), POLLIN, 0}}};
    poll(ready.data(), ready.size(), poll_timeout());
    if (ready[1].revents != 0) reap();
    if (ready[0].revents != 0 && !obey()) break;
    check_times();
  }
  while (command_ > 0) {  // the candidate is gone
    kill_all();
    int waited = 0;
    if (waitpid(-1, &waited, 0) < 0 && errno != EINTR) break;
  }
  _exit(kDone);
}

/// False: there is nobody left to obey.
bool KeeperProcess::obey() {
  std::array<char, kMaxOrder> packet{};
  const ssize_t length = recv(socket_.get(), packet.data(), packet.size(), 0);
  if (length < static_cast<ssize_t>(sizeof(Order))) return length < 0 && errno == EINTR;
  Order order{};
  memcpy(&order, packet.data(), sizeof order);
  if (order.kind != Order::kStop) {
    deadline_.reset();
    if (order.deadline != 0) deadline_ = BootTime(order.deadline);
  }
  if (order.kind == Order::kStart) {
    start(packet.data() + sizeof order, static_cast<std::size_t>(length) - sizeof order);
  } else if (order.kind == Order::kStop && command_ > 0 && !status_) {
    kill(-command_, SIGTERM);
    kill(-command_, SIGCONT);  // one that is stopped hears it too
    kill_at_ = boot_time() + std::chrono::duration_cast<BootTime>(grace_);
  }
  return true;
}

void KeeperProcess::start(const char* texts, std::size_t length) {
  for (const char* text = texts; text < texts + length; text += strlen(text) + 1) putenv(strdup(text));
  std::array<int, 2> pipe{};
  if (pipe2(pipe.data(), O_CLOEXEC) != 0) return tell(KeeperNews::kNotRun, errno);
  const Descriptor report(pipe[0]);
  Descriptor writing(pipe[1]);
  const pid_t child = fork();
  if (child < 0) return tell(KeeperNews::kNotRun, errno);
  if (child == 0) become_command(writing.get());
  setpgid(child, child);  // as the child does: whoever is first
  writing = Descriptor();
  int error = 0;
  if (read(report.get(), &error, sizeof error) == sizeof error) {
    waitpid(child, nullptr, 0);
    return tell(KeeperNews::kNotRun, error);
  }
  command_ = child;
  status_.reset();
  kill_at_.reset();
  over_ = false;
  tell(KeeperNews::kStarted, child);
}

void KeeperProcess::become_command(int report) {
  setpgid(0, 0);
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (terminal_owner_ > 0) tcsetpgrp(STDIN_FILENO, getpid());
  for (const int number : {SIGINT, SIGTERM, SIGHUP, SIGQUIT, SIGTSTP, SIGTTIN, SIGTTOU, SIGPIPE}) {
    if (number != SIGHUP || !hangup_ignored_) signal(number, SIG_DFL);
  }
  sigprocmask(SIG_SETMASK, &mask_, nullptr);
  execvp(argv_[0], argv_.data());
  const int error = errno;
  if (write(report, &error, sizeof error) < 0) _exit(kCannotRun);
  _exit(kNotFound);
}

void KeeperProcess::reap() {
  signalfd_siginfo ignored{};
  while (read(child_signal_.get(), &ignored, sizeof ignored) > 0) {
  }
  int waited = 0;
  pid_t pid = 0;
  while ((pid = waitpid(-1, &waited, WNOHANG | WUNTRACED)) > 0) {
    if (pid != command_) continue;
    if (!WIFSTOPPED(waited)) {
      status_ = shell_status(waited);
    } else if (WSTOPSIG(waited) == SIGTSTP && terminal_owner_ > 0) {
      kill(-command_, SIGCONT);  // no shell is there that could bring it back
    }
  }
  if (!status_) return;
  if (pid < 0) return command_ended(*status_);
  kill_all();  // what CMD has left behind; SIGCHLD comes when it is gone
}

/// CMD's group, and what has left it: orphans come to the keeper. Where the kernel does not list them, they are
/// waited for.
void KeeperProcess::kill_all() {
  kill(-command_, SIGKILL);
  FILE* list = fopen("/proc/thread-self/children", "re");
  if (list == nullptr) return;
  int child = 0;
  while (fscanf(list, "%d", &child) == 1) kill(child, SIGKILL);
  fclose(list);
}

void KeeperProcess::command_ended(int status) {
  if (terminal_owner_ > 0) tcsetpgrp(STDIN_FILENO, terminal_owner_);
  command_ = -1;
  status_.reset();
  kill_at_.reset();
  tell(over_ ? KeeperNews::kOverdue : KeeperNews::kEnded, status);
}

void KeeperProcess::check_times() {
  if (command_ <= 0) return;
  const BootTime now = boot_time();
  over_ = over_ || (deadline_ && *deadline_ <= now);
  if (over_ || (kill_at_ && *kill_at_ <= now)) kill_all();
}

int KeeperProcess::poll_timeout() const {
  if (command_ <= 0 || (!deadline_ && !kill_at_)) return -1;
  const BootTime next = std::min(deadline_.value_or(BootTime::max()), kill_at_.value_or(BootTime::max()));
  // Not at once again and again where a process takes its time to die.
  return static_cast<int>(std::clamp<std::int64_t>((next - boot_time()).count(), 10, 1'000'000));
}

void give(const Descriptor& socket, const Order& order, const std::vector<std::string>& texts) {
  std::string packet(reinterpret_cast<const char*>(&order), sizeof order);
  for (const std::string& text : texts) packet.append(text.c_str(), text.size() + 1);
  send(socket.get(), packet.data(), packet.size(), MSG_NOSIGNAL);  // if it is gone, that is news
}

}  // namespace

BootTime boot_time() {
  timespec now{};
  clock_gettime(CLOCK_BOOTTIME, &now);
  return std::chrono::duration_cast<BootTime>(std::chrono::seconds(now.tv_sec) +
                                              std::chrono::nanoseconds(now.tv_nsec));
}

Keeper::Keeper(const Plan& plan) {
  std::array<int, 2> ends{};
  if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends.data()) != 0) {
    throw Error(kRefused, std::string("cannot make a socket: ") + strerror(errno));
  }
  socket_ = Descriptor(ends[0]);
  Descriptor other(ends[1]);
  process_ = fork();
  if (process_ < 0) throw Error(kRefused, std::string("cannot make a process: ") + strerror(errno));
  if (process_ > 0) return;
  socket_ = Descriptor();  // so that the candidate's end is the end
  KeeperProcess(plan, std::move(other)).run();
}

void Keeper::end() {
  if (process_ < 0) return;
  shutdown(socket_.get(), SHUT_RDWR);
  while (waitpid(process_, nullptr, 0) < 0 && errno == EINTR) {
  }
  process_ = -1;
}

void Keeper::start(const std::vector<std::string>& environment, std::optional<BootTime> deadline) {
  give(socket_, {Order::kStart, deadline.value_or(BootTime(0)).count()}, environment);
}

void Keeper::extend(BootTime deadline) { give(socket_, {Order::kExtend, deadline.count()}, {}); }

void Keeper::stop() { give(socket_, {Order::kStop, 0}, {}); }

std::optional<KeeperNews> Keeper::news() {
  KeeperNews news{};
  const ssize_t length = recv(socket_.get(), &news, sizeof news, MSG_DONTWAIT);
  if (length < 0 && (errno == EAGAIN || errno == EINTR)) return std::nullopt;
  if (length != sizeof news) {
    if (command_ > 0) kill(-command_, SIGKILL);
    return KeeperNews{KeeperNews::kGone, 0};
  }
  if (news.kind == KeeperNews::kStarted) command_ = news.value;
  if (news.kind == KeeperNews::kEnded || news.kind == KeeperNews::kOverdue) command_ = -1;
  return news;
}

}  // namespace gsctl
