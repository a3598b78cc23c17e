// The answer to one operation: a buffer of finished LDAP messages with its budget and limits,
// filled by the send operations that a backend calls through the `Connection`.
//
// Sending never blocks: it appends here, and the connection drains the buffer later. Threads: the
// buffer belongs to the thread that runs the operation; only `abandon` and `cancel` may be called
// from others.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "ops/gate.h"
#include "protocol/encoder.h"
#include "slapi/connection.h"

namespace orv::server {

// What bounds an answer.
struct AnswerLimits {
  std::size_t bytes = 64 << 20;                           // budget of the whole answer
  std::int64_t entries = 0;                               // 0: no limit
  Clock::time_point deadline = Clock::time_point::max();  // of a search
};

class Answer {
 public:
  Answer(std::int32_t message_id, int response_tag, AnswerLimits limits)
      : message_id_(message_id), response_tag_(response_tag), limits_(limits) {}

  // Appends one search entry. 0; 4, 3, 11, 80 as SendSearchEntry says; 90 without memory. Nothing
  // is appended on failure.
  int entry(const orv::entry& e, char** attributes, bool types_only,
            LDAPControl** controls) noexcept;

  // Appends the result, once: later results and results of an abandoned operation are dropped.
  void result(int code, std::string_view matched_dn, std::string_view text) noexcept;

  // A result with what only some responses carry.
  void result(const ResultAnswer& answer) noexcept;

  // Takes back the result of an operation that has no entries: it was not true.
  void retract() noexcept {
    bytes_.clear();
    answered_ = false;
    code_ = 0;
  }

  // The answer is part of a persistent search: a successful result is not sent, since more is to
  // come. Without `entries` no entry is sent either.
  void keep_open(bool entries) noexcept {
    open_ = true;
    hide_entries_ = !entries;
  }
  // This control goes with each entry. It must live as long as the answer.
  void attach(LDAPControl* control) noexcept { attached_ = control; }

  // Nobody wants the answer any more: nothing is sent from now on. Any thread.
  void abandon() noexcept { abandoned_.store(true, std::memory_order_relaxed); }
  bool abandoned() const noexcept { return abandoned_.load(std::memory_order_relaxed); }

  // The client canceled the operation (RFC 3909) while somebody had it in hand: a search ends with
  // 118 and shows nothing of what it found; a change does when it has not begun. Any thread.
  void cancel() noexcept { canceled_.store(true, std::memory_order_relaxed); }
  bool canceled() const noexcept { return canceled_.load(std::memory_order_relaxed); }
  // Nobody waits for what is still to be found.
  bool is_given_up() const noexcept { return abandoned() || canceled(); }

  // Adds controls to the successful result of an operation without entries. False without memory:
  // it stays as it was.
  bool attach_to_result(const std::vector<Control>& controls) noexcept;

  // The search is cut off because the server stops: its result is then 52, whatever limit the
  // backend took for the cause.
  void cut_off_by_stop() noexcept { cut_off_ = true; }

  bool answered() const noexcept { return answered_; }
  int code() const noexcept { return code_; }
  std::int64_t entries() const noexcept { return entries_; }
  std::int32_t message_id() const noexcept { return message_id_; }
  int response_tag() const noexcept { return response_tag_; }
  const AnswerLimits& limits() const noexcept { return limits_; }
  void set_limits(const AnswerLimits& limits) noexcept { limits_ = limits; }

  // The finished messages.
  std::string& bytes() noexcept { return bytes_; }

 private:
  bool select(char** attributes) noexcept;
  bool append(const orv::entry& e, bool types_only, LDAPControl** controls) noexcept;
  void replace_by_canceled(ResultAnswer& answer) noexcept;

  const std::int32_t message_id_;
  const int response_tag_;
  AnswerLimits limits_;
  std::string bytes_;
  std::int64_t entries_ = 0;
  int code_ = 0;
  bool answered_ = false;
  bool cut_off_ = false;
  bool open_ = false;
  bool hide_entries_ = false;
  LDAPControl* attached_ = nullptr;
  bool selected_ = false;  // selection_ stands for selected_list_
  char** selected_list_ = nullptr;
  AttributeSelection selection_;
  std::atomic<bool> abandoned_{false};
  std::atomic<bool> canceled_{false};
};

// Installs the send operations in a connection. They reach the answer through `Operation::server`,
// which must point to an `Answer`; one that is null drops everything, as a connection of the
// server's own does.
void install_senders(Connection& connection) noexcept;

}  // namespace orv::server
