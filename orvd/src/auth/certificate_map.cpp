#include "auth/certificate_map.h"

#include <new>

#include "cfg/dn.h"
#include "cfg/result_codes.h"

namespace orv::server {
namespace {

// Where the arrow's second character stands; npos when there is none.
std::size_t find_arrow(std::string_view value) noexcept {
  for (std::size_t i = 0; i < value.size(); ++i) {
    if (value[i] == '\\')
      ++i;
    else if (value[i] == '>')
      return i > 0 && value[i - 1] == '=' ? i : std::string_view::npos;
  }
  return std::string_view::npos;
}

std::string_view trimmed(std::string_view text) noexcept {
  while (text.starts_with(' ')) text.remove_prefix(1);
  // A blank behind a backslash belongs to the name.
  while (text.ends_with(' ') && !text.ends_with("\\ ")) text.remove_suffix(1);
  return text;
}

bool read_name(std::string_view text, std::string& normal) {
  const int code = cfg::normalize_dn(trimmed(text), normal);
  if (code == result::no_memory) throw std::bad_alloc();
  return code == 0 && !normal.empty();
}

}  // namespace

bool parse_certificate_mapping(std::string_view value, CertificateMapping& mapping) {
  const std::size_t arrow = find_arrow(value);
  if (arrow == std::string_view::npos) return false;
  return read_name(value.substr(0, arrow - 1), mapping.subject) &&
         read_name(value.substr(arrow + 1), mapping.bound_dn);
}

}  // namespace orv::server
