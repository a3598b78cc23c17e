#include "slapi/connection.h"

#include "cfg/result_codes.h"

namespace orv {

int send_ldap_result(Connection* connection, Operation* operation, int code, const char* matched_dn,
                     const char* text) {
  if (connection == nullptr || connection->send_result == nullptr) return result::other;
  return connection->send_result(connection, operation, code, matched_dn, text);
}

}  // namespace orv
