// Walking entries in other orders than one after the other, deep trees, and the key that sessions
// share.
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <thread>

#include "cfg/secret.h"
#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

class WalkTest : public CfgTest {
 protected:
  static CfgResult chain_of(const CfgSession& session, std::vector<const char*> names = {}) {
    names.push_back(nullptr);
    _CFGMessage* chain = nullptr;
    EXPECT_EQ(cfg_search_s(session.get(), "cn=top", 2, nullptr, const_cast<char**>(names.data()), 0,
                           &chain),
              0);
    return CfgResult(chain);
  }
};

constexpr const char* kTwo =
    "dn: cn=top\ncn: top\nfree: 1\n# a comment\n  goes on\no: x\nFREE:: Mg==\n2.5.4.3: second\n"
    "free: th\n ree\ncommonName: third\n\ndn: cn=a,cn=top\nou: u\ncn: a\nother: y\n";

TEST_F(WalkTest, TwoWalksTakeTurns) {
  const CfgSession session = open(kTwo);
  const CfgResult chain = chain_of(session);
  _CFGMessage* const top = cfg_first_entry(session.get(), chain.get());
  _CFGMessage* const below = cfg_next_entry(session.get(), top);
  _CFGBer* cursors[2] = {};
  Values names[2];
  CfgText name[2] = {CfgText(cfg_first_attribute(session.get(), top, &cursors[0])),
                     CfgText(cfg_first_attribute(session.get(), below, &cursors[1]))};
  while (name[0] != nullptr || name[1] != nullptr) {
    for (const int i : {0, 1}) {
      if (name[i] == nullptr) continue;
      names[i].emplace_back(name[i].get());
      name[i].reset(cfg_next_attribute(session.get(), i == 0 ? top : below, cursors[i]));
    }
  }
  for (_CFGBer* cursor : cursors) cfg_ber_free(cursor);
  EXPECT_EQ(names[0], (Values{"cn", "free", "o"}));
  EXPECT_EQ(names[1], (Values{"ou", "cn", "other"}));
}

TEST_F(WalkTest, ValuesAreFoundInAnyOrderAndSpellingDuringAWalk) {
  const CfgSession session = open(kTwo);
  const CfgResult chain = chain_of(session);
  _CFGMessage* const top = cfg_first_entry(session.get(), chain.get());
  _CFGMessage* const below = cfg_next_entry(session.get(), top);
  _CFGBer* cursor = nullptr;
  const CfgText first(cfg_first_attribute(session.get(), top, &cursor));
  const CfgCursor owned(cursor);
  EXPECT_EQ(values_of(session.get(), top, "Free"), (Values{"1", "2", "three"}));
  EXPECT_EQ(values_of(session.get(), below, "CN"), (Values{"a"}));
  EXPECT_EQ(values_of(session.get(), top, "cn"), (Values{"top", "second", "third"}));
  EXPECT_EQ(values_of(session.get(), top, "2.5.4.3"), (Values{"top", "second", "third"}));
  EXPECT_EQ(values_of(session.get(), below, "free"), Values{});
  EXPECT_EQ(cfg_get_errno(session.get()), 16);
  EXPECT_STREQ(CfgText(cfg_next_attribute(session.get(), top, cursor)).get(), "free");
}

TEST_F(WalkTest, AWalkGoesOnWithoutItsRecord) {
  const CfgSession session = open(kTwo);
  CfgResult chain = chain_of(session, {"o", "cn"});
  _CFGMessage* const top = cfg_first_entry(session.get(), chain.get());
  _CFGBer* cursor = nullptr;
  const CfgText first(cfg_first_attribute(session.get(), top, &cursor));
  const CfgCursor owned(cursor);
  cfg_msg_unlink(session.get(), top);
  std::free(top);
  chain.reset();
  EXPECT_STREQ(CfgText(cfg_next_attribute(session.get(), nullptr, cursor)).get(), "o");
  EXPECT_EQ(cfg_next_attribute(session.get(), nullptr, cursor), nullptr);
  EXPECT_EQ(cfg_get_errno(session.get()), 0);
}

TEST_F(WalkTest, ManyTypesThatTakeTurnsKeepTheirValues) {
  std::string content = "dn: cn=top\n";
  for (const char* value : {"one", "two"}) {
    for (int i = 0; i < 700; ++i) content += "type-" + std::to_string(i) + ": " + value + "\n";
  }
  const CfgSession session = open(content + "COMMONNAME: x\nTYPE-3: three\n");
  const FoundEntry top = search(session, "cn=top", 0, nullptr).at(0);
  ASSERT_EQ(top.attributes.size(), 701U);
  for (std::size_t i = 0; i < 700; ++i) {
    EXPECT_EQ(top.attributes[i].first, "type-" + std::to_string(i));
    EXPECT_EQ(top.attributes[i].second,
              i == 3 ? (Values{"one", "two", "three"}) : (Values{"one", "two"}));
  }
  EXPECT_EQ(top.attributes[700].first, "cn");
}

TEST_F(WalkTest, EntriesOfADeepTreeAreBelowTheirParents) {
  std::string content = "dn: cn=top\ncn: x\n";
  std::vector<std::string> path = {"cn=top"};
  const auto add = [&content](const std::string& dn) { content += "\ndn: " + dn + "\ncn: x\n"; };
  for (int i = 1; i < 20; ++i) {
    path.push_back("cn=" + std::to_string(i) + "," + path.back());
    add(path.back());
  }
  for (std::size_t i = path.size(); i-- > 0;) add("cn=leaf, " + path[i]);
  for (const std::string& parent : path) add("ou=leaf," + parent);
  const CfgSession session = open(content);
  for (const std::string& parent : path) {
    const Values below = dns(search(session, parent.c_str(), 1, nullptr));
    EXPECT_EQ(below.size(), parent == path.back() ? 2U : 3U) << parent;
    EXPECT_EQ(std::count(below.begin(), below.end(), "cn=leaf, " + parent), 1) << parent;
    EXPECT_EQ(std::count(below.begin(), below.end(), "ou=leaf," + parent), 1) << parent;
  }
}

TEST_F(WalkTest, SubstringsAreFoundInLongValuesAsInShortOnes) {
  for (const std::size_t length : {100U, 500U, 510U, 511U, 512U, 520U, 2000U}) {
    const std::string many(length - 10, 'm');
    const CfgSession session =
        open("dn: cn=top\ncn: A  b " + many + " z\nexactText: " + many + "Y \n");
    const Values found = {"(cn=a b " + many + "*)", "(cn=*B  m*z)", "(cn=*" + many + " z)",
                          "(exactText=m*mY)"};
    for (const std::string& filter : found) {
      EXPECT_EQ(search(session, "cn=top", 0, filter.c_str()).size(), 1U) << length;
    }
    for (const std::string& filter :
         Values{"(cn=*m" + many + "*)", "(cn=*bm*)", "(exactText=*y)"}) {
      EXPECT_EQ(search(session, "cn=top", 0, filter.c_str()).size(), 0U) << length;
    }
  }
}

// ---- The shared key ----

class SharedKeyTest : public CfgTest {
 protected:
  void SetUp() override {
    CfgTest::SetUp();
    write_file(path_, "dn: cn=top\ncn: top\n");
    write_key('1');
  }

  void write_key(char digit) {
    write_file(stash_, "orv-key-1 " + std::string(64, digit) + "\n");
    ASSERT_EQ(::chmod(stash_.c_str(), 0600), 0);
  }

  CfgSession opened(int expected = 0) {
    CfgSession session = unbound();
    EXPECT_EQ(cfg_set_option(session.get(), kCfgOptKeyStashFile, stash_.c_str()), 0);
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), expected);
    return session;
  }

  static std::string sealed_with(const CfgSession& session) {
    std::string stored;
    EXPECT_EQ(cfg::seal_secret(*static_cast<const cfg::Key*>(session->key), {"pw", "CN=X"},
                               "secret", stored),
              0);
    return stored;
  }
  static cfg::OpenResult open_with(const CfgSession& session, const std::string& stored) {
    std::string clear;
    return cfg::open_secret(static_cast<const cfg::Key*>(session->key), stored, clear);
  }

  // Sessions share a key from some time after the file's last change on.
  bool is_shared_soon() {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (std::chrono::steady_clock::now() < deadline) {
      const CfgSession a = opened();
      if (a->key == opened()->key) return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return false;
  }

  std::string stash_ = directory_.file("key");
};

TEST_F(SharedKeyTest, AKeyWrittenOverAtOnceIsNotTheOldOne) {
  const CfgSession before = opened();
  const std::string stored = sealed_with(before);
  write_key('2');
  const CfgSession after = opened();
  EXPECT_EQ(open_with(after, stored), cfg::OpenResult::broken);
  EXPECT_EQ(open_with(before, stored), cfg::OpenResult::opened);
}

TEST_F(SharedKeyTest, SessionsShareAKeyUntilItsFileChanges) {
  ASSERT_TRUE(is_shared_soon());
  const CfgSession before = opened();
  const std::string stored = sealed_with(before);
  ASSERT_EQ(::chmod(stash_.c_str(), 0640), 0);
  const CfgSession refused = opened(1);
  EXPECT_EQ(refused->key, nullptr);
  EXPECT_NE(std::string(cfg_dump_exception(refused.get())).find("open to others"),
            std::string::npos);
  write_key('2');
  EXPECT_EQ(open_with(opened(), stored), cfg::OpenResult::broken);
  write_key('1');
  EXPECT_EQ(open_with(opened(), stored), cfg::OpenResult::opened);
  ASSERT_EQ(::unlink(stash_.c_str()), 0);
  opened(1);
  EXPECT_EQ(open_with(before, stored), cfg::OpenResult::opened);
}

TEST_F(SharedKeyTest, ThreadsSeeOneOfTheKeysWhileTheFileIsReplaced) {
  ASSERT_TRUE(is_shared_soon());
  const CfgSession first = opened();
  const std::string stored = sealed_with(first);
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([this, &stored] {
      for (int i = 0; i < 200; ++i) {
        const CfgSession session = opened();
        const cfg::OpenResult result = open_with(session, stored);
        EXPECT_TRUE(result == cfg::OpenResult::opened || result == cfg::OpenResult::broken);
      }
    });
  }
  for (int i = 0; i < 50; ++i) {
    const std::string next = stash_ + ".next";
    write_file(next, "orv-key-1 " + std::string(64, i % 2 == 0 ? '2' : '1') + "\n");
    ::chmod(next.c_str(), 0600);
    ::rename(next.c_str(), stash_.c_str());
  }
  for (std::thread& thread : threads) thread.join();
}

}  // namespace
}  // namespace orv::cfg_test
