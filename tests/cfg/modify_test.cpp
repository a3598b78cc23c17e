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

  std::string after(std::string_view content, const NewEntry& list) {
    const CfgSession session = open_for_change(content);
    EXPECT_EQ(modify(session, "CN=A, cn=top", list), 0) << cfg_dump_exception(session.get());
    EXPECT_EQ(search(session, "cn=top", 2, nullptr), search(reopen(), "cn=top", 2, nullptr));
    return read_file(path_);
  }

  int refused(std::string_view content, const NewEntry& list) {
    ::unlink(save_.c_str());
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
        NewEntry{adds("o", {"1"}), deletes("o", {"1"})},
        NewEntry{deletes("number", {"7"}), adds("number", {"7"})}}) {
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

TEST_F(ModifyTest, ACommentAtTheEndOfTheFileMayLackItsNewline) {
  const std::string above = "dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\ncn: a\n";
  EXPECT_EQ(after(above + "ou: x\n# end", {adds("ou", {"y"})}), above + "ou: x\nou: y\n# end");
  EXPECT_EQ(after(above + "ou: x\n# end", {deletes("ou")}), above + "# end");
}

TEST_F(ModifyTest, CommentsAboveAValueStayWhenItGoes) {
  EXPECT_EQ(after(tree("# 1\n# 2\n  more\ncn: a\n# 3\n# 4\nou: x\n# 5\n"),
                  {deletes("ou"), replaces("cn", {"A"})}),
            tree("# 1\n# 2\n  more\ncn: A\n# 3\n# 4\n# 5\n"));
}

// The types of a hand-edited file, and those that no schema knows.
TEST_F(ModifyTest, LinesAreFoundUnderEveryNameOfTheirType) {
  const std::string lines =
      "cn: a\norganizationalUnitName: x\n2.5.4.11: y\nOU: z\nUnKnown: 1\nunk\n nown: 2\noth\n er: "
      "3\nan\n other: 4\n";
  const std::string others = "UnKnown: 1\nunk\n nown: 2\noth\n er: 3\nan\n other: 4\n";
  EXPECT_EQ(after(tree(lines), {deletes("ou")}), tree("cn: a\n" + others));
  EXPECT_EQ(after(tree(lines), {deletes("ou", {"X", "Y", "Z"})}), tree("cn: a\n" + others));
  EXPECT_EQ(refused(tree(lines), {adds("ou", {"X"})}), 20);
  EXPECT_EQ(refused(tree(lines), {adds("unknown", {"2"})}), 20);
  const std::string known = "cn: a\norganizationalUnitName: x\n2.5.4.11: y\nOU: z\n";
  EXPECT_EQ(after(tree(lines), {deletes("unknown"), adds("OTHER", {"5"})}),
            tree(known + "oth\n er: 3\nOTHER: 5\nan\n other: 4\n"));
  EXPECT_EQ(after(tree(lines), {deletes("another", {"4"}), adds("unknown", {"0"})}),
            tree(known + "UnKnown: 1\nunk\n nown: 2\nunknown: 0\noth\n er: 3\n"));
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

// ---- Bad input ----

TEST_F(ModifyTest, ValuesOfEveryKindAreReadBackAsTheyWereGiven) {
  const Values values = {"\n",       "two\nlines",
                         " leading", "trailing ",
                         ":",        "<file:x",
                         "\xC3\xB6", "\xE4\xFF",
                         "\r",       "",
                         "\t",       "\x7F",
                         "dn: cn=x", std::string(77, ' '),
                         "- ",       "#comment",
                         "{SSHA}x",  std::string(1 << 20, 'x') + "\n"};
  for (const int code : {kModAdd, kModReplace}) {
    const CfgSession session = open_for_change(tree("cn: a\n"));
    EXPECT_EQ(modify(session, "cn=a,cn=top", {{"bytes", values, true, code}}), 0);
    const CfgSession again = reopen();
    EXPECT_EQ(search(again, "cn=a,cn=top", 0, nullptr, {"bytes"})[0].attributes[0].second, values);
    EXPECT_EQ(modify(again, "cn=a,cn=top", {deletes("bytes", values)}), 0);
    EXPECT_EQ(read_file(path_), tree("cn: a\n"));
  }
}

TEST_F(ModifyTest, TenThousandValuesAreNoBurden) {
  Values values;
  for (int i = 0; i < 10000; ++i) values.push_back("value " + std::to_string(i));
  const CfgSession session = open_for_change(tree("cn: a\n"));
  EXPECT_EQ(modify(session, "cn=a,cn=top", {adds("ou", values)}), 0);
  EXPECT_EQ(search(reopen(), "cn=a,cn=top", 0, nullptr, {"ou"})[0].attributes[0].second, values);
  EXPECT_EQ(modify(session, "cn=a,cn=top", {adds("ou", {"VALUE  9999"})}), 20);
  EXPECT_EQ(modify(session, "cn=a,cn=top", {deletes("ou", values)}), 0);
  EXPECT_EQ(read_file(path_), tree("cn: a\n"));
}

TEST_F(ModifyTest, OneAttributeUnderAllItsNamesIsOne) {
  EXPECT_EQ(after(tree(kLines), {deletes("2.5.4.11", {"x"}), adds("organizationalUnitName", {"y"}),
                                 deletes("OU", {"long er"})}),
            tree("cn: a\n# one\nou: y\n# two\nnumber: 7\ndescription: last\n# end\n"));
  for (const char* type : {"ou;x", "ou;lang-en", "2.5.4.11;x", "ou;binary", "", "o u", "-ou", "1.",
                           "ou:", "changetype", "DN", "control", "\xC3\xB6"}) {
    EXPECT_EQ(refused(tree(kLines), {adds(type, {"1"})}), 17) << type;
    EXPECT_EQ(refused(tree(kLines), {deletes(type)}), 17) << type;
    EXPECT_EQ(refused(tree(kLines), {replaces(type, {"1"})}), 17) << type;
  }
  // A type that nobody knows is stored under the name that it was given; options of a password too
  // are refused, or they would be another attribute.
  EXPECT_EQ(after(tree("cn: a\n"), {adds("1.2.3", {"y"}), adds("Other-Type", {"z"})}),
            tree("cn: a\n1.2.3: y\nOther-Type: z\n"));
  EXPECT_EQ(refused(tree("cn: a\n"), {adds("orv-slapdAdminPW;x", {"secret"})}), 17);
}

TEST_F(ModifyTest, TheEntryIsFoundInEverySpellingOfItsName) {
  for (const char* dn : {"cn=a,cn=top", "CN = A , CN = Top", "2.5.4.3=a,commonName=top",
                         "cn=\\61,cn=top", "cn=#0c0161,cn=top", "oid.2.5.4.3=a,cn=top"}) {
    const CfgSession session = open_for_change(tree("cn: a\n"));
    const int rc = modify(session, dn, {adds("o", {"1"})});
    EXPECT_TRUE(rc == 0 || (rc == 34 && std::string(dn).starts_with("oid."))) << dn << " " << rc;
    EXPECT_EQ(read_file(path_), tree(rc == 0 ? "cn: a\no: 1\n" : "cn: a\n"));
  }
  for (const char* dn : {"", "cn=a", "cn=a,cn=top,", "cn=a;cn=top", "cn=a,cn=top,cn=none"}) {
    const CfgSession session = open_for_change(tree("cn: a\n"));
    const int rc = modify(session, dn, {adds("o", {"1"})});
    EXPECT_TRUE(rc == 9 || rc == 34) << dn << " " << rc;
    EXPECT_EQ(read_file(path_), tree("cn: a\n"));
  }
}

// Whether the name's own values may go is for the schema to say.
TEST_F(ModifyTest, ValuesOfTheNameAreLikeOthersHere) {
  EXPECT_EQ(after(tree("cn: a\nou: x\n"), {deletes("cn", {"A"})}), tree("ou: x\n"));
  EXPECT_EQ(after(tree("cn: a\n"), {replaces("cn", {"b"})}), tree("cn: b\n"));
  EXPECT_EQ(after(tree("cn: a\n"), {adds("cn", {"b"})}), tree("cn: a\ncn: b\n"));
}

TEST_F(ModifyTest, ValuesAreComparedByTheSyntaxOfTheirAttribute) {
  const std::string lines =
      "cn: a\nexactText: Word\nbytes: Word\nmember: cn=X, o=Y\nnumber: 7\nflag: TRUE\n"
      "telephoneNumber: +1 23-4\nmoment: 20200101000000Z\nobjectClass: top\n";
  const auto found = [&](const char* type, const char* value) {
    const CfgSession session = open_for_change(tree(lines));
    const int exists = modify(session, "cn=a,cn=top", {adds(type, {value})});
    const CfgSession again = open_for_change(tree(lines));
    const int gone = modify(again, "cn=a,cn=top", {deletes(type, {value})});
    EXPECT_EQ(exists == 20, gone == 0) << exists << " " << gone;
    EXPECT_TRUE(exists == 0 || exists == 20) << exists;
    EXPECT_TRUE(gone == 0 || gone == 16) << gone;
    return gone == 0;
  };
  EXPECT_TRUE(found("exactText", "Word"));
  EXPECT_FALSE(found("exactText", "word"));
  EXPECT_TRUE(found("bytes", "Word"));
  EXPECT_FALSE(found("bytes", "word"));
  EXPECT_FALSE(found("bytes", "Word "));
  EXPECT_TRUE(found("member", "CN=x,O=y"));
  EXPECT_FALSE(found("member", "cn=x"));
  EXPECT_TRUE(found("telephoneNumber", "+1234"));
  EXPECT_TRUE(found("objectClass", "TOP"));
  EXPECT_TRUE(found("flag", "TRUE"));
  EXPECT_FALSE(found("flag", "FALSE"));
  EXPECT_TRUE(found("number", "7"));
  EXPECT_FALSE(found("number", "70"));
  EXPECT_FALSE(found("number", "not a number"));
}

TEST_F(ModifyTest, NullPartsOfAListAreRefused) {
  char type[] = "ou";
  char text[] = "x";
  berval good{1, text};
  berval empty{0, nullptr};
  berval* values[] = {&good, &empty, nullptr};
  ldapmod without_text{kModAdd | kModBvalues, type, {}, nullptr};
  without_text.mod_vals.modv_bvals = values;
  ldapmod without_type{kModAdd, nullptr, {}, nullptr};
  berval* none[] = {nullptr};
  ldapmod without_values{kModAdd | kModBvalues, type, {}, nullptr};
  without_values.mod_vals.modv_bvals = none;
  const auto code = [&](ldapmod& mod) {
    const CfgSession session = open_for_change(tree("cn: a\n"));
    ldapmod* mods[] = {&mod, nullptr};
    const int rc = cfg_modify_s(session.get(), "cn=a,cn=top", mods);
    EXPECT_EQ(read_file(path_), tree("cn: a\n"));
    return rc;
  };
  EXPECT_EQ(code(without_text), 21);
  EXPECT_EQ(code(without_type), 90);
  EXPECT_EQ(code(without_values), 2);
  ldapmod* mods[] = {&without_text, nullptr};
  const CfgSession session = open_for_change(tree("cn: a\n"));
  EXPECT_EQ(cfg_modify_s(session.get(), nullptr, mods), 9);
  EXPECT_EQ(cfg_modify_s(unbound().get(), "cn=a,cn=top", mods), 1);
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

TEST_F(ModifySecretTest, EveryStoredFormIsDeletedByItsClearText) {
  using cfg::SecretMethod;
  for (const SecretMethod method :
       {SecretMethod::ssha256, SecretMethod::ssha384, SecretMethod::ssha512, SecretMethod::crypt,
        SecretMethod::pbkdf2_sha256, SecretMethod::clear}) {
    if (!cfg::can_make_secret(method)) continue;
    std::string stored;
    ASSERT_EQ(cfg::make_secret(method, "the one", stored), 0);
    const std::string content = tree("cn: a\norv-slapdAdminPW: " + stored + "\n");
    write_file(path_, content);
    EXPECT_EQ(change({deletes("orv-slapdAdminPW", {"the One"})}), 16);
    EXPECT_EQ(change({deletes("orv-slapdAdminPW", {""})}), 16);
    EXPECT_EQ(read_file(path_), content);
    EXPECT_EQ(change({deletes("orv-slapdAdminPW", {"the one"})}), 0);
    EXPECT_EQ(read_file(path_), tree("cn: a\n"));
    write_file(path_, content);
    EXPECT_EQ(change({deletes("orv-slapdAdminPW", {stored})}), 0);
    EXPECT_EQ(read_file(path_), tree("cn: a\n"));
  }
}

TEST_F(ModifySecretTest, TheMethodInForceProtects) {
  using cfg::SecretMethod;
  for (const auto& [method, beginning] : {std::pair{SecretMethod::ssha256, "{SSHA256}"},
                                          {SecretMethod::clear, "new one"},
                                          {SecretMethod::sealed, "{AES256}"}}) {
    cfg::set_secret_method(method);
    EXPECT_EQ(change({replaces("orv-slapdAdminPW", {"new one"})}), 0);
    EXPECT_TRUE(password().starts_with(beginning)) << password();
    EXPECT_TRUE(is_password("new one"));
  }
}

TEST_F(ModifySecretTest, APasswordSealedElsewhereIsNotFoundByItsClearText) {
  write_file(path_,
             "dn: cn=top\ncn: top\n\ndn: cn=b,cn=top\ncn: b\norv-slapdAdminPW: " + stored_ + "\n");
  EXPECT_EQ(modify(keyed(), "cn=b,cn=top", {deletes("orv-slapdAdminPW", {"old one"})}), 16);
  EXPECT_EQ(modify(keyed(), "cn=b,cn=top", {adds("orv-slapdMasterPW", {"old one"})}), 0);
  EXPECT_EQ(modify(keyed(), "cn=b,cn=top", {deletes("orv-slapdAdminPW", {stored_})}), 0);
}

TEST_F(ModifySecretTest, WithoutItsKeyASealedPasswordIsOnlyFoundByItsStoredText) {
  EXPECT_EQ(modify(reopen(), "cn=a,cn=top", {deletes("orv-slapdAdminPW", {"old one"})}), 16);
  EXPECT_EQ(modify(reopen(), "cn=a,cn=top", {deletes("orv-slapdAdminPW", {stored_})}), 0);
}

TEST_F(ModifySecretTest, AMalformedPasswordGoesByItsStoredTextOrWhole) {
  for (const char* stored : {"{unknown}x", "{AES256}!", "{CRYPT}*0", "*", "{PBKDF2-SHA256}x"}) {
    const std::string content = tree(std::string("cn: a\norv-slapdAdminPW: ") + stored + "\n");
    write_file(path_, content);
    EXPECT_EQ(change({deletes("orv-slapdAdminPW", {"x"})}), 16) << stored;
    EXPECT_EQ(change({deletes("orv-slapdAdminPW", {stored})}), 0) << stored;
    write_file(path_, content);
    EXPECT_EQ(change({replaces("orv-slapdAdminPW", {"new one"})}), 0) << stored;
    EXPECT_TRUE(is_password("new one"));
  }
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
