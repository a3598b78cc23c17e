// What a connection writes to the audit log: every attempt to change the configuration, with its
// result, whether it was performed or refused.
#include "audit/log.h"
#include "audit/record.h"
#include "ops/session.h"

namespace orv::server {
namespace {

std::string_view kind_of(const AddRequest&) {
  return "add";
}
std::string_view kind_of(const DeleteRequest&) {
  return "delete";
}
std::string_view kind_of(const ModifyRequest&) {
  return "modify";
}

}  // namespace

bool Session::is_audited() const noexcept {
  return services_.audit && services_.audit->enabled();
}

AuditDetail Session::audit_detail() const noexcept {
  return connection_.authority == authority::no_configuration_access ? AuditDetail::brief
                                                                     : AuditDetail::whole;
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

// Writes the record of an operation, once. `wait`: it may take a moment.
void Session::audit(PendingOperation& operation, bool wait) noexcept {
  if (operation.audit_operation.empty() || !is_audited()) return;
  try {
    std::string record = audit_record(
        {std::chrono::system_clock::now(), operation.bound_dn(), peer_, number_,
         operation.answer().message_id(), operation.audit_operation, operation.outcome()},
        operation.audit_text);
    if (wait)
      services_.audit->write_and_wait(std::move(record));
    else
      services_.audit->write(std::move(record));
  } catch (...) {
    services_.logs.error("no memory for a record of the audit log");
  }
  operation.audit_operation = {};
}

// For a request that was refused before it became an operation.
void Session::audit_refused(const Message& message, int code) noexcept {
  if (!is_audited()) return;
  const auto record = [&](const auto& request) {
    services_.audit->write(
        audit_record({std::chrono::system_clock::now(), identity_ ? identity_->bound_dn : "", peer_,
                      number_, message.id, kind_of(request), code},
                     describe_change(services_.schema, request, audit_detail())));
  };
  try {
    if (const auto* add = std::get_if<AddRequest>(&message.request)) record(*add);
    if (const auto* remove = std::get_if<DeleteRequest>(&message.request)) record(*remove);
    if (const auto* modify = std::get_if<ModifyRequest>(&message.request)) record(*modify);
  } catch (...) {
    services_.logs.error("no memory for a record of the audit log");
  }
}

}  // namespace orv::server
