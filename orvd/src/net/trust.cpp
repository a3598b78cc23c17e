#include "net/trust.h"

#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <openssl/x509_vfy.h>

#include <algorithm>
#include <limits>
#include <memory>
#include <new>
#include <string_view>

#include "cfg/openssl_owners.h"
#include "net/pem.h"
#include "slapi/file_trust.h"

namespace orv::server {
namespace {

// Certificates between a client's own and the authority.
constexpr int kChainDepth = 8;

struct InfosReleaser {
  void operator()(STACK_OF(X509_INFO) * infos) const noexcept {
    sk_X509_INFO_pop_free(infos, X509_INFO_free);
  }
};
struct ObjectsReleaser {
  void operator()(STACK_OF(X509) * objects) const noexcept { sk_X509_pop_free(objects, X509_free); }
};
using Objects = std::unique_ptr<STACK_OF(X509), ObjectsReleaser>;
using RevocationList = std::unique_ptr<X509_CRL, Releaser<X509_CRL_free>>;
using Infos = std::unique_ptr<STACK_OF(X509_INFO), InfosReleaser>;
using Verification = std::unique_ptr<X509_STORE_CTX, Releaser<X509_STORE_CTX_free>>;

std::string hash_of(std::string_view text) {
  unsigned char hash[EVP_MAX_MD_SIZE];
  unsigned int size = 0;
  if (EVP_Digest(text.data(), text.size(), hash, &size, EVP_sha256(), nullptr) != 1)
    throw std::bad_alloc();
  return {reinterpret_cast<const char*>(hash), size};
}

// Also names them to clients. False when there is none, or something that is damaged.
bool add_authorities(SSL_CTX* context, BIO* from) {
  const Infos infos(PEM_X509_INFO_read_bio(from, nullptr, no_passphrase, nullptr));
  if (!infos) return false;
  int added = 0;
  for (int i = 0; i < sk_X509_INFO_num(infos.get()); ++i) {
    X509* const authority = sk_X509_INFO_value(infos.get(), i)->x509;
    if (!authority) continue;
    if (X509_STORE_add_cert(SSL_CTX_get_cert_store(context), authority) != 1 ||
        SSL_CTX_add_client_CA(context, authority) != 1)
      return false;
    ++added;
  }
  return added > 0;
}

// A list that bears the name of an authority of the file is signed by it; others may be of
// authorities that clients send along, and are looked at when they do.
bool is_plausible(SSL_CTX* context, X509_CRL* list) {
  const Objects known(X509_STORE_get1_all_certs(SSL_CTX_get_cert_store(context)));
  bool named = false;
  for (int i = 0; i < sk_X509_num(known.get()); ++i) {
    X509* const authority = sk_X509_value(known.get(), i);
    if (X509_NAME_cmp(X509_get_subject_name(authority), X509_CRL_get_issuer(list)) != 0) continue;
    named = true;
    if (X509_CRL_verify(list, X509_get0_pubkey(authority)) == 1) return true;
  }
  ERR_clear_error();
  return !named;
}

// What happened to the lists of a file.
enum class Lists { added, damaged, forged };

Lists add_revocations(SSL_CTX* context, BIO* from, std::time_t& good_until) {
  int added = 0;
  for (;; ++added) {
    const RevocationList list(PEM_read_bio_X509_CRL(from, nullptr, no_passphrase, nullptr));
    if (!list) break;
    if (!is_plausible(context, list.get())) return Lists::forged;
    if (X509_STORE_add_crl(SSL_CTX_get_cert_store(context), list.get()) != 1) return Lists::damaged;
    if (const ASN1_TIME* const next = X509_CRL_get0_nextUpdate(list.get()))
      good_until = std::min(good_until, seconds_of(next));
  }
  if (added == 0 || ERR_GET_REASON(ERR_peek_last_error()) != PEM_R_NO_START_LINE)
    return Lists::damaged;
  ERR_clear_error();  // that is how the end of the file is told
  return Lists::added;
}

// Whoever can change the file could let himself in.
bool read_trusted(const std::string& file, uid_t user, off_t most, PemText& text,
                  std::string& error) {
  if (!text.read(file, PemText::Holds::certificates, most, error)) return false;
  error = distrust_of_authority(file, user);
  return error.empty();
}

// From now on each authority up to the root must have said what it has revoked.
bool load_revocations(SSL_CTX* context, const std::string& file, uid_t user, Trust& trust,
                      std::string& error) {
  PemText text;
  if (!read_trusted(file, user, PemText::kMostOfRevocations, text, error)) return false;
  const Bio bio = text.bio();
  if (!bio) throw std::bad_alloc();
  switch (add_revocations(context, bio.get(), trust.revocations_good_until)) {
    case Lists::damaged:
      return fail(error, file, "no usable list of revoked certificates");
    case Lists::forged:
      return fail(error, file, "a list of revoked certificates is not signed by its authority");
    case Lists::added:
      break;
  }
  X509_VERIFY_PARAM_set_flags(SSL_CTX_get0_param(context),
                              X509_V_FLAG_CRL_CHECK | X509_V_FLAG_CRL_CHECK_ALL);
  trust.name += hash_of(text.text());
  return true;
}

bool load_authorities(SSL_CTX* context, const std::string& file, uid_t user, Trust& trust,
                      std::string& error) {
  PemText text;
  if (!read_trusted(file, user, PemText::kMostOfAuthorities, text, error)) return false;
  const Bio bio = text.bio();
  if (!bio || !add_authorities(context, bio.get()))
    return fail(error, file, "no usable certificates");
  trust.name += hash_of(text.text());
  return true;
}

std::time_t first_end(const STACK_OF(X509) * chain) {
  std::time_t end = std::numeric_limits<std::time_t>::max();
  for (int i = 0; i < sk_X509_num(chain); ++i)
    end = std::min(end, seconds_of(X509_get0_notAfter(sk_X509_value(chain, i))));
  return end;
}

}  // namespace

bool load_trust(SSL_CTX* context, const TlsSettings& settings, uid_t user, Trust& trust,
                std::string& error) {
  if (settings.client_certificates == ClientCertificates::none) return true;
  if (settings.ca_file.empty()) {
    error =
        "clients' certificates are asked for, but orv-slapdTlsCaFile does not say who signs them";
    return false;
  }
  if (!load_authorities(context, settings.ca_file, user, trust, error)) return false;
  if (!settings.crl_file.empty() &&
      !load_revocations(context, settings.crl_file, user, trust, error))
    return false;
  const bool required = settings.client_certificates == ClientCertificates::required;
  SSL_CTX_set_verify(context, SSL_VERIFY_PEER | (required ? SSL_VERIFY_FAIL_IF_NO_PEER_CERT : 0),
                     nullptr);
  SSL_CTX_set_verify_depth(context, kChainDepth);
  return true;
}

// Follows what OpenSSL does in a handshake.
Judgement judge_client(SSL_CTX* context, SSL* connection, std::time_t now) {
  const Certificate shown(SSL_get1_peer_certificate(connection));
  const Verification verification(X509_STORE_CTX_new());
  if (!shown || !verification ||
      X509_STORE_CTX_init(verification.get(), SSL_CTX_get_cert_store(context), shown.get(),
                          SSL_get_peer_cert_chain(connection)) != 1)
    throw std::bad_alloc();
  X509_VERIFY_PARAM* const rules = X509_STORE_CTX_get0_param(verification.get());
  X509_VERIFY_PARAM_set_auth_level(rules, SSL_CTX_get_security_level(context));
  X509_STORE_CTX_set_default(verification.get(), "ssl_client");
  X509_VERIFY_PARAM_set1(rules, SSL_CTX_get0_param(context));
  X509_VERIFY_PARAM_set_time(rules, now);
  const bool good = X509_verify_cert(verification.get()) == 1;
  ERR_clear_error();
  const int why = X509_STORE_CTX_get_error(verification.get());
  if (!good && why == X509_V_ERR_OUT_OF_MEM) throw std::bad_alloc();
  Judgement judgement;
  if (good)
    judgement.good_until = first_end(X509_STORE_CTX_get0_chain(verification.get()));
  else
    judgement.problem = X509_verify_cert_error_string(why);
  return judgement;
}

Judgement judged_in_handshake(const SSL* connection) {
  Judgement judgement;
  judgement.good_until = first_end(SSL_get0_verified_chain(connection));
  return judgement;
}

}  // namespace orv::server
