// What the library knows about attribute types: canonical names, matching rules, secrecy.
//
// The table is filled once by the program, from its schema, before the first session; it is
// immutable afterwards and may be read from any thread. Without a registration the library knows
// the names of RFC 4514 section 3, compares without regard to letter case and treats no attribute
// as secret.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace orv::cfg {

// How two values of an attribute are compared (the equality rules of RFC 4517 that the schema
// uses).
enum class MatchingRule {
  case_ignore,  // caseIgnoreMatch and caseIgnoreIA5Match; the default
  case_exact,   // caseExactMatch and caseExactIA5Match
  octets,       // octetStringMatch
  distinguished_name,
  integer,
  boolean,
  object_identifier,
  telephone_number,
  generalized_time,
};

struct AttributeType {
  std::string name;                  // canonical name, as values are returned under it
  std::string oid;                   // numeric form, may be empty
  std::vector<std::string> aliases;  // further names
  MatchingRule equality = MatchingRule::case_ignore;
  bool single_valued = false;
  bool secret = false;  // passwords: never compared in a filter, stored sealed
};

// Replaces the process-wide table. Call before the first session and at most once in a program;
// tests may call it again while no session is open. 0 or 90.
int register_attribute_types(std::vector<AttributeType> types) noexcept;

// The entry for a name, alias or numeric OID, ignoring ASCII letter case; null when unknown. The
// pointer is valid until the next registration.
const AttributeType* find_attribute_type(std::string_view name_or_oid) noexcept;

}  // namespace orv::cfg
