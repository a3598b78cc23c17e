#include "ops/equality.h"

#include <new>

#include "cfg/matching.h"
#include "cfg/result_codes.h"

namespace orv::server {

std::string equality_key(const Schema& schema, std::string_view type, const std::string& value) {
  const SchemaAttribute* const known = schema.attribute(type);
  if (known->secret) return value;
  auto rule = cfg::MatchingRule::case_ignore;
  cfg::find_matching_rule(known->equality, rule);
  std::string key;
  const int code = cfg::canonical_value(rule, value, key);
  if (code == result::no_memory) throw std::bad_alloc();
  // No value that the rule cannot read is taken for the form of one that it can.
  return code == result::success ? "=" + key : "!" + value;
}

}  // namespace orv::server
