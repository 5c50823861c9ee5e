// Local sockets as the KPL library uses them, and addresses without a length.
#ifndef KPL_LOCAL_SOCKET_H
#define KPL_LOCAL_SOCKET_H

#include <sys/socket.h>
#include <sys/un.h>

#include "common/descriptor.h"

namespace kpl {

/// A new local socket of that type, closed on exec; holds nothing, with errno, when there is none to be had.
platform::Descriptor open_local_socket(int type);

/// The length that the kernel wants for an address that travels or is set without one, 0 when it names nobody. See
/// kpl.h for what a return address may hold.
socklen_t address_length(const sockaddr_un& address);

/// The address that `text` stands for: a path, or an abstract name with '@' for its NUL. False when it is empty or
/// does not fit.
bool address_from_text(const char* text, sockaddr_un* address);

}  // namespace kpl

#endif
