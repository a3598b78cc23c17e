#include "ops/session.h"

#include <algorithm>
#include <asio/post.hpp>
#include <new>
#include <utility>

#include "cfg/dn.h"
#include "cfg/result_codes.h"
#include "cfg/secret.h"
#include "publish/match.h"
#include "publish/root_dse.h"
#include "slapi/globals.h"

namespace orv::server {
namespace {

constexpr std::string_view kSuffix = "CN=CONFIGURATION";
constexpr std::string_view kNotOffered = "operation not supported";

// The tag of the answer to a request, 0 for requests without one.
int response_tag(const Request& request) {
  struct Tags {
    int operator()(const BindRequest&) const { return tag::bind_response; }
    int operator()(const UnbindRequest&) const { return 0; }
    int operator()(const SearchRequest&) const { return tag::search_done; }
    int operator()(const AddRequest&) const { return tag::add_response; }
    int operator()(const DeleteRequest&) const { return tag::delete_response; }
    int operator()(const ModifyRequest&) const { return tag::modify_response; }
    int operator()(const ModifyDnRequest&) const { return tag::modify_dn_response; }
    int operator()(const CompareRequest&) const { return tag::compare_response; }
    int operator()(const AbandonRequest&) const { return 0; }
    int operator()(const ExtendedRequest&) const { return tag::extended_response; }
  };
  return std::visit(Tags{}, request);
}

std::string_view operation_name(int tag) {
  switch (tag) {
    case tag::bind_response:
      return "BIND";
    case tag::search_done:
      return "SEARCH";
    case tag::add_response:
      return "ADD";
    case tag::delete_response:
      return "DELETE";
    case tag::modify_response:
      return "MODIFY";
    case tag::modify_dn_response:
      return "MODIFYDN";
    case tag::compare_response:
      return "COMPARE";
    case tag::extended_response:
      return "EXTENDED";
    default:
      return "REQUEST";
  }
}

DecoderLimits decoder_limits(const Settings& settings) {
  DecoderLimits limits;
  limits.message_bytes = static_cast<std::size_t>(settings.max_message_size);
  limits.filter_depth = static_cast<int>(settings.max_filter_depth);
  limits.controls = static_cast<int>(settings.max_controls);
  limits.attributes = static_cast<int>(settings.max_attributes);
  limits.values = static_cast<int>(settings.max_values);
  return limits;
}

// The stricter of two limits of which 0 means none.
std::int64_t stricter(std::int64_t a, std::int64_t b) {
  if (a == 0 || b == 0) return std::max(a, b);
  return std::min(a, b);
}

// "NAME base="..."".
std::string describe(std::string_view name, std::string_view dn) {
  std::string text(name);
  text += " dn=";
  append_quoted(text, dn);
  return text;
}

std::string describe_search(const Schema& schema, const SearchRequest& request) {
  std::string text = describe("SEARCH", request.base);
  text += " scope=";
  append_number(text, request.scope);
  text += " filter=";
  append_quoted(text, rewrite_filter(schema, request.filter, FilterUse::show));
  return text;
}

bool has_no_access(unsigned authority) {
  return authority == authority::no_configuration_access;
}

bool may_search(unsigned authority) {
  // A server of kind 3 has another rule first, which the backend applies.
  if (g_srvType.load(std::memory_order_relaxed) == 3) return true;
  return !has_no_access(authority) && (authority & 3) == 0;
}

}  // namespace

Session::Session(Services& services, AccessLane& access, std::uint64_t number)
    : services_(services), access_(access), number_(number) {
  connection_.aux = &aux_;
  connection_.server = this;
  install_senders(connection_);
}

// ---- messages

void Session::handle(std::string_view frame) {
  Message message;
  const Decoded decoded = decode(frame, decoder_limits(settings()), message);
  if (decoded.state == DecodeState::fatal) return disconnect(decoded.code, decoded.text);
  if (decoded.state == DecodeState::decoded) return take(message);
  // Also a bind that is refused for its form leaves the connection anonymous.
  if (decoded.response_tag == tag::bind_response) {
    BindRequest none;
    return receive_bind(message.id, none, {decoded.code, decoded.text});
  }
  respond(message.id, decoded.response_tag, decoded.code, decoded.text,
          operation_name(decoded.response_tag));
}

void Session::take(Message& message) {
  const std::int32_t id = message.id;
  Request& request = message.request;
  if (std::holds_alternative<UnbindRequest>(request)) return drop();
  if (const auto* given_up = std::get_if<AbandonRequest>(&request))
    return abandon(given_up->message_id);
  const int answer_tag = response_tag(request);
  Refusal refusal;
  if (control_is_unknown(message))
    refusal = {result::unavailable_critical_extension, "critical control not supported"};
  if (auto* bind = std::get_if<BindRequest>(&request))
    return receive_bind(id, *bind, std::move(refusal));
  if (refusal)
    return respond(id, answer_tag, refusal.code, refusal.text, operation_name(answer_tag));
  if (auto* wanted = std::get_if<SearchRequest>(&request)) return search(id, *wanted);
  if (const auto* wanted = std::get_if<AddRequest>(&request)) return add(id, *wanted);
  if (const auto* wanted = std::get_if<DeleteRequest>(&request)) return remove(id, *wanted);
  if (const auto* wanted = std::get_if<ModifyRequest>(&request)) return modify(id, *wanted);
  if (std::holds_alternative<ExtendedRequest>(request))
    return respond(id, answer_tag, result::protocol_error, "extended operation not supported",
                   operation_name(answer_tag));
  respond(id, answer_tag, result::unwilling_to_perform, kNotOffered, operation_name(answer_tag));
}

bool Session::control_is_unknown(const Message& message) const {
  const auto& known = services_.supported_controls;
  return std::any_of(message.controls.begin(), message.controls.end(), [&](const Control& control) {
    return control.critical && std::find(known.begin(), known.end(), control.oid) == known.end();
  });
}

bool Session::busy() const noexcept {
  return bind_.has_value() ||
         outstanding_.size() >= static_cast<std::size_t>(settings().max_pending_operations);
}

// ---- targets

Session::Target Session::find_target(std::string_view dn, std::string& normal) const {
  if (dn.empty()) return Target::root_dse;
  if (cfg::normalize_dn(dn, normal) != 0) return Target::not_a_dn;
  if (normal.empty()) return Target::root_dse;
  if (cfg::normal_dn_is_at_or_below(normal, kSuffix)) return Target::configuration;
  return normal == kSubschemaNormalDn ? Target::subschema : Target::nothing;
}

// ---- search

void Session::search(std::int32_t id, SearchRequest& request) {
  std::string normal;
  const Target target = find_target(request.base, normal);
  if (target == Target::root_dse && request.scope == 0)
    return search_published(id, request, services_.publications.root_dse(), "");
  if (target == Target::subschema && request.scope != 1)
    return search_published(id, request, services_.publications.subschema(), kSubschemaDn);

  const OperationPtr operation =
      make_operation(id, tag::search_done, stricter(settings().time_limit, request.time_limit),
                     stricter(settings().size_limit, request.size_limit));
  if (services_.logs.access_enabled())
    operation->log_text = describe_search(services_.schema, request);
  if (target == Target::not_a_dn) return submit(operation, {result::invalid_dn_syntax, "base"});
  if (target != Target::configuration) return submit(operation, {result::no_such_object, ""});
  if (!may_search(connection_.authority))
    return submit(operation, {result::insufficient_access, ""});
  submit(operation, operation->prepare_search(services_, request, normal));
}

void Session::search_published(std::int32_t id, const SearchRequest& request, EntryPtr published,
                               std::string_view dn) {
  Answer answer(id, tag::search_done, {});
  const Clock::time_point started = Clock::now();
  int code = published ? result::success : result::no_memory;
  if (published && entry_matches(*published, request.filter)) {
    const TextArray names = canonical_names(services_.schema, request.attributes);
    code = answer.entry(*published, names.get(), request.types_only, nullptr);
  }
  answer.result(code, "", "");
  transmit(answer.bytes());
  if (services_.logs.access_enabled())
    log_result(id, describe("SEARCH", dn), answer.code(), answer.entries(), started);
}

// ---- changes

Refusal Session::refuse_change(Target target) const {
  if (target == Target::not_a_dn) return {result::invalid_dn_syntax, "not a DN"};
  if (target == Target::nothing) return {result::no_such_object, ""};
  if (target != Target::configuration) return {result::unwilling_to_perform, "cannot be changed"};
  if (has_no_access(connection_.authority)) return {result::insufficient_access, ""};
  return {};
}

void Session::add(std::int32_t id, const AddRequest& request) {
  std::string normal;
  Refusal refusal = refuse_change(find_target(request.dn, normal));
  const OperationPtr operation = make_operation(id, tag::add_response, 0, 0);
  if (services_.logs.access_enabled()) operation->log_text = describe("ADD", request.dn);
  if (!refusal) refusal = operation->prepare_add(services_, request, normal);
  submit(operation, std::move(refusal));
}

void Session::remove(std::int32_t id, const DeleteRequest& request) {
  std::string normal;
  Refusal refusal = refuse_change(find_target(request.dn, normal));
  const OperationPtr operation = make_operation(id, tag::delete_response, 0, 0);
  if (services_.logs.access_enabled()) operation->log_text = describe("DELETE", request.dn);
  if (!refusal) refusal = operation->prepare_delete(services_, normal);
  submit(operation, std::move(refusal));
}

void Session::modify(std::int32_t id, const ModifyRequest& request) {
  std::string normal;
  Refusal refusal = refuse_change(find_target(request.dn, normal));
  const OperationPtr operation = make_operation(id, tag::modify_response, 0, 0);
  if (services_.logs.access_enabled()) operation->log_text = describe("MODIFY", request.dn);
  if (!refusal) refusal = operation->prepare_modify(services_, request, normal);
  submit(operation, std::move(refusal));
}

// ---- the way of an operation

Session::OperationPtr Session::make_operation(std::int32_t id, int response_tag,
                                              std::int64_t time_limit, std::int64_t size_limit) {
  AnswerLimits limits;
  limits.bytes = static_cast<std::size_t>(settings().max_result_size);
  limits.entries = size_limit;
  if (time_limit > 0) limits.deadline = Clock::now() + std::chrono::seconds(time_limit);
  auto operation =
      std::make_shared<PendingOperation>(shared_from_this(), identity_, id, response_tag, limits);
  lend_storage(operation->answer().bytes());
  return operation;
}

void Session::submit(const OperationPtr& operation, Refusal refusal) {
  outstanding_.push_back(operation);
  if (refusal) {
    operation->answer().result(refusal.code, "", refusal.text);
    return complete(operation);
  }
  Gate& gate = services_.backend.gate();
  const auto deadline = operation->started() + std::chrono::seconds(settings().operation_wait);
  const Gate::Entry entry = operation->wants_worker() ? gate.enter_elsewhere(operation, deadline)
                                                      : gate.enter(operation, deadline);
  if (entry == Gate::Entry::inside) return run_here(operation);
  if (entry == Gate::Entry::queued) return;
  operation->answer().result(result::unavailable, "", "server is stopping");
  complete(operation);
}

void Session::run_here(const OperationPtr& operation) {
  if (operation->long_running()) flush();
  operation->run(services_, true);
  complete(operation);
}

void Session::run_on_worker(OperationPtr operation) {
  asio::post(services_.changes, [this, self = shared_from_this(), operation] {
    operation->run(services_, false);
    post([this, self, operation] {
      complete(operation);
      resume();
    });
  });
}

void Session::decided(std::shared_ptr<PendingOperation> operation, Verdict verdict) noexcept {
  try {
    if (verdict == Verdict::admitted && operation->wants_worker()) return run_on_worker(operation);
    post([this, self = shared_from_this(), operation, verdict] {
      if (verdict == Verdict::admitted) {
        run_here(operation);
      } else {
        const bool late = verdict == Verdict::late;
        operation->answer().result(late ? result::busy : result::unavailable, "",
                                   late ? "the configuration is busy" : "server is stopping");
        complete(operation);
      }
      resume();
    });
  } catch (...) {
    // Without memory to go on: whoever was admitted must not keep the gate.
    if (verdict == Verdict::admitted) services_.backend.gate().leave();
  }
}

void Session::complete(const OperationPtr& operation) {
  std::erase(outstanding_, operation);
  Answer& answer = operation->answer();
  if (!gone_ && !answer.abandoned()) transmit(answer.bytes());
  log_result(answer.message_id(), operation->log_text, answer.code(), answer.entries(),
             operation->started());
  if (bind_ && !gone_) try_bind();
  settle_if_done();
}

void Session::respond(std::int32_t id, int response_tag, int code, std::string_view text,
                      std::string_view what, std::string_view response_name) {
  Answer answer(id, response_tag, {});
  ResultAnswer result{};
  result.code = code;
  result.text = text;
  result.response_name = response_name;
  const Clock::time_point started = Clock::now();
  answer.result(result);
  transmit(answer.bytes());
  log_result(id, what, code, 0, started);
}

void Session::abandon(std::int32_t message_id) noexcept {
  const auto found =
      std::find_if(outstanding_.begin(), outstanding_.end(), [&](const OperationPtr& operation) {
        return operation->answer().message_id() == message_id;
      });
  if (found == outstanding_.end()) return;
  const OperationPtr operation = *found;
  operation->answer().abandon();
  // One that is being run, or was just admitted, finishes and is dropped then.
  if (services_.backend.gate().withdraw(*operation)) complete(operation);
}

void Session::client_left() noexcept {
  if (gone_) return;
  gone_ = true;
  connection_.state.store(0, std::memory_order_relaxed);
  aux_.client_gone.store(1, std::memory_order_relaxed);
  const std::vector<OperationPtr> all = outstanding_;
  for (const OperationPtr& operation : all) abandon(operation->answer().message_id());
  if (bind_ && !bind_->started) bind_.reset();
  settle_if_done();
}

void Session::settle_if_done() {
  if (gone_ && idle()) settled();
}

void Session::unbind() noexcept {
  Operation operation;
  const PblockPtr parameters = make_parameters(services_.backend.backend(), connection_, operation);
  if (parameters) services_.backend.call(parameter::unbind_function, parameters.get());
  // The handler leaves the handle in the slot though it is released.
  connection_.config_session = nullptr;
}

// ---- bind

void Session::receive_bind(std::int32_t id, BindRequest& request, Refusal refusal) {
  bind_.emplace();
  bind_->message_id = id;
  bind_->request = std::move(request);
  bind_->refusal = std::move(refusal);
  try_bind();
}

void Session::try_bind() {
  if (!outstanding_.empty() || bind_->started) return;
  bind_->started = true;
  become(nullptr);
  start_bind();
}

void Session::start_bind() {
  const BindRequest& request = bind_->request;
  if (bind_->refusal) return finish_bind(bind_->refusal.code, bind_->refusal.text, nullptr);
  if (request.version != 3)
    return finish_bind(result::protocol_error, "only LDAP version 3 is supported", nullptr);
  if (!request.simple)
    return finish_bind(result::auth_method_not_supported, "mechanism not supported", nullptr);
  std::string normal;
  const Target target = find_target(request.name, normal);
  if (target == Target::not_a_dn)
    return finish_bind(result::invalid_dn_syntax, "name is not a DN", nullptr);
  if (target == Target::root_dse && request.password.empty())
    return finish_bind(result::success, "", nullptr);
  if (request.password.empty())
    return finish_bind(result::unwilling_to_perform, "a name without a password proves nothing",
                       nullptr);
  if (target == Target::configuration) return ask_backend_to_bind();
  verify_password();
}

void Session::verify_password() {
  asio::post(services_.verifiers, [this, self = shared_from_this(),
                                   request = std::move(bind_->request)]() mutable {
    std::shared_ptr<const Identity> identity;
    int code = result::invalid_credentials;
    try {
      identity = services_.authenticator.authenticate(request.name, request.password);
      if (identity) code = result::success;
    } catch (const std::bad_alloc&) {
      code = result::no_memory;
    }
    cfg::wipe(request.password);
    post([this, self, code, identity = std::move(identity), name = std::move(request.name)] {
      bind_->request.name = name;  // for the access log
      finish_bind(code, "", identity);
      resume();
    });
  });
}

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
  Bind bind = std::move(*bind_);
  bind_.reset();
  cfg::wipe(bind.request.password);
  if (gone_) return settle_if_done();
  std::string what;
  if (services_.logs.access_enabled())
    what = describe("BIND", bind.request.name) + (bind.request.simple ? " simple" : " sasl");
  become(std::move(identity));
  Answer answer(bind.message_id, tag::bind_response, {});
  answer.result(code, "", text);
  transmit(answer.bytes());
  log_result(bind.message_id, what, code, 0, bind.received);
}

void Session::become(std::shared_ptr<const Identity> identity) noexcept {
  identity_ = std::move(identity);
  connection_.authority = identity_ ? identity_->authority : authority::no_configuration_access;
  connection_.roles = identity_ ? identity_->roles : 0;
}

// ---- access log

std::string* Session::begin_access_line() {
  return access_.enabled() ? &access_.begin(number_) : nullptr;
}

void Session::log_result(std::int32_t id, std::string_view what, int code, std::int64_t entries,
                         Clock::time_point started) {
  std::string* const line = begin_access_line();
  if (!line) return;
  using std::chrono::duration_cast;
  using std::chrono::microseconds;
  *line += "op=";
  append_number(*line, id);
  line->append(" ").append(what).append(" result=");
  append_number(*line, code);
  *line += " entries=";
  append_number(*line, entries);
  *line += " us=";
  append_number(*line, duration_cast<microseconds>(Clock::now() - started).count());
  end_access_line();
}

}  // namespace orv::server
