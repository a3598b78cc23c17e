#include "core_tls_client.h"

#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>
#include <poll.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>

#include <algorithm>
#include <cstdio>
#include <stdexcept>

namespace orv::server::test {
namespace {

constexpr int kPatienceSeconds = 10;

void must(bool done) {
  if (!done) throw std::runtime_error("OpenSSL refuses");
}

using File = std::unique_ptr<FILE, int (*)(FILE*)>;

File open_file(const std::string& path, const char* mode) {
  File file(std::fopen(path.c_str(), mode), &std::fclose);
  must(file != nullptr);
  return file;
}

X509* read_certificate(const std::string& path) {
  return PEM_read_X509(open_file(path, "r").get(), nullptr, nullptr, nullptr);
}

EVP_PKEY* read_key(const std::string& path) {
  return PEM_read_PrivateKey(open_file(path, "r").get(), nullptr, nullptr, nullptr);
}

void extend(X509* certificate, int kind, const char* value) {
  X509_EXTENSION* const extension = X509V3_EXT_conf_nid(nullptr, nullptr, kind, value);
  must(extension && X509_add_ext(certificate, extension, -1) == 1);
  X509_EXTENSION_free(extension);
}

Wording named(const std::string& name, const char* constraint = "CA:FALSE") {
  Wording wording;
  wording.subject = {{"O", V_ASN1_UTF8STRING, "Orv Test"}, {"CN", V_ASN1_UTF8STRING, name}};
  wording.constraint = constraint;
  return wording;
}

}  // namespace

// Files of authorities that others could change are refused, however whoever runs this makes his.
Certificates::Certificates() {
  ::umask(S_IWGRP | S_IWOTH);
}

Pair Certificates::make(const Wording& wording, const Pair* issuer) {
  EVP_PKEY* const key = EVP_EC_gen("P-256");
  X509* const certificate = X509_new();
  must(key && certificate);
  X509_set_version(certificate, X509_VERSION_3);
  ASN1_INTEGER_set(X509_get_serialNumber(certificate), ++made_);
  X509_gmtime_adj(X509_getm_notBefore(certificate), wording.begins);
  X509_gmtime_adj(X509_getm_notAfter(certificate), wording.ends);
  X509_NAME* const subject = X509_get_subject_name(certificate);
  for (const NamePart& part : wording.subject)
    must(X509_NAME_add_entry_by_txt(subject, part.type, part.kind,
                                    reinterpret_cast<const unsigned char*>(part.value.data()),
                                    static_cast<int>(part.value.size()), -1,
                                    part.joins ? -1 : 0) == 1);
  X509* const parent = issuer ? read_certificate(issuer->certificate) : certificate;
  EVP_PKEY* const parent_key = issuer ? read_key(issuer->key) : key;
  X509_set_issuer_name(certificate, X509_get_subject_name(parent));
  X509_set_pubkey(certificate, key);
  extend(certificate, NID_basic_constraints, wording.constraint);
  if (wording.purpose) extend(certificate, NID_ext_key_usage, wording.purpose);
  must(X509_sign(certificate, parent_key, EVP_sha256()) > 0);
  const std::string base = path(std::to_string(made_));
  const Pair pair{base + ".crt", base + ".key"};
  must(PEM_write_X509(open_file(pair.certificate, "w").get(), certificate) == 1);
  must(PEM_write_PrivateKey(open_file(pair.key, "w").get(), key, nullptr, nullptr, 0, nullptr,
                            nullptr) == 1);
  must(::chmod(pair.key.c_str(), 0600) == 0);
  if (issuer) X509_free(parent);
  if (issuer) EVP_PKEY_free(parent_key);
  X509_free(certificate);
  EVP_PKEY_free(key);
  return pair;
}

Pair Certificates::self_signed(const std::string& name) {
  return make(named(name), nullptr);
}

const std::string& Certificates::authority() {
  if (authority_.certificate.empty())
    authority_ = make(named("Authority", "critical,CA:TRUE"), nullptr);
  return authority_.certificate;
}

Pair Certificates::of_client(const std::string& name) {
  return of_client(named(name));
}

Pair Certificates::of_client(const Wording& wording) {
  authority();
  return make(wording, &authority_);
}

Pair Certificates::signed_by(const Pair& issuer, const Wording& wording) {
  return make(wording, &issuer);
}

std::string Certificates::revoked_by(const Pair& issuer, const std::vector<Pair>& revoked,
                                     long ends) {
  X509* const parent = read_certificate(issuer.certificate);
  EVP_PKEY* const key = read_key(issuer.key);
  X509_CRL* const list = X509_CRL_new();
  ASN1_TIME* const now = X509_gmtime_adj(nullptr, std::min(ends, 0L) - 60);
  ASN1_TIME* const next = X509_gmtime_adj(nullptr, ends);
  must(parent && key && list && now && next);
  must(X509_CRL_set_version(list, X509_CRL_VERSION_2) == 1 &&
       X509_CRL_set_issuer_name(list, X509_get_subject_name(parent)) == 1 &&
       X509_CRL_set1_lastUpdate(list, now) == 1 && X509_CRL_set1_nextUpdate(list, next) == 1);
  for (const Pair& pair : revoked) {
    X509* const certificate = read_certificate(pair.certificate);
    X509_REVOKED* const entry = X509_REVOKED_new();
    must(X509_REVOKED_set_serialNumber(entry, X509_get_serialNumber(certificate)) == 1 &&
         X509_REVOKED_set_revocationDate(entry, now) == 1 &&
         X509_CRL_add0_revoked(list, entry) == 1);
    X509_free(certificate);
  }
  must(X509_CRL_sort(list) == 1 && X509_CRL_sign(list, key, EVP_sha256()) > 0);
  const std::string file = path("list" + std::to_string(++made_));
  must(PEM_write_X509_CRL(open_file(file, "w").get(), list) == 1);
  ASN1_TIME_free(now);
  ASN1_TIME_free(next);
  X509_CRL_free(list);
  EVP_PKEY_free(key);
  X509_free(parent);
  return orv::test::content_of(file);
}

// ---- the client

TlsClient::~TlsClient() {
  SSL_free(ssl_);
  SSL_CTX_free(context_);
}

bool TlsClient::shake_hands(const TlsWish& wish) {
  context_ = SSL_CTX_new(TLS_client_method());
  must(context_ != nullptr);
  SSL_CTX_set_security_level(context_, 0);
  SSL_CTX_set_min_proto_version(context_, wish.oldest);
  SSL_CTX_set_max_proto_version(context_, wish.newest);
  if (!wish.suites.empty()) must(SSL_CTX_set_cipher_list(context_, wish.suites.c_str()) == 1);
  if (wish.own) {
    must(SSL_CTX_use_certificate_file(context_, wish.own->certificate.c_str(), SSL_FILETYPE_PEM) ==
         1);
    must(SSL_CTX_use_PrivateKey_file(context_, wish.own->key.c_str(), SSL_FILETYPE_PEM) == 1);
  }
  const timeval patience{kPatienceSeconds, 0};
  ::setsockopt(socket_, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  ssl_ = SSL_new(context_);
  must(ssl_ && SSL_set_fd(ssl_, socket_) == 1);
  if (wish.session) must(SSL_set_session(ssl_, wish.session) == 1);
  const bool done = SSL_connect(ssl_) == 1;
  ERR_clear_error();
  return done;
}

void TlsClient::send(std::string_view bytes) {
  if (!ssl_) return WireClient::send(bytes);
  if (!bytes.empty()) SSL_write(ssl_, bytes.data(), static_cast<int>(bytes.size()));
  ERR_clear_error();
}

bool TlsClient::fill() {
  if (!ssl_) return WireClient::fill();
  char bytes[65536];
  const int length = SSL_read(ssl_, bytes, sizeof bytes);
  ERR_clear_error();
  if (length <= 0) return false;
  received_.append(bytes, static_cast<std::size_t>(length));
  return true;
}

bool TlsClient::closed() {
  if (!ssl_) return WireClient::closed();
  char byte;
  const int length = SSL_read(ssl_, &byte, 1);
  const int error = SSL_get_error(ssl_, length);
  ERR_clear_error();
  return length <= 0 && error != SSL_ERROR_WANT_READ;
}

std::string TlsClient::peer_name() const {
  X509* const certificate = SSL_get1_peer_certificate(ssl_);
  if (!certificate) return "";
  char name[128] = {};
  X509_NAME_get_text_by_NID(X509_get_subject_name(certificate), NID_commonName, name, sizeof name);
  X509_free(certificate);
  return name;
}

}  // namespace orv::server::test
