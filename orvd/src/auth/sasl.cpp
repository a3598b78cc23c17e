#include "auth/sasl.h"

#include <algorithm>
#include <new>

#include "cfg/dn.h"
#include "cfg/text.h"

namespace orv::server {
namespace {

constexpr std::string_view kDnForm = "dn:";
constexpr std::string_view kUserForm = "u:";

}  // namespace

const SaslMechanism* find_mechanism(const SaslMechanisms& mechanisms, std::string_view name,
                                    const TransportFacts& transport) {
  for (const auto& mechanism : mechanisms)
    if (cfg::equals_ignore_ascii_case(mechanism->name(), name))
      return mechanism->offered(transport) ? mechanism.get() : nullptr;
  return nullptr;
}

std::vector<std::string> offered_mechanisms(const SaslMechanisms& mechanisms,
                                            const TransportFacts& transport) {
  std::vector<std::string> names;
  for (const auto& mechanism : mechanisms)
    if (mechanism->offered(transport)) names.emplace_back(mechanism->name());
  return names;
}

bool may_act_as(const Identity& identity, std::string_view user_name,
                std::string_view authorization_id) {
  if (authorization_id.empty()) return true;
  if (authorization_id.starts_with(kUserForm))
    return !user_name.empty() && authorization_id.substr(kUserForm.size()) == user_name;
  if (!authorization_id.starts_with(kDnForm)) return false;
  std::string normal;
  const int code = cfg::normalize_dn(authorization_id.substr(kDnForm.size()), normal);
  if (code == result::no_memory) throw std::bad_alloc();
  return code == 0 && normal == identity.bound_dn;
}

}  // namespace orv::server
