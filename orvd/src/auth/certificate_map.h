// Which identity a client's certificate stands for: values of orv-slapdCertificateMap.
//
// A value is "SUBJECT => NAME": the DN in the certificate and the DN that the identity binds with,
// in any spelling. The two cannot run into one another, since a DN holds ">" only escaped (RFC
// 4514, 2.4).
#pragma once

#include <string>
#include <string_view>

namespace orv::server {

inline constexpr const char* kCertificateMap = "orv-slapdCertificateMap";

struct CertificateMapping {
  std::string subject;  // normal forms
  std::string bound_dn;
};

// False when the value is none. Throws std::bad_alloc.
bool parse_certificate_mapping(std::string_view value, CertificateMapping& mapping);

}  // namespace orv::server
