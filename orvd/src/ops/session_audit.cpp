// What a connection writes to the audit log: every attempt to change the configuration, with its
// result, whether it was performed or refused.
#include "audit/log.h"
#include "audit/record.h"
#include "ops/session.h"

namespace orv::server {
namespace {

constexpr std::string_view kNoMemory = "no memory for a record of the audit log";

std::string_view kind_of(const AddRequest&) {
  return "add";
}
std::string_view kind_of(const DeleteRequest&) {
  return "delete";
}
std::string_view kind_of(const ModifyRequest&) {
  return "modify";
}
std::string_view kind_of(const ModifyDnRequest&) {
  return "rename";
}

}  // namespace

bool Session::is_audited() const noexcept {
  return services_.audit && services_.audit->enabled();
}

bool Session::is_stranger() const noexcept {
  return connection_.authority == authority::no_configuration_access;
}

AuditDetail Session::audit_detail() const noexcept {
  return is_stranger() ? AuditDetail::brief : AuditDetail::whole;
}

std::uint64_t Session::write_audit(std::string record) noexcept {
  return services_.audit->write(std::move(record),
                                is_stranger() ? Attempt::of_stranger : Attempt::of_administrator);
}

// Takes down what is to be changed, while nobody has rewritten it.
template <typename ChangeRequest>
void Session::prepare_audit(PendingOperation& operation, const ChangeRequest& request) {
  if (!is_audited()) return;
  operation.audit_text = describe_change(services_.schema, request, audit_detail());
  operation.audit_operation = kind_of(request);
}
template void Session::prepare_audit(PendingOperation&, const AddRequest&);
template void Session::prepare_audit(PendingOperation&, const DeleteRequest&);
template void Session::prepare_audit(PendingOperation&, const ModifyRequest&);

// Writes the record of an operation, once; 0 when there is none.
std::uint64_t Session::audit(PendingOperation& operation) noexcept {
  if (operation.audit_operation.empty() || !is_audited()) return 0;
  AuditLog::Ticket record = 0;
  try {
    record = write_audit(audit_record(
        {std::chrono::system_clock::now(), operation.bound_dn(), peer_, number_,
         operation.answer().message_id(), operation.audit_operation, operation.outcome()},
        operation.audit_text));
  } catch (...) {
    services_.logs.error(kNoMemory);
  }
  operation.audit_operation = {};
  return record;
}

// Gives a change back to its connection when its record is written, or cannot be for long. No
// thread waits for that: the next change has the gate already.
void Session::hand_back_recorded(const OperationPtr& operation, std::uint64_t record) noexcept {
  if (record == 0) return hand_back(operation, Step::finish);
  std::function<void()> then;
  try {
    then = [this, self = shared_from_this(), operation] { hand_back(operation, Step::finish); };
  } catch (...) {
    return hand_back(operation, Step::finish);
  }
  services_.audit->when_written(record, std::move(then));
}

// For a request that did not become an operation.
template <typename ChangeRequest>
void Session::audit_attempt(std::int32_t id, const ChangeRequest& request, int code) noexcept {
  if (!is_audited()) return;
  try {
    write_audit(
        audit_record({std::chrono::system_clock::now(), identity_ ? identity_->bound_dn : "", peer_,
                      number_, id, kind_of(request), code},
                     describe_change(services_.schema, request, audit_detail())));
  } catch (...) {
    services_.logs.error(kNoMemory);
  }
}
template void Session::audit_attempt(std::int32_t, const AddRequest&, int) noexcept;
template void Session::audit_attempt(std::int32_t, const DeleteRequest&, int) noexcept;
template void Session::audit_attempt(std::int32_t, const ModifyRequest&, int) noexcept;

void Session::audit_refused(const Message& message, int code) noexcept {
  const Request& request = message.request;
  if (const auto* add = std::get_if<AddRequest>(&request)) audit_attempt(message.id, *add, code);
  if (const auto* remove = std::get_if<DeleteRequest>(&request))
    audit_attempt(message.id, *remove, code);
  if (const auto* modify = std::get_if<ModifyRequest>(&request))
    audit_attempt(message.id, *modify, code);
  if (const auto* rename = std::get_if<ModifyDnRequest>(&request))
    audit_attempt(message.id, *rename, code);
}

}  // namespace orv::server
