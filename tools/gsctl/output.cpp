#include "tools/gsctl/output.h"

#include <poll.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "common/printable.h"
#include "tools/gsctl/status.h"

namespace gsctl {
namespace {

/// 0, or what went wrong. A descriptor that another program has made non-blocking is waited for.
int write_all(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t written = write(fd, bytes.data(), bytes.size());
    if (written >= 0) {
      bytes.remove_prefix(static_cast<std::size_t>(written));
    } else if (errno == EAGAIN) {
      pollfd room{fd, POLLOUT, 0};
      poll(&room, 1, -1);
    } else if (errno != EINTR) {
      return errno;
    }
  }
  return 0;
}

}  // namespace

void print_line(std::string_view text) { print_raw(platform::printable(text) + "\n"); }

std::string json_text(const nlohmann::ordered_json& object) {
  return object.dump(-1, ' ', true, nlohmann::ordered_json::error_handler_t::replace);
}

void print_json(const nlohmann::ordered_json& object) { print_raw(json_text(object) + "\n"); }

void print_raw(std::string_view bytes) {
  const int error = write_all(STDOUT_FILENO, bytes);
  if (error == EPIPE) throw OutputGone();
  if (error != 0) throw Error(kRefused, std::string("cannot write the output: ") + strerror(error));
}

void complain(std::string_view text) noexcept try {
  write_all(STDERR_FILENO, "gsctl: " + platform::printable(text) + "\n");
} catch (const std::bad_alloc&) {
}

}  // namespace gsctl
