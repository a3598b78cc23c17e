// What changes of the configuration file have in common: how modification lists are read, and how a
// changed text becomes the file's.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "attribute_lookup.h"
#include "cfg/ldapmod.h"
#include "cfg/result_codes.h"
#include "ldif_write.h"
#include "session_state.h"

namespace orv::cfg {

// What became of a change: a refusal and its reason. Those whose reason the code tells have none.
struct Outcome {
  int code = result::success;
  std::string reason;

  [[nodiscard]] bool refused() const noexcept { return code != result::success; }
};

// Makes the edited text the content of the file, and the session's; does nothing when it is the
// same. Throws std::bad_alloc.
Outcome commit(Session& session, const std::vector<Edit>& edits);

// The text of a C string that may be null.
inline const char* or_empty(const char* text) noexcept {
  return text == nullptr ? "" : text;
}

// The type of a modification: its place in the table, and the name it is written under.
struct ModType {
  const KnownType* known = nullptr;
  std::string_view name;

  [[nodiscard]] bool is_secret() const noexcept { return known != nullptr && known->secret; }
};
Outcome read_type(const ldapmod& mod, ModType& type);

// The values of a modification, in either form; object classes under their own names. Throws
// std::bad_alloc. 21 for a value that cannot
// be stored: without a text, or with a NUL in it.
Outcome read_values(const ldapmod& mod, const ModType& type, std::vector<std::string_view>& values);

// A text that is the same for two values of a type exactly when they are equal. Throws
// std::bad_alloc.
std::string value_key(const ModType& type, std::string_view value);

// Checks that a password in clear may be stored: 21 when it is empty, 19 when it looks protected.
Outcome check_password(const ModType& type, std::string_view clear);

Outcome given_twice(const ModType& type);

// Runs one change on the session behind a handle, keeps its code as the handle's error number and
// tells the reason of a refusal.
using Change = Outcome (*)(Session& session, std::string_view dn, ldapmod** mods);
int run_change(_CFG* handle, Change change, const char* dn, ldapmod** mods) noexcept;

}  // namespace orv::cfg
