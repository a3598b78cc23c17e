// Who the client is: binds by password and by SASL, one step at a time.
#include <asio/post.hpp>
#include <new>
#include <utility>

#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "ops/log_text.h"
#include "ops/request_text.h"
#include "ops/session.h"
#include "ops/wiped_request.h"

namespace orv::server {
namespace {

// Copies, because a moved-from short text still holds its characters.
void take_over(BindRequest& from, BindRequest& to) {
  to.version = from.version;
  to.name = from.name;
  to.simple = from.simple;
  to.mechanism = from.mechanism;
  to.password = from.password;
  to.credentials = from.credentials;
}

}  // namespace

Session::Bind::~Bind() {
  wipe_credentials(request);
}

void Session::receive_bind(std::int32_t id, BindRequest& request, Refusal refusal) {
  auto bind = std::make_shared<Bind>();
  bind->message_id = id;
  take_over(request, bind->request);
  wipe_credentials(request);
  bind->refusal = std::move(refusal);
  // They would stay outstanding for ever, and the bind would wait as long (RFC 4511, 4.2.1). It is
  // not there yet: the end of the last of them would start it, and with luck finish it, in here.
  end_persistent_searches();
  bind_ = std::move(bind);
  try_bind();
}

void Session::try_bind() {
  if (!outstanding_.empty() || bind_->started) return;
  bind_->started = true;
  become(nullptr);
  try {
    start_bind();
  } catch (...) {
    bind_.reset();  // nothing is outstanding on a connection that ends for this
    throw;
  }
}

void Session::start_bind() {
  const BindPtr bind = bind_;  // outlives the answer to it
  const BindRequest& request = bind->request;
  // RFC 4513, 5.2.1: any other bind than one by the same mechanism ends an exchange.
  if (bind->refusal || request.simple ||
      !cfg::equals_ignore_ascii_case(request.mechanism, mechanism_))
    exchange_.reset();
  if (bind_->refusal) return finish_bind(bind_->refusal.code, bind_->refusal.text, nullptr);
  if (request.version != 3)
    return finish_bind(result::protocol_error, "only LDAP version 3 is supported", nullptr);
  if (!request.simple) return start_step();
  std::string normal;
  const Target target = find_target(request.name, normal);
  if (target == Target::not_a_dn)
    return finish_bind(result::invalid_dn_syntax, "the bind name is not a DN", nullptr);
  if (target == Target::root_dse && request.password.empty())
    return finish_bind(result::success, "", nullptr);
  if (request.password.empty())
    return finish_bind(result::unwilling_to_perform, "a name without a password proves nothing",
                       nullptr);
  if (needs_confidentiality())
    return finish_bind(result::confidentiality_required, "passwords need TLS here", nullptr);
  if (target == Target::configuration) return ask_backend_to_bind();
  verify_password();
}

bool Session::needs_confidentiality() const noexcept {
  if (transport_.encrypted()) return false;
  return transport_.local || transport_.loopback ? settings().tls_for_local_passwords
                                                 : settings().tls_for_passwords;
}

// `work` ends by coming back.
template <typename Work>
void Session::on_verifier(Work work) {
  auto job = [self = shared_from_this(), bind = bind_, work] { work(bind); };
  try {
    if (transport_.local && services_.local_verifiers)
      asio::post(*services_.local_verifiers, std::move(job));
    else
      services_.binds.post(counted_as_, std::move(job));
  } catch (const std::bad_alloc&) {
    finish_bind(result::no_memory, "", nullptr);
  }
}

void Session::verify_password() {
  on_verifier([this](const BindPtr& bind) { verify(bind); });
}

// On a worker.
void Session::verify(const BindPtr& bind) noexcept {
  bind->code = result::invalid_credentials;
  bind->generation = services_.authenticator.generation();
  try {
    bind->identity =
        services_.authenticator.authenticate(bind->request.name, bind->request.password);
    if (bind->identity) bind->code = result::success;
  } catch (const std::bad_alloc&) {
    bind->code = result::no_memory;
  } catch (...) {
    bind->code = result::other;
  }
  wipe_credentials(bind->request);
  come_back(bind);
}

// On a worker.
void Session::come_back(const BindPtr& bind) noexcept {
  bind->verified.store(true);
  try {
    post([this, self = shared_from_this(), bind] {
      try {
        verified(bind);
      } catch (...) {
        end_for_want_of_memory();
      }
    });
  } catch (...) {
    stranded_.store(true);
  }
}

void Session::verified(const BindPtr& bind) {
  if (bind_ != bind) return;
  if (bind->exchange)
    finish_step(bind);
  else
    finish_bind(bind->code, "", bind->identity);
  resume();
}

// ---- bind by SASL

// Takes the next step of the exchange that the request goes on with, or the first of a new one.
void Session::start_step() {
  if (!exchange_) {
    const SaslMechanism* const mechanism =
        services_.mechanisms
            ? find_mechanism(*services_.mechanisms, bind_->request.mechanism, transport_)
            : nullptr;
    if (!mechanism)
      return finish_bind(result::auth_method_not_supported, "mechanism not supported", nullptr);
    // Whoever is found by any of the steps is no newer than this.
    exchange_generation_ = services_.authenticator.generation();
    exchange_begun_ = Clock::now();
    mechanism_ = mechanism->name();
    exchange_ = mechanism->start(transport_);
    if (!exchange_) throw std::bad_alloc();
  }
  bind_->generation = exchange_generation_;
  bind_->exchange = std::move(exchange_);
  on_verifier([this](const BindPtr& bind) { take_step_of(*bind), come_back(bind); });
}

// On a worker.
void Session::take_step_of(Bind& bind) noexcept {
  try {
    std::optional<std::string_view> credentials;
    if (bind.request.credentials) credentials = *bind.request.credentials;
    bind.outcome = bind.exchange->step(credentials);
  } catch (const std::bad_alloc&) {
    bind.outcome.code = result::no_memory;
  } catch (...) {
    bind.outcome.code = result::other;
  }
  wipe_credentials(bind.request);
}

void Session::finish_step(const BindPtr& bind) {
  SaslOutcome& outcome = bind->outcome;
  switch (outcome.state) {
    case SaslOutcome::State::go_on:
      if (!gone_) exchange_ = std::move(bind->exchange);
      return finish_bind(result::sasl_bind_in_progress, "", nullptr);
    case SaslOutcome::State::done:
      if (!outcome.identity) return finish_bind(result::other, "", nullptr);
      return finish_bind(result::success, "", outcome.identity);
    case SaslOutcome::State::failed:
      break;
  }
  outcome.reply.reset();
  const bool fails =
      outcome.code != result::success && outcome.code != result::sasl_bind_in_progress;
  finish_bind(fails ? outcome.code : result::other, outcome.text, nullptr);
}

bool Session::bind_is_overdue(Clock::time_point now) const noexcept {
  return exchange_ && now - exchange_begun_ >= std::chrono::seconds(settings().bind_timeout);
}

void Session::protect(std::unique_ptr<SecurityLayer>) {
  disconnect(result::other, "no security layer is possible here");
}

// ---- the result of a bind

void Session::ask_backend_to_bind() {
  Answer answer(bind_->message_id, tag::bind_response, {});
  Operation operation;
  operation.server = &answer;
  const PblockPtr parameters = make_parameters(services_.backend.backend(), connection_, operation);
  int code = result::no_memory;
  if (parameters) code = services_.backend.call(parameter::bind_function, parameters.get());
  // Nobody becomes anybody here, whatever a backend may say.
  finish_bind(code != 0 ? code : result::invalid_credentials, "", nullptr);
}

void Session::finish_bind(int code, std::string_view text,
                          std::shared_ptr<const Identity> identity) {
  const BindPtr bind = std::move(bind_);
  bind_ = nullptr;
  wipe_credentials(bind->request);
  std::string what;
  if (services_.logs.access_enabled()) what = describe_bind(*bind, identity.get());
  log_result(bind->message_id, what, gone_ ? kAbandoned : code, 0, bind->received, peer_);
  if (gone_) return settle_if_done();
  become(std::move(identity));
  identity_checked_ = bind->generation;
  Answer answer(bind->message_id, tag::bind_response, {});
  ResultAnswer result{};
  result.code = code;
  result.text = text;
  if (bind->outcome.reply) result.sasl_credentials = &*bind->outcome.reply;
  answer.result(result);
  transmit_answer(answer);
  if (code != result::success || !bind->outcome.layer) return;
  protected_ = true;
  protect(std::move(bind->outcome.layer));
}

std::string Session::describe_bind(const Bind& bind, const Identity* identity) {
  // Nothing is known of one that was refused for its form.
  if (bind.request.version == 0) return "BIND malformed";
  std::string text = describe_dn("BIND", bind.request.name);
  if (bind.request.simple) {
    text += " simple";
  } else {
    text += " sasl mechanism=";
    append_client_text(text, bind.request.mechanism);
  }
  if (!bind.outcome.name.empty()) append_client_text(text += " name=", bind.outcome.name);
  if (identity) append_normal_dn(text += " as=", identity->bound_dn);
  return text;
}

void Session::become(std::shared_ptr<const Identity> identity) noexcept {
  pages_.forget_all();  // somebody else's, or found under other rights
  identity_ = std::move(identity);
  connection_.authority = identity_ ? identity_->authority : authority::no_configuration_access;
  connection_.roles = identity_ ? identity_->roles : 0;
  count_as_unauthenticated(!identity_ && !gone_);
}

void Session::count_as_unauthenticated(bool counted) noexcept {
  if (std::exchange(unauthenticated_, counted) == counted) return;
  unauthenticated_since_ = Clock::now();
  count_in_total();
}

void Session::count_in_total() noexcept {
  const bool counts = unauthenticated_ && !transport_.local;
  if (std::exchange(in_total_, counts) == counts) return;
  services_.unauthenticated.fetch_add(counts ? 1 : -1, std::memory_order_relaxed);
}

}  // namespace orv::server
