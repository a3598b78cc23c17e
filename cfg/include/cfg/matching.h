// Equality of attribute values (RFC 4517, section 4.2): the one matcher of the whole system.
//
// All functions are thread-safe and do not throw.
#pragma once

#include <string>
#include <string_view>

#include "cfg/attribute_table.h"

namespace orv::cfg {

// Writes the canonical form of a value: two values are equal under `rule` exactly when the bytes of
// their canonical forms are. The form says nothing about order and is not for showing or storing.
// Text is UTF-8; in text that is not, letters outside ASCII keep their case. Object identifiers are
// compared as spelled: whoever has a schema replaces names by canonical ones first.
// 0; 21 the value is not one of the rule's syntax, so that it equals no value; 90. `canonical` is
// unchanged on failure.
int canonical_value(MatchingRule rule, std::string_view value, std::string& canonical) noexcept;

// Writes a text that two values have in common exactly when they are equal under `rule`, as a key
// of tables in which equal values are to meet. A value that is not of the rule's syntax equals none
// but itself. 0 or 90; `key` is unchanged on failure.
int equality_key(MatchingRule rule, std::string_view value, std::string& key) noexcept;

// The comparison for attribute types with the equality rule of this name (ignoring ASCII letter
// case) or numeric OID. False when the rule is unknown; `rule` is then unchanged.
bool find_matching_rule(std::string_view name_or_oid, MatchingRule& rule) noexcept;

}  // namespace orv::cfg
