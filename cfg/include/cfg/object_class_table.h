// What the library knows about object classes: their own names, and the other ones under which a
// file must not give them.
//
// Rules compare the values of objectClass as text, without regard to letter case. A class under its
// numeric OID or a second name would step around them, so a file that holds one is refused when it
// is read. Classes that the table does not hold are values like any other.
//
// The table is filled once by the program, from its schema, before the first session; it is
// immutable afterwards and may be read from any thread. Without a registration every value is read
// as it is.
#pragma once

#include <string>
#include <vector>

namespace orv::cfg {

struct ObjectClassNames {
  std::string name;                  // its own name, under which values have to be given
  std::string oid;                   // numeric form, may be empty
  std::vector<std::string> aliases;  // further names
};

// Replaces the process-wide table. Call before the first session and at most once in a program;
// tests may call it again while no session is open. 0 or 90.
int register_object_classes(std::vector<ObjectClassNames> classes) noexcept;

}  // namespace orv::cfg
