// The password policy of administrators: what is in force, where it comes from, and what it says
// about a new password.

#include <locale.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <cstdio>
#include <cwctype>
#include <limits>
#include <mutex>
#include <new>
#include <string>
#include <string_view>
#include <vector>

#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "cfg/secret.h"
#include "messages.h"
#include "slapi/admin_policy.h"
#include "slapi/services.h"

namespace orv {
namespace {

using Policy = _Admin_pwdPolicy;

constexpr const char* kPolicyEntry = kAdminPolicyEntry.data();  // of a literal

constexpr int kMaxNumber = 1000000;
constexpr int kMaxLength = 256;

// The strict policy, that of the default configuration.
constexpr Policy kStrict{
    .enabled = 1,
    .pwdLockout = 1,
    .pwdLockoutDuration = 900,
    .pwdMaxFailure = 10,
    .pwdFailureCountInterval = 900,
    .pwdMinLength = 12,
    .passwordMinAlphaChars = 2,
    .passwordMinOtherChars = 2,
    .passwordMaxRepeatedChars = 2,
    .passwordMinDiffChars = 3,
    .reserved = {0, 0},
};

struct Flag {
  const char* name;
  char Policy::*member;
};
constexpr Flag kFlags[] = {
    {"orv-slapdAdminPolicyEnabled", &Policy::enabled},
    {"pwdLockout", &Policy::pwdLockout},
};

struct Number {
  const char* name;
  int Policy::*member;
  int maximum;
};
constexpr Number kNumbers[] = {
    {"pwdLockoutDuration", &Policy::pwdLockoutDuration, kMaxNumber},
    {"pwdMaxFailure", &Policy::pwdMaxFailure, kMaxNumber},
    {"pwdFailureCountInterval", &Policy::pwdFailureCountInterval, kMaxNumber},
    {"pwdMinLength", &Policy::pwdMinLength, kMaxLength},
    {"passwordMinAlphaChars", &Policy::passwordMinAlphaChars, kMaxLength},
    {"passwordMinOtherChars", &Policy::passwordMinOtherChars, kMaxLength},
    {"passwordMaxRepeatedChars", &Policy::passwordMaxRepeatedChars, kMaxLength},
    {"passwordMinDiffChars", &Policy::passwordMinDiffChars, kMaxLength},
};

constexpr auto kTypes = [] {
  std::array<std::string_view, std::size(kFlags) + std::size(kNumbers)> types{};
  auto next = types.begin();
  for (const Flag& flag : kFlags) *next++ = flag.name;
  for (const Number& number : kNumbers) *next++ = number.name;
  return types;
}();

// ---- In force --------------------------------------------------------------------------------

// Copied under a mutex of its own, which nobody holds for longer than the copy takes.
struct InForce {
  std::mutex mutex;
  Policy policy = kStrict;
};

InForce& in_force() noexcept {
  static InForce held;
  return held;
}

void put_in_force(const Policy& policy) noexcept {
  InForce& held = in_force();
  const std::lock_guard lock(held.mutex);
  held.policy = policy;
}

// ---- Limits ----------------------------------------------------------------------------------

bool is_in_range(const Policy& policy) noexcept {
  return std::all_of(std::begin(kNumbers), std::end(kNumbers), [&](const Number& number) {
    return policy.*number.member >= 0 && policy.*number.member <= number.maximum;
  });
}

// Null for limits that a password can meet and a lockout that can happen.
const char* contradiction(const Policy& policy) noexcept {
  if (policy.passwordMinAlphaChars + policy.passwordMinOtherChars > policy.pwdMinLength)
    return "passwordMinAlphaChars and passwordMinOtherChars together exceed pwdMinLength";
  if (policy.pwdMinLength > 0 && policy.passwordMinDiffChars > policy.pwdMinLength)
    return "passwordMinDiffChars exceeds pwdMinLength";
  if (policy.pwdLockout != 0 && policy.pwdMaxFailure < 1)
    return "pwdLockout is TRUE and pwdMaxFailure is 0";
  return nullptr;
}

// Null for a policy that can be put in force.
const char* problem_of(const Policy& policy) noexcept {
  return is_in_range(policy) ? contradiction(policy) : "a number is out of range";
}

// ---- Reading ---------------------------------------------------------------------------------

constexpr const char* kUnreadable = "the entry cannot be read";

bool take(const Flag& flag, std::string_view text, Policy& policy) noexcept {
  policy.*flag.member = text == "TRUE" ? 1 : 0;
  return text == "TRUE" || text == "FALSE";
}

bool take(const Number& number, std::string_view text, Policy& policy) noexcept {
  const auto [end, status] =
      std::from_chars(text.data(), text.data() + text.size(), policy.*number.member);
  return status == std::errc() && end == text.data() + text.size();
}

int refuse_policy(int code, const char* reason) noexcept {
  PrintMessage(0, message::password_set, message::policy_refused, reason);
  return code;
}

// The policy entry of one session.
class PolicyEntry {
 public:
  explicit PolicyEntry(_CFG* session) noexcept : session_(session) {}

  // 0; 32; else the session's code.
  int find() noexcept {
    _CFGMessage* chain = nullptr;
    const int rc = cfg_search_s(session_, kPolicyEntry, kScopeBase, nullptr, nullptr, 0, &chain);
    chain_.reset(chain);
    if (rc != result::success) return rc;
    record_ = cfg_first_entry(session_, chain);
    if (record_ != nullptr) return result::success;
    const int error = cfg_get_errno(session_);
    return error == result::success ? static_cast<int>(result::no_such_object) : error;
  }

  int read(Policy& policy) noexcept {
    for (const Flag& flag : kFlags)
      if (const int rc = read_setting(flag, policy); rc != result::success) return rc;
    for (const Number& number : kNumbers)
      if (const int rc = read_setting(number, policy); rc != result::success) return rc;
    return result::success;
  }

 private:
  // Leaves `value` null for an attribute that the entry lacks.
  int first_value(const char* name, CfgValues& values, const char*& value) noexcept {
    value = nullptr;
    values.reset(cfg_get_values(session_, record_, name));
    if (values != nullptr) {
      value = values.get()[0];
      return result::success;
    }
    const int error = cfg_get_errno(session_);
    return error == result::no_such_attribute ? static_cast<int>(result::success)
                                              : refuse_policy(error, kUnreadable);
  }

  template <typename Setting>
  int read_setting(const Setting& setting, Policy& policy) noexcept {
    CfgValues values;
    const char* value = nullptr;
    const int rc = first_value(setting.name, values, value);
    if (rc != result::success || value == nullptr) return rc;
    return take(setting, value, policy) ? static_cast<int>(result::success)
                                        : refuse_value(setting.name);
  }

  static int refuse_value(const char* name) noexcept {
    char reason[128];
    std::snprintf(reason, sizeof reason, "the value of %s cannot be read", name);
    return refuse_policy(result::invalid_attribute_syntax, reason);
  }

  _CFG* session_;
  CfgResult chain_;
  _CFGMessage* record_ = nullptr;
};

// Settings of an entry that is not in the file, or not yet. The first one that cannot be read.
template <typename Setting>
const char* take_all(std::span<const Setting> all, const AdminPolicySettings& settings,
                     Policy& policy) {
  for (const Setting& setting : all) {
    const auto found = settings.find(std::string_view(setting.name));
    if (found != settings.end() && !take(setting, found->second, policy)) return setting.name;
  }
  return nullptr;
}

// ---- Passwords -------------------------------------------------------------------------------

// A password as characters: Unicode where it is UTF-8, and each byte that is not by itself, out of
// Unicode's reach. Wiped when done.
class Characters {
 public:
  explicit Characters(std::string_view text) {
    characters_.reserve(text.size());
    while (!text.empty()) characters_.push_back(take(text));
  }
  ~Characters() { cfg::wipe(characters_.data(), characters_.size() * sizeof(char32_t)); }
  Characters(const Characters&) = delete;
  Characters& operator=(const Characters&) = delete;

  [[nodiscard]] std::size_t size() const noexcept { return characters_.size(); }
  [[nodiscard]] auto begin() const noexcept { return characters_.begin(); }
  [[nodiscard]] auto end() const noexcept { return characters_.end(); }
  void sort() noexcept { std::sort(characters_.begin(), characters_.end()); }
  [[nodiscard]] bool contain(char32_t character) const noexcept {
    return std::binary_search(characters_.begin(), characters_.end(), character);
  }

 private:
  static constexpr char32_t kBeyondUnicode = 0x110000;

  // The length of the sequence that a byte begins; 0 for one that begins none.
  static std::size_t sequence_length(unsigned char lead) noexcept {
    if (lead < 0x80) return 1;
    if (lead < 0xC2) return 0;
    if (lead < 0xE0) return 2;
    if (lead < 0xF0) return 3;
    return lead < 0xF5 ? 4 : 0;
  }

  static char32_t take(std::string_view& text) noexcept {
    const auto lead = static_cast<unsigned char>(text.front());
    const std::size_t length = sequence_length(lead);
    if (length == 0 || length > text.size()) return take_byte(text);
    char32_t character = length == 1 ? lead : lead & (0xFFU >> (length + 1));
    for (std::size_t i = 1; i < length; ++i) {
      const auto byte = static_cast<unsigned char>(text[i]);
      if ((byte & 0xC0) != 0x80) return take_byte(text);
      character = (character << 6) | (byte & 0x3FU);
    }
    text.remove_prefix(length);
    return character;
  }

  static char32_t take_byte(std::string_view& text) noexcept {
    const auto byte = static_cast<unsigned char>(text.front());
    text.remove_prefix(1);
    return kBeyondUnicode + byte;
  }

  std::vector<char32_t> characters_;
};

// The system's table of letters; the process itself keeps the "C" locale, which knows those of
// ASCII only. Null when the system has none.
locale_t unicode_locale() noexcept {
  static const locale_t made = newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr);
  return made;
}

bool is_letter(char32_t character) noexcept {
  if (character < 0x80)
    return (character >= 'a' && character <= 'z') || (character >= 'A' && character <= 'Z');
  const locale_t locale = unicode_locale();
  return locale != nullptr && iswalpha_l(static_cast<wint_t>(character), locale) != 0;
}

int at_least_zero(std::ptrdiff_t count) noexcept {
  constexpr std::ptrdiff_t most = std::numeric_limits<int>::max();
  return static_cast<int>(std::clamp<std::ptrdiff_t>(count, 0, most));
}

// How often the commonest character occurs; of sorted characters.
int most_occurrences(const Characters& sorted) noexcept {
  std::ptrdiff_t most = 0;
  for (auto at = sorted.begin(); at != sorted.end();) {
    const auto next = std::upper_bound(at, sorted.end(), *at);
    most = std::max(most, next - at);
    at = next;
  }
  return at_least_zero(most);
}

// How many different characters of the one the other lacks; of sorted characters.
int count_new(const Characters& sorted, const Characters& sorted_old) noexcept {
  int count = 0;
  for (auto at = sorted.begin(); at != sorted.end(); at = std::upper_bound(at, sorted.end(), *at))
    if (!sorted_old.contain(*at)) ++count;
  return count;
}

// One new password under one policy.
class PasswordCheck {
 public:
  PasswordCheck(const Policy& policy, std::string_view password, const char* who)
      : policy_(policy), password_(password), characters_(password), who_(who) {
    characters_.sort();
  }

  int run(const char* old_password) {
    if (password_.empty()) return refuse(message::password_is_empty, 0);
    if (const int rc = check_form(); rc != result::success) return rc;
    return old_password == nullptr ? static_cast<int>(result::success)
                                   : check_difference(old_password);
  }

 private:
  int check_form() const noexcept {
    const int length = at_least_zero(static_cast<std::ptrdiff_t>(characters_.size()));
    const int letters =
        at_least_zero(std::count_if(characters_.begin(), characters_.end(), is_letter));
    if (length < policy_.pwdMinLength)
      return refuse(message::password_is_short, policy_.pwdMinLength);
    if (letters < policy_.passwordMinAlphaChars)
      return refuse(message::too_few_letters, policy_.passwordMinAlphaChars);
    if (length - letters < policy_.passwordMinOtherChars)
      return refuse(message::too_few_others, policy_.passwordMinOtherChars);
    const int limit = policy_.passwordMaxRepeatedChars;
    if (limit > 0 && most_occurrences(characters_) > limit)
      return refuse(message::too_many_repeats, limit);
    return result::success;
  }

  // A protected old password tells only whether the new one is the same.
  int check_difference(std::string_view old) const {
    const int wanted = policy_.passwordMinDiffChars;
    if (wanted <= 0) return result::success;
    if (cfg::names_scheme(old)) {
      const bool same = old == password_ || cfg::verify_secret(nullptr, {}, old, password_);
      return same ? refuse(message::password_is_old, 0) : static_cast<int>(result::success);
    }
    Characters old_characters(old);
    old_characters.sort();
    return count_new(characters_, old_characters) < wanted ? refuse(message::too_few_new, wanted)
                                                           : static_cast<int>(result::success);
  }

  int refuse(int number, int limit) const noexcept {
    char text[16] = "";
    std::to_chars(text, text + sizeof text - 1, limit);
    PrintMessage(0, message::password_set, number, who_, text);
    return result::constraint_violation;
  }

  const Policy& policy_;
  std::string_view password_;
  Characters characters_;
  const char* who_;
};

}  // namespace

bool pwdIsAdminPolicyOn() {
  return getGlobalAdminPWDPolicyLocal().enabled != 0;
}

bool pwdIsAdminPasswordLockoutOn() {
  return getGlobalAdminPWDPolicyLocal().pwdLockout != 0;
}

_Admin_pwdPolicy getGlobalAdminPWDPolicyLocal() {
  InForce& held = in_force();
  const std::lock_guard lock(held.mutex);
  return held.policy;
}

int validate_new_settings(_Admin_pwdPolicy policy, bool check_all) {
  const bool acceptable = is_in_range(policy) && (!check_all || contradiction(policy) == nullptr);
  return acceptable ? result::success : result::constraint_violation;
}

int set_admin_password_policy(const _Admin_pwdPolicy& policy) noexcept {
  const int rc = validate_new_settings(policy, true);
  if (rc == result::success) put_in_force(policy);
  return rc;
}

int load_admin_password_policy(_CFG* session) noexcept {
  PolicyEntry entry(session);
  if (const int rc = entry.find(); rc != result::success)
    return refuse_policy(rc, rc == result::no_such_object ? "there is no such entry" : kUnreadable);
  Policy policy = kStrict;
  if (const int rc = entry.read(policy); rc != result::success) return rc;
  if (const char* const reason = problem_of(policy); reason != nullptr)
    return refuse_policy(result::constraint_violation, reason);
  put_in_force(policy);
  return result::success;
}

std::span<const std::string_view> admin_policy_types() noexcept {
  return kTypes;
}

std::string admin_policy_problem(const AdminPolicySettings& settings) {
  Policy policy = kStrict;
  const char* unreadable = take_all(std::span<const Flag>(kFlags), settings, policy);
  if (unreadable == nullptr)
    unreadable = take_all(std::span<const Number>(kNumbers), settings, policy);
  if (unreadable != nullptr) return std::string("the value of ") + unreadable + " cannot be read";
  const char* const problem = problem_of(policy);
  return problem == nullptr ? "" : problem;
}

int verify_admin_password(char* new_password, char* old_password, Operation* operation) try {
  if (new_password == nullptr) return result::other;
  const char* const who =
      operation == nullptr || operation->bound_dn == nullptr ? "" : operation->bound_dn;
  const Policy policy = getGlobalAdminPWDPolicyLocal();
  return PasswordCheck(policy, new_password, who).run(old_password);
} catch (...) {
  return result::no_memory;
}

}  // namespace orv
