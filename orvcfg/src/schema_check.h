// What in an entry does not fit the schema.
#pragma once

#include <string>
#include <vector>

#include "file_session.h"
#include "slapi/schema.h"

namespace orv::orvcfg {

// Describes, one sentence each: unknown classes and attribute types, missing mandatory and
// unexpected attributes, second values of single-valued types, more or less than one structural
// class. Texts never hold values of secret attributes.
std::vector<std::string> schema_problems(const Schema& schema, const FileEntry& entry);

}  // namespace orv::orvcfg
