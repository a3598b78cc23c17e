#include "ops/operation.h"

#include <new>
#include <optional>
#include <utility>

#include "cfg/result_codes.h"

namespace orv::server {
namespace {

// How often a running search looks at the clock, in entries, and at the client, in time.
constexpr unsigned kPollsPerClock = 64;
constexpr std::chrono::milliseconds kLookInterval{10};

}  // namespace

PendingOperation::PendingOperation(std::shared_ptr<OperationHome> home,
                                   std::shared_ptr<const Identity> identity,
                                   std::int32_t message_id, int response_tag,
                                   const AnswerLimits& limits)
    : home_(std::move(home)),
      identity_(std::move(identity)),
      answer_(message_id, response_tag, limits) {
  if (identity_) {
    operation_.authority = identity_->authority;
    operation_.roles = identity_->roles;
    operation_.bound_dn = identity_->bound_dn.c_str();
  }
  operation_.server = &answer_;
}

PendingOperation::~PendingOperation() {
  if (!parameters_) return;
  ldapmod* left = nullptr;
  if (slapi_pblock_get(parameters_.get(), parameter::modifications, &left) == 0)
    free_modifications(left);
  entry* before_delete = nullptr;
  if (slapi_pblock_get(parameters_.get(), parameter::entry_before_delete, &before_delete) == 0)
    entry_free(before_delete);
}

bool PendingOperation::set(int number, void* value) noexcept {
  return slapi_pblock_set(parameters_.get(), number, value) == 0;
}

bool PendingOperation::begin(Services& services, int handler, std::string_view normal_dn) {
  handler_ = handler;
  stopping_ = &services.stopping;
  parameters_ = make_parameters(services.backend.backend(), home_->connection(), operation_);
  if (!parameters_) throw std::bad_alloc();
  dn_ = malloc_text(normal_dn);
  return set(parameter::target_dn, dn_.get());
}

Refusal PendingOperation::prepare_search(Services& services, SearchRequest& request,
                                         std::string_view normal_dn) {
  begin(services, parameter::search_function, normal_dn);
  long_running_ = request.scope != 0;
  // Who may not see an attribute must not learn it by asking for its value.
  const bool sees_all = operation_.authority == authority::primary_administrator;
  filter_ = malloc_text(sees_all ? request.filter
                                 : rewrite_filter(services.schema, request.filter,
                                                  FilterUse::evaluate_for_administrators));
  names_ = canonical_names(services.schema, request.attributes);
  set(parameter::search_filter_text, filter_.get());
  set(parameter::search_attributes, names_.get());
  slapi_pblock_set(parameters_.get(), parameter::search_scope, request.scope);
  slapi_pblock_set(parameters_.get(), parameter::search_types_only, request.types_only ? 1 : 0);
  return {};
}

Refusal PendingOperation::prepare_add(Services& services, const AddRequest& request,
                                      std::string_view normal_dn) {
  begin(services, parameter::add_function, normal_dn);
  if (Refusal refusal = make_entry(services.schema, request, entry_)) return refusal;
  set(parameter::add_entry, entry_.get());
  return {};
}

Refusal PendingOperation::prepare_delete(Services& services, std::string_view normal_dn) {
  begin(services, parameter::delete_function, normal_dn);
  return {};
}

Refusal PendingOperation::prepare_modify(Services& services, const ModifyRequest& request,
                                         std::string_view normal_dn) {
  begin(services, parameter::modify_function, normal_dn);
  ldapmod* first = nullptr;
  if (Refusal refusal = make_modifications(services.schema, request, first)) return refusal;
  // From here the block holds the list: the handler clears the parameter when it released it.
  if (!set(parameter::modifications, first)) free_modifications(first);
  return {};
}

void PendingOperation::run(Services& services, bool on_home_thread) {
  Connection& connection = home_->connection();
  on_home_thread_ = on_home_thread;
  next_look_ = Clock::now() + kLookInterval;
  const bool search = handler_ == parameter::search_function;
  std::optional<cfg::InterruptScope> scope;
  if (search) scope.emplace(&PendingOperation::interrupted, this);
  const int code =
      services.backend.call_inside_gate(handler_, parameters_.get(), connection, !search);
  if (!answer_.answered()) answer_.result(code != 0 ? code : result::other, "", "");
}

bool PendingOperation::interrupted(void* self) noexcept {
  return static_cast<PendingOperation*>(self)->must_stop();
}

bool PendingOperation::must_stop() noexcept {
  if (answer_.abandoned() || stopping_->load(std::memory_order_relaxed)) return true;
  if (++polls_ % kPollsPerClock != 0) return false;
  const Clock::time_point now = Clock::now();
  if (now >= answer_.limits().deadline) return true;
  if (!on_home_thread_ || now < next_look_) return false;
  next_look_ = now + kLookInterval;
  return home_->lost_interest(*this);
}

void PendingOperation::gate_decided(Verdict verdict) noexcept {
  home_->decided(shared_from_this(), verdict);
}

}  // namespace orv::server
