// Modifying entries: which lines change, what is compared how, what is refused.
#include <map>
#include <random>
#include <set>

#include "cfg/secret.h"
#include "change_fixture.h"
#include "faulty_files.h"

namespace orv::cfg_test {
namespace {

class ModifyTest : public ChangeTest {
 protected:
  ModifyTest() : ChangeTest(memory_directory()) {}

  static int modify(const CfgSession& session, const char* dn, const NewEntry& list) {
    Mods mods(list);
    const int rc = cfg_modify_s(session.get(), dn, mods.get());
    EXPECT_EQ(cfg_get_errno(session.get()), rc);
    return rc;
  }

  std::string after(std::string_view content, const NewEntry& list) {
    const CfgSession session = open_for_change(content);
    EXPECT_EQ(modify(session, "CN=A, cn=top", list), 0) << cfg_dump_exception(session.get());
    EXPECT_EQ(search(session, "cn=top", 2, nullptr), search(reopen(), "cn=top", 2, nullptr));
    return read_file(path_);
  }

  int refused(std::string_view content, const NewEntry& list) {
    const CfgSession session = open_for_change(content);
    const int rc = modify(session, "cn=a,cn=top", list);
    EXPECT_EQ(read_file(path_), content);
    EXPECT_FALSE(exists(save_));
    return rc;
  }

  static NewAttribute adds(const char* type, Values values) {
    return {type, std::move(values), true, kModAdd};
  }
  static NewAttribute deletes(const char* type, Values values = {}) {
    return {type, std::move(values), true, kModDelete};
  }
  static NewAttribute replaces(const char* type, Values values = {}) {
    return {type, std::move(values), false, kModReplace};
  }

  static std::string tree(const std::string& lines) {
    return "# top\ndn: cn=top\ncn: top\n\n# a\ndn: cn=a,cn=top\n" + lines +
           "\n# b\ndn: cn=b,cn=top\ncn: b\n";
  }
  static constexpr const char* kLines =
      "cn: a\n# one\nou: x\nOU: Long \n er\n# two\nnumber: 7\ndescription: last\n# end\n";
};

TEST_F(ModifyTest, OneValueIsOneLine) {
  EXPECT_EQ(
      after(tree(kLines), {replaces("count", {"8"})}),
      tree("cn: a\n# one\nou: x\nOU: Long \n er\n# two\nnumber: 8\ndescription: last\n# end\n"));
  EXPECT_EQ(after(tree(kLines), {adds("ou", {"new"})}),
            tree("cn: a\n# one\nou: x\nOU: Long \n er\nou: new\n# two\nnumber: 7\n"
                 "description: last\n# end\n"));
  EXPECT_EQ(after(tree(kLines), {deletes("2.5.4.11", {"LONG  ER"})}),
            tree("cn: a\n# one\nou: x\n# two\nnumber: 7\ndescription: last\n# end\n"));
  EXPECT_EQ(after(tree(kLines), {adds("o", {"\n"})}),
            tree("cn: a\n# one\nou: x\nOU: Long \n er\n# two\nnumber: 7\ndescription: last\n"
                 "o:: Cg==\n# end\n"));
}

TEST_F(ModifyTest, AReplaceKeepsTheLinesOfValuesThatStay) {
  EXPECT_EQ(after(tree(kLines), {replaces("ou", {"new", "Long er"})}),
            tree("cn: a\n# one\nOU: Long \n er\nou: new\n# two\nnumber: 7\ndescription: last\n"
                 "# end\n"));
  EXPECT_EQ(after(tree(kLines), {replaces("ou", {"X"})}),
            tree("cn: a\n# one\nou: X\n# two\nnumber: 7\ndescription: last\n# end\n"));
}

TEST_F(ModifyTest, WithoutValuesTheAttributeGoes) {
  const std::string gone = tree("cn: a\n# one\n# two\nnumber: 7\ndescription: last\n# end\n");
  EXPECT_EQ(after(tree(kLines), {deletes("ou")}), gone);
  EXPECT_EQ(after(tree(kLines), {replaces("ou")}), gone);
  EXPECT_EQ(after(tree(kLines), {replaces("member")}), tree(kLines));
}

TEST_F(ModifyTest, RecordsAreAppliedInOrder) {
  EXPECT_EQ(
      after(tree("cn: a\n"), {adds("ou", {"1", "2"}), deletes("ou", {"1"}), adds("ou", {"3"}),
                              replaces("number", {"1"}), deletes("number"), adds("number", {"2"})}),
      tree("cn: a\nou: 2\nou: 3\nnumber: 2\n"));
  EXPECT_EQ(after(tree("cn: a\nou: x\n"), {deletes("ou"), adds("ou", {"x"})}),
            tree("cn: a\nou: x\n"));
}

TEST_F(ModifyTest, WhatChangesNothingWritesNothing) {
  for (const NewEntry& list :
       {NewEntry{}, NewEntry{replaces("ou", {"x", "Long er"})}, NewEntry{replaces("o")},
        NewEntry{adds("o", {"1"}), deletes("o", {"1"})}}) {
    const CfgSession session = open_for_change(tree(kLines));
    EXPECT_EQ(modify(session, "cn=a,cn=top", list), 0);
    EXPECT_EQ(read_file(path_), tree(kLines));
    EXPECT_FALSE(exists(save_));
  }
  const CfgSession session = open_for_change(tree(kLines));
  EXPECT_EQ(cfg_modify_s(session.get(), "cn=a,cn=top", nullptr), 0);
  EXPECT_EQ(cfg_modify_s(session.get(), "cn=x,cn=top", nullptr), 9);
}

TEST_F(ModifyTest, LineEndsAreThoseOfTheEntry) {
  EXPECT_EQ(after("dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\r\ncn: a\r\nou: x\r\n",
                  {replaces("ou", {"y"}), adds("o", {"z"})}),
            "dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\r\ncn: a\r\nou: y\r\no: z\r\n");
}

TEST_F(ModifyTest, EqualLinesOfAHandEditedFileGoTogether) {
  EXPECT_EQ(after(tree("cn: a\nou: x\nou: X\n"), {deletes("ou", {"x"})}), tree("cn: a\n"));
}

TEST_F(ModifyTest, AllOrNothing) {
  const auto code = [this](const NewAttribute& bad) {
    return refused(tree(kLines), {replaces("number", {"9"}), bad});
  };
  EXPECT_EQ(code(deletes("o")), 16);
  EXPECT_EQ(code(deletes("ou", {"y"})), 16);
  EXPECT_EQ(code(deletes("ou", {"x", "X"})), 16);
  EXPECT_EQ(code(adds("ou", {"X"})), 20);
  EXPECT_EQ(code(adds("o", {"1", "1"})), 20);
  EXPECT_EQ(code(replaces("o", {"a", "A"})), 20);
  EXPECT_EQ(code(adds("o", {})), 2);
  EXPECT_EQ(code({"o", {"1"}, true, 3}), 2);
  EXPECT_EQ(code(adds("o;x", {"1"})), 17);
  EXPECT_EQ(code(adds("dn", {"1"})), 17);
  EXPECT_EQ(code(adds("o", {std::string("a\0", 2)})), 21);
  EXPECT_EQ(refused(tree("cn: a\n"), {deletes("cn")}), 65);
  const CfgSession session = open_for_change(tree(kLines));
  EXPECT_EQ(modify(session, "cn=x,cn=top", {adds("o", {"1"})}), 9);
  EXPECT_EQ(modify(session, "x", {adds("o", {"1"})}), 34);
  EXPECT_EQ(cfg_modify_s(nullptr, "cn=a,cn=top", nullptr), 1);
}

// ---- Passwords ----

class ModifySecretTest : public ModifyTest {
 protected:
  void SetUp() override {
    ModifyTest::SetUp();
    std::string why;
    ASSERT_EQ(cfg::create_key_stash(stash_.c_str(), why), 0);
    write_file(path_, tree("cn: a\n"));
    ASSERT_EQ(modify(keyed(), "cn=a,cn=top", {adds("orv-slapdAdminPW", {"old one"})}), 0);
    stored_ = password();
    ASSERT_EQ(stored_.rfind("{AES256}", 0), 0U);
  }

  CfgSession keyed() {
    CfgSession session = unbound_with_save();
    EXPECT_EQ(cfg_set_option(session.get(), kCfgOptKeyStashFile, stash_.c_str()), 0);
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
    return session;
  }
  std::string password() {
    const auto attributes = search(reopen(), "cn=a,cn=top", 0, nullptr)[0].attributes;
    return attributes.size() < 2 ? "" : attributes[1].second[0];
  }
  int change(const NewEntry& list) { return modify(keyed(), "cn=a,cn=top", list); }
  bool is_password(const char* clear) {
    const CfgSession session = keyed();
    return cfg::verify_secret(static_cast<const cfg::Key*>(session->key),
                              {"orv-slapdAdminPW", "CN=A,CN=TOP"}, password(), clear);
  }

  const std::string stash_ = directory_.file("key.stash");
  std::string stored_;
};

TEST_F(ModifySecretTest, APasswordIsReplacedInProtectedForm) {
  EXPECT_EQ(change({replaces("orv-slapdAdminPW", {"new one"})}), 0);
  EXPECT_TRUE(is_password("new one"));
  EXPECT_EQ(read_file(path_).find("new one"), std::string::npos);
  EXPECT_EQ(change({adds("orv-slapdAdminPW", {"newer"}), deletes("orv-slapdAdminPW", {"new one"})}),
            0);
  EXPECT_TRUE(is_password("newer"));
}

TEST_F(ModifySecretTest, AStoredTextStaysAndMayBeDeleted) {
  EXPECT_EQ(change({replaces("orv-slapdAdminPW", {stored_})}), 0);
  EXPECT_EQ(password(), stored_);
  EXPECT_EQ(change({deletes("orv-slapdAdminPW", {stored_})}), 0);
  EXPECT_EQ(password(), "");
}

TEST_F(ModifySecretTest, Refusals) {
  EXPECT_EQ(change({deletes("orv-slapdAdminPW", {"wrong"})}), 16);
  EXPECT_EQ(change({adds("orv-slapdAdminPW", {"old one"})}), 20);
  EXPECT_EQ(change({adds("orv-slapdAdminPW", {stored_})}), 20);
  EXPECT_EQ(change({replaces("orv-slapdAdminPW", {"x", "x"})}), 20);
  EXPECT_EQ(change({replaces("orv-slapdAdminPW", {"{SSHA}x"})}), 19);
  EXPECT_EQ(change({replaces("orv-slapdMasterPW", {stored_})}), 19);
  EXPECT_EQ(change({adds("orv-slapdAdminPW", {""})}), 21);
  EXPECT_EQ(password(), stored_);
}

// ---- Random lists ----

TEST_F(ModifyTest, RandomListsKeepToAModelOfTheEntry) {
  const unsigned first = std::random_device{}();
  FaultyFiles quick;
  for (unsigned seed = first; seed < first + 200 && !HasFailure(); ++seed) {
    SCOPED_TRACE(::testing::Message() << "seed " << seed);
    std::mt19937 random(seed);
    const auto below = [&random](unsigned end) { return static_cast<unsigned>(random() % end); };
    const CfgSession session = open_for_change(tree("cn: a\nou: 1\n# c\nou: 2\no: 1\nou: 3\n"));
    write_through(session, quick);
    std::map<std::string, std::set<std::string>> model = {
        {"cn", {"a"}}, {"ou", {"1", "2", "3"}}, {"o", {"1"}}};
    for (int round = 0; round < 10; ++round) {
      auto changed = model;
      int expected = 0;
      NewEntry list;
      for (unsigned i = 0; i <= below(4); ++i) {
        const char* const type = below(2) == 0 ? "ou" : "o";
        std::set<std::string> values;
        for (unsigned k = below(4); k > 0; --k) values.insert(std::to_string(below(6)));
        const int code = static_cast<int>(below(3));
        list.push_back({type, {values.begin(), values.end()}, below(2) == 0, code});
        if (expected != 0) continue;
        auto& current = changed[type];
        if (code == kModReplace) current = values;
        if (code == kModAdd && values.empty()) expected = 2;
        if (code == kModDelete && current.empty()) expected = 16;
        if (code == kModDelete && values.empty()) current.clear();
        for (const std::string& value : values) {
          if (expected != 0) break;
          if (code == kModAdd && !current.insert(value).second) expected = 20;
          if (code == kModDelete && current.erase(value) == 0) expected = 16;
        }
      }
      ASSERT_EQ(modify(session, "cn=a,cn=top", list), expected);
      if (expected == 0) model = changed;
      std::map<std::string, std::set<std::string>> found;
      const auto entries = search(session, "cn=a,cn=top", 0, nullptr);
      for (const auto& [name, values] : entries[0].attributes) {
        found[name] = {values.begin(), values.end()};
        EXPECT_EQ(found[name].size(), values.size());
      }
      for (auto at = model.begin(); at != model.end();) {
        at = at->second.empty() ? model.erase(at) : std::next(at);
      }
      ASSERT_EQ(found, model);
      const std::string text = read_file(path_);
      ASSERT_EQ(text.rfind("# top\ndn: cn=top\ncn: top\n\n# a\ndn: cn=a,cn=top\ncn: a\n", 0), 0U);
      ASSERT_NE(text.find("\n# c\n"), std::string::npos);
      ASSERT_NE(text.find("\n\n# b\ndn: cn=b,cn=top\ncn: b\n"), std::string::npos);
    }
  }
}

}  // namespace
}  // namespace orv::cfg_test
