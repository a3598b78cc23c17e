#include "slapi/dn.h"

#include <string>
#include <string_view>

#include "cfg/dn.h"
#include "cfg/result_codes.h"
#include "memory.h"
#include "reserves.h"
#include "slapi/connection.h"

namespace orv {
namespace {

bool is_suffix(const Backend* backend, std::string_view dn) noexcept {
  if (backend == nullptr || backend->suffixes == nullptr) return false;
  for (const char* const* suffix = backend->suffixes; *suffix != nullptr; ++suffix)
    if (dn == *suffix) return true;
  return false;
}

// Stands for a parent without memory: no DN, so that nothing is found there.
constexpr std::string_view kNowhere = "=";
static_assert(kNowhere.size() < slapi::kReservedText);

char* nowhere() noexcept {
  auto* const text = static_cast<char*>(slapi::text_reserve().take());
  if (text != nullptr) kNowhere.copy(text, kNowhere.size());
  return text;
}

}  // namespace

// There is one normal form, and it is upper case: `fold` selects nothing.
int replace_DN(char** dn, int /*fold*/) {
  if (dn == nullptr || *dn == nullptr) return result::other;
  std::string normal;
  if (const int rc = cfg::normalize_dn(*dn, normal); rc != result::success) return rc;
  char* const text = slapi::copy_bytes(normal);
  if (text == nullptr) return result::no_memory;
  std::free(*dn);
  *dn = text;
  return result::success;
}

ldap_escDN* dn_normalize_light_esc(const char* dn) {
  if (dn == nullptr) return nullptr;
  std::string light;
  const int rc = cfg::normalize_dn_light(dn, light);
  if (rc == result::no_memory) return nullptr;
  slapi::MallocPtr<ldap_escDN> escaped(
      static_cast<ldap_escDN*>(std::calloc(1, sizeof(ldap_escDN))));
  if (escaped == nullptr) return nullptr;
  escaped->error = rc;
  if (rc != result::success) return escaped.release();
  escaped->normalized = slapi::copy_bytes(light);
  return escaped->normalized == nullptr ? nullptr : escaped.release();
}

void free_ldap_escDN(ldap_escDN* dn) {
  if (dn == nullptr) return;
  std::free(dn->normalized);
  std::free(dn);
}

char* dn_parent_norm(const Backend* backend, const char* normalized_dn) {
  if (normalized_dn == nullptr || is_suffix(backend, normalized_dn)) return nullptr;
  const std::string_view parent = cfg::parent_of_normal_dn(normalized_dn);
  if (parent.empty()) return nullptr;
  slapi::text_reserve().fill();
  char* const text = slapi::copy_bytes(parent);
  return text == nullptr ? nowhere() : text;
}

int are_nested_dn(const char* a, const char* b) {
  if (a == nullptr || b == nullptr) return 0;
  return cfg::normal_dn_is_at_or_below(a, b) || cfg::normal_dn_is_at_or_below(b, a) ? 1 : 0;
}

int slapi_dn_compare_v3(const char* a, const char* b) {
  if (a == nullptr || b == nullptr) return 1;
  std::string normal_a;
  std::string normal_b;
  if (cfg::normalize_dn(a, normal_a) != result::success) return 1;
  if (cfg::normalize_dn(b, normal_b) != result::success) return 1;
  return normal_a == normal_b ? 0 : 1;
}

}  // namespace orv
