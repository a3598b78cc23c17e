#include "net/listening_socket.h"

#include <netinet/in.h>
#include <sys/socket.h>

#include <asio/ip/address.hpp>
#include <asio/ip/tcp.hpp>
#include <cerrno>
#include <cstddef>
#include <cstring>
#include <utility>

namespace orv::server {
namespace {

constexpr int kQueue = 1024;
// Ports that the kernel is asked for until one is free at all addresses.
constexpr int kChoices = 50;

bool set_option(int socket, int level, int option) noexcept {
  const int on = 1;
  return ::setsockopt(socket, level, option, &on, sizeof on) == 0;
}

// Without a descriptor, errno has the cause.
Descriptor open_at(const asio::ip::tcp::endpoint& endpoint) noexcept {
  const int family = endpoint.protocol().family();
  Descriptor made(::socket(family, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  const int socket = made.number();
  if (made && set_option(socket, SOL_SOCKET, SO_REUSEADDR) &&
      (family != AF_INET6 || set_option(socket, IPPROTO_IPV6, IPV6_V6ONLY)) &&
      ::bind(socket, endpoint.data(), static_cast<socklen_t>(endpoint.size())) == 0 &&
      ::listen(socket, kQueue) == 0)
    return made;
  const int failure = errno;
  made.close();
  errno = failure;
  return made;
}

// What can be done about it; "" where there is nothing to add to the system's words.
const char* advice(int failure) noexcept {
  switch (failure) {
    case EACCES:
      return "; ports below 1024 need a start as root (with --user), or a socket of the service "
             "manager";
    case EADDRINUSE:
      return "; another program has the port there: end that, or choose another port or address";
    case EADDRNOTAVAIL:
      return "; this host does not have the address, or not yet: see orv-slapdIpAddress";
    default:
      return "";
  }
}

// 0, or the system's number for the cause.
int open_one(const std::string& address, std::uint16_t port, bool secure,
             std::vector<ListeningSocket>& sockets, std::string& error) {
  asio::error_code failure;
  const asio::ip::address parsed = asio::ip::make_address(address, failure);
  if (failure) {
    error = "cannot listen on '" + address + "': not an IP address, such as 127.0.0.1 or ::1";
    return EINVAL;
  }
  Descriptor socket = open_at({parsed, port});
  if (!socket) {
    const int number = errno;
    error = "cannot listen on " + address + " port " + std::to_string(port) + ": " +
            std::strerror(number) + advice(number);
    return number;
  }
  sockets.push_back({std::move(socket), secure ? ListenerKind::secure : ListenerKind::clear,
                     parsed.is_v6() ? AF_INET6 : AF_INET});
  return 0;
}

// The same.
int open_each(const std::vector<std::string>& addresses, std::uint16_t port, bool secure,
              std::vector<ListeningSocket>& sockets, std::string& error) {
  const std::size_t before = sockets.size();
  for (const std::string& address : addresses) {
    const std::uint16_t chosen =
        port != 0 || sockets.size() == before ? port : port_of(sockets[before].socket.number());
    if (const int failure = open_one(address, chosen, secure, sockets, error)) return failure;
  }
  return 0;
}

// A host without IPv6 is served over IPv4 alone. Whatever else fails there counts: who holds the
// port at `::` would be taken for this server by everybody who comes over IPv6.
int open_every_address(std::uint16_t port, bool secure, std::vector<ListeningSocket>& sockets,
                       std::string& error) {
  const std::size_t before = sockets.size();
  const int failure = open_each({"0.0.0.0", "::"}, port, secure, sockets, error);
  const bool without_ipv6 = failure == EAFNOSUPPORT || failure == EADDRNOTAVAIL;
  if (!without_ipv6 || sockets.size() == before) return failure;
  error.clear();
  return 0;
}

}  // namespace

bool open_tcp(const std::vector<std::string>& addresses, std::uint16_t port, bool secure,
              std::vector<ListeningSocket>& sockets, std::string& error) {
  const auto before = static_cast<std::ptrdiff_t>(sockets.size());
  for (int left = kChoices;; --left) {
    const int failure = addresses.empty() ? open_every_address(port, secure, sockets, error)
                                          : open_each(addresses, port, secure, sockets, error);
    if (failure == 0) return true;
    if (failure != EADDRINUSE || port != 0 || left <= 1) return false;
    // What the kernel has chosen for the first address is taken at another one.
    sockets.erase(sockets.begin() + before, sockets.end());
  }
}

std::uint16_t port_of(int socket) noexcept {
  sockaddr_storage address{};
  socklen_t size = sizeof address;
  if (::getsockname(socket, reinterpret_cast<sockaddr*>(&address), &size) != 0) return 0;
  if (address.ss_family == AF_INET)
    return ntohs(reinterpret_cast<const sockaddr_in&>(address).sin_port);
  if (address.ss_family == AF_INET6)
    return ntohs(reinterpret_cast<const sockaddr_in6&>(address).sin6_port);
  return 0;
}

}  // namespace orv::server
