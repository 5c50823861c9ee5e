#include "master/left_behind.h"

#include <charconv>
#include <filesystem>
#include <fstream>

#include "kpl.h"

namespace kpl::master {

std::string subsystem_of(pid_t pid, const std::string& status_socket) {
  const std::string master = KPL_MASTER_ENV "=" + status_socket;
  const std::string identity = std::string(kIdentityVariable) + "=";
  const std::string its_pid = ":" + std::to_string(pid);
  std::ifstream environment("/proc/" + std::to_string(pid) + "/environ", std::ios::binary);
  bool of_this_master = false;
  std::string name;
  for (std::string one; std::getline(environment, one, '\0');) {
    if (one == master) of_this_master = true;
    if (!one.starts_with(identity) || !one.ends_with(its_pid)) continue;
    name = one.substr(identity.size(), one.size() - identity.size() - its_pid.size());
  }
  return of_this_master ? name : "";
}

std::map<std::string, pid_t> find_left_behind(const std::string& status_socket) {
  std::map<std::string, pid_t> found;
  std::error_code error;
  std::filesystem::directory_iterator processes("/proc", error);
  for (; !error && processes != std::filesystem::directory_iterator(); processes.increment(error)) {
    const std::string number = processes->path().filename();
    pid_t pid = 0;
    if (std::from_chars(number.data(), number.data() + number.size(), pid).ec != std::errc()) continue;
    const std::string name = subsystem_of(pid, status_socket);
    if (!name.empty()) found[name] = pid;
  }
  return found;
}

}  // namespace kpl::master
