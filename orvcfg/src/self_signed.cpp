#include "self_signed.h"

#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rand.h>
#include <openssl/x509v3.h>
#include <unistd.h>

#include <algorithm>
#include <memory>

#include "cfg/openssl_owners.h"
#include "cfg/secret.h"

namespace orv::orvcfg {

namespace {

constexpr long kSecondsOfADay = 86400;
constexpr long kDays = 3650;
constexpr int kSerialBytes = 16;

using Extension = std::unique_ptr<X509_EXTENSION, Releaser<X509_EXTENSION_free>>;
using Number = std::unique_ptr<BIGNUM, Releaser<BN_free>>;

// "localhost" when the host has no name that may stand in a certificate.
std::string host_name() {
  char name[256] = {};
  if (::gethostname(name, sizeof name - 1) != 0) return "localhost";
  const std::string text = name;
  const auto fits = [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' ||
           c == '.';
  };
  return !text.empty() && std::all_of(text.begin(), text.end(), fits) ? text : "localhost";
}

bool set_serial(X509* certificate) {
  unsigned char bytes[kSerialBytes];
  if (RAND_bytes(bytes, sizeof bytes) != 1) return false;
  bytes[0] = static_cast<unsigned char>((bytes[0] & 0x7F) | 0x40);
  const Number number(BN_bin2bn(bytes, sizeof bytes, nullptr));
  return number && BN_to_ASN1_INTEGER(number.get(), X509_get_serialNumber(certificate));
}

bool set_name(X509* certificate) {
  X509_NAME* const name = X509_get_subject_name(certificate);
  const auto* const host = reinterpret_cast<const unsigned char*>("localhost");
  return X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC, host, -1, -1, 0) == 1 &&
         X509_set_issuer_name(certificate, name) == 1;
}

bool extend(X509* certificate, int kind, const std::string& value) {
  X509V3_CTX context;
  X509V3_set_ctx_nodb(&context);
  X509V3_set_ctx(&context, certificate, certificate, nullptr, nullptr, 0);
  const Extension extension(X509V3_EXT_conf_nid(nullptr, &context, kind, value.c_str()));
  return extension && X509_add_ext(certificate, extension.get(), -1) == 1;
}

bool fill(X509* certificate, EVP_PKEY* key) {
  std::string names = "DNS:localhost,IP:127.0.0.1,IP:::1";
  if (const std::string host = host_name(); host != "localhost") names += ",DNS:" + host;
  return X509_set_version(certificate, X509_VERSION_3) == 1 && set_serial(certificate) &&
         X509_gmtime_adj(X509_getm_notBefore(certificate), 0) &&
         X509_gmtime_adj(X509_getm_notAfter(certificate), kDays * kSecondsOfADay) &&
         set_name(certificate) && X509_set_pubkey(certificate, key) == 1 &&
         extend(certificate, NID_basic_constraints, "critical,CA:FALSE") &&
         extend(certificate, NID_key_usage, "critical,digitalSignature") &&
         extend(certificate, NID_ext_key_usage, "serverAuth") &&
         extend(certificate, NID_subject_alt_name, names) &&
         X509_sign(certificate, key, EVP_sha256()) > 0;
}

// `memory` is wiped on the way.
std::string take_text(BIO* memory) {
  char* data = nullptr;
  const long length = BIO_get_mem_data(memory, &data);
  if (length <= 0) return {};
  std::string text(data, static_cast<std::size_t>(length));
  cfg::wipe(data, static_cast<std::size_t>(length));
  return text;
}

}  // namespace

bool make_self_signed(SelfSigned& made, std::string& why) {
  const PrivateKey key(EVP_EC_gen("P-256"));
  const Certificate certificate(X509_new());
  const Bio key_text(BIO_new(BIO_s_secmem()));
  const Bio certificate_text(BIO_new(BIO_s_mem()));
  if (key && certificate && key_text && certificate_text && fill(certificate.get(), key.get()) &&
      PEM_write_bio_PKCS8PrivateKey(key_text.get(), key.get(), nullptr, nullptr, 0, nullptr,
                                    nullptr) == 1 &&
      PEM_write_bio_X509(certificate_text.get(), certificate.get()) == 1) {
    made.key = take_text(key_text.get());
    made.certificate = take_text(certificate_text.get());
    return true;
  }
  const char* const reason = ERR_reason_error_string(ERR_peek_error());
  why = std::string("cannot make a certificate: ") + (reason ? reason : "unknown cause");
  return false;
}

}  // namespace orv::orvcfg
