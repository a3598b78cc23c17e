// What pass-through authentication needs to be sure of before it is configured: mappings and URLs.

#include <ldap.h>

#include <algorithm>
#include <array>
#include <memory>
#include <string_view>

#include "cfg/result_codes.h"
#include "equality.h"
#include "memory.h"
#include "slapi/schema.h"
#include "slapi/services.h"
#include "type_names.h"

namespace orv {
namespace {

// ---- Attribute mappings ----------------------------------------------------------------------

constexpr std::size_t kMaxMapping = 1024;
constexpr std::size_t kMaxPairs = 16;

std::string_view without_blanks(std::string_view text) noexcept {
  while (text.starts_with(' ')) text.remove_prefix(1);
  while (text.ends_with(' ')) text.remove_suffix(1);
  return text;
}

// Takes what stands before `separator` off the text; all of it when there is none.
std::string_view take_until(std::string_view& text, char separator) noexcept {
  const std::size_t end = std::min(text.find(separator), text.size());
  const std::string_view taken = text.substr(0, end);
  text.remove_prefix(std::min(end + 1, text.size()));
  return without_blanks(taken);
}

bool is_type_name(std::string_view text) noexcept {
  return slapi::is_descriptor(text) || slapi::is_numeric_oid(text);
}

// The types of this server that a mapping named so far.
class MappedTypes {
 public:
  // False for a type that is mapped already, and for one pair too many.
  bool add(const SchemaAttribute* type) noexcept {
    const auto end = types_.begin() + static_cast<std::ptrdiff_t>(count_);
    if (count_ == types_.size() || std::find(types_.begin(), end, type) != end) return false;
    types_[count_++] = type;
    return true;
  }

 private:
  std::array<const SchemaAttribute*, kMaxPairs> types_{};
  std::size_t count_ = 0;
};

// A password would be sent to the other server as a part of a filter.
bool is_pair(std::string_view pair, MappedTypes& mapped) noexcept {
  if (std::count(pair.begin(), pair.end(), '=') != 1) return false;
  const std::string_view local = take_until(pair, '=');
  const std::string_view remote = without_blanks(pair);
  if (!is_type_name(local) || !is_type_name(remote)) return false;
  const SchemaAttribute* const type = current_schema().attribute(local);
  if (type == nullptr || type->secret || slapi::is_secret_type(remote)) return false;
  return mapped.add(type);
}

bool is_mapping(std::string_view text) noexcept {
  if (text.size() > kMaxMapping || text.ends_with(',')) return false;
  MappedTypes mapped;
  do {
    if (!is_pair(take_until(text, ','), mapped)) return false;
  } while (!text.empty());
  return true;
}

// ---- URLs ------------------------------------------------------------------------------------

struct ParsedUrlDeleter {
  void operator()(::LDAPURLDesc* parsed) const noexcept { ::ldap_free_urldesc(parsed); }
};
struct DescriptionDeleter {
  void operator()(LDAPURLDesc* description) const noexcept { ldap_free_urldesc(description); }
};

char* copy_or_empty(const char* text) noexcept {
  return slapi::copy_bytes(text == nullptr ? "" : text);
}

}  // namespace

int verifyAttributeMapping(const char* mapping, void* /*reserved1*/, void* /*reserved2*/) {
  return mapping != nullptr && is_mapping(mapping) ? result::success
                                                   : result::invalid_attribute_syntax;
}

int ldap_url_parse(const char* url, LDAPURLDesc** description) {
  if (description == nullptr) return LDAP_URL_ERR_PARAM;
  *description = nullptr;
  if (url == nullptr) return LDAP_URL_ERR_PARAM;
  ::LDAPURLDesc* found = nullptr;
  const int rc = ::ldap_url_parse(url, &found);
  const std::unique_ptr<::LDAPURLDesc, ParsedUrlDeleter> parsed(found);
  if (rc != LDAP_URL_SUCCESS) return rc;
  std::unique_ptr<LDAPURLDesc, DescriptionDeleter> made(
      static_cast<LDAPURLDesc*>(std::calloc(1, sizeof(LDAPURLDesc))));
  if (made == nullptr) return LDAP_URL_ERR_MEM;
  made->scheme = copy_or_empty(parsed->lud_scheme);
  made->host = copy_or_empty(parsed->lud_host);
  made->port = parsed->lud_port;
  made->dn = copy_or_empty(parsed->lud_dn);
  if (made->scheme == nullptr || made->host == nullptr || made->dn == nullptr)
    return LDAP_URL_ERR_MEM;
  *description = made.release();
  return 0;
}

void ldap_free_urldesc(LDAPURLDesc* description) {
  if (description == nullptr) return;
  std::free(description->scheme);
  std::free(description->host);
  std::free(description->dn);
  std::free(description);
}

}  // namespace orv
