#include "file_report.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <netinet/in.h>

#include <algorithm>
#include <cstring>
#include <fstream>
#include <iterator>
#include <memory>
#include <new>

#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "settings.h"
#include "slapi/entry.h"
#include "slapi/owners.h"

namespace orv::server {
namespace {

constexpr const char* kSuffix = "CN=CONFIGURATION";

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

// ---- addresses

struct Address {
  int family = AF_UNSPEC;
  unsigned char bytes[16] = {};
};

bool parse_address(const std::string& text, Address& address) {
  const std::string literal = text.substr(0, text.find('%'));
  address.family = literal.find(':') == std::string::npos ? AF_INET : AF_INET6;
  return inet_pton(address.family, literal.c_str(), address.bytes) == 1;
}

bool is_wildcard(const Address& address) noexcept {
  return std::all_of(std::begin(address.bytes), std::end(address.bytes),
                     [](unsigned char byte) { return byte == 0; });
}

bool is_at(const ifaddrs& interface, const Address& address) noexcept {
  if (!interface.ifa_addr || interface.ifa_addr->sa_family != address.family) return false;
  if (address.family == AF_INET) {
    sockaddr_in found{};
    std::memcpy(&found, interface.ifa_addr, sizeof found);
    return std::memcmp(&found.sin_addr, address.bytes, sizeof found.sin_addr) == 0;
  }
  sockaddr_in6 found{};
  std::memcpy(&found, interface.ifa_addr, sizeof found);
  return std::memcmp(&found.sin6_addr, address.bytes, sizeof found.sin6_addr) == 0;
}

void check_addresses(const std::string& config_file, const std::string& key_stash_file,
                     std::vector<std::string>& doubts) {
  Settings settings;
  std::string error;
  if (!read_settings(config_file, key_stash_file, settings, error)) return doubts.push_back(error);
  for (const std::string& address : settings.addresses)
    if (is_foreign_address(address))
      doubts.push_back(std::string(kSuffix) + ": orv-slapdIpAddress " + address +
                       " is no address of this host; changes of this entry will be refused");
}

// ---- the schema

// What is wrong is told by the check itself.
void check_schema(const std::string& config_file, std::vector<std::string>& doubts) {
  const CfgSession session(cfg_init(nullptr, 0));
  if (!session) throw std::bad_alloc();
  cfg_set_option(session.get(), kCfgOptConfigFile, config_file.c_str());
  _CFGMessage* found = nullptr;
  int code = cfg_bind_s(session.get(), nullptr, nullptr, 128);
  if (code == 0)
    code =
        cfg_search_s(session.get(), kSuffix, kScopeSubtree, "(objectclass=*)", nullptr, 0, &found);
  const CfgResult chain(found);
  if (code != 0) return doubts.push_back(config_file + ": cannot be read");
  for (_CFGMessage* record = cfg_first_entry(session.get(), chain.get()); record;
       record = cfg_next_entry(session.get(), record)) {
    const EntryPtr checked(CFGMessage2Entry(session.get(), record));
    if (!checked) throw std::bad_alloc();
    ldcf_api_schema_check(checked.get(), 0, 0);
  }
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

bool is_foreign_address(const std::string& address) {
  Address wanted;
  if (!parse_address(address, wanted) || is_wildcard(wanted)) return false;
  ifaddrs* all = nullptr;
  if (getifaddrs(&all) != 0) return false;
  const std::unique_ptr<ifaddrs, decltype(&freeifaddrs)> owned(all, &freeifaddrs);
  for (const ifaddrs* interface = all; interface; interface = interface->ifa_next)
    if (is_at(*interface, wanted)) return false;
  return true;
}

std::vector<std::string> doubts_about_file(const std::string& config_file,
                                           const std::string& key_stash_file) {
  std::ifstream file(config_file, std::ios::binary);
  const std::string text{std::istreambuf_iterator<char>(file), {}};
  std::vector<std::string> doubts = numbered_types(text);
  check_schema(config_file, doubts);
  check_addresses(config_file, key_stash_file, doubts);
  return doubts;
}

}  // namespace orv::server
