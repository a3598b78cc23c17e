#include "cfg/result_codes.h"
#include "function_ids.h"
#include "handlers.h"
#include "slapi/trace.h"

namespace orv {

int config_back_modify(pblock* pb) {
  ldtr_function_local trace(function_id::config_back_modify, "pb=0x%p", static_cast<void*>(pb));
  Connection* connection = nullptr;
  Operation* operation = nullptr;
  slapi_pblock_get(pb, parameter::connection, &connection);
  slapi_pblock_get(pb, parameter::operation, &operation);

  send_ldap_result(connection, operation, result::unwilling_to_perform, nullptr, "");
  return trace.exit(result::unwilling_to_perform);
}

}  // namespace orv
