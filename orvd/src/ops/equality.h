// When two values of an attribute type are the same.
#pragma once

#include <string>
#include <string_view>

#include "cfg/attribute_table.h"
#include "slapi/schema.h"

namespace orv::server {

// A form in which equal values of a type (by its canonical name) are equal bytes. Passwords are
// compared as they were sent, and so is what no rule of the type can read. Throws std::bad_alloc.
std::string equality_key(const Schema& schema, std::string_view type, const std::string& value);

// The same under a rule.
std::string equality_key(cfg::MatchingRule rule, std::string_view value);

}  // namespace orv::server
