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
  return equality_key(rule, value);
}

std::string equality_key(cfg::MatchingRule rule, std::string_view value) {
  std::string key;
  if (cfg::equality_key(rule, value, key) != result::success) throw std::bad_alloc();
  return key;
}

}  // namespace orv::server
