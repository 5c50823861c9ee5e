#include "started.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <pty.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <utility>

namespace fs = std::filesystem;

namespace {

constexpr int kNoNamespace = 77;

std::vector<char*> pointers(Started::Arguments& arguments) {
  std::vector<char*> result;
  for (std::string& argument : arguments) result.push_back(argument.data());
  result.push_back(nullptr);
  return result;
}

int status_of(pid_t child) {
  int status = -1;
  while (waitpid(child, &status, 0) == -1 && errno == EINTR) {
  }
  return status;
}

/// A connected TCP socket of the loop-back interface, as inetd hands it over; -1 on failure.
int connected_socket(int* client) {
  const int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address = {};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof address;
  auto* name = reinterpret_cast<sockaddr*>(&address);
  if (bind(listener, name, length) != 0 || listen(listener, 1) != 0) return -1;
  getsockname(listener, name, &length);
  *client = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (connect(*client, name, length) != 0) return -1;
  const int accepted = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
  close(listener);
  return accepted;
}

Started::Fields fields_of(const std::string& report) {
  const size_t error = report.find(" error=");
  Started::Fields fields;
  std::istringstream words(report.substr(0, error));
  words >> fields["word"];
  for (std::string word; words >> word;) fields[word.substr(0, word.find('='))] = word.substr(word.find('=') + 1);
  if (error != std::string::npos) fields["error"] = report.substr(error + strlen(" error="));
  return fields;
}

}  // namespace

std::string program(const std::string& name) {
  return fs::read_symlink("/proc/self/exe").parent_path().string() + "/" + name;
}

Started::Started() {
  prctl(PR_SET_CHILD_SUBREAPER, 1);  // so that a daemon that lost its parent can be waited for
  inherited_[0] = open("/dev/zero", O_RDONLY);
  inherited_[1] = fcntl(inherited_[0], F_DUPFD, 2005);
  dup2(inherited_[0], 50);
  close(inherited_[0]);
  inherited_[0] = 50;
  int ends[2];
  EXPECT_EQ(socketpair(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0, ends), 0);
  channel_ = ends[0];
  daemon_end_ = ends[1];
}

Started::~Started() {
  if (starter_ > 0) kill(starter_, SIGTERM);
  if (pidfd_ >= 0) syscall(SYS_pidfd_send_signal, pidfd_, SIGKILL, nullptr, 0);
  if (starter_ > 0) status_of(starter_);
  if (pidfd_ >= 0) has_ended();
  while (waitpid(-1, nullptr, WNOHANG) > 0) {
  }
  for (const int fd : {channel_, daemon_end_, inherited_[0], inherited_[1], pidfd_}) close(fd);
}

int Started::from_shell(const std::string& path, const Arguments& arguments) {
  Arguments words = {"sh", "-c", "\"$0\" \"$@\"; exit $?", path, reports_.name()};
  words.insert(words.end(), arguments.begin(), arguments.end());
  std::vector<char*> argv = pointers(words);
  int terminal = -1;
  const pid_t shell = forkpty(&terminal, nullptr, nullptr, nullptr);
  if (shell == 0) {
    execv("/bin/sh", argv.data());
    _exit(127);
  }
  const int status = status_of(shell);
  close(terminal);  // hangs up
  take_first_report();
  return status;
}

int Started::from_inetd(const std::string& path, const Arguments& arguments) {
  Arguments words = {path, reports_.name()};
  words.insert(words.end(), arguments.begin(), arguments.end());
  std::vector<char*> argv = pointers(words);
  int client = -1;
  const int service = connected_socket(&client);
  const pid_t child = fork();
  if (child == 0) {
    for (const int fd : {0, 1, 2}) dup2(service, fd);
    execv(argv[0], argv.data());
    _exit(127);
  }
  close(service);
  take_first_report();
  int status = 0;
  if (start["code"] != "0") status = status_of(child);
  close(client);
  return status;
}

bool Started::from_master(const std::string& how, const std::string& path, const Arguments& arguments) {
  Arguments words = {program("fake_master"),      how,  reports_.name(),
                     std::to_string(daemon_end_), path, reports_.name()};
  words.insert(words.end(), arguments.begin(), arguments.end());
  std::vector<char*> argv = pointers(words);
  starter_ = fork();
  if (starter_ == 0) {
    fcntl(daemon_end_, F_SETFD, 0);
    execv(argv[0], argv.data());
    _exit(127);
  }
  const int starter_fd = static_cast<int>(syscall(SYS_pidfd_open, starter_, 0));
  pollfd entries[] = {{reports_.fd(), POLLIN, 0}, {starter_fd, POLLIN, 0}};
  poll(entries, 2, Datagram::kPatienceMs);
  close(starter_fd);
  if (entries[0].revents != 0) {
    take_first_report();
    return true;
  }
  EXPECT_EQ(WEXITSTATUS(status_of(std::exchange(starter_, 0))), kNoNamespace);
  return false;
}

void Started::take_first_report() {
  start = fields_of(reports_.receive(&pid_));
  EXPECT_EQ(start["word"], "init");
  if (pid_ > 0) pidfd_ = static_cast<int>(syscall(SYS_pidfd_open, pid_, 0));
}

std::string Started::report() { return reports_.receive(); }

Started::Fields Started::report_fields() { return fields_of(report()); }

void Started::command(const std::string& text) { EXPECT_TRUE(reports_.send(start["commands"], text)); }

bool Started::is_alive() const {
  pollfd entry = {pidfd_, POLLIN, 0};
  return poll(&entry, 1, 0) == 0;
}

bool Started::has_ended() const {
  pollfd entry = {pidfd_, POLLIN, 0};
  return pidfd_ < 0 || poll(&entry, 1, Datagram::kPatienceMs) == 1;
}

std::string Started::status_line(const std::string& label) const {
  std::ifstream file("/proc/" + std::to_string(pid_) + "/status");
  for (std::string line; std::getline(file, line);) {
    if (!line.starts_with(label + ":")) continue;
    return line.substr(line.find_first_not_of(" \t", label.size() + 1));
  }
  return "";
}

std::vector<std::string> Started::stat() const {
  std::ifstream file("/proc/" + std::to_string(pid_) + "/stat");
  std::string line;
  std::getline(file, line);
  std::istringstream words(line.substr(line.rfind(')') + 1));
  std::vector<std::string> fields;
  for (std::string word; words >> word;) fields.push_back(word);
  return fields;
}

std::string Started::cwd() const { return fs::read_symlink("/proc/" + std::to_string(pid_) + "/cwd").string(); }

std::map<int, std::string> Started::descriptors() const {
  std::map<int, std::string> result;
  for (const auto& entry : fs::directory_iterator("/proc/" + std::to_string(pid_) + "/fd")) {
    result[std::stoi(entry.path().filename().string())] = fs::read_symlink(entry.path()).string();
  }
  return result;
}

bool Started::has_signal(const std::string& label, int signo) const {
  return (std::stoull(status_line(label), nullptr, 16) >> (signo - 1) & 1) != 0;
}

std::string Requester::request(short action, short parm1, short parm2, const std::string& data,
                               short object) const {
  kplreq record = {};
  record.kplhdr.retaddr = socket_.address();
  record.kplhdr.dversion = KPL_VERSION;
  record.subreq = {object, action, parm1, parm2, "probe"};
  const auto* bytes = reinterpret_cast<const char*>(&record);
  return std::string(bytes + offsetof(kplreq, kplhdr), bytes + sizeof record) + data;
}

Requester::Answer Requester::answer() const {
  Answer result;
  for (;;) {
    std::string packet = socket_.receive();
    kplhdr header;
    if (packet.size() < sizeof header) return result;
    memcpy(&header, packet.data(), sizeof header);
    if (header.cont == KPL_CONT_STATUS) {
      result.packets.push_back((packet.size() - sizeof header) / sizeof(statcode));
      for (size_t at = sizeof header; at < packet.size(); at += sizeof(statcode)) {
        statcode record;
        memcpy(&record, packet.data() + at, sizeof record);
        result.lines.emplace_back(record.objname, record.objtext);
      }
      continue;
    }
    packet.resize(sizeof(kplrep));
    kplrep reply;
    memcpy(&reply, packet.data(), sizeof reply);
    if (header.cont == KPL_CONT_MESSAGE) {
      result.interim.emplace_back(reply.svrreply.rtnmsg);
      continue;
    }
    result.code = reply.svrreply.rtncode;
    result.message = reply.svrreply.rtnmsg;
    return result;
  }
}
