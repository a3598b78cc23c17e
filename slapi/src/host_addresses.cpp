// Listening addresses: what a literal says, and whether an interface of the host has it.

#include "host_addresses.h"

#include <arpa/inet.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <charconv>
#include <cstring>
#include <memory>
#include <string_view>

#include "slapi/services.h"

namespace orv {
namespace {

constexpr std::size_t kMaxLiteral = 64;

// An address as all interfaces and literals are compared: IPv4 in its mapped form.
struct HostAddress {
  in6_addr bytes{};
  bool needs_zone = false;  // means something on one interface only
};

HostAddress mapped(const in_addr& v4) noexcept {
  HostAddress address;
  address.bytes.s6_addr[10] = 0xFF;
  address.bytes.s6_addr[11] = 0xFF;
  std::memcpy(&address.bytes.s6_addr[12], &v4, sizeof v4);
  return address;
}

HostAddress of_v6(const in6_addr& v6) noexcept {
  return {v6, IN6_IS_ADDR_LINKLOCAL(&v6) != 0};
}

// "Any address" says nothing about this host; :: would listen everywhere where one was meant.
bool is_wildcard(const HostAddress& address) noexcept {
  static constexpr unsigned char kAnyV4[sizeof(in6_addr)] = {0, 0, 0, 0, 0,    0,
                                                             0, 0, 0, 0, 0xFF, 0xFF};
  return IN6_IS_ADDR_UNSPECIFIED(&address.bytes) ||
         std::memcmp(&address.bytes, kAnyV4, sizeof kAnyV4) == 0;
}

bool same_bytes(const HostAddress& a, const HostAddress& b) noexcept {
  return std::memcmp(&a.bytes, &b.bytes, sizeof a.bytes) == 0;
}

// A literal without its zone, as inet_pton reads it: no names, no blanks, no short forms.
bool read_literal(std::string_view text, HostAddress& address) noexcept {
  char terminated[kMaxLiteral + 1] = "";
  text.copy(terminated, kMaxLiteral);
  in_addr v4{};
  if (inet_pton(AF_INET, terminated, &v4) == 1) {
    address = mapped(v4);
    return true;
  }
  in6_addr v6{};
  if (inet_pton(AF_INET6, terminated, &v6) != 1) return false;
  address = of_v6(v6);
  return true;
}

// A zone is the name of an interface or its number (RFC 4007, section 11).
bool is_zone_of(const ifaddrs& interface, const sockaddr_in6& socket,
                std::string_view zone) noexcept {
  if (interface.ifa_name != nullptr && zone == interface.ifa_name) return true;
  unsigned number = 0;
  const auto [end, status] = std::from_chars(zone.data(), zone.data() + zone.size(), number);
  return status == std::errc() && end == zone.data() + zone.size() && number != 0 &&
         number == socket.sin6_scope_id;
}

bool has_address(const ifaddrs& interface, const HostAddress& wanted,
                 std::string_view zone) noexcept {
  if (interface.ifa_addr == nullptr) return false;
  if (interface.ifa_addr->sa_family == AF_INET) {
    sockaddr_in socket{};
    std::memcpy(&socket, interface.ifa_addr, sizeof socket);
    return same_bytes(mapped(socket.sin_addr), wanted);
  }
  if (interface.ifa_addr->sa_family != AF_INET6) return false;
  sockaddr_in6 socket{};
  std::memcpy(&socket, interface.ifa_addr, sizeof socket);
  if (!same_bytes(of_v6(socket.sin6_addr), wanted)) return false;
  return !wanted.needs_zone || is_zone_of(interface, socket, zone);
}

struct InterfacesDeleter {
  void operator()(ifaddrs* interfaces) const noexcept { freeifaddrs(interfaces); }
};

}  // namespace

bool slapi::is_address_in(const char* address, const ifaddrs* interfaces) noexcept {
  if (address == nullptr) return false;
  const std::string_view text(address, strnlen(address, kMaxLiteral + 1));
  if (text.size() > kMaxLiteral) return false;
  const std::size_t mark = text.find('%');
  const bool has_zone = mark != std::string_view::npos;
  const std::string_view zone = has_zone ? text.substr(mark + 1) : std::string_view();
  HostAddress wanted;
  if (!read_literal(text.substr(0, mark), wanted) || is_wildcard(wanted)) return false;
  // Without a zone a link-local address names no interface; elsewhere a zone has no meaning.
  if (has_zone != wanted.needs_zone || (has_zone && zone.empty())) return false;
  for (; interfaces != nullptr; interfaces = interfaces->ifa_next)
    if (has_address(*interfaces, wanted, zone)) return true;
  return false;
}

bool isValidIPAddressOnSystem(const char* address) {
  ifaddrs* found = nullptr;
  if (address == nullptr || getifaddrs(&found) != 0) return false;
  const std::unique_ptr<ifaddrs, InterfacesDeleter> interfaces(found);
  return slapi::is_address_in(address, interfaces.get());
}

}  // namespace orv
