// The schema: attribute types and object classes in the notation of RFC 4512, 4.1.
//
// Loaded once at start, immutable afterwards, readable from any thread. It decides canonical names
// (the first NAME of a description) for attribute types and object class values, feeds the
// configuration-file library's attribute table, and is what the subschema subentry publishes.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "cfg/attribute_table.h"
#include "cfg/object_class_table.h"

namespace orv {

enum class ClassKind { abstract, structural, auxiliary };

struct ObjectClass {
  std::string oid;
  std::vector<std::string> names;  // first is canonical
  std::vector<std::string> superiors;
  ClassKind kind = ClassKind::structural;
  std::vector<std::string> must;  // own, canonical; superiors' not included
  std::vector<std::string> may;
  std::string description;  // as it was given, for publishing
};

struct SchemaAttribute {
  std::string oid;
  std::vector<std::string> names;  // first is canonical
  std::string equality;            // rule name, may be inherited
  std::string ordering;
  std::string substrings;
  std::string syntax;              // numeric OID
  std::size_t max_characters = 0;  // the syntax's bound ("{64}"), 0 without one
  bool single_valued = false;
  bool no_user_modification = false;
  bool operational = false;
  bool secret = false;      // X-ORV-SECRET 'TRUE'
  std::string description;  // as it was given, for publishing
};

class Schema {
 public:
  // Reads descriptions: lines that begin "attributeTypes:" or "objectClasses:" (LDIF folding and
  // comments as in RFC 2849). Refuses what it cannot read whole, a duplicate name or OID, an
  // unknown superior or type. A superior stands before what derives from it. Null on failure, with
  // line and cause in `error`.
  static std::unique_ptr<const Schema> parse(std::string_view text, std::string& error);

  // Look-up by any name or numeric OID, ignoring ASCII letter case; null when unknown.
  const SchemaAttribute* attribute(std::string_view name) const noexcept;
  const ObjectClass* object_class(std::string_view name) const noexcept;

  // The canonical spelling, or an empty view when unknown.
  std::string_view canonical_attribute(std::string_view name) const noexcept;
  std::string_view canonical_object_class(std::string_view name) const noexcept;

  const std::vector<SchemaAttribute>& attributes() const noexcept { return attributes_; }
  const std::vector<ObjectClass>& object_classes() const noexcept { return object_classes_; }

  // The rows for cfg::register_attribute_types.
  std::vector<cfg::AttributeType> attribute_table() const;

  // The rows for cfg::register_object_classes.
  std::vector<cfg::ObjectClassNames> object_class_table() const;

  ~Schema();

 private:
  Schema();
  struct Index;
  std::vector<SchemaAttribute> attributes_;
  std::vector<ObjectClass> object_classes_;
  std::unique_ptr<Index> index_;
  friend class SchemaReader;
};

// The schema that is built into the server (the files under schema/), parsed on first use. Never
// null.
const Schema& builtin_schema();

// The schema in force for entries of this process (value_find and the schema check use it): the
// built-in one unless set. Set before threads start; the schema must outlive all entries.
const Schema& current_schema();
void set_current_schema(const Schema* schema);

}  // namespace orv
