// The schema check of entries that are added or changed.

#include <algorithm>
#include <new>
#include <string>
#include <string_view>
#include <vector>

#include "admitted.h"
#include "cfg/dn.h"
#include "cfg/masked_dn.h"
#include "cfg/result_codes.h"
#include "equality.h"
#include "local_text.h"
#include "messages.h"
#include "slapi/entry.h"
#include "slapi/schema.h"
#include "slapi/value_syntax.h"

namespace orv {
namespace {

using Classes = std::vector<const ObjectClass*>;

bool contains(const Classes& classes, const ObjectClass* object_class) noexcept {
  return std::find(classes.begin(), classes.end(), object_class) != classes.end();
}

bool lists(const std::vector<std::string>& types, const std::string& type) noexcept {
  return std::find(types.begin(), types.end(), type) != types.end();
}

std::string_view bytes_of(const berval& value) noexcept {
  return value.bv_val == nullptr ? std::string_view{}
                                 : std::string_view(value.bv_val, value.bv_len);
}

std::size_t count_values(const attr& a) noexcept {
  std::size_t count = 0;
  while (a.values != nullptr && a.values[count] != nullptr) ++count;
  return count;
}

// ---- One entry -------------------------------------------------------------------------------

// The checks in their order; each returns 0 or the code that ends them, having said why.
class EntryCheck {
 public:
  explicit EntryCheck(const entry& e) : schema_(current_schema()), entry_(e) {}

  int run() {
    using Step = int (EntryCheck::*)();
    static constexpr Step kSteps[] = {
        &EntryCheck::check_classes,    &EntryCheck::check_values,    &EntryCheck::check_allowed,
        &EntryCheck::check_structural, &EntryCheck::check_mandatory, &EntryCheck::check_rdn,
    };
    for (const Step step : kSteps)
      if (const int rc = (this->*step)(); rc != result::success) return rc;
    return result::success;
  }

 private:
  // ---- Steps

  int check_classes() {
    const attr* const given = attr_find(&entry_, "objectClass", 0, 0);
    if (given == nullptr || count_values(*given) == 0)
      return refuse(result::object_class_violation, message::no_object_class);
    for (berval** value = given->values; *value != nullptr; ++value) {
      const std::string name(bytes_of(**value));
      const ObjectClass* const object_class = schema_.object_class(name);
      if (object_class == nullptr)
        return refuse(result::object_class_violation, message::unknown_object_class, name.c_str());
      add_with_superiors(object_class);
    }
    return result::success;
  }

  int check_values() {
    for (const attr* a = entry_.attributes; a != nullptr; a = a->next)
      if (const int rc = check_attribute(*a); rc != result::success) return rc;
    return result::success;
  }

  // Operational attributes are the server's and belong to no class.
  int check_allowed() {
    for (const attr* a = entry_.attributes; a != nullptr; a = a->next) {
      const SchemaAttribute* const type = schema_.attribute(a->type);
      if (type->operational || is_allowed(type->names.front())) continue;
      return refuse(result::object_class_violation, message::not_allowed, a->type);
    }
    return result::success;
  }

  // RFC 4512, 2.4.2: the structural classes form one chain.
  int check_structural() {
    const ObjectClass* lowest = nullptr;
    for (const ObjectClass* const object_class : classes_) {
      if (object_class->kind != ClassKind::structural || is_superior(object_class)) continue;
      if (lowest != nullptr)
        return refuse(result::object_class_violation, message::two_structural_classes,
                      lowest->names.front().c_str(), object_class->names.front().c_str());
      lowest = object_class;
    }
    if (lowest == nullptr)
      return refuse(result::object_class_violation, message::no_structural_class);
    return result::success;
  }

  int check_mandatory() {
    for (const ObjectClass* const object_class : classes_)
      for (const std::string& type : object_class->must)
        if (attr_find(&entry_, type.c_str(), 0, 0) == nullptr)
          return refuse(result::object_class_violation, message::missing_attribute, type.c_str());
    return result::success;
  }

  // An entry is found by what its attributes say, and a DN is shown to everybody.
  int check_rdn() {
    std::string dn;
    if (entry_.dn == nullptr || !to_utf8(entry_.dn, dn)) return result::success;
    cfg::Dn parsed;
    if (const int rc = cfg::parse_dn(dn, parsed); rc != result::success) return rc;
    if (parsed.empty()) return result::success;
    for (const cfg::Ava& ava : parsed.front()) {
      const std::string type(canonical(ava.type));
      if (slapi::is_secret_type(type))
        return refuse(result::naming_violation, message::secret_in_name, type.c_str());
      if (!holds(type, ava.value))
        return refuse(result::naming_violation, message::name_not_in_entry, type.c_str());
    }
    return result::success;
  }

  // ---- Attributes

  int check_attribute(const attr& a) {
    const char* const name = a.type == nullptr ? "" : a.type;
    const SchemaAttribute* const type = schema_.attribute(name);
    if (type == nullptr)
      return refuse(result::undefined_attribute_type, message::unknown_type, name);
    const std::size_t count = count_values(a);
    if (count == 0)
      return refuse(result::invalid_attribute_syntax, message::bad_value, name, "is missing");
    if (type->single_valued && count > 1)
      return refuse(result::constraint_violation, message::too_many_values, name);
    for (berval** value = a.values; *value != nullptr; ++value)
      if (const int rc = check_one_value(*type, **value); rc != result::success) return rc;
    return result::success;
  }

  int check_one_value(const SchemaAttribute& type, const berval& value) {
    const char* problem = "";
    int rc = result::success;
    if (!slapi::has_foreign_texts(entry_) || type.secret) {
      rc = check_value(type, bytes_of(value), &problem);
    } else if (std::string text; to_utf8(bytes_of(value), text)) {
      rc = check_value(type, text, &problem);
    }
    if (rc == result::success || rc == result::no_memory) return rc;
    return refuse(rc, message::bad_value, type.names.front().c_str(), problem);
  }

  [[nodiscard]] bool is_allowed(const std::string& type) const noexcept {
    return std::any_of(classes_.begin(), classes_.end(), [&](const ObjectClass* object_class) {
      return lists(object_class->must, type) || lists(object_class->may, type);
    });
  }

  bool holds(const std::string& type, const std::string& value) {
    const attr* const named = attr_find(&entry_, type.c_str(), 0, 0);
    if (named == nullptr || named->values == nullptr) return false;
    const cfg::MatchingRule rule = slapi::equality_of(type);
    const std::string wanted = slapi::equality_key(rule, value);
    for (berval** held = named->values; *held != nullptr; ++held) {
      std::string text;
      if (to_utf8(bytes_of(**held), text) && slapi::equality_key(rule, text) == wanted) return true;
    }
    return false;
  }

  [[nodiscard]] std::string_view canonical(const std::string& type) const noexcept {
    const std::string_view known = schema_.canonical_attribute(type);
    return known.empty() ? std::string_view(type) : known;
  }

  // ---- Classes

  void add_with_superiors(const ObjectClass* object_class) {
    if (contains(classes_, object_class)) return;
    classes_.push_back(object_class);
    for (const std::string& superior : object_class->superiors)
      add_with_superiors(schema_.object_class(superior));
  }

  // Whether another class of the entry derives from this one. `classes_` holds all superiors, so
  // that the direct ones suffice.
  [[nodiscard]] bool is_superior(const ObjectClass* object_class) const noexcept {
    return std::any_of(classes_.begin(), classes_.end(), [&](const ObjectClass* other) {
      return lists(other->superiors, object_class->names.front());
    });
  }

  // ---- Texts

  // False for text that the code page lacks. It came from the file, where it stays as it is.
  bool to_utf8(std::string_view text, std::string& utf8) const {
    return slapi::text_to_utf8(entry_, text, utf8);
  }

  // The entry's name for a message, without a password that somebody put into it.
  [[nodiscard]] std::string shown_dn() const {
    if (entry_.dn == nullptr) return "";
    std::string utf8;
    std::string shown = "not a DN";
    if (to_utf8(entry_.dn, utf8) &&
        cfg::mask_dn(utf8, cfg::UnknownTypes::shown, shown) == result::no_memory)
      throw std::bad_alloc();
    return shown == utf8 ? entry_.dn : shown;
  }

  [[nodiscard]] int refuse(int code, int number, const char* first = "",
                           const char* second = "") const {
    PrintMessage(0, message::schema_set, number, shown_dn().c_str(), first, second);
    return code;
  }

  const Schema& schema_;
  const entry& entry_;
  Classes classes_;  // with all superiors
};

constexpr std::string_view kReferral = "referral";

}  // namespace

int ldcf_api_schema_check(entry* e, int /*reserved1*/, int /*reserved2*/) try {
  if (e == nullptr) return result::other;
  slapi::note_checked_entry(*e);
  return EntryCheck(*e).run();
} catch (...) {
  return result::no_memory;
}

int checkReferral(entry* e) {
  const attr* const classes = attr_find(e, "objectClass", 0, 0);
  if (classes == nullptr || classes->values == nullptr) return result::success;
  for (berval** value = classes->values; *value != nullptr; ++value)
    if (current_schema().canonical_object_class(bytes_of(**value)) == kReferral)
      return result::unwilling_to_perform;
  return result::success;
}

}  // namespace orv
