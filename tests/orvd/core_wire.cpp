#include "core_wire.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <stdexcept>

namespace orv::server::test {
namespace {

constexpr int kPatienceMs = 10000;

std::string length_octets(std::size_t length) {
  if (length < 0x80) return std::string(1, static_cast<char>(length));
  std::string octets;
  for (; length > 0; length >>= 8) octets.insert(octets.begin(), static_cast<char>(length & 0xFF));
  return static_cast<char>(0x80 | octets.size()) + octets;
}

std::string boolean(bool value) {
  return tlv(0x01, value ? "\xFF" : std::string(1, '\0'));
}

struct Element {
  int tag = 0;
  std::string_view content;
  std::size_t length = 0;  // 0: not whole
};

Element element(std::string_view bytes) {
  if (bytes.size() < 2) return {};
  std::size_t length = static_cast<unsigned char>(bytes[1]);
  std::size_t header = 2;
  if (length & 0x80) {
    const std::size_t octets = length & 0x7F;
    if (bytes.size() < 2 + octets) return {};
    length = 0;
    for (std::size_t i = 0; i < octets; ++i)
      length = length << 8 | static_cast<unsigned char>(bytes[2 + i]);
    header += octets;
  }
  if (bytes.size() < header + length) return {};
  return {static_cast<unsigned char>(bytes[0]), bytes.substr(header, length), header + length};
}

int number(std::string_view content) {
  int value = 0;
  for (const char c : content) value = value << 8 | static_cast<unsigned char>(c);
  return value;
}

}  // namespace

std::string tlv(int tag, std::string_view content) {
  return static_cast<char>(tag) + length_octets(content.size()) + std::string(content);
}

std::string integer(int value) {
  std::string octets;
  do {
    octets.insert(octets.begin(), static_cast<char>(value & 0xFF));
    value >>= 8;
  } while (value > 0);
  if (octets[0] & 0x80) octets.insert(octets.begin(), '\0');
  return tlv(0x02, octets);
}

std::string message(int id, std::string_view operation, std::string_view controls) {
  std::string content = integer(id) + std::string(operation);
  if (!controls.empty()) content += tlv(0xA0, controls);
  return tlv(0x30, content);
}

std::string bind(int id, std::string_view name, std::string_view password) {
  return message(id, tlv(0x60, integer(3) + tlv(0x04, name) + tlv(0x80, password)));
}

std::string sasl_bind(int id, std::string_view mechanism,
                      const std::optional<std::string>& credentials) {
  std::string sasl = tlv(0x04, mechanism);
  if (credentials) sasl += tlv(0x04, *credentials);
  return message(id, tlv(0x60, integer(3) + tlv(0x04, "") + tlv(0xA3, sasl)));
}

std::string search(int id, std::string_view base, int scope, int size_limit, int time_limit) {
  return message(
      id,
      tlv(0x63, tlv(0x04, base) + tlv(0x0A, std::string(1, static_cast<char>(scope))) +
                    tlv(0x0A, std::string(1, '\0')) + integer(size_limit) + integer(time_limit) +
                    boolean(false) + tlv(0x87, "objectClass") + tlv(0x30, "")));
}

std::string delete_entry(int id, std::string_view dn) {
  return message(id, tlv(0x4A, dn));
}

std::string add_entry(int id, std::string_view dn, std::string_view type, std::string_view value) {
  const std::string attribute = tlv(0x30, tlv(0x04, type) + tlv(0x31, tlv(0x04, value)));
  return message(id, tlv(0x68, tlv(0x04, dn) + tlv(0x30, attribute)));
}

std::string modify(int id, std::string_view dn, std::string_view type, std::string_view value) {
  const std::string attribute = tlv(0x30, tlv(0x04, type) + tlv(0x31, tlv(0x04, value)));
  const std::string change = tlv(0x30, tlv(0x0A, "\x02") + attribute);
  return message(id, tlv(0x66, tlv(0x04, dn) + tlv(0x30, change)));
}

std::string compare(int id, std::string_view dn) {
  return message(id, tlv(0x6E, tlv(0x04, dn) + tlv(0x30, tlv(0x04, "cn") + tlv(0x04, "x"))));
}

std::string extended(int id, std::string_view oid) {
  return message(id, tlv(0x77, tlv(0x80, oid)));
}

std::string abandon(int id, int given_up) {
  std::string target = integer(given_up);
  target[0] = 0x50;
  return message(id, target);
}

std::string unbind(int id) {
  return message(id, tlv(0x42, ""));
}

std::string control(std::string_view oid, bool critical) {
  return tlv(0x30, tlv(0x04, oid) + boolean(critical));
}

namespace {

struct Address {
  sockaddr_storage storage{};
  socklen_t length = 0;
  const sockaddr* get() const { return reinterpret_cast<const sockaddr*>(&storage); }
};

Address address_of(const std::string& text, std::uint16_t port) {
  Address address;
  auto* const v4 = reinterpret_cast<sockaddr_in*>(&address.storage);
  auto* const v6 = reinterpret_cast<sockaddr_in6*>(&address.storage);
  if (::inet_pton(AF_INET, text.c_str(), &v4->sin_addr) == 1) {
    v4->sin_family = AF_INET;
    v4->sin_port = htons(port);
    address.length = sizeof *v4;
  } else if (::inet_pton(AF_INET6, text.c_str(), &v6->sin6_addr) == 1) {
    v6->sin6_family = AF_INET6;
    v6->sin6_port = htons(port);
    address.length = sizeof *v6;
  }
  return address;
}

}  // namespace

WireClient::WireClient(std::uint16_t port) : WireClient("127.0.0.1", port) {}

WireClient::WireClient(const std::string& address, std::uint16_t port, const std::string& from) {
  const Address to = address_of(address, port);
  socket_ = ::socket(to.storage.ss_family, SOCK_STREAM, 0);
  const Address own = from.empty() ? Address{} : address_of(from, 0);
  const bool bound = own.length == 0 || ::bind(socket_, own.get(), own.length) == 0;
  if (bound && ::connect(socket_, to.get(), to.length) == 0) return;
  close();
  throw std::runtime_error("cannot connect to " + address);
}

WireClient::~WireClient() {
  close();
}

void WireClient::close() {
  if (socket_ >= 0) ::close(socket_);
  socket_ = -1;
}

void WireClient::send(std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t sent = ::send(socket_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (sent <= 0) return;  // the server may have closed already; the test looks at what it said
    bytes.remove_prefix(static_cast<std::size_t>(sent));
  }
}

bool WireClient::fill() {
  pollfd ready{socket_, POLLIN, 0};
  if (::poll(&ready, 1, kPatienceMs) <= 0) return false;
  char bytes[65536];
  const ssize_t length = ::recv(socket_, bytes, sizeof bytes, 0);
  if (length <= 0) return false;
  received_.append(bytes, static_cast<std::size_t>(length));
  return true;
}

std::optional<Reply> WireClient::receive() {
  Element whole;
  while ((whole = element(received_)).length == 0)
    if (!fill()) return std::nullopt;
  Reply reply;
  const Element id = element(whole.content);
  const Element operation = element(whole.content.substr(id.length));
  reply.id = number(id.content);
  reply.tag = operation.tag;
  reply.body = operation.content;
  reply.controls = whole.content.substr(id.length + operation.length);
  if (reply.tag != 0x64) reply.code = number(element(operation.content).content);
  received_.erase(0, whole.length);
  return reply;
}

std::vector<Reply> WireClient::receive_result() {
  std::vector<Reply> replies;
  while (std::optional<Reply> reply = receive()) {
    replies.push_back(*reply);
    if (reply->tag != 0x64) break;
  }
  return replies;
}

bool WireClient::closed() {
  if (element(received_).length != 0) return false;
  pollfd ready{socket_, POLLIN, 0};
  if (::poll(&ready, 1, kPatienceMs) <= 0) return false;
  char byte;
  return ::recv(socket_, &byte, 1, 0) <= 0;
}

}  // namespace orv::server::test
