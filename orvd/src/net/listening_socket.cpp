#include "net/listening_socket.h"

#include <netinet/in.h>
#include <sys/socket.h>

#include <asio/ip/address.hpp>
#include <asio/ip/tcp.hpp>
#include <cerrno>
#include <cstring>
#include <utility>

namespace orv::server {
namespace {

constexpr int kQueue = 1024;

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

bool open_one(const std::string& address, std::uint16_t port, bool secure, bool required,
              std::vector<ListeningSocket>& sockets, std::string& error) {
  asio::error_code failure;
  const asio::ip::address parsed = asio::ip::make_address(address, failure);
  if (failure) {
    error = "cannot listen on '" + address + "': not an IP address, such as 127.0.0.1 or ::1";
    return false;
  }
  Descriptor socket = open_at({parsed, port});
  if (!socket) {
    if (!required) return true;
    error = "cannot listen on " + address + " port " + std::to_string(port) + ": " +
            std::strerror(errno);
    if (errno == EACCES)
      error +=
          "; ports below 1024 need a start as root (with --user), or a socket of the service "
          "manager";
    return false;
  }
  sockets.push_back({std::move(socket), secure ? ListenerKind::secure : ListenerKind::clear,
                     parsed.is_v6() ? AF_INET6 : AF_INET});
  return true;
}

}  // namespace

bool open_tcp(const std::vector<std::string>& addresses, std::uint16_t port, bool secure,
              std::vector<ListeningSocket>& sockets, std::string& error) {
  const std::size_t before = sockets.size();
  const auto chosen = [&] {
    return port != 0 || sockets.size() == before ? port : port_of(sockets[before].socket.number());
  };
  if (addresses.empty()) {
    // A host without IPv6 is served over IPv4 alone.
    return open_one("0.0.0.0", port, secure, true, sockets, error) &&
           open_one("::", chosen(), secure, false, sockets, error);
  }
  for (const std::string& address : addresses)
    if (!open_one(address, chosen(), secure, true, sockets, error)) return false;
  return true;
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
