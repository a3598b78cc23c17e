// Counted values and modification records, shared by the configuration-file library, the server
// and its plug-ins.
//
// All of these are plain structs, valid when filled with zeros. Every text, value and array they
// point to is a block of its own from the malloc family, because their users free, replace and
// rewrite single parts in place. `bv_val` is never null in a list, holds a terminating NUL one past
// `bv_len`, and no NUL before it.
#pragma once

#include <cstddef>

namespace orv {

// One attribute value. Not the global type of the same name in LDAP client libraries.
struct berval {
  std::size_t bv_len;
  char* bv_val;
};

// Operation codes of `ldapmod::mod_op` (RFC 4511, 4.6), and the flag that says which arm of
// `mod_vals` holds the values.
enum ModOp : int {
  kModAdd = 0,
  kModDelete = 1,
  kModReplace = 2,
  kModBvalues = 0x80,
};

// One modification of one attribute. Servers chain them through `mod_next`; the library takes them
// as a null-terminated array of pointers. "No values" is a null array, never an empty one.
struct ldapmod {
  int mod_op;
  char* mod_type;
  union {
    char** modv_strvals;  // without kModBvalues
    berval** modv_bvals;  // with kModBvalues
  } mod_vals;
  ldapmod* mod_next;

  [[nodiscard]] int operation() const noexcept { return mod_op & ~kModBvalues; }
};

}  // namespace orv
