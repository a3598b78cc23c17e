// Sockets that listen, before anybody accepts from them: opened while the process may still open
// low ports, or handed over by a service manager.
//
// Threads: functions without state.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "descriptor.h"

namespace orv::server {

enum class ListenerKind { clear, secure, local };

struct ListeningSocket {
  Descriptor socket;
  ListenerKind kind = ListenerKind::clear;
  int family = 0;  // AF_INET, AF_INET6 or AF_UNIX
};

// Opens a socket on each address (literal IPv4 or IPv6; none: every address of the host, of IPv4
// alone where there is no IPv6), for connections that begin in clear or with TLS, and appends them.
// With port 0 the kernel chooses one that is free at all of them. False with the cause, also when
// somebody else has the port at one of the addresses; what was opened until then stays.
bool open_tcp(const std::vector<std::string>& addresses, std::uint16_t port, bool secure,
              std::vector<ListeningSocket>& sockets, std::string& error);

// The TCP port of a socket; 0 when it has none.
std::uint16_t port_of(int socket) noexcept;

}  // namespace orv::server
