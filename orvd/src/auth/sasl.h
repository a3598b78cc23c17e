// SASL authentication (RFC 4422) between the protocol engine and the mechanisms.
//
// A mechanism stands for what the server offers under one name; an exchange is one attempt of one
// client to prove who it is, as a sequence of steps, each with what the client sent and what it is
// to be answered. The engine keeps the rules of LDAP (RFC 4511, 4.2; RFC 4513, 5.2): which requests
// go on with an exchange and which end it, result codes, and that a client is anonymous until an
// exchange is done.
//
// Threads: mechanisms are made before the server serves, and shared; `offered` and `start` are
// called by event loops and must not block. The steps of one exchange follow one another, on worker
// threads; they may compute, read files, and throw std::bad_alloc.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "auth/identities.h"
#include "cfg/result_codes.h"

namespace orv::server {

// What the transport of a connection proves and promises. It changes only while nothing is
// outstanding on the connection and no exchange is under way.
struct TransportFacts {
  bool local = false;                     // a Unix socket of this host
  bool loopback = false;                  // TCP that never left this host
  std::optional<std::uint32_t> peer_uid;  // who holds the other end of a Unix socket
  std::string peer;                       // IP address and port of the client; "" when local
  std::string own;                        // the same of this end

  // Of TLS; empty and 0 without it.
  std::string tls_version;          // "TLSv1.3"
  std::string tls_cipher;           // OpenSSL's name
  int tls_strength = 0;             // bits of the cipher's key
  std::string certificate_subject;  // normal form of the DN in the client's verified certificate
  std::string server_end_point;     // channel binding of this name (RFC 5929, 4)

  bool encrypted() const noexcept { return !tls_version.empty(); }
};

// What stands between the messages of LDAP and the transport after an exchange that negotiated
// integrity or confidentiality. It applies to what follows the exchange's last answer. On the
// connection's loop thread; want of memory may throw.
class SecurityLayer {
 public:
  virtual ~SecurityLayer() = default;
  // Appends `clear`, of any length, to `wire` in its protected form. False: the connection ends.
  virtual bool wrap(std::string_view clear, std::string& wire) = 0;
  // Takes the next bytes from the client, cut anywhere, and appends what they hold to `clear`;
  // keeps the beginning of what is not whole yet. False when they are damaged, or longer than what
  // was negotiated: the connection ends.
  virtual bool unwrap(std::string_view wire, std::string& clear) = 0;
  // Whether such a beginning is kept: the client owes its other half.
  virtual bool has_part() const noexcept = 0;
};

// What one step came to.
struct SaslOutcome {
  enum class State { go_on, done, failed };
  State state = State::failed;
  // go_on: the challenge. done: additional data, if the mechanism has any. Failed: none.
  std::optional<std::string> reply{};
  // done: who the client is from now on; must not be null.
  std::shared_ptr<const Identity> identity{};
  // done: from the end of the answer on; null: none, and one that was there before stays.
  std::unique_ptr<SecurityLayer> layer{};
  // failed: the result code and the text for the client, which tells nothing about who exists.
  int code = result::invalid_credentials;
  std::string text{};
  // For the access log, whatever the state: the name that the client claims, as it was sent; ""
  // while unknown.
  std::string name{};
};

class SaslExchange {
 public:
  virtual ~SaslExchange() = default;
  // `credentials`: what the client sent; nothing when the field was absent, which is not the same
  // as empty. It is wiped when the step has returned.
  virtual SaslOutcome step(std::optional<std::string_view> credentials) = 0;
};

class SaslMechanism {
 public:
  virtual ~SaslMechanism() = default;
  // In upper case, as RFC 4422 has it.
  virtual std::string_view name() const noexcept = 0;
  // Whether somebody could succeed with it, as the server is configured, on such a connection. What
  // is not offered is neither announced nor started.
  virtual bool offered(const TransportFacts& transport) const = 0;
  // `transport` outlives the exchange. Null: out of memory.
  virtual std::unique_ptr<SaslExchange> start(const TransportFacts& transport) const = 0;
};

using SaslMechanisms = std::vector<std::unique_ptr<const SaslMechanism>>;

// The one of this name (in any letter case) that is offered on such a connection; or null.
const SaslMechanism* find_mechanism(const SaslMechanisms& mechanisms, std::string_view name,
                                    const TransportFacts& transport);

// The names of those that are offered.
std::vector<std::string> offered_mechanisms(const SaslMechanisms& mechanisms,
                                            const TransportFacts& transport);

// Whether somebody who proved `identity` may act as the authorisation identity that the client sent
// (RFC 4513, 5.2.1.8): nothing, "dn:" and the bind DN in any spelling, or "u:" and the name that
// proved it (`user_name`; "" when the mechanism knows none). Nobody acts as anybody else. Throws
// std::bad_alloc.
bool may_act_as(const Identity& identity, std::string_view user_name,
                std::string_view authorization_id);

}  // namespace orv::server
