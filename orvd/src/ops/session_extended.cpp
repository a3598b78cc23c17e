// Extended operations (RFC 4511, 4.12) other than StartTLS: Who am I (RFC 4532) and Cancel
// (RFC 3909).
#include <algorithm>
#include <new>

#include "cfg/result_codes.h"
#include "logs.h"
#include "ops/request_text.h"
#include "ops/session.h"

namespace orv::server {
namespace {

// More than a client has reason to send while one search runs.
constexpr std::size_t kMostCanceledAhead = 64;

}  // namespace

void Session::extended(std::int32_t id, const ExtendedRequest& request) {
  if (request.oid == kStartTlsOid) return begin_tls(id, request);
  if (request.oid == kWhoAmIOid) return who_am_i(id, request);
  if (request.oid == kCancelOid) return cancel(id, request);
  respond(id, tag::extended_response, result::protocol_error, "extended operation not supported",
          described(request));
}

// ---- Who am I

void Session::who_am_i(std::int32_t id, const ExtendedRequest& request) {
  constexpr std::string_view kWhat = "WHOAMI";
  if (request.value)
    return respond(id, tag::extended_response, result::protocol_error, "Who am I takes no value",
                   kWhat);
  const Clock::time_point started = Clock::now();
  std::string who;
  if (identity_) {
    const std::string& shown = identity_->shown_dn;
    who = "dn:" + (shown.empty() ? identity_->bound_dn : shown);
  }
  Answer answer(id, tag::extended_response, {});
  ResultAnswer result{};
  result.response_value = &who;
  answer.result(result);
  transmit_answer(answer);
  log_result(id, kWhat, result.code, 0, started);
}

// ---- Cancel

// What waits is ended at once. What somebody has in hand is told so, and answers when it comes
// back: the Cancel operation is answered then, by what became of it.
void Session::cancel(std::int32_t id, const ExtendedRequest& request) {
  std::string what = "CANCEL";
  const auto answer = [&](int code, std::string_view text) {
    respond(id, tag::extended_response, code, text, what);
  };
  std::int32_t target = 0;
  const int code = request.value ? read_cancel(*request.value, target) : result::protocol_error;
  if (code == result::no_memory) throw std::bad_alloc();
  if (code != 0) return answer(code, "the request of Cancel is not valid");
  append_number(what += " id=", target);
  if (was_canceled_ahead(id, target)) return answer(result::success, "");
  if (target == id || is_being_canceled_by(target))
    return answer(result::cannot_cancel, "a Cancel operation cannot be canceled");
  if (const PersistentSearchPtr search = persistent_search(target)) {
    end_persistent(search, result::canceled, "");
    return answer(result::success, "");
  }
  const OperationPtr operation = outstanding(target);
  if (!operation) return answer(result::no_such_operation, "");
  if (operation->canceled_by != 0) return answer(result::too_late, "it is being canceled already");
  operation->canceled_by = id;
  operation->cancel_received = Clock::now();
  operation->answer().cancel();
  if (operation->held || services_.backend.gate().withdraw(*operation))
    answer_and_complete(operation, result::canceled, "");
}

bool Session::is_being_canceled_by(std::int32_t message_id) const noexcept {
  if (message_id == 0) return false;  // that of operations that nobody cancels
  return std::any_of(
      outstanding_.begin(), outstanding_.end(),
      [message_id](const OperationPtr& other) { return other->canceled_by == message_id; });
}

// The operation that was to be canceled is answered.
void Session::finish_cancel(const PendingOperation& operation) {
  const Answer& answer = operation.answer();
  if (gone_)
    return log_result(operation.canceled_by, "CANCEL", kAbandoned, 0, operation.cancel_received);
  std::string what = "CANCEL id=";
  append_number(what, answer.message_id());
  bool canceled = !answer.abandoned() && answer.code() == result::canceled;
  // The first part of a persistent search may end just then: what follows it can be canceled still.
  const PersistentSearchPtr search = persistent_search(answer.message_id());
  if (search && search == operation.persistent) {
    end_persistent(search, result::canceled, "");
    canceled = true;
  }
  respond(operation.canceled_by, tag::extended_response,
          canceled ? result::success : result::too_late, "", what);
}

// ---- Cancel operations that were seen while a search ran on the connection's own thread

void Session::cancel_ahead(PendingOperation& operation, std::int32_t canceled_by) {
  if (canceled_ahead_.size() >= kMostCanceledAhead) return;
  canceled_ahead_.push_back({canceled_by, operation.answer().message_id()});
  operation.answer().cancel();
}

bool Session::was_canceled_ahead(std::int32_t id, std::int32_t target) noexcept {
  const auto found = std::find_if(canceled_ahead_.begin(), canceled_ahead_.end(),
                                  [id, target](const CanceledAhead& ahead) {
                                    return ahead.canceled_by == id && ahead.target == target;
                                  });
  if (found == canceled_ahead_.end()) return false;
  canceled_ahead_.erase(found);
  return true;
}

}  // namespace orv::server
