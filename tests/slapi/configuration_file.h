// A session on a configuration file of the test's own.
#pragma once

#include <gtest/gtest.h>

#include <string>

#include "../temporary_directory.h"
#include "cfg/owners.h"

namespace orv::test {

class ConfigurationFile {
 public:
  explicit ConfigurationFile(const std::string& ldif) : session_(cfg_init(nullptr, 0)) {
    const std::string path = directory_.write("config.ldif", ldif);
    cfg_set_option(session_.get(), kCfgOptDiagnostics, 1);
    cfg_set_option(session_.get(), kCfgOptConfigFile, path.c_str());
    EXPECT_EQ(cfg_bind_s(session_.get(), nullptr, nullptr, 128), 0)
        << cfg_dump_exception(session_.get());
  }

  _CFG* session() { return session_.get(); }

  CfgResult find(const char* dn, bool types_only = false) {
    _CFGMessage* chain = nullptr;
    EXPECT_EQ(cfg_search_s(session_.get(), dn, kScopeBase, "objectclass=*", nullptr,
                           types_only ? 1 : 0, &chain),
              0);
    return CfgResult(chain);
  }

  _CFGMessage* first(const CfgResult& result) {
    return cfg_first_entry(session_.get(), result.get());
  }

 private:
  TemporaryDirectory directory_;
  CfgSession session_;
};

}  // namespace orv::test
