// Input that is rare and in order, or nearly in order: long names, odd encodings, files in odd
// places. What is common has a test beside what it is about.
#include <sys/stat.h>
#include <unistd.h>

#include <set>
#include <utility>

#include "cfg/dn.h"
#include "cfg/interrupt.h"
#include "cfg/masked_dn.h"
#include "cfg/matching.h"
#include "cfg/secret.h"
#include "change_fixture.h"
#include "faulty_files.h"

namespace orv::cfg_test {
namespace {

const NewEntry kNew = {{"cn", {"a"}}};

class RareFormsTest : public ChangeTest {
 protected:
  static std::string normal(std::string_view dn) {
    std::string form;
    const int rc = cfg::normalize_dn(dn, form);
    return rc == 0 ? form : "error " + std::to_string(rc);
  }
  static std::string masked(std::string_view dn) {
    std::string text;
    EXPECT_EQ(cfg::mask_dn(dn, cfg::UnknownTypes::shown, text), 0) << dn;
    return text;
  }
  // What a text shows of the first secret in it; "none" when there is none.
  static std::string secret_in(std::string_view text) {
    const std::optional<cfg::TextPart> part = cfg::find_secret(text, 0);
    return part ? std::string(text.substr(part->begin, part->end - part->begin)) : "none";
  }
  static std::size_t count(const CfgSession& session, const char* filter) {
    return search(session, "cn=top", 2, filter).size();
  }
};

// ---- Names

TEST_F(RareFormsTest, AMaskedDnEscapesWhateverMightMeanSomething) {
  EXPECT_EQ(masked("orv-slapdAdminPW=x,cn=azAZ09-._@/:{`[!"),
            "orv-slapdAdminPW=********,cn=azAZ09-._@/:\\7B\\60\\5B\\21");
}

TEST_F(RareFormsTest, ASecretInATextIsFoundBehindEveryFormOfTheSign) {
  for (const char* sign : {"=", "\\=", "\\3D", "\\3d", "%3D", "%3d", "\\5C=", "\\5c=", "\\5C\\=",
                           " =", "~=", ">=", ";lang-en=", ":2.5.13.17:="}) {
    for (const char* before : {"", "{", "`", "[", "@", " ", "("}) {
      const std::string text = std::string(before) + "orv-slapdAdminPW" + sign + "hidden";
      EXPECT_EQ(secret_in(text), "hidden") << text;
    }
  }
  EXPECT_EQ(secret_in("adminPassword=one\\,two,cn=a"), "one\\,two");
  EXPECT_EQ(secret_in("adminPassword=one\\"), "one\\");
  EXPECT_EQ(secret_in("cn=a,=b,%3"), "none");
}

TEST_F(RareFormsTest, ANameWithoutATypeNeedsNoMask) {
  EXPECT_FALSE(cfg::normal_dn_may_need_mask("CN=A,=B"));
  EXPECT_TRUE(cfg::normal_dn_may_need_mask("CN=A,=B,ORV-SLAPDADMINPW=X"));
}

TEST_F(RareFormsTest, HexValuesMayHoldEveryCharacterAndMustBeWhole) {
  EXPECT_EQ(normal("cn=#1C040001F600"), "CN=\xF0\x9F\x98\x80");
  for (const char* dn :
       {"cn=#0C850000000003616263", "cn=#0C8203", "cn=#0C0361626g", "cn=\\4g", "1x=a", "1.2x=a"}) {
    EXPECT_EQ(normal(dn), "error 34") << dn;
  }
}

TEST_F(RareFormsTest, AValueMayEndWithHalfACharacterOfAnotherCodePage) {
  const CfgSession session = open("dn: cn=a\xC2\ncn: a\n");
  EXPECT_EQ(search(session, "CN=a\xC2", 0, nullptr).size(), 1U);
}

TEST_F(RareFormsTest, NamesOfTypesAreAsLongAsTheyAre) {
  const std::string name(70, 'n');
  const std::string longest(2000, 'm');
  std::vector<cfg::AttributeType> types = test_types();
  types.push_back(attribute_type(name, "1.9.70", {}, cfg::MatchingRule::case_exact));
  ASSERT_EQ(cfg::register_attribute_types(types), 0);
  const CfgSession session = open("dn: cn=top\ncn: top\n" + std::string(70, 'N') +
                                  ": Value\n\ndn: " + longest + "=x,cn=top\n" + longest + ": x\n");
  EXPECT_EQ(count(session, ("(" + name + "=Value)").c_str()), 1U);
  EXPECT_EQ(count(session, ("(" + name + "=value)").c_str()), 0U);
  EXPECT_EQ(search(session, (std::string(2000, 'M') + "=X,cn=top").c_str(), 0, nullptr).size(), 1U);
}

// ---- Values

TEST_F(RareFormsTest, ValuesOutsideTheSyntaxAreInNoOrderAndEqualNothing) {
  const CfgSession session = open("dn: cn=top\ncn: top\nnumber: many\nnumber: 42\n");
  EXPECT_EQ(count(session, "(number=4)"), 0U);
  EXPECT_EQ(count(session, "(number=42)"), 1U);
  EXPECT_EQ(count(session, "(number>=43)"), 0U);
  EXPECT_EQ(count(session, "(number>=100)"), 0U);
  EXPECT_EQ(count(session, "(number<=100)"), 1U);
  EXPECT_EQ(count(session, "(number<=9)"), 0U);
}

TEST_F(RareFormsTest, AValueOfBlanksHoldsNoWord) {
  const CfgSession session = open("dn: cn=top\ncn: top\ndescription:: ICA=\n");
  EXPECT_EQ(count(session, "(description=*x*)"), 0U);
  EXPECT_EQ(count(session, "(description=x*)"), 0U);
}

TEST_F(RareFormsTest, OfAFractionNineDigitsCount) {
  std::string nine;
  std::string more;
  constexpr auto kTime = cfg::MatchingRule::generalized_time;
  EXPECT_EQ(cfg::canonical_value(kTime, "20240229120000.123456789Z", nine), 0);
  EXPECT_EQ(cfg::canonical_value(kTime, "20240229120000.12345678999Z", more), 0);
  EXPECT_EQ(nine, more);
}

// ---- Filters

TEST_F(RareFormsTest, WhatOnlyBeginsLikeAnExtensibleFilterIsNone) {
  const CfgSession session = open("dn: x-unknown=a,o=b\ncn: top\n");
  const auto found = [&](const char* filter) {
    return search(session, "x-unknown=a,o=b", 0, filter).size();
  };
  EXPECT_EQ(found("(:dn:caseIgnoreMatch:=a)"), 1U);
  EXPECT_EQ(found("(x-unknown:dn:=a)"), 1U);
  EXPECT_EQ(found("(x-unknown:dnx:=a)"), 0U);
  EXPECT_EQ(found("(!(x-unknown:dnx:=a))"), 0U);
  for (const char* filter : {"(c n=a*)", "(c n:=a)", "(cn=\\2g)", "(c n>=a)"}) {
    EXPECT_EQ(search_code(session, "x-unknown=a,o=b", 0, filter), 2) << filter;
  }
}

// ---- The file

TEST_F(RareFormsTest, DamageBehindAFoldIsToldByItsPlace) {
  EXPECT_EQ(refusal("dn: cn=top\r\ncn:: YWJj\r\n YW!j\r\n"),
            path_ + ": line 3, column 4: the base64 value is damaged or cut short");
  EXPECT_EQ(refusal("dn: cn=top\ncn:: YWJj\n YW!j\n"),
            path_ + ": line 3, column 4: the base64 value is damaged or cut short");
  for (const char* type : {"1..2", "1.x.2", "1.2."}) {
    EXPECT_EQ(refusal(std::string("dn: cn=top\n") + type + ": x\n"),
              path_ + ": line 2, column 1: the attribute name is not well formed");
  }
  for (const char* version : {"version: 1\n 0", "version:: MQ==", "version: 2"}) {
    EXPECT_EQ(refusal(std::string(version) + "\n\ndn: cn=top\ncn: top\n"),
              path_ + ": line 1, column 1: only version 1 of LDIF is known");
  }
}

// ---- Answers

TEST_F(RareFormsTest, ASearchWithoutAPlaceForItsResultIsRefused) {
  const CfgSession session = open("dn: cn=top\ncn: top\n");
  EXPECT_EQ(cfg_search_s(session.get(), "cn=top", 0, nullptr, nullptr, 0, nullptr), 1);
}

TEST_F(RareFormsTest, ASearchBelowALeafIsInterruptedAndSaysSo) {
  const CfgSession session = open("dn: cn=top\ncn: top\n");
  const cfg::InterruptScope scope([](void*) noexcept { return true; }, nullptr);
  EXPECT_EQ(search_code(session, "cn=top", kScopeOneLevel, nullptr), 3);
  cfg_perror(session.get(), nullptr);
  EXPECT_EQ(told, "interrupted\n");
}

TEST_F(RareFormsTest, ChangesThatWereMadeAreCounted) {
  const CfgSession session = open_for_change("dn: cn=top\ncn: top\n");
  const unsigned long before = cfg_changes_made();
  EXPECT_EQ(add(session, "cn=a,cn=top", kNew), 0);
  EXPECT_EQ(cfg_changes_made(), before + 1);
  EXPECT_EQ(add(session, "cn=a,cn=top", kNew), 68);
  EXPECT_EQ(cfg_changes_made(), before + 1);
}

// ---- Passwords

TEST_F(RareFormsTest, CostsThatCannotBeReadAreNotPaid) {
  constexpr cfg::SecretPlace kPlace{"orv-slapdAdminPW", "CN=CONFIGURATION"};
  for (const char* stored :
       {"{CRYPT}$2b$/5$abcdefghijklmnopqrstuv", "{CRYPT}$2b$0:$abcdefghijklmnop",
        "{CRYPT}$y$j!T$abc$def", "{CRYPT}$y$j9!$abc$def"}) {
    EXPECT_EQ(cfg::verification_cost(stored), 0U) << stored;
    EXPECT_FALSE(cfg::verify_secret(nullptr, kPlace, stored, "secret")) << stored;
  }
}

TEST_F(RareFormsTest, AStashWithOneBadDigitIsRefused) {
  const std::string path = directory_.file("key.stash");
  std::string why;
  cfg::KeyPtr key;
  write_file(path, "orv-key-1 ag" + std::string(62, 'a') + "\n");
  ASSERT_EQ(::chmod(path.c_str(), 0600), 0);
  EXPECT_EQ(cfg::load_key_stash(path.c_str(), key, why), 1);
  EXPECT_EQ(why, path + ": the key stash does not hold a key");
}

// ---- Saving

TEST_F(RareFormsTest, ASaveFileMayBeNamedFromTheWorkingDirectory) {
  char before[4096];
  ASSERT_NE(::getcwd(before, sizeof before), nullptr);
  ASSERT_EQ(::chdir(directory_.file("").c_str()), 0);
  write_file(path_, "dn: cn=top\ncn: top\n");
  {
    const CfgSession session = unbound();
    cfg_set_option(session.get(), kCfgOptSaveFile, "kept");
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
    EXPECT_EQ(add(session, "cn=a,cn=top", kNew), 0);
  }
  ASSERT_EQ(::chdir(before), 0);
  EXPECT_EQ(read_file(directory_.file("kept")), "dn: cn=top\ncn: top\n");
}

// A save file that is only thought to be where it is named.
class ThoughtSaveFile : public ObservedFiles {
 public:
  explicit ThoughtSaveFile(std::string name) : name_(std::move(name)) {}

  int before_call(const char* name, const std::string& subject) override {
    if (name == std::string("open")) opened.insert(subject);
    return 0;
  }
  int link(const char* from, const char* /*to*/) override {
    return FileCalls::status_of(from, old_);
  }
  int rename(const char* from, const char* to) override {
    return to == name_ ? 0 : ObservedFiles::rename(from, to);
  }
  int status_of(const char* path, struct stat& status) override {
    if (path != name_ + ".new") return ObservedFiles::status_of(path, status);
    status = old_;
    return 0;
  }

  std::set<std::string> opened;

 private:
  std::string name_;
  struct stat old_ {};
};

TEST_F(RareFormsTest, NamesInTheTopDirectoryAreFlushedThere) {
  const std::string save = "/orv-save-file-of-a-test";
  write_file(path_, "dn: cn=top\ncn: top\n");
  const CfgSession session = unbound();
  cfg_set_option(session.get(), kCfgOptSaveFile, save.c_str());
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
  ThoughtSaveFile files(save);
  write_through(session, files);
  EXPECT_EQ(add(session, "cn=a,cn=top", kNew), 0) << told;
  EXPECT_TRUE(files.opened.contains("/"));
}

TEST_F(RareFormsTest, TheGroupOfTheFileIsKeptAndSharesTheLock) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give a file to another group";
  write_file(path_, "dn: cn=top\ncn: top\n");
  constexpr gid_t kGroup = 65534;
  ASSERT_EQ(::chown(path_.c_str(), ::geteuid(), kGroup), 0);
  EXPECT_EQ(add(reopen(), "cn=a,cn=top", kNew), 0);
  for (const std::string& path : {path_, path_ + ".lock"}) {
    struct stat status {};
    ASSERT_EQ(::stat(path.c_str(), &status), 0);
    EXPECT_EQ(status.st_uid, ::geteuid()) << path;
    EXPECT_EQ(status.st_gid, kGroup) << path;
  }
}

TEST_F(RareFormsTest, AnUnknownLeftoverIsKeptWithoutASaveFileToo) {
  write_file(path_, "dn: cn=top\ncn: top\n");
  write_file(path_ + ".swap", "an edit\n");
  const CfgSession session = unbound();
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
  EXPECT_EQ(add(session, "cn=a,cn=top", kNew), 0);
  EXPECT_EQ(read_file(path_ + ".rescued"), "an edit\n");
}

TEST_F(RareFormsTest, ALargeLeftoverIsComparedToItsEnd) {
  const std::string large = "dn: cn=top\ncn: top\n# " + std::string(200'000, 'x') + "\n";
  for (const bool same : {true, false}) {
    std::string leftover = large;
    if (!same) leftover[leftover.size() - 2] = 'y';
    write_file(path_, large);
    write_file(path_ + ".swap", leftover);
    const CfgSession session = unbound();
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
    EXPECT_EQ(add(session, "cn=a,cn=top", kNew), 0);
    EXPECT_EQ(exists(path_ + ".rescued"), !same);
  }
}

// Every name for an edit that is to be kept is taken already.
class AllNamesTaken : public ObservedFiles {
 public:
  int before_call(const char* /*name*/, const std::string& /*subject*/) override { return 0; }
  int status_of(const char* path, struct stat& status) override {
    if (std::string(path).find(".rescued") != std::string::npos) return 0;
    return ObservedFiles::status_of(path, status);
  }
};

TEST_F(RareFormsTest, AnEditForWhichThereIsNoNameLeftStopsTheWriter) {
  write_file(path_, "dn: cn=top\ncn: top\n");
  write_file(path_ + ".swap", "an edit\n");
  AllNamesTaken files;
  const CfgSession session = reopen();
  write_through(session, files);
  EXPECT_EQ(add(session, "cn=a,cn=top", kNew), 80);
  EXPECT_NE(told.find("cannot be kept: File exists"), std::string::npos) << told;
  EXPECT_EQ(read_file(path_ + ".swap"), "an edit\n");
  EXPECT_EQ(read_file(path_), "dn: cn=top\ncn: top\n");
}

}  // namespace
}  // namespace orv::cfg_test
