// A configuration file of the library, for tests of searches that take as long as the test wants.
#pragma once

#include <gtest/gtest.h>

#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <string>

#include "cfg/owners.h"
#include "cfg/session.h"

namespace orv::server::test {

class SearchedFile {
 public:
  // With the top entry and `below` entries right under it.
  explicit SearchedFile(int below = 0) {
    char name[] = "/tmp/orv-core-XXXXXX";
    ::close(mkstemp(name));
    path_ = name;
    std::ofstream out(path_);
    out << "dn: cn=configuration\ncn: configuration\n";
    for (int i = 0; i < below; ++i)
      out << "\ndn: cn=" << i << ",cn=configuration\ncn: " << i << "\n";
    out.close();
    EXPECT_TRUE(out) << path_;
  }
  ~SearchedFile() { unlink(path_.c_str()); }
  SearchedFile(const SearchedFile&) = delete;
  SearchedFile& operator=(const SearchedFile&) = delete;

  // Looks at every entry and finds none. Returns the library's code.
  int search() const {
    const CfgSession session(cfg_init(nullptr, 0));
    cfg_set_option(session.get(), kCfgOptConfigFile, path_.c_str());
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
    _CFGMessage* chain = nullptr;
    const int code =
        cfg_search_s(session.get(), "cn=configuration", 2, "(cn=nobody)", nullptr, 0, &chain);
    const CfgResult owned(chain);
    return code;
  }
  // The same again and again, until a search is interrupted, `enough` says so, or ten seconds are
  // over. Returns the last code.
  int search_until(const std::function<bool()>& enough) const {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    int code = 0;
    while (code == 0 && !enough() && std::chrono::steady_clock::now() < end) code = search();
    return code;
  }
  int search_until_interrupted() const {
    return search_until([] { return false; });
  }

 private:
  std::string path_;
};

}  // namespace orv::server::test
