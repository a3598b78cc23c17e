#include "auth/sasl_cyrus.h"

#include <openssl/rand.h>
#include <sasl/sasl.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <new>
#include <optional>
#include <utility>

#include "auth/digest_response.h"
#include "auth/kerberos.h"
#include "auth/sasl_callbacks.h"
#include "auth/sasl_frames.h"
#include "auth/sasl_memory.h"
#include "cfg/secret.h"

namespace orv::server {
namespace {

constexpr std::string_view kGssapi = "GSSAPI";
constexpr std::string_view kScram = "SCRAM-SHA-256";
constexpr std::string_view kDigest = "DIGEST-MD5";

constexpr const char* kService = "ldap";
// The longest of one message of a client's: a ticket may hold many groups.
constexpr std::size_t kLongestCredentials = 65536;
// More steps than any of the mechanisms takes.
constexpr int kMostSteps = 16;
// The longest frame of a layer, and the shortest that a client may ask for: shorter ones would make
// an answer many times as long.
constexpr unsigned kLongestFrame = 65536;
constexpr unsigned kShortestFrame = 1024;
// Bits; ciphers of less are broken. 1 is integrity alone.
constexpr sasl_ssf_t kIntegrity = 1;
constexpr sasl_ssf_t kWeakestCipher = 112;
constexpr sasl_ssf_t kStrongest = 256;
// What clients, too, take the strength of a Unix socket for.
constexpr sasl_ssf_t kLocalStrength = 71;

constexpr std::string_view kNobodyElse = "only the own identity can be assumed";
constexpr std::string_view kWeakLayer = "the cipher of the security layer is too weak";
constexpr std::string_view kSmallFrames = "the frames of the security layer are too small";

// Nobody proves to know this one.
void make_unknown_password(std::string& password) {
  std::array<unsigned char, 24> random{};
  if (RAND_bytes(random.data(), static_cast<int>(random.size())) != 1) throw std::bad_alloc();
  password.reserve(2 * random.size());
  for (const unsigned char byte : random) {
    password += static_cast<char>('A' + (byte & 0x0F));
    password += static_cast<char>('A' + (byte >> 4));
  }
  cfg::wipe(random.data(), random.size());
}

std::string host_name() {
  std::array<char, 256> name{};
  const bool known = gethostname(name.data(), name.size() - 1) == 0 && name.front() != '\0';
  return known ? name.data() : "localhost";
}

struct ConnectionDeleter {
  void operator()(sasl_conn_t* connection) const noexcept { sasl_dispose(&connection); }
};
using Connection = std::unique_ptr<sasl_conn_t, ConnectionDeleter>;

// The code of the library for want of memory in what it called.
template <typename Work>
int guarded(Work work) noexcept {
  try {
    work();
    return SASL_OK;
  } catch (...) {
    return SASL_NOMEM;
  }
}

}  // namespace

// What exchanges go by from their start on.
struct CyrusSasl::State {
  SaslSettings settings;
  std::string host = host_name();
  std::shared_ptr<const KerberosAcceptor> acceptor;  // null: no Kerberos

  bool allows(std::string_view mechanism) const {
    const std::vector<std::string>& allowed = settings.mechanisms;
    return allowed.empty() || std::find(allowed.begin(), allowed.end(), mechanism) != allowed.end();
  }
};

namespace {

// ---- One exchange, in the library

// With what an exchange begins.
struct Opening {
  std::string host;
  std::string realm;  // "": the host's name
  sasl_ssf_t external;
  std::shared_ptr<const KerberosAcceptor> acceptor;
  sasl_ssf_t strongest;  // layer, where nothing else protects the connection
  bool by_password;      // the name that is claimed is a user's, and to be proved with the password
};

// What the library knows of an exchange, and what its callbacks found out. A security layer goes on
// using it when the exchange is done.
class Exchange final : public SaslClaimant {
 public:
  Exchange(SaslIdentities& identities, Opening opening)
      : identities_(identities), opening_(std::move(opening)), callbacks_(callbacks_of(*this)) {}
  ~Exchange() override { forget_password(); }
  Exchange(const Exchange&) = delete;
  Exchange& operator=(const Exchange&) = delete;

  int open() {
    const sasl_ssf_t external = opening_.external;
    sasl_conn_t* made = nullptr;
    int code = sasl_server_new(kService, opening_.host.c_str(),
                               opening_.realm.empty() ? nullptr : opening_.realm.c_str(), nullptr,
                               nullptr, callbacks_.data(), SASL_SUCCESS_DATA, &made);
    connection_.reset(made);
    // What is protected already needs no layer.
    sasl_security_properties_t wanted{};
    wanted.max_ssf = external > 0 ? external : opening_.strongest;
    wanted.maxbufsize = kLongestFrame;
    wanted.security_flags = SASL_SEC_NOANONYMOUS | SASL_SEC_NOPLAINTEXT;
    if (code == SASL_OK) code = sasl_setprop(made, SASL_SSF_EXTERNAL, &external);
    if (code == SASL_OK) code = sasl_setprop(made, SASL_SEC_PROPS, &wanted);
    if (code == SASL_OK && opening_.acceptor)
      code = sasl_setprop(made, SASL_GSS_CREDS, opening_.acceptor->credentials());
    return code;
  }

  // ---- What the callbacks tell

  int claim_name(std::string_view name) noexcept override {
    return guarded([&] {
      name_ = name;
      if (by_password()) find_user();
    });
  }
  int claim_authorization(std::string_view authorization_id) noexcept override {
    return guarded([&] { authorization_id_ = authorization_id; });
  }
  const char* password() const noexcept override { return password_.c_str(); }

  // The library has its own copy, for as long as it needs it, and gives that up as well.
  void forget_password() noexcept {
    cfg::wipe(password_);
    propctx* const properties = connection_ ? sasl_auxprop_getctx(connection_.get()) : nullptr;
    if (properties) prop_erase(properties, kPasswordProperty);
  }

  // ---- What was found

  bool by_password() const noexcept { return opening_.by_password; }
  sasl_conn_t* connection() const noexcept { return connection_.get(); }
  const std::string& name() const noexcept { return name_; }
  const std::string& authorization_id() const noexcept { return authorization_id_; }
  // By user name; null: it is nobody's.
  const std::shared_ptr<const Identity>& user() const noexcept { return user_; }

 private:
  void find_user() {
    cfg::wipe(password_);
    user_ = identities_.of_user(name_, password_);
    if (user_ && !password_.empty()) return;
    user_.reset();
    make_unknown_password(password_);
  }

  SaslIdentities& identities_;
  const Opening opening_;
  const SaslCallbacks callbacks_;
  Connection connection_;
  std::string name_;
  std::string authorization_id_;
  std::string password_;
  std::shared_ptr<const Identity> user_;
};

// ---- What an exchange negotiated

class CyrusLayer final : public SecurityLayer {
 public:
  CyrusLayer(std::shared_ptr<Exchange> exchange, unsigned longest)
      : exchange_(std::move(exchange)), longest_(std::min(longest, kLongestFrame)) {}

  bool wrap(std::string_view clear, std::string& wire) override {
    return convert(sasl_encode, clear, wire);
  }
  bool unwrap(std::string_view wire, std::string& clear) override {
    frames_.pass(wire);
    return convert(sasl_decode, wire, clear);
  }
  bool has_part() const noexcept override { return frames_.has_part(); }

 private:
  // The library's buffer, until its next call. Passwords would stay in it for as long as nothing
  // longer follows; what it keeps beside it is wiped with the connection only.
  static void take_from(const char* converted, unsigned length, std::string& to) {
    struct Wiper {
      ~Wiper() { cfg::wipe(const_cast<char*>(from), length); }
      const char* from;
      unsigned length;
    } const wiper{converted, length};
    append_wiping(to, {converted, length});
  }

  // What outgrows its place leaves nothing there.
  static void append_wiping(std::string& to, std::string_view more) {
    if (to.capacity() - to.size() < more.size()) {
      std::string larger;
      larger.reserve(std::max(2 * to.size(), to.size() + more.size()));
      larger += to;
      to.swap(larger);
      cfg::wipe(larger);
    }
    to += more;
  }

  template <typename Convert>
  bool convert(Convert function, std::string_view from, std::string& to) {
    while (!from.empty()) {
      const std::string_view part = from.substr(0, longest_);
      const char* converted = nullptr;
      unsigned length = 0;
      sasl_lacked_memory();
      const int code = function(exchange_->connection(), part.data(),
                                static_cast<unsigned>(part.size()), &converted, &length);
      if (code == SASL_NOMEM || sasl_lacked_memory()) throw std::bad_alloc();
      if (code != SASL_OK) return false;
      if (length > 0) take_from(converted, length, to);
      from.remove_prefix(part.size());
    }
    return true;
  }

  const std::shared_ptr<Exchange> exchange_;
  const unsigned longest_;
  SaslFrames frames_;  // from the client
};

// ---- One exchange, as the protocol engine sees it

class CyrusExchange final : public SaslExchange {
 public:
  CyrusExchange(std::string_view mechanism, Opening opening, SaslIdentities& identities,
                const SaslReport& report)
      : mechanism_(mechanism),
        exchange_(std::make_shared<Exchange>(identities, std::move(opening))),
        identities_(identities),
        report_(report) {}

  SaslOutcome step(std::optional<std::string_view> credentials) override {
    SaslOutcome outcome;
    const char* reply = nullptr;
    unsigned length = 0;
    sasl_lacked_memory();
    const int code = take(credentials, reply, length);
    exchange_->forget_password();
    outcome.name = exchange_->name();
    if (code == SASL_NOMEM || sasl_lacked_memory()) throw std::bad_alloc();
    if (code == SASL_OK || code == SASL_CONTINUE) {
      if (reply) outcome.reply.emplace(reply, length);
      outcome.state = SaslOutcome::State::go_on;
      if (code == SASL_OK) finish(outcome);
    } else {
      report(code);
      settle(false);
    }
    return outcome;
  }

 private:
  int take(std::optional<std::string_view> credentials, const char*& reply, unsigned& length) {
    if (++steps_ > kMostSteps) return SASL_BADPROT;
    if (credentials && credentials->size() > kLongestCredentials) return SASL_BADPROT;
    if (steps_ == 1 && insists_on_channel_binding(credentials)) return SASL_BADPROT;
    if (steps_ > 1 && mechanism_ == kDigest && !is_digest_response(credentials.value_or("")))
      return SASL_BADPROT;
    // Some mechanisms read their input as a text that ends.
    struct Copy {
      ~Copy() { cfg::wipe(text); }
      std::string text;
    } copy{std::string(credentials.value_or(""))};
    const auto size = static_cast<unsigned>(copy.text.size());
    sasl_conn_t* const connection = exchange_->connection();
    if (connection) return sasl_server_step(connection, copy.text.c_str(), size, &reply, &length);
    const int code = exchange_->open();
    if (code != SASL_OK) return code;
    return sasl_server_start(exchange_->connection(), mechanism_.c_str(),
                             credentials ? copy.text.c_str() : nullptr, size, &reply, &length);
  }

  // RFC 5802, 6: what such a client proves about the channel, nobody would look at.
  bool insists_on_channel_binding(std::optional<std::string_view> credentials) const noexcept {
    return mechanism_ == kScram && credentials && credentials->starts_with('p');
  }

  void finish(SaslOutcome& outcome) {
    std::shared_ptr<const Identity> identity = prove(outcome);
    if (may_bind(identity.get(), outcome) && make_layer(outcome)) {
      outcome.state = SaslOutcome::State::done;
      outcome.identity = std::move(identity);
    } else {
      outcome.state = SaslOutcome::State::failed;
      outcome.reply.reset();
    }
  }

  // Also after a proof: an identity that is locked out stays so, and nothing tells which it was.
  bool may_bind(const Identity* identity, SaslOutcome& outcome) {
    if (!identity || !settle(true)) return false;
    if (may_act_as(*identity, outcome.name, exchange_->authorization_id())) return true;
    outcome.text = kNobodyElse;
    return false;
  }

  std::shared_ptr<const Identity> prove(SaslOutcome& outcome) {
    if (exchange_->by_password()) return exchange_->user();
    const std::string principal = full_principal(exchange_->name());
    if (principal.empty()) return nullptr;
    outcome.name = principal;
    return identities_.of_principal(principal);
  }

  // False when what was negotiated is refused.
  bool make_layer(SaslOutcome& outcome) {
    const sasl_ssf_t strength = number(SASL_SSF);
    const unsigned longest = number(SASL_MAXOUTBUF);
    if (strength == 0) return true;
    if (strength != kIntegrity && strength < kWeakestCipher) {
      outcome.code = result::confidentiality_required;
      outcome.text = kWeakLayer;
    } else if (longest < kShortestFrame) {
      outcome.code = result::unwilling_to_perform;
      outcome.text = kSmallFrames;
    } else {
      outcome.layer = std::make_unique<CyrusLayer>(exchange_, longest);
    }
    return outcome.layer != nullptr;
  }

  unsigned number(int property) const noexcept {
    const void* value = nullptr;
    const int code = sasl_getprop(exchange_->connection(), property, &value);
    return code == SASL_OK && value ? *static_cast<const unsigned*>(value) : 0;
  }

  bool settle(bool proved) {
    if (!exchange_->by_password()) return proved;
    return exchange_->user() && identities_.settle(*exchange_->user(), proved);
  }

  void report(int code) const {
    std::string line = "SASL " + mechanism_ + ": ";
    const char* const detail =
        exchange_->connection() ? sasl_errdetail(exchange_->connection()) : nullptr;
    report_(line += detail ? detail : sasl_errstring(code, nullptr, nullptr));
  }

  const std::string mechanism_;
  const std::shared_ptr<Exchange> exchange_;
  SaslIdentities& identities_;
  const SaslReport& report_;
  int steps_ = 0;
};

sasl_ssf_t strength_of(const TransportFacts& transport) noexcept {
  if (transport.local) return kLocalStrength;
  return transport.encrypted() ? static_cast<sasl_ssf_t>(std::max(transport.tls_strength, 1)) : 0;
}

// ---- A mechanism that is offered under a condition

class Conditional final : public SaslMechanism {
 public:
  Conditional(std::function<bool()> allowed, std::unique_ptr<const SaslMechanism> mechanism)
      : allowed_(std::move(allowed)), mechanism_(std::move(mechanism)) {}
  std::string_view name() const noexcept override { return mechanism_->name(); }
  bool offered(const TransportFacts& transport) const override {
    return allowed_() && mechanism_->offered(transport);
  }
  std::unique_ptr<SaslExchange> start(const TransportFacts& transport) const override {
    return mechanism_->start(transport);
  }

 private:
  const std::function<bool()> allowed_;
  const std::unique_ptr<const SaslMechanism> mechanism_;
};

}  // namespace

// ---- The mechanisms

namespace {

constexpr std::string_view kNoPlugin = "its plug-in of the SASL library is missing";

std::shared_ptr<const KerberosAcceptor> accept_kerberos(const SaslLibrary& library,
                                                        const std::string& keytab,
                                                        std::string& error) {
  if (!library.has(kGssapi))
    error = kNoPlugin;
  else if (has_foreign_gssapi())
    error = "the plug-in of the SASL library is not the one for MIT Kerberos";
  else
    return KerberosAcceptor::open(keytab, error);
  return nullptr;
}

}  // namespace

class CyrusMechanism final : public SaslMechanism {
 public:
  CyrusMechanism(const CyrusSasl& sasl, std::string_view name) : sasl_(sasl), name_(name) {}

  std::string_view name() const noexcept override { return name_; }

  bool offered(const TransportFacts&) const override {
    if (!sasl_.library_.has(name_)) return false;
    const auto state = sasl_.state();
    if (!state->allows(name_)) return false;
    if (name_ != kGssapi) return sasl_.identities_.has_users();
    return state->acceptor && sasl_.identities_.has_principals();
  }

  std::unique_ptr<SaslExchange> start(const TransportFacts& transport) const override {
    const auto state = sasl_.state();
    Opening opening{state->host, "", strength_of(transport), nullptr, kStrongest, name_ != kGssapi};
    if (name_ == kDigest) {
      opening.realm = state->settings.digest_realm;
      // Its ciphers are broken, and the library does not give all their memory back.
      opening.strongest = kIntegrity;
    }
    if (name_ == kGssapi) opening.acceptor = state->acceptor;
    return std::make_unique<CyrusExchange>(name_, std::move(opening), sasl_.identities_,
                                           sasl_.report_);
  }

 private:
  const CyrusSasl& sasl_;
  const std::string_view name_;
};

CyrusSasl::CyrusSasl(const SaslLibrary& library, SaslIdentities& identities, SaslReport report)
    : library_(library),
      identities_(identities),
      report_(std::move(report)),
      state_(std::make_shared<State>()) {}

CyrusSasl::~CyrusSasl() = default;

std::vector<std::string> CyrusSasl::configure(const SaslSettings& settings) {
  std::vector<std::string> problems;
  auto fresh = std::make_shared<State>();
  fresh->settings = settings;
  if (!settings.keytab.empty() && fresh->allows(kGssapi)) {
    std::string error;
    fresh->acceptor = accept_kerberos(library_, settings.keytab, error);
    if (!fresh->acceptor) problems.push_back("GSSAPI is not offered: " + error);
  }
  for (const std::string& name : settings.mechanisms)
    if ((name == kScram || name == kDigest) && !library_.has(name))
      problems.push_back(name + " is not offered: " + std::string(kNoPlugin));
  const std::lock_guard lock(mutex_);
  state_ = std::move(fresh);
  return problems;
}

std::shared_ptr<const CyrusSasl::State> CyrusSasl::state() const {
  const std::lock_guard lock(mutex_);
  return state_;
}

bool CyrusSasl::allows(std::string_view mechanism) const {
  return state()->allows(mechanism);
}

void CyrusSasl::add_mechanisms(SaslMechanisms& mechanisms) {
  for (const std::string_view name : {kGssapi, kScram, kDigest})
    mechanisms.push_back(std::make_unique<CyrusMechanism>(*this, name));
}

std::unique_ptr<const SaslMechanism> offer_while(std::function<bool()> allowed,
                                                 std::unique_ptr<const SaslMechanism> mechanism) {
  return std::make_unique<Conditional>(std::move(allowed), std::move(mechanism));
}

}  // namespace orv::server
