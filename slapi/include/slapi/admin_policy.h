// The entry CN=PWDPOLICY ADMIN,CN=CONFIGURATION before it is in force: whether its settings could
// be (slapi/services.h), for the server that is to change them and for tools that examine a file.
//
// Thread-safe. Nothing throws but std::bad_alloc.
#pragma once

#include <functional>
#include <map>
#include <span>
#include <string>
#include <string_view>

namespace orv {

inline constexpr std::string_view kAdminPolicyEntry = "CN=PWDPOLICY ADMIN,CN=CONFIGURATION";

// The attributes that make the policy, by their canonical names.
std::span<const std::string_view> admin_policy_types() noexcept;

// The first values of those of them that an entry has.
using AdminPolicySettings = std::map<std::string, std::string, std::less<>>;

// Why an entry with these settings would not be put in force, in a few words; "" when it would.
// Settings that it lacks have the values of the default configuration.
std::string admin_policy_problem(const AdminPolicySettings& settings);

}  // namespace orv
