#include "auth/sasl_external.h"

#include <unistd.h>

#include <utility>

namespace orv::server {
namespace {

constexpr std::string_view kNobody = "the connection proves no identity of this server";
constexpr std::string_view kNobodyElse = "only the own identity can be assumed";

bool is_local_administrator(const TransportFacts& transport) noexcept {
  return transport.peer_uid && (*transport.peer_uid == 0 || *transport.peer_uid == ::geteuid());
}

class ExternalExchange final : public SaslExchange {
 public:
  ExternalExchange(ExternalIdentities& identities, const TransportFacts& transport)
      : identities_(identities), transport_(transport) {}

  SaslOutcome step(std::optional<std::string_view> credentials) override {
    SaslOutcome outcome;
    // Without an initial response the client is asked for one.
    if (!credentials && !std::exchange(asked_, true)) {
      outcome.state = SaslOutcome::State::go_on;
      outcome.reply.emplace();
      return outcome;
    }
    std::shared_ptr<const Identity> identity = find();
    if (!identity)
      outcome.text = kNobody;
    else if (!may_act_as(*identity, "", credentials.value_or("")))
      outcome.text = kNobodyElse;
    else
      outcome.state = SaslOutcome::State::done;
    if (outcome.state == SaslOutcome::State::done) outcome.identity = std::move(identity);
    return outcome;
  }

 private:
  std::shared_ptr<const Identity> find() {
    if (is_local_administrator(transport_)) return identities_.primary_administrator();
    if (transport_.certificate_subject.empty()) return nullptr;
    return identities_.of_certificate(transport_.certificate_subject);
  }

  ExternalIdentities& identities_;
  const TransportFacts& transport_;
  bool asked_ = false;
};

class External final : public SaslMechanism {
 public:
  explicit External(ExternalIdentities& identities) : identities_(identities) {}

  std::string_view name() const noexcept override { return "EXTERNAL"; }
  bool offered(const TransportFacts& transport) const override {
    return is_local_administrator(transport) ||
           (!transport.certificate_subject.empty() && identities_.maps_certificates());
  }
  std::unique_ptr<SaslExchange> start(const TransportFacts& transport) const override {
    return std::make_unique<ExternalExchange>(identities_, transport);
  }

 private:
  ExternalIdentities& identities_;
};

}  // namespace

std::unique_ptr<const SaslMechanism> make_external(ExternalIdentities& identities) {
  return std::make_unique<External>(identities);
}

}  // namespace orv::server
