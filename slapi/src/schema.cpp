#include "slapi/schema.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>

#include "equality.h"
#include "schema/builtin_schema.h"
#include "schema_index.h"

namespace orv {
namespace {

std::atomic<const Schema*>& schema_in_force() noexcept {
  static std::atomic<const Schema*> schema{nullptr};
  return schema;
}

// Without its own schema the server would know no secrets and no rules: it does not run so.
const Schema* read_builtin_schema() noexcept {
  std::string error;
  std::unique_ptr<const Schema> schema = Schema::parse(kBuiltinSchemaText, error);
  if (schema != nullptr) return schema.release();
  std::fprintf(stderr, "The built-in schema cannot be read: %s\n", error.c_str());
  std::abort();
}

cfg::AttributeType table_row(const SchemaAttribute& attribute) {
  cfg::AttributeType row;
  row.name = attribute.names.front();
  row.oid = attribute.oid;
  row.aliases.assign(attribute.names.begin() + 1, attribute.names.end());
  slapi::find_equality(attribute.equality, row.equality);
  row.single_valued = attribute.single_valued;
  row.secret = attribute.secret;
  return row;
}

}  // namespace

Schema::Schema() : index_(std::make_unique<Index>()) {}
Schema::~Schema() = default;

const SchemaAttribute* Schema::attribute(std::string_view name) const noexcept {
  const auto position = find_name(index_->attributes, name);
  return position ? &attributes_[*position] : nullptr;
}

const ObjectClass* Schema::object_class(std::string_view name) const noexcept {
  const auto position = find_name(index_->object_classes, name);
  return position ? &object_classes_[*position] : nullptr;
}

std::string_view Schema::canonical_attribute(std::string_view name) const noexcept {
  const SchemaAttribute* const known = attribute(name);
  return known == nullptr ? std::string_view{} : known->names.front();
}

std::string_view Schema::canonical_object_class(std::string_view name) const noexcept {
  const ObjectClass* const known = object_class(name);
  return known == nullptr ? std::string_view{} : known->names.front();
}

std::vector<cfg::AttributeType> Schema::attribute_table() const {
  std::vector<cfg::AttributeType> table;
  table.reserve(attributes_.size());
  for (const SchemaAttribute& attribute : attributes_) table.push_back(table_row(attribute));
  return table;
}

std::vector<cfg::ObjectClassNames> Schema::object_class_table() const {
  std::vector<cfg::ObjectClassNames> table;
  table.reserve(object_classes_.size());
  for (const ObjectClass& known : object_classes_) {
    table.push_back({known.names.front(), known.oid, {known.names.begin() + 1, known.names.end()}});
  }
  return table;
}

const Schema& builtin_schema() {
  static const Schema* const schema = read_builtin_schema();
  return *schema;
}

const Schema& current_schema() {
  const Schema* schema = slapi::schema_if_loaded();
  if (schema != nullptr) return *schema;
  schema = &builtin_schema();
  set_current_schema(schema);
  return *schema;
}

void set_current_schema(const Schema* schema) {
  schema_in_force().store(schema, std::memory_order_release);
}

const Schema* slapi::schema_if_loaded() noexcept {
  return schema_in_force().load(std::memory_order_acquire);
}

}  // namespace orv
