#include "equality.h"

#include <new>

#include "cfg/matching.h"
#include "cfg/result_codes.h"

namespace orv::slapi {
namespace {

using cfg::MatchingRule;

// False when the value is not of the rule's syntax.
bool canonicalize(MatchingRule rule, std::string_view value, std::string& canonical) {
  const int rc = cfg::canonical_value(rule, value, canonical);
  if (rc == result::no_memory) throw std::bad_alloc();
  return rc == result::success;
}

// Empty when the schema in force does not know the name.
std::string_view canonical_name(std::string_view name) {
  const Schema& schema = current_schema();
  const std::string_view object_class = schema.canonical_object_class(name);
  return object_class.empty() ? schema.canonical_attribute(name) : object_class;
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
  std::string key;
  if (!canonicalize(rule, value, key)) {
    // The NUL keeps it apart from canonical forms, which have none under rules that refuse values.
    key.assign(1, '\0');
    return key += value;
  }
  if (rule != MatchingRule::object_identifier) return key;
  if (const std::string_view name = canonical_name(key); !name.empty()) key = name;
  return key;
}

}  // namespace orv::slapi
