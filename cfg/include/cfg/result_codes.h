// Result codes of LDAP operations (RFC 4511, 4.1.9) and the few that this server adds.
//
// Functions return plain integers, as the interfaces of a directory server do; these names are for
// reading and writing them. Codes of operations not listed here are passed through unchanged.
#pragma once

namespace orv::result {

enum Code : int {
  success = 0,
  operations_error = 1,     // also: the configuration file could not be opened or read
  protocol_error = 2,       // the request is not what RFC 4511 allows
  time_limit_exceeded = 3,  // the search ran past its deadline
  size_limit_exceeded = 4,  // more entries matched than may be sent
  auth_method_not_supported = 7,
  stronger_auth_required = 8,
  no_such_record = 9,  // the library: the entry to change, or the parent to add under, is missing
  admin_limit_exceeded = 11,  // the answer outgrew its budget
  unavailable_critical_extension = 12,
  confidentiality_required = 13,
  sasl_bind_in_progress = 14,
  no_such_attribute = 16,
  undefined_attribute_type = 17,  // also: the backend was closed without ever having been started
  inappropriate_matching = 18,
  constraint_violation = 19,
  attribute_or_value_exists = 20,
  invalid_attribute_syntax = 21,
  no_such_object = 32,
  invalid_dn_syntax = 34,
  inappropriate_authentication = 48,
  invalid_credentials = 49,
  insufficient_access = 50,
  busy = 51,
  unavailable = 52,
  unwilling_to_perform = 53,
  loop_detect = 54,
  naming_violation = 64,
  object_class_violation = 65,
  not_allowed_on_non_leaf = 66,
  not_allowed_on_rdn = 67,
  already_exists = 68,
  object_class_mods_prohibited = 69,
  other = 80,
  no_memory = 90,
  replication_context =
      92,          // the entry would be a replication context, which this subtree never holds
  canceled = 118,  // RFC 3909
  no_such_operation = 119,
  too_late = 120,
  cannot_cancel = 121,
  assertion_failed = 122,  // RFC 4528
};

}  // namespace orv::result
