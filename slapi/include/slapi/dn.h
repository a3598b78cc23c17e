// Distinguished names as plug-ins use them: C texts in, C texts out. The rules of the normal form
// are those of cfg/dn.h; every DN that reaches a handler is in that form. All functions are
// thread-safe.
#pragma once

namespace orv {

struct Backend;

// Normalises `*dn` in place: the old text (a malloc block) is freed and replaced by a new one.
// `fold` is passed as 1 and asks for upper case. 0; 34 not a DN; 90; 80 a null argument. On failure
// `*dn` is untouched and still the caller's. "" succeeds.
int replace_DN(char** dn, int fold);

// A DN in the light form of cfg/dn.h: spelling cleaned, letter case, type names and order kept.
struct ldap_escDN {
  int error;         // 0, or 34: not a DN
  char* normalized;  // null when error is not 0
};
// Null only without memory (or for a null text).
ldap_escDN* dn_normalize_light_esc(const char* dn);
void free_ldap_escDN(ldap_escDN* dn);  // null is a no-op

// The parent of a normalised DN: a malloced text, or null when the DN is a suffix of the backend or
// has no parent. A null backend has no suffixes. Without memory the text is "=", which is no DN:
// who finds no parent takes the entry for one that needs none.
char* dn_parent_norm(const Backend* backend, const char* normalized_dn);

// 1 when one of two normalised DNs equals the other or lies below it, else 0. The empty DN is above
// everything. Null arguments: 0.
int are_nested_dn(const char* a, const char* b);

// 0 when the two are the same DN after normalisation, non-zero otherwise (also when either is null
// or not a DN).
int slapi_dn_compare_v3(const char* a, const char* b);

}  // namespace orv
