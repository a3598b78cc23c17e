// Adding entries: where and how they are written, that they read back the same, what is refused.
#include <algorithm>
#include <sstream>

#include "cfg/object_class_table.h"
#include "cfg/secret.h"
#include "change_fixture.h"

namespace orv::cfg_test {
namespace {

class AddTest : public ChangeTest {
 protected:
  // The values of an attribute of an entry just added, seen by the same and by another session.
  Values read_back(const Values& values, bool counted) {
    const CfgSession session = open_for_change(kSmall);
    EXPECT_EQ(add(session, "cn=new,cn=top", {{"cn", {"new"}}, {"bytes", values, counted}}), 0)
        << cfg_dump_exception(session.get());
    const auto seen = search(session, "cn=new,cn=top", 0, nullptr);
    const auto stored = search(reopen(), "cn=new,cn=top", 0, nullptr);
    EXPECT_EQ(seen, stored);
    if (stored.size() != 1 || stored[0].attributes.size() != 2) return {"(no such entry)"};
    return stored[0].attributes[1].second;
  }

  static constexpr const char* kSmall = "dn: cn=top\ncn: top\n";
};

// ---- The text ----

TEST_F(AddTest, TheEntryIsWrittenInTheOrderGiven) {
  EXPECT_EQ(after_add("dn: cn=top\ncn: top\n", "cn=a,cn=top",
                      {{"objectClass", {"top", "container"}}, {"cn", {"a"}}, {"ou", {"x", "y"}}}),
            "dn: cn=top\ncn: top\n\n"
            "dn: cn=a,cn=top\nobjectClass: top\nobjectClass: container\ncn: a\nou: x\nou: y\n");
}

TEST_F(AddTest, TheEntryGoesBehindTheLastOneBelowItsParent) {
  constexpr const char* kBefore =
      "dn: cn=top\ncn: top\n\n"
      "dn: ou=a,cn=top\nou: a\n\n"
      "dn: cn=1,ou=a,cn=top\ncn: 1\n\n"
      "# about b\ndn: ou=b,cn=top\nou: b\n\n"
      "dn: cn=2,ou=a,cn=top\ncn: 2\n\n\n"
      "# about c\n\ndn: ou=c,cn=top\nou: c\n\n";
  EXPECT_EQ(after_add(kBefore, "cn=3,ou=a,cn=top", {{"cn", {"3"}}}),
            "dn: cn=top\ncn: top\n\n"
            "dn: ou=a,cn=top\nou: a\n\n"
            "dn: cn=1,ou=a,cn=top\ncn: 1\n\n"
            "# about b\ndn: ou=b,cn=top\nou: b\n\n"
            "dn: cn=2,ou=a,cn=top\ncn: 2\n\n"
            "dn: cn=3,ou=a,cn=top\ncn: 3\n\n\n"
            "# about c\n\ndn: ou=c,cn=top\nou: c\n\n");
  EXPECT_EQ(
      after_add(kBefore, "ou=d,cn=top", {{"ou", {"d"}}}),
      std::string(kBefore, std::string_view(kBefore).size() - 1) + "\ndn: ou=d,cn=top\nou: d\n\n");
}

TEST_F(AddTest, TheEntryGoesBehindChildrenOfChildren) {
  EXPECT_EQ(after_add("dn: cn=top\ncn: top\n\ndn: ou=a,cn=top\nou: a\n\n"
                      "dn: cn=1,ou=a,cn=top\ncn: 1\n",
                      "ou=b,cn=top", {{"ou", {"b"}}}),
            "dn: cn=top\ncn: top\n\ndn: ou=a,cn=top\nou: a\n\n"
            "dn: cn=1,ou=a,cn=top\ncn: 1\n\ndn: ou=b,cn=top\nou: b\n");
}

TEST_F(AddTest, LinesEndAsThoseOfTheNeighbour) {
  EXPECT_EQ(after_add("dn: cn=top\r\ncn: top\r\n\r\n", "cn=a,cn=top", {{"cn", {"a"}}}),
            "dn: cn=top\r\ncn: top\r\n\r\ndn: cn=a,cn=top\r\ncn: a\r\n\r\n");
  EXPECT_EQ(after_add("dn: cn=top\r\ncn: top\r\n\r\ndn: ou=a,cn=top\nou: a\n", "cn=1,ou=a,cn=top",
                      {{"cn", {"1"}}}),
            "dn: cn=top\r\ncn: top\r\n\r\ndn: ou=a,cn=top\nou: a\n\ndn: cn=1,ou=a,cn=top\ncn: 1\n");
}

TEST_F(AddTest, CommentsBlankLinesFoldingAndOrderOfTheRestAreKept) {
  constexpr const char* kBefore =
      "\xEF\xBB\xBFversion: 1\n\n\n# one\n#  two\n\ndn:: Y249dG9w\n# inside\ncn: to\n p\n"
      "description:   \n# behind\n\n\n# last, without a newline";
  const std::string after = after_add(kBefore, "cn=a,cn=top", {{"cn", {"a"}}});
  EXPECT_EQ(after,
            "\xEF\xBB\xBFversion: 1\n\n\n# one\n#  two\n\ndn:: Y249dG9w\n# inside\ncn: to\n p\n"
            "description:   \n# behind\n\ndn: cn=a,cn=top\ncn: a\n\n\n# last, without a newline");
}

TEST_F(AddTest, ACommentWithoutNewlineAtTheEndGetsOne) {
  EXPECT_EQ(after_add("dn: cn=top\ncn: top\n# end", "cn=a,cn=top", {{"cn", {"a"}}}),
            "dn: cn=top\ncn: top\n# end\n\ndn: cn=a,cn=top\ncn: a\n");
}

TEST_F(AddTest, LongLinesAreFoldedAt76Columns) {
  const std::string value = std::string(70, 'x') + "   " + std::string(100, 'y');
  const std::string after = after_add(kSmall, "cn=a,cn=top", {{"cn", {"a"}}, {"ou", {value}}});
  std::size_t longest = 0;
  std::istringstream lines(after);
  for (std::string line; std::getline(lines, line);) {
    longest = std::max(longest, line.size());
    EXPECT_FALSE(line.ends_with(' ')) << line;
  }
  EXPECT_EQ(longest, 76U);
  EXPECT_EQ(search(reopen(), "cn=a,cn=top", 0, nullptr)[0].attributes[1].second, Values{value});
}

TEST_F(AddTest, TheSpellingOfTheDnIsKept) {
  const CfgSession session = open_for_change(kSmall);
  EXPECT_EQ(add(session, "2.5.4.3=\\41dmin\\2C x , CN=TOP", {{"cn", {"Admin, x"}}}), 0);
  EXPECT_EQ(read_file(path_),
            "dn: cn=top\ncn: top\n\ndn: 2.5.4.3=\\41dmin\\2C x , CN=TOP\ncn: Admin, x\n");
  EXPECT_EQ(dns(search(session, "cn=admin\\, X,cn=top", 0, nullptr)),
            Values{"2.5.4.3=\\41dmin\\2C x , CN=TOP"});
}

TEST_F(AddTest, ADnThatIsNotPlainTextIsEncoded) {
  const CfgSession session = open_for_change(kSmall);
  const std::string dn = "cn=\xC3\xA4,cn=top";
  EXPECT_EQ(add(session, dn, {{"cn", {"\xC3\xA4"}}}), 0);
  EXPECT_EQ(read_file(path_), "dn: cn=top\ncn: top\n\ndn:: Y249w6QsY249dG9w\ncn:: w6Q=\n");
  EXPECT_EQ(dns(search(reopen(), "cn=\xC3\x84,cn=top", 0, nullptr)), Values{dn});
  EXPECT_EQ(add(session, " cn=blank,cn=top", {{"cn", {"blank"}}}), 0);
  EXPECT_EQ(dns(search(reopen(), "cn=blank,cn=top", 0, nullptr)), Values{" cn=blank,cn=top"});
}

TEST_F(AddTest, TypesAreWrittenUnderTheirCanonicalNames) {
  EXPECT_EQ(after_add(kSmall, "cn=a,cn=top",
                      {{"2.5.4.3", {"a"}}, {"COUNT", {"1"}}, {"1.2.3", {"x"}}, {"other", {"y"}}}),
            "dn: cn=top\ncn: top\n\n"
            "dn: cn=a,cn=top\ncn: a\nnumber: 1\n1.2.3: x\nother: y\n");
}

TEST_F(AddTest, ObjectClassesAreWrittenUnderTheirOwnNames) {
  ASSERT_EQ(cfg::register_object_classes({{"container", "1.2.3.4", {"box"}}}), 0);
  EXPECT_EQ(after_add(kSmall, "cn=a,cn=top", {{"2.5.4.0", {"top", "1.2.3.4", "CONTAINERS"}}}),
            "dn: cn=top\ncn: top\n\n"
            "dn: cn=a,cn=top\nobjectClass: top\nobjectClass: container\n"
            "objectClass: CONTAINERS\n");
  EXPECT_EQ(after_add(kSmall, "cn=a,cn=top", {{"objectClass", {"Box"}}}),
            "dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\nobjectClass: container\n");
  ::unlink(save_.c_str());
  EXPECT_EQ(refused_add(kSmall, "cn=a,cn=top", {{"objectClass", {"container", "1.2.3.4"}}}), 20);
  ASSERT_EQ(cfg::register_object_classes({}), 0);
}

// ---- Values ----

TEST_F(AddTest, ValuesAreReadBackAsTheyWereGiven) {
  const Values values = {"plain",
                         "",
                         " leading",
                         "trailing ",
                         "  ",
                         ":colon",
                         "<less",
                         "#hash",
                         "line\nline",
                         "\n",
                         "carriage\rreturn\r\n",
                         "\xC3\xA4\xE2\x82\xAC",
                         "latin-1 \xE4",
                         "\xFF\xFE",
                         "\x01\x7F",
                         "tab\t",
                         "dn: cn=evil,cn=top",
                         std::string(76, ' ') + "x",
                         "a" + std::string(500, ' ') + "b",
                         std::string(70, 'q') + "\n"};
  EXPECT_EQ(read_back(values, true), values);
  EXPECT_EQ(read_back(values, false), values);
}

TEST_F(AddTest, WhatOthersWouldMisreadIsEncoded) {
  EXPECT_EQ(after_add(kSmall, "cn=a,cn=top",
                      {{"bytes", {"<x", ":x", " x", "x ", "x\ry", "x\ny", "\xE4", "\tx", "x\t"}}}),
            "dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\n"
            "bytes:: PHg=\nbytes:: Ong=\nbytes:: IHg=\nbytes:: eCA=\nbytes:: eA15\n"
            "bytes:: eAp5\nbytes:: 5A==\nbytes:: CXg=\nbytes:: eAk=\n");
}

TEST_F(AddTest, WhatATerminalWouldTakeForCommandsIsEncoded) {
  EXPECT_EQ(after_add(kSmall, "cn=a,cn=top", {{"bytes", {"\x1B[m", "\x7F", "\x01", "a\tb"}}}),
            "dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\n"
            "bytes:: G1tt\nbytes:: fw==\nbytes:: AQ==\nbytes: a\tb\n");
}

TEST_F(AddTest, AValueOfAMegabyteIsReadBack) {
  std::string plain(1 << 20, 'v');
  std::string binary = plain;
  for (std::size_t i = 0; i < binary.size(); ++i) binary[i] = static_cast<char>(1 + i * 7 % 255);
  EXPECT_EQ(read_back({plain, binary}, true), (Values{plain, binary}));
}

TEST_F(AddTest, TenThousandValuesAreReadBack) {
  Values values;
  for (int i = 0; i < 10000; ++i) values.push_back("value " + std::to_string(i));
  EXPECT_EQ(read_back(values, true), values);
}

TEST_F(AddTest, AnAttributeGivenInTwoPlacesIsOne) {
  const CfgSession session = open_for_change(kSmall);
  EXPECT_EQ(add(session, "cn=a,cn=top", {{"ou", {"1"}}, {"cn", {"a"}}, {"2.5.4.11", {"2"}}}), 0);
  const auto entry = search(session, "cn=a,cn=top", 0, nullptr)[0];
  EXPECT_EQ(entry.attributes[0], std::make_pair(std::string("ou"), Values{"1", "2"}));
}

TEST_F(AddTest, AValueWithANulOrWithoutTextIsRefused) {
  EXPECT_EQ(refused_add(kSmall, "cn=a,cn=top", {{"cn", {std::string("a\0b", 3)}, true}}), 21);
  const CfgSession session = open_for_change(kSmall);
  berval empty{0, nullptr};
  berval* values[] = {&empty, nullptr};
  char type[] = "cn";
  ldapmod mod{};
  mod.mod_op = kModBvalues;
  mod.mod_type = type;
  mod.mod_vals.modv_bvals = values;
  ldapmod* list[] = {&mod, nullptr};
  EXPECT_EQ(cfg_add_s(session.get(), "cn=a,cn=top", list), 21);
  EXPECT_EQ(read_file(path_), kSmall);
}

TEST_F(AddTest, AListThatMemoryWasShortForIsRefused) {
  const CfgSession session = open_for_change(kSmall);
  ldapmod without_type{};
  without_type.mod_op = kModBvalues;
  ldapmod* list[] = {&without_type, nullptr};
  EXPECT_EQ(cfg_add_s(session.get(), "cn=a,cn=top", list), 90);
  EXPECT_EQ(read_file(path_), kSmall);
}

TEST_F(AddTest, AValueGivenTwiceIsRefusedByTheRuleOfItsType) {
  const auto code = [this](const char* type, Values values) {
    return refused_add(kSmall, "cn=a,cn=top", {{"cn", {"a"}}, {type, std::move(values), true}});
  };
  EXPECT_EQ(code("ou", {"x", "x"}), 20);
  EXPECT_EQ(code("ou", {"An  X", "an x"}), 20);
  EXPECT_EQ(code("ou", {"", ""}), 20);
  EXPECT_EQ(code("unknown", {"X", "x"}), 20);
  EXPECT_EQ(code("member", {"cn=a,o=x", "CN=A, O=X"}), 20);
  EXPECT_EQ(code("number", {"07", "7"}), 20);
  EXPECT_EQ(code("number", {"no number", "no number"}), 20);
  EXPECT_EQ(code("orv-slapdAdminPW", {"secret", "secret"}), 20);
  EXPECT_EQ(refused_add(kSmall, "cn=a,cn=top", {{"ou", {"x"}}, {"2.5.4.11", {"X"}}}), 20);
}

TEST_F(AddTest, ValuesThatDifferByTheRuleOfTheirTypeAreKept) {
  after_add(kSmall, "cn=a,cn=top",
            {{"exactText", {"X", "x"}},
             {"ou", {"x"}},
             {"o", {"x"}},
             {"number", {"no number", "No number"}},
             {"orv-slapdAdminPW", {"secret", "Secret"}},
             {"orv-slapdMasterPW", {"secret"}}});
}

// ---- Refusals ----

TEST_F(AddTest, AnEntryThatExistsIsRefusedInAnySpelling) {
  EXPECT_EQ(refused_add("dn: cn=top\ncn: top\n\ndn: cn=\\61 b,cn=top\ncn: a b\n",
                        "CN = A  B , 2.5.4.3=\\54op", {{"cn", {"a b"}}}),
            68);
  EXPECT_EQ(refused_add(kSmall, "CN=TOP", {{"cn", {"top"}}}), 68);
}

TEST_F(AddTest, AnEntryWithoutAParentIsRefused) {
  EXPECT_EQ(refused_add(kSmall, "cn=a,cn=b,cn=top", {{"cn", {"a"}}}), 9);
  EXPECT_EQ(refused_add(kSmall, "cn=other", {{"cn", {"other"}}}), 9);
  EXPECT_EQ(refused_add(kSmall, "", {{"cn", {"x"}}}), 9);
}

TEST_F(AddTest, WhatIsNoDnIsRefused) {
  EXPECT_EQ(refused_add(kSmall, "no dn", {{"cn", {"a"}}}), 34);
  EXPECT_EQ(refused_add(kSmall, "cn=a;cn=top", {{"cn", {"a"}}}), 34);
}

TEST_F(AddTest, APasswordInADnIsRefused) {
  EXPECT_EQ(refused_add(kSmall, "orv-slapdAdminPW=x,cn=top", {{"cn", {"a"}}}), 64);
  EXPECT_EQ(refused_add(kSmall, "cn=a+1.9.6=x,cn=top", {{"cn", {"a"}}}), 64);
}

TEST_F(AddTest, TypesThatCannotBeStoredAreRefused) {
  for (const char* type : {"", "cn;lang-en", "c n", "-cn", "1", "1.", "dn", "DN", "changeType",
                           "control", "cn:", "cn\ndn", "\xC3\xA4"}) {
    EXPECT_EQ(refused_add(kSmall, "cn=a,cn=top", {{type, {"a"}}}), 17) << type;
  }
}

TEST_F(AddTest, ListsThatAreNoEntryAreRefused) {
  EXPECT_EQ(refused_add(kSmall, "cn=a,cn=top", {}), 2);
  EXPECT_EQ(refused_add(kSmall, "cn=a,cn=top", {{"cn", {}}}), 2);
  EXPECT_EQ(refused_add(kSmall, "cn=a,cn=top", {{"cn", {"a"}, false, kModReplace}}), 2);
  EXPECT_EQ(refused_add(kSmall, "cn=a,cn=top", {{"cn", {"a"}, true, kModDelete}}), 2);
  const CfgSession session = open_for_change(kSmall);
  EXPECT_EQ(cfg_add_s(session.get(), "cn=a,cn=top", nullptr), 2);
  EXPECT_EQ(cfg_add_s(session.get(), nullptr, nullptr), 9);
}

TEST_F(AddTest, WithoutASessionNothingIsAdded) {
  Mods mods(NewEntry{{"cn", {"a"}}});
  EXPECT_EQ(cfg_add_s(nullptr, "cn=a,cn=top", mods.get()), 1);
  const CfgSession session = unbound();
  EXPECT_EQ(cfg_add_s(session.get(), "cn=a,cn=top", mods.get()), 1);
  EXPECT_EQ(cfg_get_errno(session.get()), 1);
}

TEST_F(AddTest, TheReasonOfARefusalIsToldWithoutTheValue) {
  const CfgSession session = open_for_change(kSmall);
  EXPECT_EQ(add(session, "cn=a,cn=top", {{"orv-slapdAdminPW", {"{SSHA}hidden"}}}), 19);
  EXPECT_NE(told.find("orv-slapdAdminPW"), std::string::npos);
  EXPECT_EQ(told.find("hidden"), std::string::npos);
  EXPECT_NE(std::string(cfg_dump_exception(session.get())).find("scheme"), std::string::npos);
}

// ---- Passwords ----

class AddSecretTest : public AddTest {
 protected:
  void TearDown() override {
    cfg::set_secret_method(cfg::SecretMethod::sealed);
    AddTest::TearDown();
  }

  CfgSession open_with_key() {
    write_file(path_, kSmall);
    std::string why;
    EXPECT_EQ(cfg::create_key_stash(stash_.c_str(), why), 0) << why;
    return reopen_with_key();
  }
  CfgSession reopen_with_key() {
    CfgSession session = unbound_with_save();
    EXPECT_EQ(cfg_set_option(session.get(), kCfgOptKeyStashFile, stash_.c_str()), 0);
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
    return session;
  }
  static const cfg::Key* key_of(const CfgSession& session) {
    return static_cast<const cfg::Key*>(session->key);
  }
  static Values passwords(const CfgSession& session) {
    return search(session, "cn=a,cn=top", 0, nullptr)[0].attributes[1].second;
  }

  const NewEntry entry_ = {{"cn", {"a"}}, {"ORV-SLAPDADMINPW", {"correct horse"}}};
  const cfg::SecretPlace place_{"orv-slapdAdminPW", "CN=A,CN=TOP"};
  const std::string stash_ = directory_.file("key.stash");
};

TEST_F(AddSecretTest, PasswordsAreSealedForTheirPlace) {
  const CfgSession session = open_with_key();
  ASSERT_EQ(add(session, " CN = \\61 , cn=top", entry_), 0);
  EXPECT_EQ(read_file(path_).find("correct"), std::string::npos);
  const Values stored = passwords(reopen_with_key());
  ASSERT_EQ(stored.size(), 1U);
  EXPECT_EQ(stored[0].rfind("{AES256}", 0), 0U);
  std::string clear;
  EXPECT_EQ(cfg::open_secret(key_of(session), stored[0], clear), cfg::OpenResult::opened);
  EXPECT_EQ(clear, "correct horse");
  EXPECT_TRUE(cfg::verify_secret(key_of(session), place_, stored[0], "correct horse"));
  EXPECT_FALSE(cfg::verify_secret(key_of(session), {"orv-slapdMasterPW", place_.normal_dn},
                                  stored[0], "correct horse"));
}

TEST_F(AddSecretTest, PasswordsAreHashedWhenTheMethodSaysSo) {
  cfg::set_secret_method(cfg::SecretMethod::hashed);
  const CfgSession session = open_with_key();
  ASSERT_EQ(add(session, "cn=a,cn=top", entry_), 0);
  const Values stored = passwords(session);
  EXPECT_EQ(stored[0].rfind("{SSHA512}", 0), 0U);
  EXPECT_TRUE(cfg::verify_secret(nullptr, place_, stored[0], "correct horse"));
}

TEST_F(AddSecretTest, WithoutAKeyPasswordsAreHashed) {
  const CfgSession session = open_for_change(kSmall);
  ASSERT_EQ(add(session, "cn=a,cn=top", entry_), 0);
  EXPECT_EQ(passwords(session)[0].rfind("{SSHA512}", 0), 0U);
  EXPECT_EQ(read_file(path_).find("correct"), std::string::npos);
}

TEST_F(AddSecretTest, PasswordsThatAreEmptyOrLookProtectedAreRefused) {
  const auto code = [this](const char* password) {
    return refused_add(kSmall, "cn=a,cn=top", {{"cn", {"a"}}, {"orv-slapdMasterPW", {password}}});
  };
  EXPECT_EQ(code(""), 21);
  EXPECT_EQ(code("{AES256}AAAA"), 19);
  EXPECT_EQ(code("{ssha512}AAAA"), 19);
  EXPECT_EQ(code("{CRYPT}x"), 19);
}

TEST_F(AddSecretTest, PasswordsWithBracesOfAnotherKindAreTaken) {
  const CfgSession session = open_with_key();
  for (const char* password : {"{}x", "{ }x", "a{SSHA}x", "{", " {SSHA}"}) {
    const std::string dn = "cn=" + std::to_string(password[0] * 256 + password[1]) + ",cn=top";
    EXPECT_EQ(add(session, dn, {{"orv-slapdAdminPW", {password}}}), 0) << password;
  }
}

// ---- The session afterwards ----

TEST_F(AddTest, TheSessionSeesItsOwnChanges) {
  const CfgSession session = open_for_change(kSmall);
  EXPECT_EQ(search(session, "cn=top", 0, nullptr).size(), 1U);
  for (int i = 0; i < 5; ++i) {
    const std::string dn = "cn=" + std::to_string(i) + ",cn=top";
    ASSERT_EQ(add(session, dn, {{"ou", {dn}}}), 0);
    EXPECT_EQ(search(session, dn.c_str(), 0, nullptr)[0].attributes[0].second, Values{dn});
  }
  ASSERT_EQ(remove(session, "cn=2,cn=top"), 0);
  EXPECT_EQ(search_code(session, "cn=2,cn=top", 0, nullptr), 32);
  EXPECT_EQ(search(session, "cn=top", 2, nullptr).size(), 5U);
}

TEST_F(AddTest, SeveralChangesWithoutALookLeaveNothingStale) {
  const CfgSession session = open_for_change("dn: cn=top\nou: 0\n");
  for (int i = 1; i < 9; ++i) {
    EXPECT_EQ(search(session, "cn=top", 0, nullptr)[0].attributes[0].second.size(),
              static_cast<std::size_t>(i == 1 ? 1 : 2 * i - 1));
    for (const int k : {2 * i, 2 * i + 1}) {
      Mods mods(NewEntry{{"ou", {std::string(static_cast<std::size_t>(k), 'x')}}});
      ASSERT_EQ(cfg_modify_s(session.get(), "cn=top", mods.get()), 0);
    }
  }
}

TEST_F(AddTest, ResultsObtainedBeforeShowWhatWasThere) {
  const CfgSession session = open_for_change("dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\nou: old\n");
  _CFGMessage* chain = nullptr;
  ASSERT_EQ(cfg_search_s(session.get(), "cn=a,cn=top", 0, nullptr, nullptr, 0, &chain), 0);
  const CfgResult owned(chain);
  _CFGMessage* const record = cfg_first_entry(session.get(), chain);
  _CFGBer* raw = nullptr;
  const CfgText name(cfg_first_attribute(session.get(), record, &raw));
  const CfgCursor cursor(raw);
  ASSERT_EQ(remove(session, "cn=a,cn=top"), 0);
  for (int i = 0; i < 3; ++i) {
    ASSERT_EQ(add(session, "cn=b" + std::to_string(i) + ",cn=top", {{"ou", {"new"}}}), 0);
  }
  EXPECT_EQ(values_of(session.get(), record, "ou"), Values{"old"});
  EXPECT_EQ(cfg_next_attribute(session.get(), record, cursor.get()), nullptr);
  EXPECT_EQ(cfg_get_errno(session.get()), 0);
}

}  // namespace
}  // namespace orv::cfg_test
