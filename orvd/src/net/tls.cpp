#include "net/tls.h"

#include <lber.h>
#include <ldap.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>

#include <new>
#include <utility>

#include "cfg/dn.h"
#include "cfg/openssl_owners.h"
#include "net/pem.h"

namespace orv::server {
namespace {

// Of TLS 1.2; those of 1.3 are all of this kind.
constexpr const char* kSuites = "ECDHE+AESGCM:ECDHE+CHACHA20";
constexpr const char* kGroups = "X25519:P-256:P-384";
// 112 bits at least: RSA from 2048 bits on, no SHA-1 signatures.
constexpr int kSecurityLevel = 2;
// Of the socket, in search of data, before others have their turn: two for each record. Nobody
// needs more than a few records without data in a row (new keys, padding), and whoever sent them
// without an end would keep the thread to himself: OpenSSL goes on as long as some come.
constexpr int kReadsInSearchOfData = 64;

using Context = std::unique_ptr<SSL_CTX, Releaser<SSL_CTX_free>>;

void set_rules(SSL_CTX* context, const TlsSettings& settings) {
  SSL_CTX_set_security_level(context, kSecurityLevel);
  SSL_CTX_set_min_proto_version(context, settings.tls_1_2 ? TLS1_2_VERSION : TLS1_3_VERSION);
  SSL_CTX_set_options(context, SSL_OP_NO_RENEGOTIATION | SSL_OP_NO_COMPRESSION |
                                   SSL_OP_CIPHER_SERVER_PREFERENCE | SSL_OP_PRIORITIZE_CHACHA |
                                   SSL_OP_NO_TICKET | SSL_OP_CLEANSE_PLAINTEXT);
  SSL_CTX_set_session_cache_mode(context, SSL_SESS_CACHE_OFF);
  SSL_CTX_set_num_tickets(context, 0);
  SSL_CTX_set_mode(context, SSL_MODE_ENABLE_PARTIAL_WRITE | SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER |
                                SSL_MODE_RELEASE_BUFFERS);
  SSL_CTX_set_default_passwd_cb(context, no_passphrase);
}

// The server's own certificate, and behind it those up to the authority.
bool use_certificates(SSL_CTX* context, BIO* from) {
  const Certificate own(PEM_read_bio_X509_AUX(from, nullptr, no_passphrase, nullptr));
  if (!own || SSL_CTX_use_certificate(context, own.get()) != 1) return false;
  for (;;) {
    Certificate next(PEM_read_bio_X509(from, nullptr, no_passphrase, nullptr));
    if (!next) break;
    if (SSL_CTX_add0_chain_cert(context, next.get()) != 1) return false;
    static_cast<void>(next.release());
  }
  if (ERR_GET_REASON(ERR_peek_last_error()) != PEM_R_NO_START_LINE) return false;
  ERR_clear_error();  // that is how the end of the file is told
  return true;
}

bool load_own(SSL_CTX* context, const TlsSettings& settings, std::string& error) {
  const std::string& certificate = settings.certificate_file;
  const std::string& key = settings.key_file.empty() ? certificate : settings.key_file;
  PemText certificates;
  PemText keys;
  if (!certificates.read(certificate, PemText::Holds::certificates, PemText::kMostOfCertificates,
                         error) ||
      !keys.read(key, PemText::Holds::key, PemText::kMostOfCertificates, error))
    return false;
  const Bio of_certificates = certificates.bio();
  if (!of_certificates || !use_certificates(context, of_certificates.get()))
    return fail(error, certificate, "no usable certificate");
  const Bio of_keys = keys.bio();
  const PrivateKey used(
      of_keys ? PEM_read_bio_PrivateKey(of_keys.get(), nullptr, no_passphrase, nullptr) : nullptr);
  if (!used) return fail(error, key, "no usable private key");
  if (SSL_CTX_use_PrivateKey(context, used.get()) != 1 || SSL_CTX_check_private_key(context) != 1)
    return fail(error, key, "not the key of the certificate in " + certificate);
  return true;
}

// The DN as LDAP writes it; "" when it has none.
std::string ldap_name(const X509_NAME* name) {
  unsigned char* encoded = nullptr;
  const int length = i2d_X509_NAME(name, &encoded);
  if (length < 0) throw std::bad_alloc();
  berval der{static_cast<ber_len_t>(length), reinterpret_cast<char*>(encoded)};
  berval text{};
  const int code = ldap_X509dn2bv(&der, &text, nullptr, 0);
  OPENSSL_free(encoded);
  std::string dn;
  if (code == LDAP_SUCCESS && text.bv_val) dn.assign(text.bv_val, text.bv_len);
  ber_memfree(text.bv_val);
  if (code == LDAP_NO_MEMORY) throw std::bad_alloc();
  return dn;
}

std::string normal_name(const X509_NAME* name) {
  std::string normal;
  if (cfg::normalize_dn(ldap_name(name), normal) != 0) normal.clear();
  return normal;
}

std::string time_text(const ASN1_TIME* time) {
  const Bio memory(BIO_new(BIO_s_mem()));
  char buffer[64];
  if (!memory || ASN1_TIME_print(memory.get(), time) != 1) return "?";
  const int length = BIO_read(memory.get(), buffer, sizeof buffer);
  return std::string(buffer, length > 0 ? static_cast<std::size_t>(length) : 0);
}

// RFC 5929, 4.1: the hash of the certificate's own signature, SHA-256 in place of weaker ones.
std::string end_point_of(const X509* certificate) {
  int digest = NID_undef;
  if (X509_get_signature_info(const_cast<X509*>(certificate), &digest, nullptr, nullptr, nullptr) !=
          1 ||
      digest == NID_undef || digest == NID_md5 || digest == NID_sha1)
    digest = NID_sha256;
  unsigned char hash[EVP_MAX_MD_SIZE];
  unsigned int size = 0;
  if (X509_digest(certificate, EVP_get_digestbynid(digest), hash, &size) != 1) size = 0;
  return {reinterpret_cast<const char*>(hash), size};
}

}  // namespace

// ---- what connections share

TlsContext::~TlsContext() {
  SSL_CTX_free(context_);
}

std::shared_ptr<const TlsContext> TlsContext::load(const TlsSettings& settings, std::string& error,
                                                   uid_t user) {
  ERR_clear_error();
  Context made(SSL_CTX_new(TLS_server_method()));
  if (!made) throw std::bad_alloc();
  set_rules(made.get(), settings);
  if (SSL_CTX_set_cipher_list(made.get(), kSuites) != 1 ||
      SSL_CTX_set1_groups_list(made.get(), kGroups) != 1) {
    error = "OpenSSL does not know the suites: " + queued_error();
    return nullptr;
  }
  Trust trust;
  if (!load_own(made.get(), settings, error) ||
      !load_trust(made.get(), settings, user, trust, error))
    return nullptr;
  const std::shared_ptr<TlsContext> context(new TlsContext(made.release()));
  context->trust_ = std::move(trust);
  const X509* const certificate = SSL_CTX_get0_certificate(context->context_);
  context->end_point_ = end_point_of(certificate);
  context->description_ = ldap_name(X509_get_subject_name(certificate)) + ", good until " +
                          time_text(X509_get0_notAfter(certificate));
  context->good_until_ = seconds_of(X509_get0_notAfter(certificate));
  ERR_clear_error();
  return context;
}

// ---- one connection

TlsStream::TlsStream(std::shared_ptr<const TlsContext> context, int socket)
    : context_(std::move(context)), ssl_(SSL_new(context_->get())) {
  if (!ssl_) throw std::bad_alloc();
  if (SSL_set_fd(ssl_, socket) != 1) {
    SSL_free(ssl_);
    throw std::bad_alloc();
  }
  BIO* const bio = SSL_get_rbio(ssl_);
  BIO_set_callback_ex(bio, before_or_after_socket);
  BIO_set_callback_arg(bio, reinterpret_cast<char*>(this));
  SSL_set_accept_state(ssl_);
}

TlsStream::~TlsStream() {
  SSL_free(ssl_);
}

// Called by OpenSSL around everything it does with the socket; what is not positive forbids it.
long TlsStream::before_or_after_socket(BIO* bio, int operation, const char*, std::size_t, int, long,
                                       int result, std::size_t*) {
  if (operation != BIO_CB_READ) return result;
  auto* const stream = reinterpret_cast<TlsStream*>(BIO_get_callback_arg(bio));
  if (!SSL_is_init_finished(stream->ssl_) || stream->spend_read()) return result;
  BIO_clear_retry_flags(bio);
  return -1;
}

bool TlsStream::spend_read() noexcept {
  return reads_left_-- > 0;
}

Flow TlsStream::outcome(int returned) {
  if (returned > 0) return Flow::moved;
  switch (SSL_get_error(ssl_, returned)) {
    case SSL_ERROR_WANT_READ:
      return Flow::needs_input;
    case SSL_ERROR_WANT_WRITE:
      return Flow::needs_output;
    case SSL_ERROR_ZERO_RETURN:
      return Flow::ended;
    default:
      broken_ = true;
      failure_ = queued_error();
      if (failure_.empty() && reads_left_ < 0) failure_ = "too many records without data";
      return Flow::failed;
  }
}

Flow TlsStream::shake_hands() {
  ERR_clear_error();
  const Flow flow = outcome(SSL_do_handshake(ssl_));
  if (flow == Flow::moved && shows_certificate()) {
    trust_ = context_->trust();
    judgement_ = judged_in_handshake(ssl_);
  }
  return flow;
}

bool TlsStream::shows_certificate() const noexcept {
  return SSL_get0_peer_certificate(ssl_) != nullptr;
}

std::string TlsStream::certificate_problem(const TlsContext* in_force, std::time_t now) {
  if (!shows_certificate()) return "";
  if (!in_force || in_force->trust().empty()) return "certificates are not asked for any more";
  if (trust_ != in_force->trust()) {
    judgement_ = judge_client(in_force->get(), ssl_, now);
    trust_ = in_force->trust();
  }
  if (!judgement_.problem.empty()) return judgement_.problem;
  return now > judgement_.good_until ? "certificate has expired" : "";
}

Flow TlsStream::read(char* to, std::size_t room, std::size_t& length) {
  ERR_clear_error();
  length = 0;
  reads_left_ = kReadsInSearchOfData;
  return outcome(SSL_read_ex(ssl_, to, room, &length));
}

Flow TlsStream::write(const char* from, std::size_t size, std::size_t& length) {
  ERR_clear_error();
  length = 0;
  return outcome(SSL_write_ex(ssl_, from, size, &length));
}

Flow TlsStream::peek(char* to, std::size_t room, std::size_t& length) {
  ERR_clear_error();
  length = 0;
  reads_left_ = kReadsInSearchOfData;
  return outcome(SSL_peek_ex(ssl_, to, room, &length));
}

bool TlsStream::has_more() const noexcept {
  return SSL_pending(ssl_) > 0;
}

bool TlsStream::has_part_of_record() const noexcept {
  return SSL_pending(ssl_) == 0 && SSL_has_pending(ssl_) == 1;
}

void TlsStream::say_goodbye() noexcept {
  if (broken_ || !SSL_is_init_finished(ssl_)) return;
  ERR_clear_error();
  SSL_shutdown(ssl_);
  ERR_clear_error();
}

void TlsStream::describe(TransportFacts& facts) const {
  facts.tls_version = SSL_get_version(ssl_);
  facts.tls_cipher = SSL_get_cipher_name(ssl_);
  facts.tls_strength = SSL_get_cipher_bits(ssl_, nullptr);
  facts.server_end_point = context_->end_point();
  facts.certificate_subject.clear();
  const Certificate certificate(SSL_get1_peer_certificate(ssl_));
  if (certificate && SSL_get_verify_result(ssl_) == X509_V_OK)
    facts.certificate_subject = normal_name(X509_get_subject_name(certificate.get()));
}

}  // namespace orv::server
