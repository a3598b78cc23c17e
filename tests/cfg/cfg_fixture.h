// A session on a file of the test's own, and the results of searches as plain containers.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "../temporary_directory.h"
#include "cfg/attribute_table.h"
#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "cfg/session.h"

namespace orv::cfg_test {

using test::TemporaryDirectory;

inline void write_file(const std::string& path, std::string_view content) {
  std::ofstream(path, std::ios::binary | std::ios::trunc)
      .write(content.data(), static_cast<std::streamsize>(content.size()));
}

inline cfg::AttributeType attribute_type(std::string name, std::string oid,
                                         std::vector<std::string> aliases,
                                         cfg::MatchingRule equality) {
  cfg::AttributeType type;
  type.name = std::move(name);
  type.oid = std::move(oid);
  type.aliases = std::move(aliases);
  type.equality = equality;
  return type;
}

// One type of each matching rule, and secrets with and without other names.
inline std::vector<cfg::AttributeType> test_types() {
  using cfg::MatchingRule;
  std::vector<cfg::AttributeType> types = {
      attribute_type("cn", "2.5.4.3", {"commonName"}, MatchingRule::case_ignore),
      attribute_type("ou", "2.5.4.11", {"organizationalUnitName"}, MatchingRule::case_ignore),
      attribute_type("o", "2.5.4.10", {}, MatchingRule::case_ignore),
      attribute_type("objectClass", "2.5.4.0", {}, MatchingRule::object_identifier),
      attribute_type("description", "2.5.4.13", {}, MatchingRule::case_ignore),
      attribute_type("exactText", "1.9.1", {}, MatchingRule::case_exact),
      attribute_type("bytes", "1.9.2", {}, MatchingRule::octets),
      attribute_type("member", "2.5.4.31", {}, MatchingRule::distinguished_name),
      attribute_type("number", "1.9.3", {"count"}, MatchingRule::integer),
      attribute_type("flag", "1.9.4", {}, MatchingRule::boolean),
      attribute_type("telephoneNumber", "2.5.4.20", {}, MatchingRule::telephone_number),
      attribute_type("moment", "1.9.5", {}, MatchingRule::generalized_time),
      attribute_type("orv-slapdAdminPW", "1.9.6", {"adminPassword"}, MatchingRule::octets),
      attribute_type("orv-slapdMasterPW", "1.9.7", {}, MatchingRule::octets),
  };
  types[types.size() - 1].secret = true;
  types[types.size() - 2].secret = true;
  return types;
}

using Values = std::vector<std::string>;
struct FoundEntry {
  std::string dn;
  std::vector<std::pair<std::string, Values>> attributes;
  bool operator==(const FoundEntry& other) const {
    return dn == other.dn && attributes == other.attributes;
  }
};

inline Values values_of(_CFG* session, _CFGMessage* record, const char* name) {
  const CfgValues values(cfg_get_values(session, record, name));
  Values result;
  for (char** value = values.get(); value != nullptr && *value != nullptr; ++value) {
    result.emplace_back(*value);
  }
  return result;
}

inline FoundEntry read_entry(_CFG* session, _CFGMessage* record) {
  FoundEntry entry;
  const CfgText dn(cfg_get_dn(session, record));
  EXPECT_NE(dn, nullptr);
  if (dn != nullptr) entry.dn = dn.get();
  _CFGBer* raw = nullptr;
  CfgText name(cfg_first_attribute(session, record, &raw));
  const CfgCursor cursor(raw);
  while (name != nullptr) {
    entry.attributes.emplace_back(name.get(), values_of(session, record, name.get()));
    EXPECT_EQ(cfg_get_errno(session), 0);
    name.reset(cfg_next_attribute(session, record, cursor.get()));
  }
  EXPECT_EQ(cfg_get_errno(session), 0);
  return entry;
}

inline std::vector<FoundEntry> read_chain(_CFG* session, _CFGMessage* chain) {
  std::vector<FoundEntry> entries;
  for (_CFGMessage* record = cfg_first_entry(session, chain); record != nullptr;
       record = cfg_next_entry(session, record)) {
    entries.push_back(read_entry(session, record));
  }
  return entries;
}

class CfgTest : public ::testing::Test {
 protected:
  explicit CfgTest(const std::string& parent = "/tmp") : directory_(parent) {}

  void SetUp() override { ASSERT_EQ(cfg::register_attribute_types(test_types()), 0); }

  // A handle with the file's path set.
  CfgSession unbound() {
    CfgSession session(cfg_init(nullptr, 0));
    EXPECT_EQ(cfg_set_option(session.get(), kCfgOptConfigFile, path_.c_str()), 0);
    return session;
  }

  // A bound session on `content`.
  CfgSession open(std::string_view content) {
    write_file(path_, content);
    CfgSession session = unbound();
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0)
        << cfg_dump_exception(session.get());
    return session;
  }

  // What the bind of a file that must be refused says.
  std::string refusal(std::string_view content) {
    write_file(path_, content);
    const CfgSession session = unbound();
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 1);
    return cfg_dump_exception(session.get());
  }

  static std::vector<FoundEntry> search(const CfgSession& session, const char* base, int scope,
                                        const char* filter, std::vector<const char*> names = {},
                                        bool types_only = false) {
    names.push_back(nullptr);
    _CFGMessage* chain = nullptr;
    EXPECT_EQ(cfg_search_s(session.get(), base, scope, filter,
                           names.size() == 1 ? nullptr : const_cast<char**>(names.data()),
                           types_only ? 1 : 0, &chain),
              0);
    const CfgResult owned(chain);
    std::vector<FoundEntry> entries = read_chain(session.get(), chain);
    EXPECT_EQ(cfg_count_entries(session.get(), chain), static_cast<int>(entries.size()));
    return entries;
  }

  static Values dns(const std::vector<FoundEntry>& entries) {
    Values result;
    for (const FoundEntry& entry : entries) result.push_back(entry.dn);
    return result;
  }

  static int search_code(const CfgSession& session, const char* base, int scope,
                         const char* filter) {
    _CFGMessage* chain = reinterpret_cast<_CFGMessage*>(&chain);
    const int rc = cfg_search_s(session.get(), base, scope, filter, nullptr, 0, &chain);
    EXPECT_EQ(cfg_get_errno(session.get()), rc);
    if (rc != 0) {
      EXPECT_EQ(chain, nullptr);
    } else {
      cfg_msgfree(chain);
    }
    return rc;
  }

  const TemporaryDirectory directory_;
  std::string path_ = directory_.file("config.ldif");
};

}  // namespace orv::cfg_test
