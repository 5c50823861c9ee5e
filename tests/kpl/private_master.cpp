#include "kpl/private_master.h"

#include <fcntl.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <stdexcept>

namespace kpl_test {
namespace {

// Process 1 of the namespace.
constexpr char kInit[] =
    "start() { setsid \"$@\" & master=$!; }\n"
    "start \"$@\"\n"
    "while read -r line; do eval \"$line\"; done\n"
    "kill -TERM $master 2>/dev/null; wait $master";

}  // namespace

std::string program_path(const std::string& program) {
  const auto here = std::filesystem::read_symlink("/proc/self/exe").parent_path();
  return here / (program == "subsystem_probe" ? program : "../" + program);
}

Outcome run(const std::string& program, const std::vector<std::string>& arguments) {
  std::vector<std::string> command = {program_path(program)};
  command.insert(command.end(), arguments.begin(), arguments.end());
  return test_support::run(command);
}

PrivateMaster::~PrivateMaster() {
  if (is_started()) stop();
}

void PrivateMaster::define(const std::string& name, const std::string& rest) const {
  std::filesystem::create_directory(dir_ / "definitions");
  std::ofstream(dir_ / "definitions/" + name + ".toml") << "name = \"" + name + "\"\n" + rest;
}

void PrivateMaster::define_probe(const std::string& name, const std::string& transport, const std::string& more,
                                 const std::string& mode) const {
  define(name, "program = \"" + program_path("subsystem_probe") + "\"\narguments = [\"" + log_path(name) +
                   "\", \"" + transport + "\"" + (mode.empty() ? "" : ", \"" + mode + "\"") + "]\ntransport = \"" +
                   transport.substr(0, transport.find('=')) + "\"\n" + more);
}

void PrivateMaster::start(const std::vector<std::string>& options) {
  std::vector<std::string> command = {"sh",
                                      "-c",
                                      kInit,
                                      "sh",
                                      program_path("kplmstr"),
                                      "--definitions",
                                      dir_ / "definitions",
                                      "--socket-path",
                                      socket_path()};
  command.insert(command.end(), options.begin(), options.end());
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
  shell_ = test_support::spawn(zn::in_namespaces(command), log_path("master"), log_path("master"), ends[0],
                               STDIN_FILENO);
  commands_ = ends[1];
  close(ends[0]);
  if (!wait_until([&] { return ctl({"list"}).status == 0; }))
    throw std::runtime_error("kplmstr did not come up: " + log("master"));
}

void PrivateMaster::tell_shell(const std::string& line) const {
  const std::string whole = line + "\n";
  if (write(commands_, whole.data(), whole.size()) < 0) throw std::runtime_error("the shell is gone");
}

int PrivateMaster::stop() {
  close(commands_);
  const int status = test_support::wait_for_exit(shell_);
  shell_ = -1;
  return status;
}

Outcome PrivateMaster::ctl(const std::vector<std::string>& arguments, std::vector<std::string> as) const {
  as.insert(as.end(), {program_path("kplctl"), "--socket-path", socket_path()});
  as.insert(as.end(), arguments.begin(), arguments.end());
  return test_support::run(as);
}

bool PrivateMaster::wait_for_status(const std::string& text) const {
  return wait_until([&] { return ctl({"status"}).out.find(text) != std::string::npos; });
}

bool PrivateMaster::wait_for_log(const std::string& name, const std::string& text) const {
  return wait_until([&] { return log(name).find(text) != std::string::npos; });
}

}  // namespace kpl_test
