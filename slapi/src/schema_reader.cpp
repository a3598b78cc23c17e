// Reads schema descriptions: unfolds the text, has libldap parse each description, and resolves the
// names in it.

#include <ldap_schema.h>

#include <algorithm>
#include <memory>
#include <new>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "cfg/text.h"
#include "equality.h"
#include "schema_index.h"
#include "slapi/schema.h"
#include "type_names.h"

namespace orv {
namespace {

// Thrown inside the reader only: a line that is refused, and why.
struct SchemaError {
  std::size_t line;
  std::string cause;
};

[[noreturn]] void refuse(std::size_t line, std::string cause) {
  throw SchemaError{line, std::move(cause)};
}

std::string quoted(std::string_view text) {
  std::string out = "'";
  out += text;
  return out += '\'';
}

// ---- Lines -----------------------------------------------------------------------------------

// A description without its folding, and where each of its physical lines begins in it.
struct LogicalLine {
  struct Part {
    std::size_t offset;
    std::size_t line;  // counted from 1
  };
  std::string text;
  std::vector<Part> parts;

  [[nodiscard]] std::size_t line_at(std::size_t offset) const noexcept {
    std::size_t line = parts.front().line;
    for (const Part& part : parts)
      if (part.offset <= offset) line = part.line;
    return line;
  }
};

std::string_view take_line(std::string_view& text) noexcept {
  const std::size_t end = text.find('\n');
  std::string_view line = text.substr(0, end);
  text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
  if (line.ends_with('\r')) line.remove_suffix(1);
  return line;
}

// Unfolds as RFC 2849 does: a line that begins with a blank continues the one before it, a comment
// included.
std::vector<LogicalLine> unfold(std::string_view text) {
  std::vector<LogicalLine> lines;
  bool can_continue = false;
  for (std::size_t number = 1; !text.empty(); ++number) {
    const std::string_view line = take_line(text);
    if (line.find('\0') != std::string_view::npos) refuse(number, "NUL byte");
    if (line.starts_with(' ')) {
      if (!can_continue) refuse(number, "a continuation of nothing");
      LogicalLine& last = lines.back();
      last.parts.push_back({last.text.size(), number});
      last.text += line.substr(1);
      continue;
    }
    can_continue = !line.empty();
    if (can_continue) lines.push_back({std::string(line), {{0, number}}});
  }
  std::erase_if(lines, [](const LogicalLine& line) { return line.text.starts_with('#'); });
  return lines;
}

// ---- Descriptions ----------------------------------------------------------------------------

// Takes "name:" and the blanks after it off the line; false when the line begins otherwise.
bool take_keyword(const LogicalLine& line, std::string_view keyword, std::size_t& offset) noexcept {
  const std::string_view text = line.text;
  if (text.size() <= keyword.size() || text[keyword.size()] != ':') return false;
  if (!cfg::equals_ignore_ascii_case(text.substr(0, keyword.size()), keyword)) return false;
  offset = std::min(text.find_first_not_of(' ', keyword.size() + 1), text.size());
  return true;
}

// The parser stops at the closing parenthesis and does not tell where. Returns the offset behind
// it, or nothing when it is missing.
std::optional<std::size_t> end_of_description(std::string_view text, std::size_t offset) noexcept {
  int depth = 0;
  bool in_quotes = false;
  for (std::size_t i = offset; i < text.size(); ++i) {
    if (text[i] == '\'') in_quotes = !in_quotes;
    if (in_quotes) continue;
    if (text[i] == '(') ++depth;
    if (text[i] == ')' && --depth == 0) return i + 1;
  }
  return std::nullopt;
}

void check_nothing_follows(const LogicalLine& line, std::size_t offset) {
  const std::optional<std::size_t> end = end_of_description(line.text, offset);
  if (!end) refuse(line.line_at(line.text.size()), "missing closing parenthesis");
  const std::size_t rest = line.text.find_first_not_of(' ', *end);
  if (rest != std::string::npos) refuse(line.line_at(rest), "text after the description");
}

struct AttributeTypeDeleter {
  void operator()(LDAPAttributeType* type) const noexcept { ldap_attributetype_free(type); }
};
struct ObjectClassDeleter {
  void operator()(LDAPObjectClass* object_class) const noexcept {
    ldap_objectclass_free(object_class);
  }
};
using ParsedType = std::unique_ptr<LDAPAttributeType, AttributeTypeDeleter>;
using ParsedClass = std::unique_ptr<LDAPObjectClass, ObjectClassDeleter>;

// Runs one of libldap's parsers on the description at `offset`.
template <typename Owner, typename Parser>
Owner parse_description(const LogicalLine& line, std::size_t offset, Parser parser) {
  int code = 0;
  const char* error_at = nullptr;
  const char* const start = line.text.c_str() + offset;
  Owner parsed(parser(start, &code, &error_at, LDAP_SCHEMA_ALLOW_NONE));
  if (parsed == nullptr) {
    if (code == LDAP_SCHERR_OUTOFMEM) throw std::bad_alloc();
    const std::size_t at = error_at == nullptr || error_at < start
                               ? offset
                               : static_cast<std::size_t>(error_at - line.text.c_str());
    refuse(line.line_at(at), ldap_scherr2str(code));
  }
  check_nothing_follows(line, offset);
  return parsed;
}

std::string text_or_empty(const char* text) {
  return text == nullptr ? "" : text;
}

std::vector<std::string> texts(char* const* list) {
  std::vector<std::string> copies;
  for (; list != nullptr && *list != nullptr; ++list) copies.emplace_back(*list);
  return copies;
}

std::vector<std::string> checked_names(char* const* list, std::string_view oid, std::size_t line) {
  std::vector<std::string> names = texts(list);
  if (!slapi::is_numeric_oid(oid)) refuse(line, "not a numeric OID: " + quoted(oid));
  if (names.empty()) refuse(line, "no NAME");
  for (const std::string& name : names)
    if (!slapi::is_descriptor(name)) refuse(line, "not a name: " + quoted(name));
  return names;
}

// X-ORV-SECRET 'TRUE'.
bool is_marked_secret(LDAPSchemaExtensionItem* const* extensions, std::size_t line) {
  bool secret = false;
  for (; extensions != nullptr && *extensions != nullptr; ++extensions) {
    if (std::string_view((*extensions)->lsei_name) != "X-ORV-SECRET") continue;
    const std::vector<std::string> values = texts((*extensions)->lsei_values);
    if (values.size() != 1 || (values.front() != "TRUE" && values.front() != "FALSE"))
      refuse(line, "X-ORV-SECRET is neither 'TRUE' nor 'FALSE'");
    secret = values.front() == "TRUE";
  }
  return secret;
}

ClassKind kind_of(int code) noexcept {
  switch (code) {
    case LDAP_SCHEMA_ABSTRACT:
      return ClassKind::abstract;
    case LDAP_SCHEMA_AUXILIARY:
      return ClassKind::auxiliary;
    default:
      return ClassKind::structural;
  }
}

// RFC 4512, 2.4: abstract classes derive from abstract ones only, structural and auxiliary ones
// from their like and from abstract ones.
bool may_derive(ClassKind kind, ClassKind superior) noexcept {
  return superior == ClassKind::abstract || superior == kind;
}

}  // namespace

// Fills a schema in two walks, attribute types first: a class may name types that stand after it.
class SchemaReader {
 public:
  explicit SchemaReader(std::string_view text) : lines_(unfold(text)), schema_(new Schema) {}

  std::unique_ptr<const Schema> run() {
    for (const LogicalLine& line : lines_) {
      std::size_t offset = 0;
      if (take_keyword(line, "attributeTypes", offset))
        read_attribute(line, offset);
      else if (!take_keyword(line, "objectClasses", offset))
        refuse(line.line_at(0), "neither attributeTypes nor objectClasses");
    }
    for (const LogicalLine& line : lines_) {
      std::size_t offset = 0;
      if (take_keyword(line, "objectClasses", offset)) read_object_class(line, offset);
    }
    return std::move(schema_);
  }

 private:
  void read_attribute(const LogicalLine& line, std::size_t offset) {
    const ParsedType parsed = parse_description<ParsedType>(line, offset, ldap_str2attributetype);
    const std::size_t number = line.line_at(0);
    SchemaAttribute attribute;
    attribute.oid = text_or_empty(parsed->at_oid);
    attribute.names = checked_names(parsed->at_names, attribute.oid, number);
    attribute.equality = text_or_empty(parsed->at_equality_oid);
    attribute.ordering = text_or_empty(parsed->at_ordering_oid);
    attribute.substrings = text_or_empty(parsed->at_substr_oid);
    attribute.syntax = text_or_empty(parsed->at_syntax_oid);
    attribute.max_characters = static_cast<std::size_t>(std::max(parsed->at_syntax_len, 0));
    attribute.single_valued = parsed->at_single_value != 0;
    attribute.no_user_modification = parsed->at_no_user_mod != 0;
    attribute.operational = parsed->at_usage != LDAP_SCHEMA_USER_APPLICATIONS;
    attribute.secret = is_marked_secret(parsed->at_extensions, number);
    attribute.description = line.text.substr(offset);
    inherit(attribute, parsed->at_sup_oid, number);
    if (attribute.syntax.empty()) refuse(number, "neither SYNTAX nor SUP");
    if (cfg::MatchingRule rule{}; !slapi::find_equality(attribute.equality, rule))
      refuse(number, "unknown matching rule " + quoted(attribute.equality));
    add_names(schema_->index_->attributes, attribute.names, attribute.oid, number,
              schema_->attributes_.size());
    schema_->attributes_.push_back(std::move(attribute));
  }

  void inherit(SchemaAttribute& attribute, const char* superior_name, std::size_t line) const {
    if (superior_name == nullptr) return;
    const SchemaAttribute* const superior = schema_->attribute(superior_name);
    if (superior == nullptr) refuse(line, "unknown superior " + quoted(superior_name));
    if (attribute.equality.empty()) attribute.equality = superior->equality;
    if (attribute.ordering.empty()) attribute.ordering = superior->ordering;
    if (attribute.substrings.empty()) attribute.substrings = superior->substrings;
    if (attribute.syntax.empty()) {
      attribute.syntax = superior->syntax;
      attribute.max_characters = superior->max_characters;
    }
    attribute.secret = attribute.secret || superior->secret;
  }

  void read_object_class(const LogicalLine& line, std::size_t offset) {
    const ParsedClass parsed = parse_description<ParsedClass>(line, offset, ldap_str2objectclass);
    const std::size_t number = line.line_at(0);
    ObjectClass object_class;
    object_class.oid = text_or_empty(parsed->oc_oid);
    object_class.names = checked_names(parsed->oc_names, object_class.oid, number);
    object_class.kind = kind_of(parsed->oc_kind);
    object_class.superiors = superiors(parsed->oc_sup_oids, object_class.kind, number);
    object_class.must = canonical_types(parsed->oc_at_oids_must, number);
    object_class.may = canonical_types(parsed->oc_at_oids_may, number);
    object_class.description = line.text.substr(offset);
    add_names(schema_->index_->object_classes, object_class.names, object_class.oid, number,
              schema_->object_classes_.size());
    schema_->object_classes_.push_back(std::move(object_class));
  }

  std::vector<std::string> superiors(char* const* list, ClassKind kind, std::size_t line) const {
    std::vector<std::string> canonical;
    for (const std::string& name : texts(list)) {
      const ObjectClass* const superior = schema_->object_class(name);
      if (superior == nullptr) refuse(line, "unknown superior " + quoted(name));
      if (!may_derive(kind, superior->kind))
        refuse(line, "a class of another kind as superior: " + quoted(name));
      canonical.push_back(superior->names.front());
    }
    return canonical;
  }

  std::vector<std::string> canonical_types(char* const* list, std::size_t line) const {
    std::vector<std::string> canonical;
    for (const std::string& name : texts(list)) {
      const SchemaAttribute* const attribute = schema_->attribute(name);
      if (attribute == nullptr) refuse(line, "unknown attribute type " + quoted(name));
      canonical.push_back(attribute->names.front());
    }
    return canonical;
  }

  // OIDs are unique in the whole schema, names among types and among classes.
  void add_names(NameIndex& index, const std::vector<std::string>& names, const std::string& oid,
                 std::size_t line, std::size_t position) {
    if (schema_->attribute(oid) != nullptr || schema_->object_class(oid) != nullptr)
      refuse(line, "duplicate OID " + quoted(oid));
    index.emplace(oid, position);
    for (const std::string& name : names)
      if (!index.emplace(name, position).second) refuse(line, "duplicate name " + quoted(name));
  }

  std::vector<LogicalLine> lines_;
  std::unique_ptr<Schema> schema_;
};

std::unique_ptr<const Schema> Schema::parse(std::string_view text, std::string& error) {
  try {
    try {
      return SchemaReader(text).run();
    } catch (const SchemaError& refused) {
      error = "line " + std::to_string(refused.line) + ": " + refused.cause;
    }
  } catch (const std::bad_alloc&) {
    error = "no memory";  // short enough to need none
  }
  return nullptr;
}

}  // namespace orv
