#include "local_socket.h"

#include <stddef.h>
#include <string.h>

namespace kpl {

platform::Descriptor open_local_socket(int type) {
  return platform::Descriptor(socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
}

socklen_t address_length(const sockaddr_un& address) {
  constexpr size_t kPathOffset = offsetof(sockaddr_un, sun_path);
  constexpr size_t kPathSize = sizeof address.sun_path;
  if (address.sun_family != AF_UNIX) return 0;
  if (address.sun_path[0] != '\0') {
    return static_cast<socklen_t>(kPathOffset + strnlen(address.sun_path, kPathSize));
  }
  const size_t name = strnlen(address.sun_path + 1, kPathSize - 1);
  return name == 0 ? 0 : static_cast<socklen_t>(kPathOffset + 1 + name);
}

bool address_from_text(const char* text, sockaddr_un* address) {
  *address = {};
  const size_t length = strlen(text);
  if (length == 0 || length >= sizeof address->sun_path) return false;
  address->sun_family = AF_UNIX;
  memcpy(address->sun_path, text, length);
  if (text[0] == '@') address->sun_path[0] = '\0';
  return address_length(*address) != 0;
}

}  // namespace kpl
