// How SASL is offered; values, as the configuration file has them.
#pragma once

#include <string>
#include <vector>

namespace orv::server {

struct SaslSettings {
  std::vector<std::string> mechanisms{};  // allowed ones in upper case; empty: all, "NONE": none
  std::string digest_realm{};             // of DIGEST-MD5; "": the name of the host
  std::string keytab{};                   // path; "": no Kerberos
  bool operator==(const SaslSettings&) const = default;
};

}  // namespace orv::server
