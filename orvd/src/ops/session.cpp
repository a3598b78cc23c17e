#include "ops/session.h"

#include <algorithm>
#include <asio/post.hpp>
#include <new>
#include <utility>

#include "cfg/dn.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "ops/log_text.h"
#include "ops/request_text.h"
#include "ops/wiped_request.h"
#include "publish/match.h"
#include "publish/root_dse.h"
#include "slapi/globals.h"

namespace orv::server {
namespace {

constexpr std::string_view kSuffix = "CN=CONFIGURATION";
constexpr std::string_view kNotOffered = "operation not supported";
constexpr std::string_view kStopping = "server is stopping";
// For the answer to a change, before the connection of somebody who is no longer the same ends.
constexpr std::chrono::seconds kTimeToRead{1};

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

DecoderLimits decoder_limits(const Settings& settings) {
  DecoderLimits limits;
  limits.message_bytes = static_cast<std::size_t>(settings.max_message_size);
  limits.filter_depth = static_cast<int>(settings.max_filter_depth);
  limits.filter_items = static_cast<int>(settings.max_filter_items);
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

// Why a change of somebody with access did not reach the backend, which tells of its own refusals.
void tell(Logs& logs, std::string line, const Refusal& refusal) {
  line += " refused with ";
  append_number(line, refusal.code);
  line += ": ";
  append_client_text(line, refusal.text);
  logs.warning(line);
}

bool has_no_access(unsigned authority) {
  return authority == authority::no_configuration_access;
}

}  // namespace

Session::Session(Services& services, AccessLane& access, std::uint64_t number)
    : services_(services),
      access_(access),
      number_(number),
      output_(services.output),
      pages_(services.kept_pages) {
  connection_.aux = &aux_;
  connection_.server = this;
  install_senders(connection_);
  count_as_unauthenticated(true);
}

Session::~Session() {
  count_as_unauthenticated(false);
}

// ---- messages

void Session::handle(std::string_view frame) {
  WipedMessage message;
  const Decoded decoded = decode(frame, decoder_limits(settings()), message);
  if (decoded.state == DecodeState::fatal) return disconnect(decoded.code, decoded.text);
  if (decoded.state == DecodeState::decoded) return take(message);
  refuse_form(message, decoded);
}

// What can be told is the kind of request and its message id.
void Session::refuse_form(Message& message, const Decoded& decoded) {
  if (is_in_use(message.id)) return end_for_message_id(message);
  // Also a bind that is refused for its form leaves the connection anonymous.
  if (decoded.response_tag == tag::bind_response) {
    audit_refused(message, decoded.code);
    BindRequest none;
    return receive_bind(message.id, none, {decoded.code, decoded.text});
  }
  Refusal refusal = refuse_within_bind();
  if (!refusal) refusal = {decoded.code, decoded.text};
  audit_refused(message, refusal.code);
  respond(message.id, decoded.response_tag, refusal.code, refusal.text,
          operation_name(decoded.response_tag));
}

// RFC 4511, 4.1.1.1: answers could not be told apart.
void Session::end_for_message_id(const Message& message) {
  audit_refused(message, result::protocol_error);
  disconnect(result::protocol_error, "message ID is in use");
}

// RFC 4511, 4.2.1: nothing may come between the steps of a bind. Whatever does ends it.
Refusal Session::refuse_within_bind() {
  if (!std::exchange(exchange_, nullptr)) return {};
  return {result::operations_error, "a bind is under way"};
}

void Session::take(Message& message) {
  const std::int32_t id = message.id;
  Request& request = message.request;
  if (std::holds_alternative<UnbindRequest>(request)) return drop();
  if (is_in_use(id)) return end_for_message_id(message);
  RequestControls controls;
  Refusal refusal = read_controls(message, controls);
  if (const auto* given_up = std::get_if<AbandonRequest>(&request)) {
    if (!refusal) abandon(given_up->message_id);  // it has no answer
    return;
  }
  if (!identity_holds()) return audit_refused(message, result::stronger_auth_required);
  const int answer_tag = response_tag(request);
  if (auto* bind = std::get_if<BindRequest>(&request))
    return receive_bind(id, *bind, std::move(refusal));
  if (Refusal within = refuse_within_bind()) refusal = std::move(within);
  if (refusal) {
    audit_refused(message, refusal.code);
    return respond(id, answer_tag, refusal.code, refusal.text, described(request));
  }
  if (auto* wanted = std::get_if<SearchRequest>(&request)) return search(id, *wanted, controls);
  if (const auto* wanted = std::get_if<AddRequest>(&request)) return change(id, *wanted, controls);
  if (const auto* wanted = std::get_if<DeleteRequest>(&request))
    return change(id, *wanted, controls);
  if (const auto* wanted = std::get_if<ModifyRequest>(&request))
    return change(id, *wanted, controls);
  if (const auto* wanted = std::get_if<ExtendedRequest>(&request)) return extended(id, *wanted);
  audit_refused(message, result::unwilling_to_perform);
  respond(id, answer_tag, result::unwilling_to_perform, kNotOffered, described(request));
}

Refusal Session::read_controls(const Message& message, RequestControls& controls) const {
  if (message.controls.empty()) return {};
  std::vector<std::string> offered = services_.supported_controls;
  std::erase_if(offered, [this](const std::string& oid) { return is_switched_off(oid); });
  return server::read_controls(message, offered, decoder_limits(settings()), controls);
}

bool Session::is_switched_off(std::string_view control) const noexcept {
  if (control == kPagedResultsOid) return settings().max_paged_searches == 0;
  const bool persistent = control == kPersistentSearchOid || control == kEntryChangeOid;
  return persistent && settings().max_persistent_searches == 0;
}

// Also that of a Cancel operation that has not been answered yet.
bool Session::is_in_use(std::int32_t message_id) const noexcept {
  return outstanding(message_id) || persistent_search(message_id) ||
         is_being_canceled_by(message_id);
}

std::string Session::described(const Request& request) const {
  return services_.logs.access_enabled() ? describe(services_.schema, request) : std::string();
}

bool Session::busy() const noexcept {
  return bind_ != nullptr ||
         outstanding_.size() >= static_cast<std::size_t>(settings().max_pending_operations);
}

// ---- targets

Session::Target Session::find_target(std::string_view dn, std::string& normal) const {
  if (dn.empty()) return Target::root_dse;
  const int code = cfg::normalize_dn(dn, normal);
  if (code == result::no_memory) throw std::bad_alloc();
  if (code != 0) return Target::not_a_dn;
  if (normal.empty()) return Target::root_dse;
  if (cfg::normal_dn_is_at_or_below(normal, kSuffix)) return Target::configuration;
  return normal == kSubschemaNormalDn ? Target::subschema : Target::nothing;
}

// ---- search

void Session::search(std::int32_t id, SearchRequest& request, const RequestControls& controls) {
  const PersistentWish& wish = controls.persistent;
  std::string normal;
  const Target target = find_target(request.base, normal);
  if (wish.critical && (target == Target::root_dse || target == Target::subschema))
    return respond(id, tag::search_done, result::unavailable_critical_extension,
                   "persistent searches are for the configuration", described(request));
  if (target == Target::root_dse && request.scope == 0)
    return search_published(id, request, controls, services_.publications.root_dse(offer()));
  if (target == Target::subschema)
    return search_published(id, request, controls, services_.publications.subschema());
  if (controls.paged && !controls.paged->cookie.empty() && target == Target::configuration &&
      may_search(connection_.authority))
    return next_page(id, request, normal, *controls.paged);

  const OperationPtr operation =
      make_operation(id, tag::search_done, stricter(settings().time_limit, request.time_limit),
                     stricter(settings().size_limit, request.size_limit));
  if (services_.logs.access_enabled())
    operation->log_text =
        describe_search(services_.schema, request, normal) + describe_controls(controls);
  if (target == Target::not_a_dn)
    return submit(operation, {result::invalid_dn_syntax, "the base object is not a DN"});
  if (target != Target::configuration) return submit(operation, {result::no_such_object, ""});
  if (!may_search(connection_.authority))
    return submit(operation, {result::insufficient_access, ""});
  if (controls.paged) prepare_pages(*operation, request, normal, *controls.paged);
  if (!wish.wanted) return submit_search(operation, request, normal, controls);
  if (services_.logs.access_enabled()) operation->log_text += " persistent";
  if (Refusal refusal = begin_persistent(*operation, wish.control, request, normal))
    return submit(operation, refusal);
  SearchRequest first_part = wish.control.changes_only ? probe(request) : request;
  submit_search(operation, first_part, normal, controls);
}

void Session::submit_search(const OperationPtr& operation, SearchRequest& request,
                            std::string_view normal_base, const RequestControls& controls) {
  Refusal refusal = operation->prepare_search(services_, request, normal_base);
  if (!refusal) refusal = operation->prepare_controls(services_, controls);
  submit(operation, refusal);
}

void Session::search_published(std::int32_t id, const SearchRequest& request,
                               const RequestControls& controls,
                               const std::shared_ptr<const entry>& published) {
  Answer answer(id, tag::search_done, {});
  const Clock::time_point started = Clock::now();
  int code = published ? result::success : result::no_memory;
  // RFC 4528, 3: tested on the base, before anything is looked for.
  if (published && controls.assertion && !entry_matches(*published, *controls.assertion))
    code = result::assertion_failed;
  // One entry never needs a second page, so no cookie was ever given out for it.
  if (controls.paged && !controls.paged->cookie.empty()) code = result::unwilling_to_perform;
  const bool shown = !controls.paged || controls.paged->size > 0;
  // It has no children: only the searches that begin with the base itself find something.
  if (code == 0 && shown && request.scope != 1 && entry_matches(*published, request.filter)) {
    const TextArray names = canonical_names(services_.schema, request.attributes);
    code = answer.entry(*published, names.get(), request.types_only, nullptr);
  }
  std::vector<Control> page;
  if (controls.paged && code == 0)
    page.push_back(paged_results_answer(static_cast<std::int32_t>(answer.entries()), ""));
  ResultAnswer result{};
  result.code = code;
  result.controls = &page;
  answer.result(result);
  transmit_answer(answer);
  // Neither of the names that are published holds a password.
  if (services_.logs.access_enabled())
    log_result(id,
               describe_search(services_.schema, request, kSubschemaNormalDn) +
                   describe_controls(controls),
               answer.code(), answer.entries(), started);
}

// ---- changes

Refusal Session::refuse_change(Target target) const {
  if (target == Target::not_a_dn) return {result::invalid_dn_syntax, "the target is not a DN"};
  if (target == Target::nothing) return {result::no_such_object, ""};
  if (target != Target::configuration) return {result::unwilling_to_perform, "cannot be changed"};
  if (has_no_access(connection_.authority)) return {result::insufficient_access, ""};
  return {};
}

namespace {

constexpr int tag_of(const AddRequest&) {
  return tag::add_response;
}
constexpr int tag_of(const DeleteRequest&) {
  return tag::delete_response;
}
constexpr int tag_of(const ModifyRequest&) {
  return tag::modify_response;
}

}  // namespace

template <typename ChangeRequest>
void Session::change(std::int32_t id, const ChangeRequest& request,
                     const RequestControls& controls) {
  Refusal refusal;
  OperationPtr operation;
  try {
    operation = prepare_change(id, request, controls, refusal);
  } catch (...) {
    audit_attempt(id, request, result::no_memory);
    throw;
  }
  submit(operation, refusal);
}

template <typename ChangeRequest>
Session::OperationPtr Session::prepare_change(std::int32_t id, const ChangeRequest& request,
                                              const RequestControls& controls, Refusal& refusal) {
  const int answer_tag = tag_of(request);
  const std::string_view name = operation_name(answer_tag);
  std::string normal;
  refusal = refuse_change(find_target(request.dn, normal));
  // The change itself takes its time; what comes before and after it is bounded as searches are.
  const bool searches = controls.assertion || controls.pre_read || controls.post_read;
  OperationPtr operation = make_operation(id, answer_tag, searches ? settings().time_limit : 0, 0);
  if (services_.logs.access_enabled())
    operation->log_text = describe_dn(name, request.dn, normal) + describe_controls(controls);
  prepare_audit(*operation, request);
  outstanding_.reserve(outstanding_.size() + 1);
  if (refusal) return operation;
  refusal = operation->prepare(services_, request, normal);
  if (!refusal) refusal = operation->prepare_controls(services_, controls);
  if (refusal) tell(services_.logs, describe_dn(name, request.dn, normal), refusal);
  return operation;
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
  operation->identity_generation = identity_checked_;
  operation->trust = transport_trust();
  operation->failure_limit = settings().max_failed_change_size;
  operation->failure_limit_of_all = settings().max_failed_change_total_size;
  lend_storage(operation->answer().bytes());
  return operation;
}

void Session::submit(const OperationPtr& operation, const Refusal& refusal) {
  outstanding_.push_back(operation);
  if (refusal) return answer_and_complete(operation, refusal.code, refusal.text);
  start(operation);
}

// Goes to the gate, or waits for the client to read.
void Session::start(const OperationPtr& operation) {
  if (output_.full() || (held_ > 0 && !starting_held_)) return hold(operation);
  Gate& gate = services_.backend.gate();
  // A notice waits as long as it takes: its client would hear of nothing more without it.
  const auto deadline = operation->notice_of
                            ? Clock::time_point::max()
                            : Clock::now() + std::chrono::seconds(settings().operation_wait);
  Gate::Entry entry = Gate::Entry::closed;
  try {
    entry = operation->wants_worker() ? gate.enter_elsewhere(operation, deadline, &gate_user_)
                                      : gate.enter(operation, deadline, &gate_user_);
  } catch (const std::bad_alloc&) {
    return answer_and_complete(operation, result::no_memory, "");
  }
  if (entry == Gate::Entry::inside) return run_here(operation);
  if (entry == Gate::Entry::closed) answer_and_complete(operation, result::unavailable, kStopping);
}

void Session::answer_and_complete(const OperationPtr& operation, int code, std::string_view text) {
  operation->answer().result(code, "", text);
  complete(operation);
}

// Inside the gate, on any thread. Whether the operation must wait for the client to read; what is
// behind it then waits as well, though the client may have read by its turn.
bool Session::turn_back(PendingOperation& operation) noexcept {
  if (operation.answer().is_given_up() || !(output_.full() || turned_back_.load())) {
    operation.begun.store(true);
    return false;
  }
  turned_back_.store(true);
  services_.backend.leave_gate();
  return true;
}

void Session::run_here(const OperationPtr& operation) {
  if (turn_back(*operation)) return hold(operation);
  try {
    if (operation->long_running()) flush();
  } catch (...) {
    services_.backend.leave_gate();
    forget(operation);
    throw;
  }
  operation->run(services_, true);
  complete(operation);
}

// Nobody will complete it.
void Session::forget(const OperationPtr& operation) noexcept {
  std::erase(outstanding_, operation);
  if (notice_ == operation) notice_.reset();
}

void Session::run_on_worker(const OperationPtr& operation) noexcept {
  try {
    asio::post(services_.changes,
               [this, self = shared_from_this(), operation] { work(operation); });
  } catch (...) {
    // It keeps the gate until the tick tries again.
    operation->step.store(Step::run);
    operation->stranded.store(true);
    stranded_.store(true);
  }
}

// On a worker, inside the gate.
void Session::work(const OperationPtr& operation) noexcept {
  if (turn_back(*operation)) return hand_back(operation, Step::hold);
  operation->run(services_, false);
  // Before the settings, which may name another audit log, or none.
  const std::uint64_t record = audit(*operation);
  operation->renew_settings(services_);
  hand_back_recorded(operation, record);
}

void Session::decided(std::shared_ptr<PendingOperation> operation, Verdict verdict) noexcept {
  if (verdict == Verdict::admitted) {
    if (operation->wants_worker()) return run_on_worker(operation);
    return hand_back(operation, Step::run);
  }
  hand_back(operation, verdict == Verdict::late ? Step::late : Step::closed);
}

// Any thread.
void Session::hand_back(const OperationPtr& operation, Step step) noexcept {
  operation->step.store(step);
  try {
    post([this, self = shared_from_this(), operation] { take_step_or_end(operation); });
  } catch (...) {
    operation->stranded.store(true);
    stranded_.store(true);
  }
}

void Session::take_step(const OperationPtr& operation) {
  switch (operation->step.load()) {
    case Step::run:
      if (operation->wants_worker()) return run_on_worker(operation);
      run_here(operation);
      break;
    case Step::hold:
      hold(operation);
      break;
    case Step::late:
      answer_and_complete(operation, result::busy, "the configuration is busy");
      break;
    case Step::closed:
      answer_and_complete(operation, result::unavailable, kStopping);
      break;
    case Step::finish:
      complete(operation);
      break;
  }
  resume();
}

void Session::take_step_or_end(const OperationPtr& operation) noexcept {
  try {
    take_step(operation);
  } catch (...) {
    end_for_want_of_memory();
  }
}

// The client cannot be told what became of its request, so it must not wait for it either.
void Session::end_for_want_of_memory() noexcept {
  try {
    return disconnect(result::no_memory, "out of memory");
  } catch (...) {
  }
  try {
    drop();
  } catch (...) {
  }
}

void Session::complete(const OperationPtr& operation) {
  std::erase(outstanding_, operation);
  if (operation->held) {
    operation->held = false;
    --held_;
  }
  audit(*operation);
  if (operation->notice_of) {
    notice_done(operation);
    return go_on();
  }
  // Whatever keeps its first part from being told, a persistent search does not go on without it.
  struct Unestablished {
    ~Unestablished() {
      if (search && !search->established) searches.leave(*search);
    }
    PersistentSearches& searches;
    const PersistentSearchPtr search;
  } const unestablished{services_.persistent_searches, operation->persistent};
  const Answer& answer = operation->answer();
  if (answer.code() == result::operations_error && services_.note_failure) services_.note_failure();
  const Delivered sent = deliver(*operation);  // what follows is done while the client reads
  if (operation->is_change()) change_told_ = Clock::now();
  log_result(answer.message_id(), operation->log_text, sent.code, sent.entries,
             operation->started());
  if (operation->persistent) first_part_done(*operation);
  if (operation->canceled_by != 0) finish_cancel(*operation);
  go_on();
}

// Something is no longer outstanding.
void Session::go_on() {
  start_held_later();
  if (bind_ && !gone_) try_bind();
  settle_if_done();
}

Session::Delivered Session::deliver(PendingOperation& operation) {
  struct Settle {
    ~Settle() { share.settled(bytes); }
    OutputShare& share;
    std::size_t bytes;
  } const settle{output_, operation.charged()};
  Answer& answer = operation.answer();
  if (answer.abandoned()) return {kAbandoned, answer.entries()};
  if (gone_) return {answer.code(), answer.entries()};
  if (operation.page && answer.answered() && (answer.code() == 0 || answer.entries() > 0))
    return first_page(operation);
  output_.queued(operation.charged());
  transmit_answer(answer);
  return {answer.code(), answer.entries()};
}

// ---- waiting for the client to read

void Session::hold(const OperationPtr& operation) {
  if (gone_ || operation->answer().abandoned()) return complete(operation);
  if (operation->answer().canceled()) return answer_and_complete(operation, result::canceled, "");
  operation->held = true;
  ++held_;
  start_held_later();
}

// Whether all operations that have not begun are held: those that wait at the gate are taken from
// there. One that a thread has in hand comes back by itself.
bool Session::hold_all() {
  bool all = true;
  for (const OperationPtr& operation : outstanding_) {
    if (operation->held || operation->begun.load()) continue;
    if (services_.backend.gate().withdraw(*operation)) {
      operation->held = true;
      ++held_;
    } else {
      all = false;
    }
  }
  return all;
}

// In the order in which they came, so none may be ahead of those that were turned back.
void Session::start_held() {
  if (starting_held_ || held_ == 0 || output_.full()) return;
  if (turned_back_.load()) {
    if (!hold_all()) return;
    turned_back_.store(false);
  }
  struct Flag {
    explicit Flag(bool& f) : flag(f) { flag = true; }
    ~Flag() { flag = false; }
    bool& flag;
  } const starting(starting_held_);
  while (held_ > 0 && !output_.full()) {
    const auto found = std::find_if(outstanding_.begin(), outstanding_.end(),
                                    [](const OperationPtr& operation) { return operation->held; });
    const OperationPtr operation = *found;
    operation->held = false;
    --held_;
    start(operation);
  }
}

void Session::start_held_later() noexcept {
  if (held_ == 0 || starting_held_ || output_.full()) return;
  try {
    post([this, self = shared_from_this()] {
      try {
        start_held();
        resume();
      } catch (...) {
        end_for_want_of_memory();
      }
    });
  } catch (...) {
    stranded_.store(true);
  }
}

void Session::output_is(std::size_t unwritten) noexcept {
  output_.unwritten(unwritten);
  start_held_later();
  next_notice_later();
}

// ---- now and then

void Session::tick() {
  pick_up_stranded();
  // Whoever changed a password of their own, or their own roles, hears of it first, and has a
  // moment to read it: some clients throw away what they have not read when they find the
  // connection ended. A further request does not get through meanwhile.
  const bool reads = Clock::now() - change_told_ < kTimeToRead;
  if (!gone_ && !awaits_change() && !reads) identity_holds();
  if (!gone_ && listens()) look_after_persistent_searches();
}

void Session::pick_up_stranded() {
  if (!stranded_.load()) return;
  const std::vector<OperationPtr> all = outstanding_;  // without memory for it the next tick tries
  if (!stranded_.exchange(false)) return;
  for (const OperationPtr& operation : all)
    if (operation->stranded.exchange(false)) take_step_or_end(operation);
  try {
    if (bind_ && bind_->verified.load()) verified(bind_);
    start_held();
    resume();
  } catch (...) {
    end_for_want_of_memory();
  }
}

void Session::respond(std::int32_t id, int response_tag, int code, std::string_view text,
                      std::string_view what) {
  Answer answer(id, response_tag, {});
  ResultAnswer result{};
  result.code = code;
  result.text = text;
  const Clock::time_point started = Clock::now();
  answer.result(result);
  transmit_answer(answer);
  log_result(id, what, code, 0, started);
}

// A client that would wait for an answer that could not be made has its connection ended instead.
void Session::transmit_answer(Answer& answer) {
  if (!answer.answered()) throw std::bad_alloc();
  transmit(answer.bytes());
}

// One that was given up does not count: its client does not wait for it any more.
Session::OperationPtr Session::outstanding(std::int32_t message_id) const noexcept {
  for (const OperationPtr& operation : outstanding_) {
    const Answer& answer = operation->answer();
    if (answer.message_id() == message_id && !answer.abandoned()) return operation;
  }
  return nullptr;
}

void Session::abandon(std::int32_t message_id) {
  if (const PersistentSearchPtr search = persistent_search(message_id))
    return end_persistent(search, kAbandoned, "");
  const OperationPtr operation = outstanding(message_id);
  if (operation && give_up(operation)) complete(operation);
}

// Whether nobody has it in hand any more. One that is being run, or was just admitted, finishes and
// is dropped then.
bool Session::give_up(const OperationPtr& operation) noexcept {
  operation->answer().abandon();
  return operation->held || services_.backend.gate().withdraw(*operation);
}

void Session::client_left() noexcept {
  if (gone_) return;
  gone_ = true;
  connection_.state.store(0, std::memory_order_relaxed);
  aux_.client_gone.store(1, std::memory_order_relaxed);
  count_as_unauthenticated(false);
  exchange_.reset();
  pages_.forget_all();
  end_persistent_searches();
  for (std::size_t i = 0; i < outstanding_.size();) {
    const OperationPtr operation = outstanding_[i];
    // With the client gone, completing is forgetting: nothing in it can throw.
    if (give_up(operation))
      complete(operation);
    else
      ++i;
  }
  if (bind_ && !bind_->started) {
    log_result(bind_->message_id, operation_name(tag::bind_response), kAbandoned, 0,
               bind_->received);
    bind_.reset();
  }
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

// ---- StartTLS (RFC 4511, 4.14)

Refusal Session::refuse_tls(const ExtendedRequest& request) const {
  if (request.value) return {result::protocol_error, "StartTLS takes no value"};
  if (transport_.encrypted()) return {result::operations_error, "TLS is in use already"};
  if (protected_) return {result::operations_error, "a security layer is in use"};
  if (!outstanding_.empty() || listens())
    return {result::operations_error, "operations are outstanding"};
  if (!can_start_tls()) return {result::protocol_error, "TLS is not offered here"};
  return {};
}

// What was proved in clear, where others may have had a hand in it, does not hold under TLS.
void Session::begin_tls(std::int32_t id, const ExtendedRequest& request) {
  const Refusal refusal = refuse_tls(request);
  // Whoever put it there, it must never be taken for something said under TLS.
  if (!refusal && more_is_here())
    return disconnect(result::protocol_error, "something follows a StartTLS request");
  const Clock::time_point started = Clock::now();
  Answer answer(id, tag::extended_response, {});
  ResultAnswer result{};
  result.code = refusal.code;
  result.text = refusal.text;
  result.response_name = kStartTlsOid;
  answer.result(result);
  if (!refusal) become(nullptr);
  transmit_answer(answer);
  log_result(id, "STARTTLS", refusal.code, 0, started);
  if (!refusal) start_tls();
}

Offer Session::offer() const {
  Offer offer;
  if (services_.mechanisms)
    offer.sasl_mechanisms = offered_mechanisms(*services_.mechanisms, transport_);
  offer.start_tls = !transport_.encrypted() && can_start_tls();
  for (const std::string& oid : services_.supported_controls)
    if (is_switched_off(oid)) offer.controls_off.push_back(oid);
  return offer;
}

bool Session::awaits_change() const noexcept {
  return std::any_of(outstanding_.begin(), outstanding_.end(), [](const OperationPtr& operation) {
    return operation->is_change() && !operation->held;
  });
}

// Ends the connection when the identities were read anew and the bound one is not what it was, or
// when what the transport proves is not good any more.
bool Session::identity_holds() {
  if (!transport_holds()) return false;
  if (!identity_) return true;
  const std::uint64_t generation = services_.authenticator.generation();
  if (generation == identity_checked_) return true;
  if (services_.authenticator.still_valid(*identity_)) {
    identity_checked_ = generation;
    return true;
  }
  disconnect(result::stronger_auth_required, "the bound identity has changed or is gone");
  return false;
}

// ---- access log

std::string* Session::begin_access_line() {
  return access_.enabled() ? &access_.begin(number_) : nullptr;
}

void Session::log_result(std::int32_t id, std::string_view what, int code, std::int64_t entries,
                         Clock::time_point started, std::string_view from) noexcept try {
  std::string* const line = begin_access_line();
  if (!line) return;
  using std::chrono::duration_cast;
  using std::chrono::microseconds;
  *line += "op=";
  append_number(*line, id);
  line->append(" ").append(what);
  if (code == kAbandoned) {
    *line += " abandoned";
  } else {
    *line += " result=";
    append_number(*line, code);
  }
  *line += " entries=";
  append_number(*line, entries);
  *line += " us=";
  append_number(*line, duration_cast<microseconds>(Clock::now() - started).count());
  if (!from.empty()) line->append(" from=").append(from);
  end_access_line();
} catch (...) {
  // Without memory the line is lost.
}

}  // namespace orv::server
