#include "ops/operation.h"

#include <algorithm>
#include <cstring>
#include <new>
#include <optional>
#include <utility>

#include "cfg/dn.h"
#include "cfg/result_codes.h"
#include "net/tls.h"
#include "ops/guards.h"
#include "ops/log_text.h"
#include "slapi/administrators.h"
#include "slapi/reserves.h"
#include "slapi/services.h"

namespace orv::server {
namespace {

// How often a running search looks at the client.
constexpr std::chrono::milliseconds kLookInterval{10};
constexpr std::string_view kWholeTree = "CN=CONFIGURATION";
constexpr std::string_view kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";

// Suppliers may do nothing but add suffixes, and members nothing in the group but change their own
// password, with a request that holds nothing else: to fold such a list could make one of several
// modifications one of a single one.
ListForm list_form(unsigned flags, std::string_view normal_dn) noexcept {
  constexpr unsigned kSupplier = authority::supplier_of_server | authority::supplier_of_suffix;
  if ((flags & kSupplier) != 0) return ListForm::as_sent;
  const bool member = (flags & authority::group_member) != 0;
  return member && cfg::normal_dn_is_at_or_below(normal_dn, kGroup) ? ListForm::as_sent
                                                                    : ListForm::folded;
}

// What the copy of a list takes that the backend makes: its blocks, with what the allocator adds.
std::int64_t cost_of_list(const ldapmod* first) noexcept {
  constexpr std::size_t kList = 256;
  constexpr std::size_t kRecord = 160;
  constexpr std::size_t kValue = 96;
  std::size_t bytes = kList;
  for (; first; first = first->mod_next) {
    bytes += kRecord + std::strlen(first->mod_type);
    for (berval** value = first->mod_vals.modv_bvals; value && *value; ++value)
      bytes += kValue + (*value)->bv_len;
  }
  return static_cast<std::int64_t>(bytes);
}

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
  if (handler != parameter::search_function) changed_dn_ = normal_dn;
  return set(parameter::target_dn, dn_.get());
}

Refusal PendingOperation::prepare_search(Services& services, SearchRequest& request,
                                         std::string_view normal_dn) {
  begin(services, parameter::search_function, normal_dn);
  long_running_ = request.scope != 0;
  filter_ = malloc_text(filter_for(services.schema, request.filter, operation_.authority));
  names_ = canonical_names(services.schema, request.attributes);
  scope_ = request.scope;
  wants_worker_ = long_running_ && services.search_cost.may_be_long(request.filter.size());
  set(parameter::search_filter_text, filter_.get());
  set(parameter::search_attributes, names_.get());
  slapi_pblock_set(parameters_.get(), parameter::search_scope, request.scope);
  slapi_pblock_set(parameters_.get(), parameter::search_types_only, request.types_only ? 1 : 0);
  return {};
}

Refusal PendingOperation::prepare(Services& services, const AddRequest& request,
                                  std::string_view normal_dn) {
  begin(services, parameter::add_function, normal_dn);
  if (Refusal refusal = make_entry(services.schema, request, entry_)) return refusal;
  if (services.guards) {
    const unsigned authority = operation_.authority;
    if (Refusal refusal = guarded(GuardedChange::add, normal_dn, authority, entry_.get()))
      return refusal;
    if (Refusal refusal = guarded_tls_files(normal_dn, *entry_, authority)) return refusal;
  }
  consequences_ = consequences_of_add(normal_dn, *entry_);
  set(parameter::add_entry, entry_.get());
  return {};
}

Refusal PendingOperation::prepare(Services& services, const DeleteRequest& /*request*/,
                                  std::string_view normal_dn) {
  begin(services, parameter::delete_function, normal_dn);
  if (Refusal refusal = check_target_code_page(normal_dn)) return refusal;
  if (!services.guards) return {};
  return guarded(GuardedChange::remove, normal_dn, operation_.authority, nullptr);
}

Refusal PendingOperation::prepare(Services& services, const ModifyRequest& request,
                                  std::string_view normal_dn) {
  begin(services, parameter::modify_function, normal_dn);
  if (Refusal refusal = check_target_code_page(normal_dn)) return refusal;
  ldapmod* first = nullptr;
  const ListForm form = list_form(operation_.authority, normal_dn);
  if (Refusal refusal = make_modifications(services.schema, request, form, first)) return refusal;
  cost_of_failure_ = cost_of_list(first);
  // From here the block holds the list: the handler clears the parameter when it released it.
  if (!set(parameter::modifications, first)) {
    free_modifications(first);
    return {result::other, ""};
  }
  if (!services.guards || form == ListForm::as_sent) return {};
  if (Refusal refusal = guarded_modification(normal_dn, first)) return refusal;
  return guarded_tls_files(normal_dn, first, operation_.authority, services.read_settings);
}

Refusal PendingOperation::prepare_controls(Services& services, const RequestControls& controls) {
  constexpr const char* kEverything = "(objectClass=*)";
  const bool may_read = may_search(operation_.authority);
  const auto search = [&](std::string_view filter, const std::vector<std::string>& attributes) {
    return std::make_unique<SideSearch>(services, home_->connection(), operation_, dn_.get(),
                                        filter, attributes, answer_.limits().bytes);
  };
  const auto read = [&](const std::optional<ReadWish>& wish, std::unique_ptr<SideSearch>& made) {
    if (!wish) return true;
    if (may_read) made = search(kEverything, wish->attributes);
    return may_read || !wish->critical;
  };
  if (controls.assertion && handler_ == parameter::add_function) {
    // There is no other entry that it could mean.
    assertion_on_added_ = controls.assertion;
  } else if (controls.assertion) {
    if (!may_read) return {result::assertion_failed, ""};
    assertion_ = search(*controls.assertion, {"1.1"});
  }
  if (!read(controls.pre_read, pre_read_) || !read(controls.post_read, post_read_))
    return {result::unavailable_critical_extension, "the bound identity may not read entries"};
  return {};
}

// What all connections may keep bounds each answer, and of a change the copies of the entry that go
// with it, half of the room each. Without room there is nothing of that; a change without copies is
// let through, since its answer is short.
bool PendingOperation::take_budget(const Services& services) noexcept {
  AnswerLimits limits = answer_.limits();
  const std::size_t room = services.output.room();
  limits.bytes = std::min(limits.bytes, room);
  if (pre_read_) pre_read_->bound(room / 2);
  if (post_read_) post_read_->bound(room / 2);
  if (handler_ != parameter::search_function && !pre_read_ && !post_read_) return true;
  answer_.set_limits(limits);
  if (room == 0) answer_.result(result::busy, "", "too many answers are unread");
  return room != 0;
}

// Other certificates may be believed than when the operation began to wait; whether that of its
// client is, the connection's own thread finds out.
bool PendingOperation::trust_holds(const Services& services) noexcept {
  if (trust.empty()) return true;
  const auto in_force = services.tls ? services.tls->current() : nullptr;
  if (in_force && in_force->trust() == trust) return true;
  answer_.result(result::busy, "", "other certificates are believed from now on, try again");
  return false;
}

// Whether who asked is still the same; who is not bound always is.
bool PendingOperation::identity_holds(const Services& services) const noexcept {
  return !identity_ || services.authenticator.generation() == identity_generation ||
         services.authenticator.still_valid(*identity_);
}

// Who lost rights while the operation waited has them no more.
bool PendingOperation::rights_hold(const Services& services) noexcept {
  if (identity_holds(services)) return true;
  answer_.result(result::insufficient_access, "", "the bound identity has changed or is gone");
  return false;
}

bool PendingOperation::is_primary() const noexcept {
  return operation_.authority == authority::primary_administrator;
}

// Which allowance is used up; "" when none is.
std::string_view PendingOperation::why_not_fail(Services& services) noexcept {
  const Clock::time_point now = Clock::now();
  FailedChangesByName& all = services.failed_changes;
  if (home_->failed_changes().used_up(share_of_connection(failure_limit), now) ||
      all.used_up(bound_dn(), failure_limit, now))
    return "too many modifications failed, try again later";
  if (!is_primary() && all.all_used_up(failure_limit_of_all, now))
    return "too many modifications of all identities failed, try again later";
  return "";
}

// A modify waits while those that failed have cost too much.
bool PendingOperation::may_fail(Services& services) noexcept {
  if (cost_of_failure_ == 0) return true;
  const std::string_view reason = why_not_fail(services);
  if (reason.empty()) return true;
  answer_.result(result::busy, "", reason);
  try {
    std::string line = "modify by ";
    append_client_text(line, bound_dn());
    line += " refused with 51: ";
    line += reason;
    services.cut_offs.tell(CutOff::changes, line);
  } catch (...) {
    // Without memory the line is lost.
  }
  return false;
}

bool PendingOperation::has_reserves() noexcept {
  if (!is_change() || fill_reserves()) return true;
  answer_.result(result::no_memory, "", "");
  return false;
}

// Inside the gate: the next operation must find the identities as this one left them.
void PendingOperation::take_over(Services& services, int code) noexcept {
  const bool made = code == result::success;
  const Consequences consequences =
      handler_ == parameter::add_function
          ? consequences_
          : consequences_of_change(changed_dn_, services.authenticator);
  settings_changed_ = made && consequences.settings;
  if (!services.take_over || (made && !consequences.any())) return;
  if (services.take_over(consequences, made)) settings_changed_ = consequences.settings;
}

void PendingOperation::renew_settings(Services& services) noexcept {
  if (settings_changed_ && services.renew_settings) services.renew_settings();
}

int PendingOperation::outcome() const noexcept {
  if (returned_) return *returned_;
  return answer_.answered() ? answer_.code() : kNotPerformed;
}

namespace {

ChangeType change_type(int handler) noexcept {
  if (handler == parameter::add_function) return ChangeType::add;
  return handler == parameter::delete_function ? ChangeType::remove : ChangeType::modify;
}

}  // namespace

// Who is to be told of what the handler did. Inside the gate.
PersistentSearches::Audience PendingOperation::changed(Services& services, int code) noexcept {
  if (code != result::success) return {};
  entry* before = nullptr;
  slapi_pblock_get(parameters_.get(), parameter::entry_before_delete, &before);
  slapi_pblock_set(parameters_.get(), parameter::entry_before_delete, nullptr);
  return services.persistent_searches.audience(change_type(handler_), changed_dn_,
                                               EntryPtr(before));
}

// Whether a change was made that the handler reports as made.
bool PendingOperation::was_made(const Services& services,
                                unsigned long made_before) const noexcept {
  return !is_change() || !services.changes_made || services.changes_made() != made_before;
}

// Calls the handler and sees to the result.
int PendingOperation::call(Services& services) noexcept {
  const unsigned long made_before = services.changes_made ? services.changes_made() : 0;
  int code = services.backend.call_keeping_gate(handler_, parameters_.get(), home_->connection(),
                                                is_change());
  // Where memory runs out at one place, handlers take it that nothing was to be written.
  if (code == result::success && !was_made(services, made_before)) {
    code = result::no_memory;
    answer_.retract();
    services.logs.error("a change was reported as made that was not, for want of memory");
  }
  if (!answer_.answered()) answer_.result(code != 0 ? code : result::other, "", "");
  returned_ = code;
  return code;
}

// What follows a change, whatever became of it.
void PendingOperation::settle_change(Services& services, int code) noexcept {
  settle_password_changes(code == result::success);
  if (code != result::success && cost_of_failure_ != 0 && !services.backend.could_not_open()) {
    const Clock::time_point now = Clock::now();
    home_->failed_changes().charge(cost_of_failure_, share_of_connection(failure_limit), now);
    services.failed_changes.charge(bound_dn(), cost_of_failure_, failure_limit, now);
    if (!is_primary())
      services.failed_changes.charge_all(cost_of_failure_, failure_limit_of_all, now);
  }
  take_over(services, code);
}

bool PendingOperation::may_begin(Services& services) noexcept {
  if (answer_.abandoned()) return false;
  if (answer_.canceled()) {
    answer_.result(result::canceled, "", "");
    return false;
  }
  return trust_holds(services) && rights_hold(services) && take_budget(services) &&
         may_fail(services) && has_reserves();
}

// Keeps what a search for a copy of the entry has found. False without memory.
bool PendingOperation::take_copy(SideSearch& search, const char* oid) noexcept {
  try {
    copies_.push_back({oid, false, search.shown_entry()});
    return true;
  } catch (...) {
    return false;
  }
}

// What is to be known before the operation itself, by the state of the file that it will find: the
// gate is held from here to its end.
int PendingOperation::test_conditions(Services& services) noexcept {
  if (assertion_on_added_) {
    const int code =
        test_assertion(services.schema, *entry_, *assertion_on_added_, operation_.authority);
    if (code != 0) return code;
  }
  if (assertion_) {
    if (const int code = assertion_->run(services.backend)) return code;
    if (!assertion_->found()) return result::assertion_failed;
  }
  if (!pre_read_) return result::success;
  if (const int code = pre_read_->run(services.backend)) return code;
  return take_copy(*pre_read_, kPreReadOid) ? result::success : result::no_memory;
}

// A failure is the operation's result. Nothing is made yet, so also a change can be given up here.
bool PendingOperation::conditions_hold(Services& services) noexcept {
  const cfg::InterruptScope scope(&PendingOperation::interrupted, this);
  int code = test_conditions(services);
  if (is_change() && answer_.is_given_up()) code = result::canceled;
  if (code == 0) return true;
  answer_.result(code, "", "");
  return false;
}

Refusal PendingOperation::refuse_policy(Services& services) {
  if (!services.guards) return {};
  const unsigned authority = operation_.authority;
  if (handler_ == parameter::add_function)
    return guarded_policy(services.schema, changed_dn_, *entry_, authority);
  ldapmod* first = nullptr;
  if (handler_ == parameter::modify_function)
    slapi_pblock_get(parameters_.get(), parameter::modifications, &first);
  return guarded_policy(services.schema, changed_dn_, first, authority, services.read_policy);
}

// Looked at here, since it depends on what the changes before this one have left. While the policy
// is on the rules refuse most of this themselves, without a text: the answer is the same then.
bool PendingOperation::policy_holds(Services& services) noexcept try {
  if (!is_change()) return true;
  const Refusal refusal = refuse_policy(services);
  if (!refusal) return true;
  services.logs.warning(refusal.text);
  answer_.result(refusal.code, "", pwdIsAdminPolicyOn() ? "" : refusal.text);
  return false;
} catch (...) {
  answer_.result(result::no_memory, "", "");
  return false;
}

// The change is made, so nothing here can fail it any more: without a copy the result goes alone,
// also when it would take too long. Whoever is not any more who they were sees a name and nothing
// else.
void PendingOperation::copy_afterwards(Services& services) noexcept {
  if (answer_.abandoned()) return;
  bool good = true;
  if (post_read_) {
    const cfg::InterruptScope scope(&PendingOperation::interrupted, this);
    const int code = identity_holds(services) ? post_read_->run(services.backend) : 0;
    good = code == 0 && take_copy(*post_read_, kPostReadOid);
  }
  if (!answer_.attach_to_result(copies_)) good = false;
  if (!good && !answer_.is_given_up())
    services.logs.error("a change was made, but a copy of its entry cannot be shown");
}

void PendingOperation::run(Services& services, bool on_home_thread) noexcept {
  PersistentSearches::Audience audience;
  if (may_begin(services)) {
    on_home_thread_ = on_home_thread;
    next_look_ = Clock::now() + kLookInterval;
    std::optional<cfg::InterruptScope> scope;
    if (!is_change()) scope.emplace(&PendingOperation::interrupted, this);
    if (conditions_hold(services) && policy_holds(services)) audience = perform(services);
    // A search that could not join would miss changes.
    if (persistent && !notice_of && answer_.code() == result::success &&
        !services.persistent_searches.join(persistent))
      persistent->fail(result::no_memory);
    charged_ = answer_.bytes().size();
    home_->output().answered(charged_);
  }
  services.backend.leave_gate();
  services.persistent_searches.announce(std::move(audience));
}

PersistentSearches::Audience PendingOperation::perform(Services& services) noexcept {
  const int code = call(services);
  if (!is_change()) {
    learn_cost(services, code);
    return {};
  }
  settle_change(services, code);
  PersistentSearches::Audience audience = changed(services, code);
  if (code == result::success) copy_afterwards(services);
  return audience;
}

void PendingOperation::learn_cost(Services& services, int code) noexcept {
  if (!long_running_) return;
  const bool whole = scope_ == 2 && dn_.get() == kWholeTree && code == result::success;
  services.search_cost.learn(looked_at_, whole);
}

bool PendingOperation::interrupted(void* self) noexcept {
  return static_cast<PendingOperation*>(self)->must_stop();
}

// Called for each entry that a search looks at.
bool PendingOperation::must_stop() noexcept {
  ++looked_at_;
  if (answer_.is_given_up()) return true;
  if (stopping_->load(std::memory_order_relaxed)) {
    answer_.cut_off_by_stop();
    return true;
  }
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
