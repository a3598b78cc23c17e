#include "slapi/password_method.h"

#include <cstdio>
#include <iterator>
#include <mutex>
#include <new>
#include <string>
#include <string_view>

#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "cfg/secret.h"
#include "cfg/text.h"
#include "memory.h"
#include "messages.h"
#include "slapi/services.h"

namespace orv {
namespace {

constexpr const char* kTop = "CN=CONFIGURATION";
constexpr const char* kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
constexpr const char* kMethodType = "orv-slapdPwEncryption";
constexpr const char* kAllowedType = "orv-slapdPwEncryptionAllowed";

// ---- The methods -----------------------------------------------------------------------------

struct Method {
  std::string_view name;
  int number;
  cfg::SecretMethod stored;
  bool needs_key;
};
constexpr Method kMethods[] = {
    {"none", password_method::none, cfg::SecretMethod::clear, false},
    {"AES256", password_method::aes256, cfg::SecretMethod::sealed, true},
    {"SSHA256", password_method::ssha256, cfg::SecretMethod::ssha256, false},
    {"SSHA384", password_method::ssha384, cfg::SecretMethod::ssha384, false},
    {"SSHA512", password_method::ssha512, cfg::SecretMethod::ssha512, false},
    {"PBKDF2-SHA256", password_method::pbkdf2_sha256, cfg::SecretMethod::pbkdf2_sha256, false},
    {"PBKDF2-SHA512", password_method::pbkdf2_sha512, cfg::SecretMethod::pbkdf2_sha512, false},
    {"crypt", password_method::crypt, cfg::SecretMethod::crypt, false},
};

const Method* find_method(std::string_view name) noexcept {
  for (const Method& method : kMethods)
    if (cfg::equals_ignore_ascii_case(method.name, name))
      return cfg::can_make_secret(method.stored) ? &method : nullptr;
  return nullptr;
}

const Method* find_method(int number) noexcept {
  for (const Method& method : kMethods)
    if (method.number == number && cfg::can_make_secret(method.stored)) return &method;
  return nullptr;
}

// Methods as bits, by their place in the table.
using MethodSet = unsigned;

MethodSet set_of(const Method& method) noexcept {
  return 1U << static_cast<unsigned>(&method - std::begin(kMethods));
}

// Passwords in clear have to be asked for twice: here and in the list of what is allowed.
constexpr MethodSet kUnlisted = ((1U << std::size(kMethods)) - 1) & ~1U;
static_assert(kMethods[0].number == password_method::none);

// ---- In force --------------------------------------------------------------------------------

struct Rules {
  int method = password_method::aes256;
  MethodSet allowed = kUnlisted;
  bool has_key = false;

  [[nodiscard]] bool allow(const Method& wanted) const noexcept {
    return (allowed & set_of(wanted)) != 0;
  }
  [[nodiscard]] bool permit(const Method& wanted) const noexcept {
    return allow(wanted) && (has_key || !wanted.needs_key);
  }
};

struct InForce {
  std::mutex mutex;  // held for the length of a copy
  Rules rules;
  int staged = password_method::none_converted;
};

InForce& in_force() noexcept {
  static InForce held;
  return held;
}

Rules rules_in_force() noexcept {
  InForce& held = in_force();
  const std::lock_guard lock(held.mutex);
  return held.rules;
}

void put_in_force(const Rules& rules) noexcept {
  InForce& held = in_force();
  const std::lock_guard lock(held.mutex);
  held.rules = rules;
  cfg::set_secret_method(find_method(rules.method)->stored);
}

void stage(int method) noexcept {
  InForce& held = in_force();
  const std::lock_guard lock(held.mutex);
  held.staged = method;
}

// ---- Reading ---------------------------------------------------------------------------------

int refuse(int code, const char* reason) noexcept {
  PrintMessage(0, message::password_set, message::method_refused, reason);
  return code;
}

int refuse(int code, const char* reason, const char* value) noexcept {
  char text[256];
  std::snprintf(text, sizeof text, "%s \"%.100s\"", reason, value);
  return refuse(code, text);
}

// The values of an attribute; null with 0 for an entry or attribute that is not there.
int read_values(_CFG* session, const char* dn, const char* type, CfgValues& values) noexcept {
  _CFGMessage* found = nullptr;
  const int rc = cfg_search_s(session, dn, kScopeBase, nullptr, nullptr, 0, &found);
  const CfgResult chain(found);
  if (rc == result::no_such_object) return result::success;
  if (rc != result::success) return refuse(rc, "the configuration file cannot be read");
  _CFGMessage* const record = cfg_first_entry(session, found);
  if (record != nullptr) values.reset(cfg_get_values(session, record, type));
  const int error = values == nullptr ? cfg_get_errno(session) : static_cast<int>(result::success);
  if (error == result::success || error == result::no_such_attribute) return result::success;
  return refuse(error, "the configuration file cannot be read");
}

int read_allowed(_CFG* session, Rules& rules) noexcept {
  CfgValues names;
  const int rc = read_values(session, kGroup, kAllowedType, names);
  if (rc != result::success || names == nullptr) return rc;
  rules.allowed = 0;
  for (char** name = names.get(); *name != nullptr; ++name) {
    const Method* const method = find_method(std::string_view(*name));
    if (method == nullptr)
      return refuse(result::invalid_attribute_syntax, "there is no method", *name);
    rules.allowed |= set_of(*method);
  }
  return result::success;
}

// A file without a key stash may well say AES256, as every new one does: passwords are hashed then.
int read_method(_CFG* session, Rules& rules) noexcept {
  CfgValues names;
  const int rc = read_values(session, kTop, kMethodType, names);
  if (rc != result::success) return rc;
  if (names != nullptr && names.get()[0] != nullptr) {
    const char* const name = names.get()[0];
    const Method* const method = find_method(std::string_view(name));
    if (method == nullptr)
      return refuse(result::invalid_attribute_syntax, "there is no method", name);
    rules.method = method->number;
  }
  const Method& method = *find_method(rules.method);
  return rules.allow(method) ? static_cast<int>(result::success)
                             : refuse(result::unwilling_to_perform,
                                      "orv-slapdPwEncryptionAllowed lacks the method in use");
}

// ---- Staging ---------------------------------------------------------------------------------

int refuse_staging(const char* reason, char** text) noexcept {
  if (text != nullptr) *text = slapi::copy_bytes(reason);
  return result::unwilling_to_perform;
}

// Whether this host can make a password of the method: better found out before it is in force.
int try_method(const Method& method) noexcept {
  if (method.needs_key) return result::success;  // the key was loaded; nothing else is needed
  std::string stored;
  return cfg::make_secret(method.stored, "trial", stored);
}

}  // namespace

std::string password_method_problem(std::string_view name) {
  if (find_method(name) != nullptr) return "";
  std::string problem = "is none of the methods";
  for (const Method& method : kMethods)
    if (cfg::can_make_secret(method.stored)) problem.append(" ").append(method.name);
  return problem;
}

int load_password_methods(_CFG* session) noexcept {
  stage(password_method::none_converted);
  Rules rules;
  rules.has_key = session != nullptr && session->key != nullptr;
  if (const int rc = read_allowed(session, rules); rc != result::success) return rc;
  if (const int rc = read_method(session, rules); rc != result::success) return rc;
  put_in_force(rules);
  return result::success;
}

int stage_password_method(int number, char** text) noexcept {
  const Method* const method = find_method(number);
  if (method == nullptr) return refuse_staging("There is no such password method.", text);
  if (!rules_in_force().permit(*method))
    return refuse_staging("The configuration does not allow this password method.", text);
  if (const int rc = try_method(*method); rc != result::success) return rc;
  stage(number);
  return result::success;
}

int staged_password_method() noexcept {
  InForce& held = in_force();
  const std::lock_guard lock(held.mutex);
  return held.staged;
}

int password_method_in_force() noexcept {
  return rules_in_force().method;
}

int convertPWEncryptionMethod(const char* name, int* method) {
  if (name == nullptr) return 0;
  const Method* const found = find_method(std::string_view(name));
  if (found == nullptr) return 0;
  if (!rules_in_force().permit(*found)) return 1;
  if (method != nullptr) *method = found->number;
  return 0;
}

int unformat_password(const char* stored, char** clear, const void* key, int /*reserved*/) {
  constexpr int opened = 1;
  constexpr int not_sealed = 0;
  constexpr int failed = -1;
  if (clear == nullptr) return failed;
  *clear = nullptr;
  if (stored == nullptr) return failed;
  std::string text;
  const cfg::OpenResult rc = cfg::open_secret(static_cast<const cfg::Key*>(key), stored, text);
  if (rc == cfg::OpenResult::not_sealed) return not_sealed;
  // A text with a NUL in it was sealed by somebody else, and would come out as another one.
  if (rc == cfg::OpenResult::opened && text.find('\0') == std::string::npos)
    *clear = slapi::copy_bytes(text);
  cfg::wipe(text);
  return *clear == nullptr ? failed : opened;
}

}  // namespace orv
