// What a connection means in LDAP: who is bound, which operations are outstanding, and what is done
// with each message. How bytes come and go is its subclass's affair.
//
// Rules kept here (RFC 4511): a bind waits until nothing is outstanding, and nothing else is read
// meanwhile; a failed bind leaves the connection anonymous; abandon and unbind have no answer; a
// message ID that is still in use ends the connection; unknown critical controls are refused; what
// follows a StartTLS request in clear is not looked at.
// Callers without access to the configuration are refused before the backend is entered.
//
// Threads: everything on the connection's loop thread, except `decided`.
#pragma once

#include <atomic>
#include <deque>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "auth/sasl.h"
#include "ops/controls.h"
#include "ops/operation.h"
#include "ops/paged_results.h"
#include "ops/services.h"
#include "protocol/decoder.h"
#include "protocol/message.h"
#include "settings.h"

namespace orv::server {

inline constexpr const char* kStartTlsOid = "1.3.6.1.4.1.1466.20037";

class Session : public OperationHome,
                public ChangeListener,
                public std::enable_shared_from_this<Session> {
 public:
  Session(Services& services, AccessLane& access, std::uint64_t number);
  ~Session() override;

  Connection& connection() noexcept override { return connection_; }
  void decided(std::shared_ptr<PendingOperation> operation, Verdict verdict) noexcept override;
  OutputShare& output() noexcept override { return output_; }
  FailedChanges& failed_changes() noexcept override { return failed_changes_; }
  void has_news(PersistentSearchPtr search) noexcept override;

 protected:
  // ---- what the subclass provides
  virtual const Settings& settings() const noexcept = 0;
  // Runs `work` on the loop's thread later. Any thread.
  virtual void post(std::function<void()> work) = 0;
  // Queues finished messages for the client; `bytes` is left empty, perhaps with other storage.
  virtual void transmit(std::string& bytes) = 0;
  // Lends an empty string with storage that was used before, if there is one.
  virtual void lend_storage(std::string& bytes) noexcept = 0;
  // Writes what is queued before something that may take long.
  virtual void flush() = 0;
  // Ends the connection with a notice of disconnection.
  virtual void disconnect(int code, std::string_view text) = 0;
  // Ends the connection without a word.
  virtual void drop() = 0;
  // Something that kept the session from taking messages may be over.
  virtual void resume() = 0;
  // Nothing is outstanding any more on a connection that has ended.
  virtual void settled() = 0;
  // Whether TLS could be started now, if nothing but the transport were asked.
  virtual bool can_start_tls() const noexcept { return false; }
  // The answer to StartTLS is queued: no message is handled any more before TLS stands.
  virtual void start_tls() {}
  // Whether bytes are here that the client sent behind the message at hand.
  virtual bool more_is_here() const noexcept { return false; }
  // Whether what the transport proves of the client still holds; ends the connection when it does
  // not. To be asked before anything is done for the client.
  virtual bool transport_holds() { return true; }
  // By what the certificate of the client was believed (TlsContext::trust); "" when it has none.
  virtual std::string transport_trust() const { return ""; }
  // From what is queued next on, and for what comes in from now on, `layer` is used.
  virtual void protect(std::unique_ptr<SecurityLayer> layer);

  // ---- what the subclass calls
  // Handles one whole message; `frame` need not outlive the call.
  void handle(std::string_view frame);
  // Whether the next message must wait.
  bool busy() const noexcept;
  // The client is gone: no answer reaches it, waiting operations are dropped.
  void client_left() noexcept;
  bool client_is_gone() const noexcept { return gone_; }
  bool idle() const noexcept { return outstanding_.empty() && !bind_; }
  // The client waits for changes, however long nothing happens.
  bool listens() const noexcept { return !persistent_.empty(); }
  // Who the client is, for the audit log.
  void set_peer(std::string_view peer) { peer_ = peer; }
  // As whom the client takes turns with others where work queues.
  void set_counted_as(std::string_view address) { counted_as_ = address; }
  // What the transport proves; before the first message, and when TLS stands.
  void set_transport(TransportFacts facts) {
    transport_ = std::move(facts);
    count_in_total();
  }
  const TransportFacts& transport() const noexcept { return transport_; }
  // A search that runs on the connection's thread is canceled by a message that is here and has not
  // had its turn yet. Throws std::bad_alloc.
  void cancel_ahead(PendingOperation& operation, std::int32_t canceled_by);
  // Whether a bind in several steps has taken until `now` longer than it may.
  bool bind_is_overdue(Clock::time_point now) const noexcept;
  bool is_unauthenticated() const noexcept { return unauthenticated_; }
  // For how long nobody has been bound on the connection, if nobody is.
  Clock::duration without_identity(Clock::time_point now) const noexcept {
    return unauthenticated_ ? now - unauthenticated_since_ : Clock::duration::zero();
  }
  std::string_view peer() const noexcept { return peer_; }
  // The subclass has so many bytes to write now. To be called whenever that changes.
  void output_is(std::size_t unwritten) noexcept;
  // To be called a few times a second, also when the client is gone.
  void tick();
  // Calls the unbind handler. Once, when the session has settled.
  void unbind() noexcept;
  // Starts an access line of this connection; null when the access log is off.
  std::string* begin_access_line();
  void end_access_line() { access_.end(); }

  Services& services() const noexcept { return services_; }

 private:
  // A bind request that waits or is being verified. It does not move, so that the password is in
  // one place, and is wiped there.
  struct Bind {
    ~Bind();
    std::int32_t message_id = 0;
    BindRequest request;
    Refusal refusal;  // decided already
    bool started = false;
    Clock::time_point received = Clock::now();

    // The verification's outcome; valid from `verified` on.
    int code = 0;
    std::shared_ptr<const Identity> identity;
    std::unique_ptr<SaslExchange> exchange;  // whose step this is
    SaslOutcome outcome;                     // of that step
    std::uint64_t generation = 0;            // of the identities, not newer than what was asked
    std::atomic<bool> verified{false};
  };
  // What became of an operation, for the log.
  struct Delivered {
    int code;
    std::int64_t entries;
  };
  // A Cancel operation that took effect before its turn came to be handled.
  struct CanceledAhead {
    std::int32_t canceled_by;
    std::int32_t target;
  };
  using BindPtr = std::shared_ptr<Bind>;
  using OperationPtr = std::shared_ptr<PendingOperation>;

  void refuse_form(Message& message, const Decoded& decoded);
  void end_for_message_id(const Message& message);
  Refusal refuse_within_bind();
  void take(Message& message);
  OperationPtr outstanding(std::int32_t message_id) const noexcept;
  // For the access log; "" when that is off.
  std::string described(const Request& request) const;
  void abandon(std::int32_t message_id);

  // Reads the controls, and which of them are used here and now.
  Refusal read_controls(const Message& message, RequestControls& controls) const;
  bool is_switched_off(std::string_view control) const noexcept;
  bool is_in_use(std::int32_t message_id) const noexcept;

  void search(std::int32_t id, SearchRequest& request, const RequestControls& controls);
  void submit_search(const OperationPtr& operation, SearchRequest& request,
                     std::string_view normal_base, const RequestControls& controls);
  template <typename ChangeRequest>
  void change(std::int32_t id, const ChangeRequest& request, const RequestControls& controls);
  template <typename ChangeRequest>
  OperationPtr prepare_change(std::int32_t id, const ChangeRequest& request,
                              const RequestControls& controls, Refusal& refusal);
  void search_published(std::int32_t id, const SearchRequest& request,
                        const RequestControls& controls,
                        const std::shared_ptr<const entry>& published);

  enum class Target { root_dse, subschema, configuration, nothing, not_a_dn };
  Target find_target(std::string_view dn, std::string& normal) const;
  Refusal refuse_change(Target target) const;

  OperationPtr make_operation(std::int32_t id, int response_tag, std::int64_t time_limit,
                              std::int64_t size_limit);
  void submit(const OperationPtr& operation, const Refusal& refusal);
  void start(const OperationPtr& operation);
  void answer_and_complete(const OperationPtr& operation, int code, std::string_view text);
  void run_here(const OperationPtr& operation);
  void forget(const OperationPtr& operation) noexcept;
  void run_on_worker(const OperationPtr& operation) noexcept;
  void work(const OperationPtr& operation) noexcept;
  void hand_back(const OperationPtr& operation, Step step) noexcept;
  void take_step(const OperationPtr& operation);
  void take_step_or_end(const OperationPtr& operation) noexcept;
  void complete(const OperationPtr& operation);
  void go_on();
  Delivered deliver(PendingOperation& operation);
  void transmit_answer(Answer& answer);
  bool give_up(const OperationPtr& operation) noexcept;
  bool turn_back(PendingOperation& operation) noexcept;
  void hold(const OperationPtr& operation);
  bool hold_all();
  void start_held();
  void start_held_later() noexcept;
  void pick_up_stranded();
  void end_for_want_of_memory() noexcept;
  void respond(std::int32_t id, int response_tag, int code, std::string_view text,
               std::string_view what);
  // In the place of a result code: the operation had none.
  static constexpr int kAbandoned = -1;
  // `from`: who the client is, where that belongs on the line.
  void log_result(std::int32_t id, std::string_view what, int code, std::int64_t entries,
                  Clock::time_point started, std::string_view from = {}) noexcept;

  // ---- persistent searches, in session_notices.cpp
  Refusal begin_persistent(PendingOperation& operation, const PersistentSearchControl& control,
                           const SearchRequest& request, std::string_view normal_base);
  static SearchRequest probe(const SearchRequest& request);
  void first_part_done(PendingOperation& operation);
  void hear(const PersistentSearchPtr& search);
  void next_notice();
  void next_notice_later() noexcept;
  void search_for_notice(const PersistentSearchPtr& search, const ChangePtr& change);
  void tell_deletion(PersistentSearch& search, const Change& change);
  void notice_done(const OperationPtr& operation);
  PersistentSearchPtr persistent_search(std::int32_t message_id) const noexcept;
  // `code` kAbandoned: without a result.
  void end_persistent(PersistentSearchPtr search, int code, std::string_view text);
  void end_persistent_searches();
  void look_after_persistent_searches();

  // ---- the audit log, in session_audit.cpp
  bool is_audited() const noexcept;
  AuditDetail audit_detail() const noexcept;
  template <typename ChangeRequest>
  void prepare_audit(PendingOperation& operation, const ChangeRequest& request);
  bool is_stranger() const noexcept;
  std::uint64_t write_audit(std::string record) noexcept;
  std::uint64_t audit(PendingOperation& operation) noexcept;
  void hand_back_recorded(const OperationPtr& operation, std::uint64_t record) noexcept;
  template <typename ChangeRequest>
  void audit_attempt(std::int32_t id, const ChangeRequest& request, int code) noexcept;
  void audit_refused(const Message& message, int code) noexcept;

  // ---- binds, in session_bind.cpp
  void receive_bind(std::int32_t id, BindRequest& request, Refusal refusal);
  void try_bind();
  void start_bind();
  bool needs_confidentiality() const noexcept;
  void verify_password();
  void start_step();
  static void take_step_of(Bind& bind) noexcept;
  void finish_step(const BindPtr& bind);
  template <typename Work>
  void on_verifier(Work work);
  void come_back(const BindPtr& bind) noexcept;
  static std::string describe_bind(const Bind& bind, const Identity* identity);
  void verify(const BindPtr& bind) noexcept;
  void verified(const BindPtr& bind);
  void ask_backend_to_bind();
  void finish_bind(int code, std::string_view text, std::shared_ptr<const Identity> identity);
  void become(std::shared_ptr<const Identity> identity) noexcept;
  void count_as_unauthenticated(bool counted) noexcept;
  void count_in_total() noexcept;

  // ---- paged results, in session_pages.cpp
  PagedSearches::Limits page_limits() const noexcept;
  void prepare_pages(PendingOperation& operation, const SearchRequest& request,
                     std::string_view normal_base, const PagedResultsControl& control);
  void next_page(std::int32_t id, const SearchRequest& request, std::string_view normal_base,
                 const PagedResultsControl& control);
  Delivered first_page(PendingOperation& operation);
  Delivered make_page(std::int32_t id, std::int64_t size, std::string key, FoundEntries found,
                      std::string& out);

  // ---- extended operations, in session_extended.cpp
  void extended(std::int32_t id, const ExtendedRequest& request);
  void who_am_i(std::int32_t id, const ExtendedRequest& request);
  void cancel(std::int32_t id, const ExtendedRequest& request);
  bool is_being_canceled_by(std::int32_t message_id) const noexcept;
  bool was_canceled_ahead(std::int32_t id, std::int32_t target) noexcept;
  void finish_cancel(const PendingOperation& operation);
  void begin_tls(std::int32_t id, const ExtendedRequest& request);
  Refusal refuse_tls(const ExtendedRequest& request) const;
  Offer offer() const;
  bool identity_holds();
  bool awaits_change() const noexcept;
  void settle_if_done();

  Services& services_;
  AccessLane& access_;
  const std::uint64_t number_;
  Connection connection_;
  ConnectionAux aux_;
  std::shared_ptr<const Identity> identity_;  // null: anonymous
  std::uint64_t identity_checked_ = 0;        // the generation by which it was good
  Clock::time_point change_told_{};           // when the last change was answered
  OutputShare output_;
  GateUser gate_user_;
  FailedChanges failed_changes_;
  std::string peer_;
  std::string counted_as_;
  std::vector<OperationPtr> outstanding_;
  std::vector<PersistentSearchPtr> persistent_;  // whose first part is over
  std::deque<PersistentSearchPtr> news_;         // one for each change that is to be told
  OperationPtr notice_;                          // that is being looked up
  bool notice_posted_ = false;
  BindPtr bind_;
  PagedSearches pages_;
  std::vector<CanceledAhead> canceled_ahead_;
  TransportFacts transport_;
  bool protected_ = false;                  // a security layer of SASL is in use
  std::unique_ptr<SaslExchange> exchange_;  // between two of its steps
  std::string mechanism_;                   // of the exchange
  Clock::time_point exchange_begun_{};
  std::uint64_t exchange_generation_ = 0;  // of the identities when it began
  bool unauthenticated_ = false;           // nobody is bound on the connection, and it is there
  bool in_total_ = false;                  // and counts among those over TCP
  Clock::time_point unauthenticated_since_{};
  bool gone_ = false;
  bool starting_held_ = false;
  std::size_t held_ = 0;                  // of the outstanding ones
  std::atomic<bool> turned_back_{false};  // at the gate, by an operation that has not begun since
  std::atomic<bool> stranded_{false};     // something could not be posted
};

}  // namespace orv::server
