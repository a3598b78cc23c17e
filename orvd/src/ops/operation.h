// One operation of a client on its way through the backend: the arguments in the form that handlers
// get, the wait at the gate, the call, and the answer.
//
// Threads: made and finished on the connection's loop thread; run on that thread or on a worker, by
// one thread at a time. Changes run on a worker, and so do searches below the base that may be
// long.
#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <string>

#include "audit/record.h"
#include "cfg/interrupt.h"
#include "ops/answer.h"
#include "ops/canonical.h"
#include "ops/consequences.h"
#include "ops/controls.h"
#include "ops/gate.h"
#include "ops/persistent_search.h"
#include "ops/services.h"
#include "ops/side_search.h"

namespace orv::server {

class PendingOperation;

// The connection as its operations see it. It outlives them.
class OperationHome {
 public:
  virtual ~OperationHome() = default;
  virtual Connection& connection() noexcept = 0;

  // The gate decided on a waiting operation. Any thread; must not run it at once.
  virtual void decided(std::shared_ptr<PendingOperation> operation, Verdict verdict) noexcept = 0;

  // Polled now and then while an operation runs on the connection's own thread, which cannot read
  // meanwhile: whether the client left or gave the operation up, which is then marked abandoned.
  virtual bool lost_interest(PendingOperation& operation) noexcept = 0;

  // What the client has not read yet.
  virtual OutputShare& output() noexcept = 0;

  // What its changes that failed have cost. Only from inside the gate.
  virtual FailedChanges& failed_changes() noexcept = 0;
};

// What is to be done next with an operation that comes back to its connection's thread.
enum class Step {
  run,     // it holds the gate
  hold,    // its client has to read first
  late,    // it was not admitted in time
  closed,  // nobody is admitted any more
  finish,  // it has run
};

class PendingOperation final : public GateWaiter,
                               public std::enable_shared_from_this<PendingOperation> {
 public:
  PendingOperation(std::shared_ptr<OperationHome> home, std::shared_ptr<const Identity> identity,
                   std::int32_t message_id, int response_tag, const AnswerLimits& limits);
  ~PendingOperation() override;

  // Take over a request. A refusal leaves the operation to be answered with it.
  Refusal prepare_search(Services& services, SearchRequest& request, std::string_view normal_dn);
  Refusal prepare(Services& services, const AddRequest& request, std::string_view normal_dn);
  Refusal prepare(Services& services, const DeleteRequest& request, std::string_view normal_dn);
  Refusal prepare(Services& services, const ModifyRequest& request, std::string_view normal_dn);

  // Takes over the controls that have to do with the target's entry: assertion, pre-read and
  // post-read, which are tested and read by run(). After prepare, which it may follow with a
  // refusal: 12 an entry that the client may not read, 122 an assertion that he may not make.
  Refusal prepare_controls(Services& services, const RequestControls& controls);

  // Calls the handler and makes sure that there is a result. The caller holds the gate, which is
  // open or passed on afterwards. `on_home_thread`: the connection's thread runs it.
  void run(Services& services, bool on_home_thread) noexcept;

  // Makes the server's settings those of the file, after a change that touched them. Outside the
  // gate, on a worker, and before the result leaves: whoever has heard of the change can count on
  // it.
  void renew_settings(Services& services) noexcept;

  void gate_decided(Verdict verdict) noexcept override;

  Answer& answer() noexcept { return answer_; }
  const Answer& answer() const noexcept { return answer_; }
  // Changes flush to disk and some searches take long, so they run on a worker thread.
  bool wants_worker() const noexcept { return wants_worker_; }
  bool is_change() const noexcept {
    return handler_ != 0 && handler_ != parameter::search_function;
  }
  bool long_running() const noexcept { return long_running_; }
  Clock::time_point started() const noexcept { return started_; }

  // The result for the audit log: what the handler returned, also when nobody waited for it.
  int outcome() const noexcept;
  std::string_view bound_dn() const noexcept { return operation_.bound_dn; }

  // Which reading of the identities the bound one was good by.
  std::uint64_t identity_generation = 0;

  // By what the certificate of the client was believed; "": it has none.
  std::string trust;

  // The limit of what changes that fail may cost, in bytes.
  std::int64_t failure_limit = 0;
  std::int64_t failure_limit_of_all = 0;  // of all identities together

  std::string log_text;  // what the access log says of the request; empty when it is off

  std::string audit_text;            // what the audit log says of the request,
  std::string_view audit_operation;  // and its kind; empty: nothing, or it has said it

  // The persistent search that this operation is a part of: a notice of the change `notice_of`, or
  // the first part when that is null.
  PersistentSearchPtr persistent;
  ChangePtr notice_of;
  std::optional<EntryChangeControl> change_control;

  // The page that this search is to be answered with, and what all its pages have in common.
  std::optional<PagedResultsControl> page;
  std::string page_key;

  // A Cancel operation that waits for the end of this one: its message id, 0 for none.
  std::int32_t canceled_by = 0;
  Clock::time_point cancel_received{};

  // Bytes of the answer that were added to the connection's output share.
  std::size_t charged() const noexcept { return charged_; }

  // For the connection's thread: it waits until the client has read.
  bool held = false;
  // It was not turned back at the gate. Written by whoever has the operation in hand.
  std::atomic<bool> begun{false};
  // The next step, and whether it could not be posted, for want of memory. Written by whoever has
  // the operation in hand.
  std::atomic<Step> step{Step::run};
  std::atomic<bool> stranded{false};

 private:
  bool begin(Services& services, int handler, std::string_view normal_dn);
  bool set(int number, void* value) noexcept;
  static bool interrupted(void* self) noexcept;
  bool must_stop() noexcept;
  bool take_budget(const Services& services) noexcept;
  bool trust_holds(const Services& services) noexcept;
  bool identity_holds(const Services& services) const noexcept;
  bool rights_hold(const Services& services) noexcept;
  bool is_primary() const noexcept;
  std::string_view why_not_fail(Services& services) noexcept;
  bool may_fail(Services& services) noexcept;
  bool has_reserves() noexcept;
  bool may_begin(Services& services) noexcept;
  int test_conditions(Services& services) noexcept;
  bool conditions_hold(Services& services) noexcept;
  Refusal refuse_policy(Services& services);
  bool policy_holds(Services& services) noexcept;
  bool take_copy(SideSearch& search, const char* oid) noexcept;
  void copy_afterwards(Services& services) noexcept;
  PersistentSearches::Audience perform(Services& services) noexcept;
  int call(Services& services) noexcept;
  bool was_made(const Services& services, unsigned long made_before) const noexcept;
  void settle_change(Services& services, int code) noexcept;
  void take_over(Services& services, int code) noexcept;
  void learn_cost(Services& services, int code) noexcept;
  PersistentSearches::Audience changed(Services& services, int code) noexcept;

  const std::shared_ptr<OperationHome> home_;
  const std::shared_ptr<const Identity> identity_;  // null: anonymous
  const Clock::time_point started_ = Clock::now();
  Answer answer_;
  Operation operation_;
  int handler_ = 0;
  int scope_ = 0;
  bool long_running_ = false;
  bool wants_worker_ = true;
  std::size_t charged_ = 0;
  std::optional<int> returned_;       // by the handler
  std::string changed_dn_;            // of a change: handlers may rewrite their own copy
  Consequences consequences_;         // of an add, while it is as the client wrote it
  bool settings_changed_ = false;     // by a change that was made
  std::int64_t cost_of_failure_ = 0;  // what the backend keeps if it fails, in bytes

  // Arguments of the handler, released with the operation.
  PblockPtr parameters_;
  MallocText dn_;
  MallocText filter_;
  TextArray names_;
  EntryPtr entry_;

  // What controls ask for; null or nothing: nothing. Copies of the entry go with a successful
  // result.
  std::unique_ptr<SideSearch> assertion_;
  std::optional<std::string> assertion_on_added_;  // the filter as clients send it
  std::unique_ptr<SideSearch> pre_read_;
  std::unique_ptr<SideSearch> post_read_;
  std::vector<Control> copies_;

  // For the check of a running search.
  const std::atomic<bool>* stopping_ = nullptr;
  bool on_home_thread_ = false;
  std::size_t looked_at_ = 0;
  Clock::time_point next_look_{};
};

}  // namespace orv::server
