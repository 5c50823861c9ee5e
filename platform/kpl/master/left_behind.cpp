#include "master/left_behind.h"

#include <charconv>
#include <filesystem>
#include <fstream>

#include "kpl.h"

namespace kpl::master {
namespace {

std::string proc_file(pid_t pid, const char* name) { return "/proc/" + std::to_string(pid) + "/" + name; }

std::optional<uid_t> real_user_of(pid_t pid) {
  std::ifstream status(proc_file(pid, "status"));
  for (std::string word; status >> word;) {
    uid_t user = 0;
    if (word == "Uid:" && status >> user) return user;
  }
  return std::nullopt;
}

}  // namespace

std::optional<Claim> claim_of(pid_t pid, const std::string& status_socket) {
  const std::string master = KPL_MASTER_ENV "=" + status_socket;
  const std::string identity = std::string(kIdentityVariable) + "=";
  const std::string its_pid = ":" + std::to_string(pid);
  std::ifstream environment(proc_file(pid, "environ"), std::ios::binary);
  bool of_this_master = false;
  std::string name;
  for (std::string one; std::getline(environment, one, '\0');) {
    if (one == master) of_this_master = true;
    if (!one.starts_with(identity) || !one.ends_with(its_pid)) continue;
    name = one.substr(identity.size(), one.size() - identity.size() - its_pid.size());
  }
  const std::optional<uid_t> user = real_user_of(pid);
  if (!of_this_master || name.empty() || !user) return std::nullopt;
  return Claim{name, pid, *user};
}

std::vector<Claim> find_claims(const std::string& status_socket) {
  std::vector<Claim> found;
  std::error_code error;
  std::filesystem::directory_iterator processes("/proc", error);
  for (; !error && processes != std::filesystem::directory_iterator(); processes.increment(error)) {
    const std::string number = processes->path().filename();
    pid_t pid = 0;
    if (std::from_chars(number.data(), number.data() + number.size(), pid).ec != std::errc()) continue;
    if (const auto claim = claim_of(pid, status_socket)) found.push_back(*claim);
  }
  return found;
}

}  // namespace kpl::master
