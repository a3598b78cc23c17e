#include "equality.h"

#include <new>

#include "cfg/matching.h"
#include "cfg/result_codes.h"

namespace orv::slapi {
namespace {

using cfg::MatchingRule;

// The name itself when the schema in force does not know it.
std::string_view canonical_name(std::string_view name) {
  const Schema& schema = current_schema();
  if (const std::string_view known = schema.canonical_object_class(name); !known.empty())
    return known;
  const std::string_view known = schema.canonical_attribute(name);
  return known.empty() ? name : known;
}

}  // namespace

bool find_equality(std::string_view name_or_oid, cfg::MatchingRule& rule) noexcept {
  if (!name_or_oid.empty()) return cfg::find_matching_rule(name_or_oid, rule);
  rule = MatchingRule::octets;
  return true;
}

cfg::MatchingRule equality_of(std::string_view type) noexcept {
  MatchingRule rule = MatchingRule::case_ignore;
  if (const SchemaAttribute* const known = current_schema().attribute(type); known != nullptr)
    find_equality(known->equality, rule);
  return rule;
}

bool is_secret_type(std::string_view type) noexcept {
  const std::string_view without_options = type.substr(0, type.find(';'));
  const SchemaAttribute* const known = current_schema().attribute(without_options);
  return known != nullptr && known->secret;
}

std::string equality_key(cfg::MatchingRule rule, std::string_view value) {
  std::string name;
  std::string key;
  if (rule == MatchingRule::object_identifier) {
    if (cfg::canonical_value(rule, value, name) != result::success) throw std::bad_alloc();
    value = canonical_name(name);
  }
  if (cfg::equality_key(rule, value, key) != result::success) throw std::bad_alloc();
  return key;
}

}  // namespace orv::slapi
