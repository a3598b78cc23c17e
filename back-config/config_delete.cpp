#include "config_delete.h"

#include <strings.h>

#include <cstring>
#include <memory>

#include "callers.h"
#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "config_add.h"
#include "config_names.h"
#include "config_session.h"
#include "config_xlate.h"
#include "function_ids.h"
#include "handlers.h"
#include "slapi/entry.h"
#include "slapi/owners.h"
#include "slapi/psearch.h"
#include "slapi/strings.h"
#include "slapi/trace.h"

namespace orv {
namespace {

constexpr const char* kNoEntry = "Error - check_delete_authority: entry %s does not exist!\n";
constexpr const char* kMonitorNotLocked = "Failed to acquire lock on monitor mutex, rc=%d.\n";
constexpr const char* kMonitorNotUnlocked = "Failed to release lock on monitor mutex, rc=%d.\n";

constexpr const char* kObjectClass = "OBJECTCLASS";
// The backend's own entry, in mixed case; compared without regard to case.
constexpr const char* kOwnBackendDn =
    "cn=ConfigDB,cn=Config Backends,cn=ORV Directory,cn=Schemas,cn=Configuration";
constexpr int kPersistentSearchesOn = 1;

}  // namespace

// ======== Who may delete

namespace {

struct CharrayDeleter {
  void operator()(char** array) const noexcept { charray_free(array); }
};
using Charray = std::unique_ptr<char*, CharrayDeleter>;

bool is_supplier(char** object_classes) {
  for (char** value = object_classes; *value != nullptr; ++value) {
    if (kel_strcasecmp(*value, config_names::supplier_class) == 0) return true;
  }
  return false;
}

// Whether the entry is that of a supplier. 0; 32 there is no entry; 16 it has no object classes; or
// the code with which it could not be read.
int read_object_classes(const ldtr_function_local& trace, _CFG* session, const char* dn,
                        bool& supplier) {
  Charray values;  // independent of the chain, which goes first
  CfgResult chain;
  _CFGMessage* found = nullptr;
  int rc = cfg_read_cfg_entry(session, dn, kObjectClass, kScopeBase, &found);
  chain.reset(found);
  if (rc != 0) return rc;
  _CFGMessage* const record = cfg_first_entry(session, chain.get());
  if (record == nullptr) {
    trace.debug(trace::error, kNoEntry, dn);
    return result::no_such_object;
  }
  values.reset(cfg_get_values(session, record, kObjectClass));
  rc = cfg_get_errno(session);
  if (values == nullptr) return result::no_such_attribute;  // whatever the error number
  supplier = is_supplier(values.get());
  return rc;
}

}  // namespace

int check_delete_authority(Connection* connection, Operation* operation, entry* /*e*/,
                           const char* dn) {
  ldtr_function_local trace(function_id::check_delete_authority);
  if (has_no_configuration_access(*operation)) return trace.exit(result::insufficient_access);

  // The entry is read for every caller, so that a missing one is told before the roles are asked.
  bool supplier = false;
  const int rc = read_object_classes(trace, connection->config_session, dn, supplier);
  if (rc != 0) return trace.exit(rc);

  if (!is_admin_group_member(*operation)) return trace.exit(result::success);
  return trace.exit(roles_cover(operation->roles, dn, supplier) ? result::success
                                                                : result::insufficient_access);
}

namespace {

// Kept as it is: the group anywhere in the DN, so with everything below it, but the other two as
// whole DNs, and all three byte for byte, unlike the rule before, which ignores case.
bool is_for_primary_administrator(const char* dn) {
  return std::strstr(dn, config_names::admin_group_dn) != nullptr ||
         std::strcmp(dn, config_names::kerberos_dn) == 0 ||
         std::strcmp(dn, config_names::digest_dn) == 0;
}

}  // namespace

// ======== Persistent searches

int PSearchMonitor::get_num_current_psearches() {
  ldtr_function_local trace(function_id::get_num_current_psearches);
  int rc = pthread_mutex_lock(&mutex_);
  if (rc != 0) {
    trace.debug(trace::error, kMonitorNotLocked, rc);
    return trace.exit(0);
  }
  const int current = current_;
  rc = pthread_mutex_unlock(&mutex_);
  if (rc != 0) trace.debug(trace::error, kMonitorNotUnlocked, rc);
  return trace.exit(current);
}

namespace {

bool somebody_searches_persistently() {
  int active = 0;
  PSearchMonitor* monitor = nullptr;
  pblock* const global = getGlobalPBlock();
  slapi_pblock_get(global, parameter::persistent_search_switch, &active);
  slapi_pblock_get(global, parameter::persistent_search_monitor, &monitor);
  return active == kPersistentSearchesOn && monitor != nullptr &&
         monitor->get_num_current_psearches() != 0;
}

// Hands the entry to the server, as it is in the file before the delete. Without it only the notice
// is lost.
void keep_for_persistent_searches(_CFG* session, const char* local_dn, Operation& operation) {
  entry* e = nullptr;
  if (retrieve_entry(session, local_dn, &e) != 0) return;
  // From here on the server's; ours only when it was not taken.
  if (slapi_pblock_set(operation.parameters, parameter::entry_before_delete, e) != 0) {
    entry_free(e);
  }
}

// ======== The handler

struct DeleteRequest {
  Backend* backend = nullptr;  // each null when it could not be read
  Connection* connection = nullptr;
  Operation* operation = nullptr;
  const char* dn = nullptr;  // UTF-8, normalised by the server
};

bool read_request(pblock* pb, DeleteRequest& request) {
  return slapi_pblock_get(pb, parameter::backend, &request.backend) == 0 &&
         slapi_pblock_get(pb, parameter::connection, &request.connection) == 0 &&
         slapi_pblock_get(pb, parameter::operation, &request.operation) == 0 &&
         slapi_pblock_get(pb, parameter::target_dn, &request.dn) == 0;
}

int answer(const DeleteRequest& request, int rc) {
  if (request.connection != nullptr && request.operation != nullptr) {
    send_ldap_result(request.connection, request.operation, rc, nullptr, "");
  }
  return rc;
}

// Steps 3 to 5: the rules, in their order.
int check_rules(const DeleteRequest& request) {
  // 3. Authority. It also tells whether there is such an entry.
  const int rc = check_delete_authority(request.connection, request.operation, nullptr, request.dn);
  if (rc != 0) return rc;

  // 4. Without its own entry the server would not find this backend again: nobody deletes it.
  if (strcasecmp(request.dn, kOwnBackendDn) == 0) return result::unwilling_to_perform;

  // 5. Administrators do not delete one another.
  if (is_for_primary_administrator(request.dn) && !is_primary_administrator(*request.operation)) {
    return result::insufficient_access;
  }
  return result::success;
}

// Steps 6 and 7: the entry, told to persistent searches, then gone.
int remove_entry(_CFG* session, const DeleteRequest& request) {
  MallocText local_dn;
  int rc = convert(cfg_xlate_utf8_to_localcp, request.dn, local_dn);
  if (rc == 0) {
    if (somebody_searches_persistently()) {
      keep_for_persistent_searches(session, local_dn.get(), *request.operation);
    }
    rc = cfg_delete_s(session, local_dn.get());
  }
  return rc == result::no_such_record ? static_cast<int>(result::no_such_object) : rc;
}

}  // namespace

int config_back_delete(pblock* pb) {
  ldtr_function_local trace(function_id::config_back_delete, "pb=0x%p", static_cast<void*>(pb));

  // 1. Who deletes what. Without all of it no session is opened.
  DeleteRequest request;
  if (!read_request(pb, request)) return trace.exit(answer(request, result::operations_error));

  // 2. The session. When it cannot be opened nothing is sent, and the lock, where it was taken,
  // stays taken: the server answers for us and brings the backend back to rest.
  OperationSession session(request.connection,
                           static_cast<ConfigBackendPrivate*>(request.backend->private_data));
  int rc = session.open();
  if (rc != 0) return trace.exit(rc);

  // 3. to 5. May this caller delete this entry?
  rc = check_rules(request);

  // 6. and 7. Then it goes.
  if (rc == 0) rc = remove_entry(session.handle(), request);

  // 8. Back to rest. No entry is held here; the call stands where one would be released.
  entry_free(nullptr);
  session.close();

  // 9. The one answer.
  return trace.exit(answer(request, rc));
}

}  // namespace orv
