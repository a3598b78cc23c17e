#include "file_report.h"

#include <fstream>
#include <iterator>
#include <new>

#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "settings.h"
#include "slapi/entry.h"
#include "slapi/file_doubts.h"
#include "slapi/owners.h"

namespace orv::server {
namespace {

constexpr const char* kSuffix = "CN=CONFIGURATION";

void check_addresses(const std::string& config_file, const std::string& key_stash_file,
                     std::vector<std::string>& doubts) {
  Settings settings;
  std::string error;
  if (!read_settings(config_file, key_stash_file, settings, error)) return doubts.push_back(error);
  for (const std::string& address : settings.addresses)
    if (const std::string doubt = address_doubt(address); !doubt.empty())
      doubts.push_back(std::string(kSuffix) + ": " + doubt);
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
