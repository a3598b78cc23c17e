// Whether a value is what its attribute type and, for a setting, the server ask for.
#pragma once

#include <string>

#include "slapi/schema.h"

namespace orv::orvcfg {

// What is wrong with a value of the type, in words that follow the type's name and never hold the
// value; "" when nothing is. Looks at INTEGER, Boolean, DN, IA5 String and the settings with a
// range or a vocabulary of their own.
std::string value_problem(const SchemaAttribute& type, const std::string& value);

}  // namespace orv::orvcfg
