#include "schema_check.h"

#include <algorithm>
#include <set>

#include "cfg/text.h"
#include "value_check.h"

namespace orv::orvcfg {

namespace {

// The classes of an entry and all their superiors.
using Classes = std::set<const ObjectClass*>;

void add_with_superiors(const Schema& schema, const ObjectClass* object_class, Classes& classes) {
  if (object_class == nullptr || !classes.insert(object_class).second) return;
  for (const std::string& superior : object_class->superiors) {
    add_with_superiors(schema, schema.object_class(superior), classes);
  }
}

class EntryCheck {
 public:
  EntryCheck(const Schema& schema, const FileEntry& entry) : schema_(schema), entry_(entry) {}

  std::vector<std::string> run() {
    check_class_values();
    check_structural_classes();
    check_mandatory_attributes();
    for (const FileAttribute& attribute : entry_.attributes) check_attribute(attribute);
    return std::move(problems_);
  }

 private:
  void check_class_values() {
    for (const std::string& value : entry_.values("objectClass")) {
      const ObjectClass* object_class = schema_.object_class(value);
      if (object_class == nullptr) problems_.push_back("unknown object class " + value);
      add_with_superiors(schema_, object_class, classes_);
    }
  }

  // A structural class that another one of the entry inherits from does not count by itself.
  void check_structural_classes() {
    Classes inherited;
    for (const ObjectClass* object_class : classes_) {
      for (const std::string& superior : object_class->superiors) {
        add_with_superiors(schema_, schema_.object_class(superior), inherited);
      }
    }
    const auto own = std::count_if(classes_.begin(), classes_.end(), [&](const ObjectClass* c) {
      return c->kind == ClassKind::structural && !inherited.contains(c);
    });
    if (own == 0) problems_.emplace_back("no structural object class");
    if (own > 1) problems_.emplace_back("more than one structural object class");
  }

  void check_mandatory_attributes() {
    std::set<std::string> missing;
    for (const ObjectClass* object_class : classes_) {
      for (const std::string& name : object_class->must) {
        if (entry_.values(name).empty()) missing.insert(name);
      }
    }
    for (const std::string& name : missing) problems_.push_back("missing attribute " + name);
  }

  void check_attribute(const FileAttribute& attribute) {
    const SchemaAttribute* type = schema_.attribute(attribute.name);
    if (type == nullptr) {
      problems_.push_back("unknown attribute type " + attribute.name);
      return;
    }
    if (type->single_valued && attribute.values.size() > 1) {
      problems_.push_back(attribute.name + " has " + std::to_string(attribute.values.size()) +
                          " values, only one is allowed");
    }
    for (const std::string& value : attribute.values) {
      const std::string problem = value_problem(*type, value);
      if (!problem.empty()) problems_.push_back(type->names.front() + " " + problem);
    }
    if (!type->operational && !is_allowed(*type)) {
      problems_.push_back(attribute.name + " is not allowed by the object classes of the entry");
    }
  }

  [[nodiscard]] bool is_allowed(const SchemaAttribute& type) const {
    const auto lists = [&](const std::vector<std::string>& names) {
      return std::any_of(names.begin(), names.end(), [&](const std::string& name) {
        return cfg::equals_ignore_ascii_case(name, type.names.front());
      });
    };
    return std::any_of(classes_.begin(), classes_.end(), [&](const ObjectClass* object_class) {
      return lists(object_class->must) || lists(object_class->may);
    });
  }

  const Schema& schema_;
  const FileEntry& entry_;
  Classes classes_;
  std::vector<std::string> problems_;
};

}  // namespace

std::vector<std::string> schema_problems(const Schema& schema, const FileEntry& entry) {
  return EntryCheck(schema, entry).run();
}

}  // namespace orv::orvcfg
