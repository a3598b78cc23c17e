// Certificates made on the spot, and a client that speaks TLS with them.
#pragma once

#include <openssl/ssl.h>

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "../temporary_directory.h"
#include "core_wire.h"

namespace orv::server::test {

// A certificate and its key, in two PEM files (0600).
struct Pair {
  std::string certificate;
  std::string key;
};

// One attribute of a subject, encoded as is: `kind` V_ASN1_UTF8STRING and the like.
struct NamePart {
  const char* type;  // name or number
  int kind;
  std::string value;
  bool joins = false;  // the RDN of the part before it
};

// What a certificate says; as it should be, unless told otherwise.
struct Wording {
  std::vector<NamePart> subject{};  // first part first
  long begins = -60;                // seconds from now
  long ends = 3600;
  const char* purpose = nullptr;  // extendedKeyUsage
  const char* constraint = "CA:FALSE";
};

// Makes pairs in a folder of its own, which goes with it.
class Certificates {
 public:
  Certificates();

  Pair self_signed(const std::string& name);
  Pair self_signed(const Wording& wording) { return make(wording, nullptr); }
  // By an authority that is made with the first of them.
  Pair of_client(const std::string& name);
  Pair of_client(const Wording& wording);
  Pair signed_by(const Pair& issuer, const Wording& wording);
  // A list in PEM of what an authority has revoked, which a newer one follows in so many seconds.
  std::string revoked_by(const Pair& issuer, const std::vector<Pair>& revoked, long ends = 3600);
  const std::string& authority();
  std::string path(const std::string& name) const { return folder_.file(name); }

 private:
  Pair make(const Wording& wording, const Pair* issuer);
  const orv::test::TemporaryDirectory folder_;
  Pair authority_;
  int made_ = 0;
};

// How a client shakes hands.
struct TlsWish {
  int oldest = TLS1_2_VERSION;
  int newest = TLS1_3_VERSION;
  const Pair* own = nullptr;
  std::string suites{};            // of TLS 1.2; "": all that OpenSSL has
  SSL_SESSION* session = nullptr;  // to go on with
};

// A connection in clear until it shakes hands. It trusts every server.
class TlsClient : public WireClient {
 public:
  explicit TlsClient(std::uint16_t port) : WireClient(port) {}
  ~TlsClient() override;

  // False when it fails; under TLS 1.3 a server may still refuse the client's certificate.
  bool shake_hands(const TlsWish& wish = {});
  // In clear, whatever stands.
  void send_raw(std::string_view bytes) { WireClient::send(bytes); }
  void send(std::string_view bytes) override;
  bool closed() override;
  void say_goodbye() { SSL_shutdown(ssl_); }
  SSL* ssl() const { return ssl_; }
  std::string peer_name() const;

 protected:
  bool fill() override;

 private:
  SSL_CTX* context_ = nullptr;
  SSL* ssl_ = nullptr;
};

}  // namespace orv::server::test
