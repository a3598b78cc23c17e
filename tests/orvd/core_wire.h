// LDAP messages byte by byte, and a blocking client to send them with.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace orv::server::test {

// BER with definite lengths.
std::string tlv(int tag, std::string_view content);
std::string integer(int value);

std::string message(int id, std::string_view operation, std::string_view controls = "");
std::string bind(int id, std::string_view name, std::string_view password);
std::string sasl_bind(int id, std::string_view mechanism,
                      const std::optional<std::string>& credentials = std::nullopt);
std::string search(int id, std::string_view base, int scope = 0, int size_limit = 0,
                   int time_limit = 0);
std::string delete_entry(int id, std::string_view dn);
std::string add_entry(int id, std::string_view dn, std::string_view type, std::string_view value);
std::string modify(int id, std::string_view dn, std::string_view type, std::string_view value);
std::string compare(int id, std::string_view dn);
std::string extended(int id, std::string_view oid);
std::string abandon(int id, int given_up);
std::string unbind(int id);
std::string control(std::string_view oid, bool critical);

// An answer: its message id, the tag of its operation, and its result code (-1 for entries).
struct Reply {
  int id = -1;
  int tag = 0;
  int code = -1;
  std::string body;
  std::string controls;  // the list of them with its tag; "": none
};

class WireClient {
 public:
  explicit WireClient(std::uint16_t port);
  // To a literal IPv4 or IPv6 address, from a certain one of this host ("": any). Throws
  // std::runtime_error when there is no connection.
  WireClient(const std::string& address, std::uint16_t port, const std::string& from = "");
  virtual ~WireClient();
  WireClient(const WireClient&) = delete;
  WireClient& operator=(const WireClient&) = delete;

  virtual void send(std::string_view bytes);
  // The next answer, or nothing when the server closed the connection (or ten seconds passed).
  std::optional<Reply> receive();
  // Answers up to and including the first that is no search entry.
  std::vector<Reply> receive_result();
  // Whether the server closes the connection without another answer.
  virtual bool closed();
  void close();
  int descriptor() const { return socket_; }

 protected:
  WireClient() = default;
  // Adds what comes in; false when nothing does any more.
  virtual bool fill();
  int socket_ = -1;
  std::string received_;
};

}  // namespace orv::server::test
