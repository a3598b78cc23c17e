// An LDAP client that nobody here wrote (libldap), at the other end of a socket pair: what it sends
// is decoded, and it reads what was encoded.
#pragma once

#include <ldap.h>
#include <openldap.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <string>

#include "protocol/decoder.h"

namespace orv::server {

class ClientLibrary {
 public:
  ClientLibrary() {
    if (socketpair(AF_UNIX, SOCK_STREAM, 0, ends_.data()) != 0) std::abort();
    if (ldap_init_fd(ends_[0], LDAP_PROTO_TCP, nullptr, &ld_) != LDAP_SUCCESS) std::abort();
    const int version = LDAP_VERSION3;
    ldap_set_option(ld_, LDAP_OPT_PROTOCOL_VERSION, &version);
    const timeval patience{10, 0};
    setsockopt(ends_[1], SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  }
  ~ClientLibrary() {
    ldap_unbind_ext(ld_, nullptr, nullptr);
    close(ends_[1]);
  }
  ClientLibrary(const ClientLibrary&) = delete;
  ClientLibrary& operator=(const ClientLibrary&) = delete;

  LDAP* handle() const noexcept { return ld_; }

  // The next request that the client sent, as one frame; "" when none comes.
  std::string sent() {
    std::string bytes;
    char octet = 0;
    while (read(ends_[1], &octet, 1) == 1) {
      bytes += octet;
      const Frame frame = next_frame(bytes, 1 << 24);
      if (frame.state == FrameState::complete) return bytes;
      if (frame.state != FrameState::need_more) break;
    }
    return {};
  }

  // Hands the client an answer.
  bool receive(const std::string& bytes) {
    return send(ends_[1], bytes.data(), bytes.size(), MSG_NOSIGNAL) ==
           static_cast<ssize_t>(bytes.size());
  }

 private:
  std::array<int, 2> ends_{};
  LDAP* ld_ = nullptr;
};

}  // namespace orv::server
