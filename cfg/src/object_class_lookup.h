// The object class table as the library itself reads it: which values of objectClass are another
// spelling of a class that the table holds.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "attribute_lookup.h"
#include "cfg/object_class_table.h"
#include "characters.h"

namespace orv::cfg {

class ObjectClassLookup {
 public:
  explicit ObjectClassLookup(std::vector<ObjectClassNames> classes);

  // Certain, and cheap, for nearly every value that is no other spelling.
  [[nodiscard]] bool is_surely_own_name(std::string_view value) const noexcept {
    return classes_.empty() || (!value.empty() && is_ascii_letter(value.front()) &&
                                value.back() != ' ' && !aliases_.may_hold(value));
  }

  // The name under which the class has to be given whose OID or second name this value is, or whose
  // name it is with blanks around it. Null for every other value: a class's own name in any letter
  // case, or what names none of the classes.
  [[nodiscard]] const std::string* required_name(std::string_view value) const noexcept;

 private:
  std::vector<ObjectClassNames> classes_;
  NameFilter aliases_;  // OIDs are told apart by their first character
};

// The table in force; valid until the next registration.
const ObjectClassLookup& object_class_lookup() noexcept;

}  // namespace orv::cfg
