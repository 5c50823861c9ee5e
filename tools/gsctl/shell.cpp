#include "tools/gsctl/shell.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/mman.h>
#include <sys/wait.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <cstring>

#include "tools/gsctl/output.h"
#include "tools/gsctl/status.h"

extern char** environ;

namespace gsctl {
namespace {

using platform::Descriptor;

constexpr std::size_t kMaxWaiting = 10'000;

/// A file of these bytes, at its beginning: unlike a pipe it is never waited for.
Descriptor file_of(const std::string& bytes) {
  Descriptor file(memfd_create("gsctl", MFD_CLOEXEC));
  if (!file || write(file.get(), bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()) ||
      lseek(file.get(), 0, SEEK_SET) != 0) {
    throw Error(kRefused, std::string("cannot make the standard input of a program: ") + strerror(errno));
  }
  return file;
}

struct Spawn {
  posix_spawnattr_t attributes;
  posix_spawn_file_actions_t files;
  Spawn() {
    posix_spawnattr_init(&attributes);
    posix_spawn_file_actions_init(&files);
    sigset_t defaults;
    sigemptyset(&defaults);
    sigaddset(&defaults, SIGPIPE);  // gsctl ignores it
    posix_spawnattr_setsigdefault(&attributes, &defaults);
    posix_spawnattr_setpgroup(&attributes, 0);
    posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETPGROUP);
  }
  ~Spawn() {
    posix_spawn_file_actions_destroy(&files);
    posix_spawnattr_destroy(&attributes);
  }
};

pid_t spawn(const Job& job, int input, int output) {
  Spawn how;
  posix_spawn_file_actions_adddup2(&how.files, input, STDIN_FILENO);
  if (output >= 0) posix_spawn_file_actions_adddup2(&how.files, output, STDOUT_FILENO);
  std::vector<char*> environment;
  for (const std::string& text : job.environment) environment.push_back(const_cast<char*>(text.c_str()));
  for (char** text = environ; *text != nullptr; ++text)
    environment.push_back(*text);  // the first of a name counts
  environment.push_back(nullptr);
  std::array<const char*, 4> arguments = {"sh", "-c", job.command.c_str(), nullptr};
  pid_t process = -1;
  const int error = posix_spawn(&process, "/bin/sh", &how.files, &how.attributes,
                                const_cast<char**>(arguments.data()), environment.data());
  if (error != 0) throw Error(kRefused, std::string("cannot run /bin/sh: ") + strerror(error));
  return process;
}

}  // namespace

Shell::Shell(Loop& loop, const Job& job, std::size_t captured, Ended ended)
    : captured_(captured), ended_(std::move(ended)) {
  const Descriptor input = file_of(job.input);
  Descriptor writing;
  if (captured_ > 0) {
    std::array<int, 2> pipe{};
    if (pipe2(pipe.data(), O_CLOEXEC) != 0)
      throw Error(kRefused, std::string("cannot make a pipe: ") + strerror(errno));
    out_ = Descriptor(pipe[0]);
    writing = Descriptor(pipe[1]);
    fcntl(out_.get(), F_SETFL, O_NONBLOCK);
    readable_ = loop.on_readable(out_.get(), [this] { read_output(); });
  }
  child_ = loop.on_signal(SIGCHLD, [this] { look(); });
  process_ = spawn(job, input.get(), writing.get());
}

Shell::~Shell() {
  if (process_ > 0) kill(-process_, SIGTERM);
}

void Shell::read_output() {
  std::array<char, 4096> bytes{};
  ssize_t got = 0;
  while ((got = read(out_.get(), bytes.data(), bytes.size())) > 0) {
    const std::size_t room = captured_ - output_.size();
    output_.append(bytes.data(), std::min(room, static_cast<std::size_t>(got)));
  }
  if (got == 0) readable_.reset();
}

void Shell::look() {
  int waited = 0;
  if (process_ < 0 || waitpid(process_, &waited, WNOHANG) != process_) return;
  process_ = -1;
  if (readable_) read_output();
  ended_(WIFSIGNALED(waited) ? 128 + WTERMSIG(waited) : WEXITSTATUS(waited), output_);
}

void JobQueue::add(Job job) {
  if (waiting_.size() >= kMaxWaiting) {
    ++left_out_;
    return;
  }
  if (left_out_ > 0)
    complain("the command is too slow: it was not run for " + std::to_string(left_out_) + " changes");
  left_out_ = 0;
  waiting_.push_back(std::move(job));
  if (!running_) next();
}

void JobQueue::next() {
  running_.reset();
  if (waiting_.empty()) return;
  const Job job = std::move(waiting_.front());
  waiting_.pop_front();
  running_ = std::make_unique<Shell>(loop_, job, 0, [this](int status, const std::string&) {
    if (status != 0) complain("the command ended with status " + std::to_string(status));
    next_ = loop_.after(std::chrono::seconds(0), [this] { next(); });  // not inside the one that ends
  });
}

}  // namespace gsctl
