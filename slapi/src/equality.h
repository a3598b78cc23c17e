// Which values of an attribute count as the same, and which attributes are secret, by the schema in
// force.
#pragma once

#include <string>
#include <string_view>

#include "cfg/attribute_table.h"
#include "slapi/schema.h"

namespace orv::slapi {

// The comparison for types whose description has this EQUALITY (name or numeric OID). False when
// the rule is unknown. Without a rule ("") values are compared byte for byte.
bool find_equality(std::string_view name_or_oid, cfg::MatchingRule& rule) noexcept;

// Equality of an attribute type; unknown types ignore letter case.
cfg::MatchingRule equality_of(std::string_view type) noexcept;

// Whether a type's values are secret, with and without attribute options. Unknown types are not.
bool is_secret_type(std::string_view type) noexcept;

// A text that two values have in common exactly when they are equal under `rule`. Values that are
// not of the rule's syntax are equal to nothing but themselves; object identifiers are equal when
// they name the same class or type of the schema in force. Throws std::bad_alloc.
std::string equality_key(cfg::MatchingRule rule, std::string_view value);

// The schema in force, without reading the built-in one; null while there is none.
const Schema* schema_if_loaded() noexcept;

}  // namespace orv::slapi
