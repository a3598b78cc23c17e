// What the eye of an administrator may have missed in a configuration file.

#include "slapi/file_doubts.h"

#include <algorithm>

#include "slapi/services.h"

namespace orv {
namespace {

bool is_digit(char c) noexcept {
  return c >= '0' && c <= '9';
}

// The number at the beginning of a line, or "": continued lines begin with a blank.
std::string_view numbered_type(std::string_view line) noexcept {
  const std::size_t end = std::min(line.find_first_of(":;"), line.size());
  const std::string_view type = line.substr(0, end);
  const bool number =
      !type.empty() && end < line.size() && is_digit(type.front()) &&
      std::all_of(type.begin(), type.end(), [](char c) { return is_digit(c) || c == '.'; });
  return number ? type : std::string_view();
}

bool is_wildcard(const std::string& address) noexcept {
  return address == "0.0.0.0" || address == "::";
}

}  // namespace

std::vector<std::string> numbered_types(std::string_view ldif) {
  std::vector<std::string> found;
  for (std::size_t at = 0, number = 1; at < ldif.size(); ++number) {
    const std::size_t end = std::min(ldif.find('\n', at), ldif.size());
    const std::string_view type = numbered_type(ldif.substr(at, end - at));
    if (!type.empty())
      found.push_back("line " + std::to_string(number) + ": the attribute type " +
                      std::string(type) + " stands under its number");
    at = end + 1;
  }
  return found;
}

std::string address_doubt(const std::string& address) {
  if (isValidIPAddressOnSystem(address.c_str())) return "";
  const char* const reason =
      is_wildcard(address) ? " stands for every address of the host, which is what no value says"
                           : " is no address of this host";
  return "orv-slapdIpAddress " + address + reason + "; changes of this entry will be refused";
}

}  // namespace orv
