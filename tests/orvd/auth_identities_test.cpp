// Who may bind, and what is granted: read from real files, proven with real passwords.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <thread>

#include "auth_identities_fixture.h"
#include "cfg/dn.h"
#include "slapi/codepage.h"
#include "slapi/connection.h"
#include "slapi/schema.h"

namespace orv::server {
namespace {

using namespace std::string_literals;  // NOLINT: texts with NUL octets
using ::testing::Contains;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;

class SchemaRegistration : public ::testing::Environment {
 public:
  void SetUp() override {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }
};
const auto* const kRegistration = ::testing::AddGlobalTestEnvironment(new SchemaRegistration);

std::string supplier(const std::string& name, const std::string& object_class,
                     const std::string& dn, const std::string& password) {
  return "\ndn: cn=" + name + ",cn=configuration\nobjectClass: " + object_class + "\ncn: " + name +
         "\norv-slapdMasterDN: " + dn + "\norv-slapdMasterPW: " + password + "\n";
}

void expect_identity(const Identity* identity, const char* bound_dn, unsigned flags, unsigned roles,
                     const char* entry_dn) {
  ASSERT_NE(identity, nullptr);
  EXPECT_EQ(identity->bound_dn, bound_dn);
  EXPECT_EQ(identity->authority, flags);
  EXPECT_EQ(identity->roles, roles);
  EXPECT_EQ(identity->entry_dn, entry_dn);
}

// ---- Roles

TEST(RoleBits, EachRoleHasItsBits) {
  EXPECT_EQ(role_bits({"AuditAdmin"}), 0x02U);
  EXPECT_EQ(role_bits({"ReplicationAdmin"}), 0x0CU);
  EXPECT_EQ(role_bits({"SchemaAdmin"}), 0x10U);
  EXPECT_EQ(role_bits({"ServerConfigGroupMember"}), 0x20U);
  EXPECT_EQ(role_bits({"auditadmin", "SCHEMAADMIN"}), 0x12U);
  EXPECT_EQ(role_bits({}), 0U);
  EXPECT_EQ(role_bits({"Wizard", ""}), 0U);
}

TEST(RoleBits, OtherRolesConcernNoPartOfTheConfiguration) {
  unsigned seen = 0;
  for (const char* name : {"DirDataAdmin", "PasswordAdmin", "ServerStartStopAdmin"}) {
    const unsigned bits = role_bits({name});
    EXPECT_NE(bits, 0U) << name;
    EXPECT_EQ(bits & role::any_configuration, 0U) << name;
    EXPECT_EQ(bits & 1U, 0U) << name;
    EXPECT_EQ(bits & seen, 0U) << name;
    seen |= bits;
  }
}

TEST(RoleBits, NoAdminTakesAllAway) {
  EXPECT_EQ(role_bits({"AuditAdmin", "noadmin"}), 0U);
  EXPECT_EQ(role_bits({"NoAdmin", "SchemaAdmin"}), 0U);
}

// ---- Kinds of identities

TEST_F(IdentitiesOfAFile, PrimaryAdministrator) {
  const auto identities = read(kTop);
  ASSERT_TRUE(identities) << error_;
  EXPECT_THAT(warnings_, IsEmpty());
  expect_identity(identities->authenticate("cn=root", "rootpw"), "CN=ROOT", 0x0C, 0,
                  "CN=CONFIGURATION");
}

TEST_F(IdentitiesOfAFile, NameIsFoundInEverySpelling) {
  const auto identities = read(kTop);
  ASSERT_TRUE(identities) << error_;
  for (const char* name :
       {"CN=Root", "commonName=root", "2.5.4.3= root", "cn=\\72oot", "cn=#0404726F6F74"}) {
    EXPECT_NE(identities->authenticate(name, "rootpw"), nullptr) << name;
  }
}

TEST_F(IdentitiesOfAFile, GroupMemberWithRoles) {
  const auto identities =
      read(kTop + kGroup +
           member("m", "cn=member,o=x", "mpw",
                  "orv-slapdAdminRole: auditadmin\norv-slapdAdminRole: ServerConfigGroupMember\n"));
  ASSERT_TRUE(identities) << error_;
  expect_identity(identities->authenticate("cn=member,o=x", "mpw"), "CN=MEMBER,O=X", 0x14, 0x22,
                  "CN=M,CN=ADMINGROUP,CN=CONFIGURATION");
}

TEST_F(IdentitiesOfAFile, MemberWithNoAdminBindsWithoutRoles) {
  const auto identities = read(
      kTop + kGroup + member("m", "cn=m", "mpw", "orv-slapdAdminRole: NoAdmin\n" + kAuditRole));
  ASSERT_TRUE(identities) << error_;
  expect_identity(identities->authenticate("cn=m", "mpw"), "CN=M", 0x14, 0,
                  "CN=M,CN=ADMINGROUP,CN=CONFIGURATION");
}

TEST_F(IdentitiesOfAFile, MembersFarBelowTheGroupCount) {
  const std::string below =
      "\ndn: cn=inner,cn=m,cn=AdminGroup,cn=configuration\n"
      "objectClass: orv-slapdAdminGroupMember\ncn: inner\norv-slapdAdminDN: cn=inner\n"
      "orv-slapdAdminPW: ipw\norv-slapdAdminRole: AuditAdmin\n";
  const auto identities = read(kTop + kGroup + member("m", "cn=m", "mpw") + below);
  ASSERT_TRUE(identities) << error_;
  EXPECT_NE(identities->authenticate("cn=inner", "ipw"), nullptr);
}

TEST_F(IdentitiesOfAFile, MemberClassElsewhereGrantsNothing) {
  const auto identities =
      read(kTop + std::string("\ndn: cn=fake,cn=configuration\nobjectClass: "
                              "orv-slapdAdminGroupMember\ncn: fake\norv-slapdAdminDN: cn=fake\n"
                              "orv-slapdAdminPW: pw\norv-slapdAdminRole: AuditAdmin\n"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=fake", "pw"), nullptr);
}

TEST_F(IdentitiesOfAFile, ContainerOfTheGroupIsNobodyWhateverItsClass) {
  const auto identities =
      read(kTop + std::string("\ndn: cn=AdminGroup,cn=configuration\nobjectClass: "
                              "orv-slapdAdminGroupMember\ncn: AdminGroup\norv-slapdAdminDN: cn=g\n"
                              "orv-slapdAdminPW: pw\n"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=g", "pw"), nullptr);
}

TEST_F(IdentitiesOfAFile, EntryOfAnotherClassInTheGroupGrantsNothing) {
  const auto identities =
      read(kTop + kGroup +
           "\ndn: cn=x,cn=AdminGroup,cn=configuration\nobjectClass: orv-slapdConfigEntry\ncn: x\n"
           "orv-slapdAdminDN: cn=x\norv-slapdAdminPW: pw\n");
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=x", "pw"), nullptr);
}

TEST_F(IdentitiesOfAFile, SuppliersOfServerAndSuffix) {
  const auto identities =
      read(kTop + supplier("Master Server", "orv-slapdReplication", "cn=master", "masterpw") +
           supplier("s1", "orv-slapdSupplier", "cn=supplier", "supplierpw"));
  ASSERT_TRUE(identities) << error_;
  expect_identity(identities->authenticate("cn=master", "masterpw"), "CN=MASTER", 0x01, 0,
                  "CN=MASTER SERVER,CN=CONFIGURATION");
  expect_identity(identities->authenticate("cn=supplier", "supplierpw"), "CN=SUPPLIER", 0x02, 0,
                  "CN=S1,CN=CONFIGURATION");
}

TEST_F(IdentitiesOfAFile, ReplicationClassElsewhereGrantsNothing) {
  const auto identities = read(kTop + supplier("x", "orv-slapdReplication", "cn=x", "pw"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=x", "pw"), nullptr);
}

TEST_F(IdentitiesOfAFile, MasterServerOfSupplierClassIsOneIdentity) {
  const auto identities =
      read(kTop + supplier("Master Server", "orv-slapdSupplier", "cn=master", "pw"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_THAT(warnings_, IsEmpty());
  expect_identity(identities->authenticate("cn=master", "pw"), "CN=MASTER", 0x01, 0,
                  "CN=MASTER SERVER,CN=CONFIGURATION");
}

// ---- The group's switch

TEST_F(IdentitiesOfAFile, GroupSwitchDecidesWhetherMembersBind) {
  const struct {
    const char* line;
    bool binds;
  } kCases[] = {{"", true},
                {"orv-slapdAdminGroupEnabled: TRUE\n", true},
                {"orv-slapdAdminGroupEnabled: true\n", true},
                {"orv-slapdAdminGroupEnabled: FALSE\n", false},
                {"orv-slapdAdminGroupEnabled: yes\n", false}};
  for (const auto& c : kCases) {
    const auto identities = read(kTop + c.line + kGroup + member("m", "cn=m", "mpw"));
    ASSERT_TRUE(identities) << error_;
    EXPECT_EQ(identities->authenticate("cn=m", "mpw") != nullptr, c.binds) << c.line;
    EXPECT_NE(identities->authenticate("cn=root", "rootpw"), nullptr) << c.line;
  }
}

// ---- Who is nobody

TEST_F(IdentitiesOfAFile, WrongPasswordsAndNamesProveNothing) {
  const auto identities = read(kTop);
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=root", "wrong"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", "ROOTPW"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", "rootpw "), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", "rootpw\0"s), nullptr);
  EXPECT_EQ(identities->authenticate("cn=nobody", "rootpw"), nullptr);
  EXPECT_EQ(identities->authenticate("not a dn", "rootpw"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=\xFF", "rootpw"), nullptr);
  EXPECT_EQ(identities->authenticate("", "rootpw"), nullptr);
}

TEST_F(IdentitiesOfAFile, EmptyPasswordNeverMatches) {
  const auto identities = read(kTopWithoutPassword + "orv-slapdAdminPW:\n" +
                               supplier("s", "orv-slapdSupplier", "cn=s", "pw"));
  if (identities) {
    EXPECT_EQ(identities->authenticate("cn=root", ""), nullptr);
    EXPECT_EQ(identities->authenticate("cn=s", ""), nullptr);
  }
  const auto usual = read(kTop);
  ASSERT_TRUE(usual) << error_;
  EXPECT_EQ(usual->authenticate("cn=root", ""), nullptr);
}

TEST_F(IdentitiesOfAFile, IdentityWithoutPasswordCannotBind) {
  const auto identities = read(kTopWithoutPassword);
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=root", "x"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", ""), nullptr);
}

TEST_F(IdentitiesOfAFile, NamesInsideTheConfigurationAreNobodysWithAWarning) {
  const auto identities =
      read(kTop + kGroup + member("m", "cn=m,cn=AdminGroup,cn=Configuration", "mpw") +
           supplier("s", "orv-slapdSupplier", "cn=configuration", "spw"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=m,cn=admingroup,cn=configuration", "mpw"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=configuration", "spw"), nullptr);
  EXPECT_THAT(warnings_,
              ElementsAre(HasSubstr("CN=M,CN=ADMINGROUP,CN=CONFIGURATION: orv-slapdAdminDN"),
                          HasSubstr("CN=S,CN=CONFIGURATION: orv-slapdMasterDN")));
}

TEST_F(IdentitiesOfAFile, NameThatTwoEntriesClaimBindsAsNeither) {
  const auto identities =
      read(kTop + kGroup + member("a", "cn=Twin,o=x", "apw") + member("b", "cn=twin, o=X", "bpw") +
           member("c", "CN=TWIN,O=X", "cpw") + member("d", "cn=single", "dpw"));
  ASSERT_TRUE(identities) << error_;
  for (const char* password : {"apw", "bpw", "cpw"}) {
    EXPECT_EQ(identities->authenticate("cn=twin,o=x", password), nullptr);
  }
  EXPECT_NE(identities->authenticate("cn=single", "dpw"), nullptr);
  EXPECT_EQ(warnings_.size(), 2U);
  EXPECT_THAT(warnings_, Contains(HasSubstr("another entry has the same bind DN")));
}

TEST_F(IdentitiesOfAFile, ClaimOnThePrimaryAdministratorsNameShutsBothOut) {
  const auto identities = read(kTop + kGroup + member("m", "CN=ROOT", "mpw"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=root", "rootpw"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", "mpw"), nullptr);
}

TEST_F(IdentitiesOfAFile, OnlyFirstValuesCountWithAWarningThatNamesNoSecret) {
  const auto identities = read(kTop + "orv-slapdAdminPW: secondpw\norv-slapdAdminDN: cn=second\n");
  ASSERT_TRUE(identities) << error_;
  EXPECT_NE(identities->authenticate("cn=root", "rootpw"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", "secondpw"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=second", "rootpw"), nullptr);
  EXPECT_EQ(warnings_.size(), 2U);
  EXPECT_THAT(warnings_, Each(Not(HasSubstr("secondpw"))));
}

TEST_F(IdentitiesOfAFile, MemberWithoutANameIsLeftOutWithAWarning) {
  const auto identities =
      read(kTop + kGroup +
           "\ndn: cn=m,cn=AdminGroup,cn=configuration\nobjectClass: orv-slapdAdminGroupMember\n"
           "cn: m\norv-slapdAdminPW: pw\n");
  ASSERT_TRUE(identities) << error_;
  EXPECT_THAT(warnings_, ElementsAre(HasSubstr("has no orv-slapdAdminDN")));
}

TEST_F(IdentitiesOfAFile, SealedPasswordThatProvesNothingIsToldOfWithoutShowingIt) {
  const auto expect_doubt = [&](const std::string& stored, const char* why) {
    EXPECT_TRUE(read(top_with(stored))) << error_;
    EXPECT_THAT(warnings_, ElementsAre(HasSubstr(why)));
    EXPECT_THAT(warnings_, Each(HasSubstr("CN=CONFIGURATION: orv-slapdAdminPW ")));
    EXPECT_THAT(warnings_, Each(Not(HasSubstr(stored))));
  };
  const cfg::KeyPtr first = make_key();
  const std::string here = sealed(*first, "orv-slapdAdminPW", "CN=CONFIGURATION", "pw");
  const std::string elsewhere = sealed(*first, "orv-slapdAdminPW", "CN=M,CN=CONFIGURATION", "pw");
  EXPECT_TRUE(read(top_with(here))) << error_;
  EXPECT_THAT(warnings_, IsEmpty());
  expect_doubt(elsewhere, "sealed for another entry");
  std::filesystem::remove(stash());
  const cfg::KeyPtr second = make_key();
  expect_doubt(here, "does not open");
  use_stash_ = false;
  expect_doubt(here, "no key stash is named");
}

// ---- Forms of stored passwords

TEST_F(IdentitiesOfAFile, HashedPasswordIsVerified) {
  std::string hashed;
  ASSERT_EQ(cfg::hash_secret("hashedpw", hashed), 0);
  const auto identities = read(top_with(hashed));
  ASSERT_TRUE(identities) << error_;
  EXPECT_NE(identities->authenticate("cn=root", "hashedpw"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", "other"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", hashed), nullptr);
}

TEST_F(IdentitiesOfAFile, SealedPasswordIsVerifiedAtItsPlaceOnly) {
  const cfg::KeyPtr key = make_key();
  const std::string admin = sealed(*key, "orv-slapdAdminPW", "CN=CONFIGURATION", "sealedpw");
  const std::string good =
      sealed(*key, "orv-slapdAdminPW", "CN=M,CN=ADMINGROUP,CN=CONFIGURATION", "mpw");
  const auto identities = read(top_with(admin) + kGroup + member("m", "cn=m", good) +
                               member("thief", "cn=thief", admin));
  ASSERT_TRUE(identities) << error_;
  EXPECT_NE(identities->authenticate("cn=root", "sealedpw"), nullptr);
  EXPECT_NE(identities->authenticate("cn=m", "mpw"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=thief", "sealedpw"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", admin), nullptr);
}

TEST_F(IdentitiesOfAFile, SealedSupplierPasswordIsVerified) {
  const cfg::KeyPtr key = make_key();
  const std::string stored = sealed(*key, "orv-slapdMasterPW", "CN=S,CN=CONFIGURATION", "spw");
  const auto identities = read(kTop + supplier("s", "orv-slapdSupplier", "cn=s", stored));
  ASSERT_TRUE(identities) << error_;
  EXPECT_NE(identities->authenticate("cn=s", "spw"), nullptr);
}

TEST_F(IdentitiesOfAFile, PasswordOfAnUnknownSchemeNeverMatches) {
  const auto identities = read(top_with("{WHIRL}abc"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=root", "{WHIRL}abc"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=root", "abc"), nullptr);
}

// What an administrator, or a tool of another system, may have left in the file.
TEST_F(IdentitiesOfAFile, MalformedStoredPasswordNeverMatches) {
  const std::string hash = "MDEyMzQ1Njc4OTAxMjM0NQ";
  const std::vector<std::string> stored{
      "*",
      "{" + std::string(512, 'A') + "}x",
      "{SSHA512}",
      "{SSHA512}=",
      "{SSHA512}AAAA",
      "{AES256}",
      "{AES256}AAAA",
      "{PBKDF2-SHA256}",
      "{PBKDF2-SHA256}$$",
      "{PBKDF2-SHA256}0$c2FsdA$" + hash,
      "{PBKDF2-SHA256}-1$c2FsdA$" + hash,
      "{PBKDF2-SHA256}4294967297$c2FsdA$" + hash,
      "{PBKDF2-SHA512}99999999999999999999$c2FsdA$" + hash,
      "{PBKDF2-SHA512}10000001$c2FsdA$" + hash,
      "{CRYPT}",
      "{CRYPT}*",
      "{CRYPT}*0",
      "{CRYPT}!",
      "{CRYPT}x",
      "{CRYPT}$6$rounds=999999999$salt$x",
      "{CRYPT}$5$rounds=4294967297$salt$x",
      "{CRYPT}$2b$31$abcdefghijklmnopqrstuuAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAA",
      "{CRYPT}$y$jzT$abcdefghijklmnop$x",
      "{CRYPT}$y$j9TAAAA$abcdefghijklmnop$x",
      "{CRYPT}$7$zU..../....salt$x",
      "{CRYPT}$7$",
      "{CRYPT}$sha1$4294967295$salt$x",
      "{CRYPT}$md5,rounds=4294967295$salt$x",
      "{CRYPT}_",
      "{CRYPT}$",
  };
  for (const std::string& value : stored) {
    const auto identities = read(top_with(value));
    ASSERT_TRUE(identities) << value << error_;
    for (const std::string& guess : {value, std::string("*"), std::string("x"), "secret"s})
      EXPECT_EQ(identities->authenticate("cn=root", guess), nullptr) << value << " / " << guess;
  }
}

TEST_F(IdentitiesOfAFile, NameOfBlanksIsNobodys) {
  const auto identities = read(
      "dn: cn=configuration\nobjectClass: orv-slapdTop\ncn: configuration\n"
      "orv-slapdAdminDN:: IA==\norv-slapdAdminPW: rootpw\n");
  ASSERT_TRUE(identities) << error_;
  for (const char* name : {"", " "}) {
    EXPECT_EQ(identities->authenticate(name, "rootpw"), nullptr);
  }
  EXPECT_EQ(warnings_.size(), 1U);
}

// Names and passwords come in UTF-8 and are kept in the file's code page.
TEST_F(IdentitiesOfAFile, FileInAnotherCodePageIsUnderstood) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  // cn=J\xFCrgen and p\xE4ss in that code page, in base64
  const auto identities = read(
      "dn: cn=configuration\nobjectClass: orv-slapdTop\ncn: configuration\n"
      "orv-slapdAdminDN:: Y249SvxyZ2Vu\norv-slapdAdminPW:: cORzcw==\n");
  EXPECT_TRUE(identities) << error_;
  if (identities) {
    EXPECT_NE(identities->authenticate("cn=j\xC3\xBCrgen", "p\xC3\xA4ss"), nullptr);
    EXPECT_EQ(identities->authenticate("cn=j\xC3\xBCrgen", "p\xE4ss"), nullptr);
    EXPECT_EQ(identities->authenticate("cn=j\xC3\xBCrgen", "p\xC3\xA4ss\0x"s), nullptr);
    EXPECT_EQ(identities->authenticate("cn=j\xC3\xBCrgen", "\xE6\x97\xA5"), nullptr);
  }
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
}

// ---- Files that cannot be used

TEST_F(IdentitiesOfAFile, MissingOrDamagedFileIsAFailureWithItsCause) {
  std::string error;
  EXPECT_FALSE(Identities::read(folder_.file("none").c_str(), nullptr, error, warnings_));
  EXPECT_THAT(error, HasSubstr("none"));
  EXPECT_FALSE(read("this is no LDIF\n"));
  EXPECT_FALSE(error_.empty());
  EXPECT_FALSE(read("dn: cn=other\nobjectClass: container\ncn: other\n"));
  EXPECT_THAT(error_, HasSubstr("CN=CONFIGURATION"));
}

TEST_F(IdentitiesOfAFile, KeyStashThatCannotBeUsedIsAFailure) {
  use_stash_ = true;
  EXPECT_FALSE(read(kTop)) << "no stash there";
  EXPECT_FALSE(error_.empty());
  make_key();
  ASSERT_EQ(chmod(stash().c_str(), 0644), 0);
  EXPECT_FALSE(read(kTop)) << "readable by others";
  ASSERT_EQ(chmod(stash().c_str(), 0600), 0);
  EXPECT_TRUE(read(kTop)) << error_;
}

// ---- The store

class Store : public IdentitiesOfAFile {
 protected:
  bool binds(IdentityStore& store, const char* password) {
    const auto identities = store.current();
    return identities != nullptr && identities->authenticate("cn=root", password) != nullptr;
  }
};

TEST_F(Store, IsEmptyWhenTheFirstReadingFails) {
  IdentityStore store(config(), "");
  EXPECT_FALSE(store.reload(error_, warnings_));
  EXPECT_FALSE(error_.empty());
  EXPECT_EQ(store.current(), nullptr);
}

TEST_F(Store, ReadsTheFileAgainWhenItWasReplaced) {
  write(top_with("one"));
  IdentityStore store(config(), "");
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  EXPECT_TRUE(binds(store, "one"));
  replace(top_with("two"));
  EXPECT_TRUE(binds(store, "two"));
  EXPECT_FALSE(binds(store, "one"));
}

TEST_F(Store, KeepsTheSameSnapshotWhileTheFileStays) {
  write(top_with("one"));
  IdentityStore store(config(), "");
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  EXPECT_EQ(store.current(), store.current());
  const auto before = store.current();
  ASSERT_TRUE(store.reload(error_, warnings_));
  EXPECT_NE(store.current(), before) << "reload reads whatever the times say";
}

TEST_F(Store, KeepsTheLastGoodOneWhileTheFileIsDamaged) {
  write(top_with("one"));
  IdentityStore store(config(), "");
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  replace("damaged\n");
  EXPECT_TRUE(binds(store, "one"));
  EXPECT_FALSE(store.reload(error_, warnings_));
  EXPECT_FALSE(error_.empty());
  EXPECT_TRUE(binds(store, "one"));
  std::filesystem::remove(config());
  EXPECT_TRUE(binds(store, "one"));
  replace(top_with("two"));
  EXPECT_TRUE(binds(store, "two"));
}

TEST_F(Store, ReadsAgainWhenTheKeyStashChanges) {
  const cfg::KeyPtr key = make_key();
  write(top_with(sealed(*key, "orv-slapdAdminPW", "CN=CONFIGURATION", "one")));
  IdentityStore store(config(), stash());
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  EXPECT_TRUE(binds(store, "one"));
  std::filesystem::remove(stash());
  make_key();
  EXPECT_FALSE(binds(store, "one")) << "the new key does not open the old value";
}

TEST_F(Store, ServesManyThreadsWhileTheFileIsReplaced) {
  write(top_with("stays"));
  IdentityStore store(config(), "");
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int n = 0; n < 50; ++n) {
        if (!binds(store, "stays")) ++failures;
      }
    });
  }
  for (int n = 0; n < 50; ++n) replace(top_with("stays") + std::string(n % 3U, '\n'));
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures, 0);
}

// ---- What a try costs

// Which stored passwords were verified, in their order.
std::vector<std::string>& verified() {
  static std::vector<std::string> stored;
  return stored;
}

bool record_and_refuse(const cfg::Key*, cfg::SecretPlace, std::string_view stored,
                       std::string_view) noexcept {
  verified().emplace_back(stored);
  return false;
}

class CostOfATry : public IdentitiesOfAFile {
 protected:
  const std::string cheap_ = "cheappw";
  const std::string few_ = "{PBKDF2-SHA256}1000$c2FsdHNhbHQ$MDEyMzQ1Njc4OTAxMjM0NQ";
  const std::string many_ = "{pbkdf2-sha512}600000$c2FsdHNhbHQ$MDEyMzQ1Njc4OTAxMjM0NQ";

  std::vector<std::string> tried(const Identities& identities, const char* name,
                                 const char* password = "guess") {
    verified().clear();
    EXPECT_EQ(identities.authenticate(name, password, record_and_refuse), nullptr);
    return verified();
  }
};

TEST_F(CostOfATry, OfAnUnknownNameIsThatOfTheCostliestPassword) {
  const auto identities = read(kTop + kGroup + member("a", "cn=a", few_) +
                               member("b", "cn=b", many_) + member("c", "cn=c", cheap_));
  ASSERT_TRUE(identities) << error_;
  for (const char* name : {"cn=nobody", "not a dn", "cn=x,cn=configuration"})
    EXPECT_THAT(tried(*identities, name), ElementsAre(many_)) << name;
}

TEST_F(CostOfATry, OfAKnownNameIsThatOfItsOwnPasswordAndTheCostliestWhenItsOwnIsCheap) {
  const auto identities =
      read(kTop + kGroup + member("b", "cn=b", many_) + member("c", "cn=c", cheap_));
  ASSERT_TRUE(identities) << error_;
  EXPECT_THAT(tried(*identities, "cn=b"), ElementsAre(many_));
  EXPECT_THAT(tried(*identities, "cn=c"), ElementsAre(cheap_, many_));
}

TEST_F(CostOfATry, IsOneVerificationWhereAllPasswordsAreCheap) {
  const auto identities = read(kTop + kGroup + member("c", "cn=c", cheap_));
  ASSERT_TRUE(identities) << error_;
  EXPECT_THAT(tried(*identities, "cn=c"), ElementsAre(cheap_));
  EXPECT_EQ(tried(*identities, "cn=nobody").size(), 1U);
}

TEST_F(CostOfATry, CountsNoNumberOfIterationsThatIsNeverComputed) {
  const auto identities =
      read(kTop + kGroup + member("a", "cn=a", many_) +
           member("b", "cn=b", "{PBKDF2-SHA256}99999999$c2FsdHNhbHQ$MDEyMzQ1Njc4OTAxMjM0NQ"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_THAT(tried(*identities, "cn=nobody"), ElementsAre(many_));
}

TEST_F(CostOfATry, OfATextOfCryptIsThatOfACostlyOne) {
  if (!cfg::can_make_secret(cfg::SecretMethod::crypt)) GTEST_SKIP() << "the platform has none";
  std::string crypt;
  ASSERT_EQ(cfg::make_secret(cfg::SecretMethod::crypt, "secret", crypt), 0);
  const auto identities =
      read(kTop + kGroup + member("b", "cn=b", crypt) + member("c", "cn=c", cheap_));
  ASSERT_TRUE(identities) << error_;
  EXPECT_THAT(tried(*identities, "cn=nobody"), ElementsAre(crypt));
  EXPECT_THAT(tried(*identities, "cn=b"), ElementsAre(crypt));
  EXPECT_THAT(tried(*identities, "cn=c"), ElementsAre(cheap_, crypt));
}

TEST_F(CostOfATry, OfHashesThatTakeLongerIsMore) {
  if (!cfg::can_make_secret(cfg::SecretMethod::crypt)) GTEST_SKIP() << "the platform has none";
  const std::string rounds = "{CRYPT}$6$rounds=700000$salt$x";
  const auto identities =
      read(kTop + kGroup + member("a", "cn=a", many_) + member("b", "cn=b", rounds));
  ASSERT_TRUE(identities) << error_;
  EXPECT_THAT(tried(*identities, "cn=nobody"), ElementsAre(rounds));
}

TEST_F(CostOfATry, NeverMakesTheAnswerOfAnotherPasswordCount) {
  const auto identities = read(kTop);
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->authenticate("cn=nobody", "rootpw"), nullptr);
  EXPECT_EQ(identities->authenticate("cn=nobody", "rootpw",
                                     [](const cfg::Key*, cfg::SecretPlace, std::string_view,
                                        std::string_view) noexcept { return true; }),
            nullptr);
}

// ---- Grants that still stand

class Grants : public IdentitiesOfAFile {
 protected:
  const std::string before_ = kTop + kGroup + member("m", "cn=m", "mpw");

  // Whether what cn=m proved by `before_` stands by `after`.
  bool stands(const std::string& after) {
    const auto old = read(before_);
    EXPECT_TRUE(old) << error_;
    const Identity* const bound = old->authenticate("cn=m", "mpw");
    EXPECT_NE(bound, nullptr);
    const auto fresh = read(after);
    EXPECT_TRUE(fresh) << error_;
    return bound != nullptr && fresh != nullptr && fresh->still_valid(*bound);
  }
};

TEST_F(Grants, StandWhileNothingOfTheIdentityChanges) {
  EXPECT_TRUE(stands(before_));
  EXPECT_TRUE(stands("# a comment\n" + before_ + member("other", "cn=other", "opw")));
  EXPECT_TRUE(stands(kTop + "orv-slapdSizeLimit: 5\n" + kGroup + member("m", "CN = M", "mpw")));
}

TEST_F(Grants, FallWithTheEntryItsNameItsRolesItsPasswordAndTheGroup) {
  EXPECT_FALSE(stands(kTop + kGroup));
  EXPECT_FALSE(stands(kTop + kGroup + member("n", "cn=m", "mpw"))) << "another entry";
  EXPECT_FALSE(stands(kTop + kGroup + member("m", "cn=n", "mpw"))) << "another name";
  EXPECT_FALSE(
      stands(kTop + kGroup + member("m", "cn=m", "mpw", "orv-slapdAdminRole: SchemaAdmin\n")));
  EXPECT_FALSE(stands(kTop + kGroup + member("m", "cn=m", "new"))) << "another password";
  EXPECT_FALSE(
      stands(kTop + "orv-slapdAdminGroupEnabled: FALSE\n" + kGroup + member("m", "cn=m", "mpw")));
  EXPECT_FALSE(stands(before_ + member("twin", "cn=m", "mpw"))) << "claimed twice";
}

TEST_F(Grants, FallWithTheFlags) {
  const auto identities = read(before_);
  ASSERT_TRUE(identities) << error_;
  Identity bound = *identities->authenticate("cn=m", "mpw");
  EXPECT_TRUE(identities->still_valid(bound));
  bound.authority = authority::primary_administrator;
  EXPECT_FALSE(identities->still_valid(bound));
}

// ---- What the store tells

TEST_F(Store, TellsTheCauseOfADamageOnceForEachStateOfTheFile) {
  write(top_with("one"));
  std::vector<std::string> told;
  IdentityStore store(config(), "",
                      [&](const std::string& error, const auto&) { told.push_back(error); });
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  const auto generation = store.generation();
  EXPECT_TRUE(binds(store, "one"));
  replace("damaged\n");
  EXPECT_TRUE(binds(store, "one"));
  EXPECT_TRUE(binds(store, "one"));
  EXPECT_THAT(told, ElementsAre(HasSubstr(config())));
  EXPECT_EQ(store.generation(), generation);
  replace("damaged otherwise\n");
  EXPECT_TRUE(binds(store, "one"));
  EXPECT_EQ(told.size(), 2U);
  replace(top_with("one"));
  EXPECT_TRUE(binds(store, "one"));
  EXPECT_EQ(told.size(), 2U);
  EXPECT_GT(store.generation(), generation);
  EXPECT_EQ(store.latest(), store.current());
}

TEST_F(Store, TellsDoubtsOnceForEachStateOfTheFile) {
  write(top_with("one"));
  std::vector<std::string> told;
  IdentityStore store(config(), "", [&](const std::string& error, const auto& warnings) {
    EXPECT_EQ(error, "");
    told.insert(told.end(), warnings.begin(), warnings.end());
  });
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  replace(kTop + kGroup + member("a", "cn=a", "x") + member("b", "cn=a", "y"));
  for (int i = 0; i < 3; ++i) store.current();
  EXPECT_THAT(told, ElementsAre(HasSubstr("same bind DN")));
}

// ---- What keeps the files from being read, and passes

// While it lives, the process can open no file.
class NoMoreFiles {
 public:
  NoMoreFiles() {
    getrlimit(RLIMIT_NOFILE, &before_);
    const int lowest_free = dup(STDIN_FILENO);
    close(lowest_free);
    rlimit none = before_;
    none.rlim_cur = static_cast<rlim_t>(lowest_free);
    EXPECT_EQ(setrlimit(RLIMIT_NOFILE, &none), 0);
  }
  ~NoMoreFiles() { setrlimit(RLIMIT_NOFILE, &before_); }

 private:
  rlimit before_{};
};

TEST_F(Store, ReadsAgainAfterAPauseWhenWhatWasInTheWayHasPassed) {
  const auto start = IdentityStore::Clock::now();
  write(top_with("one"));
  std::vector<std::string> told;
  IdentityStore store(config(), "",
                      [&](const std::string& error, const auto&) { told.push_back(error); });
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  const auto proves = [&](IdentityStore::Clock::time_point when, const char* password) {
    return store.current(when)->authenticate("cn=root", password) != nullptr;
  };
  // Sanitizers look at a type's objects for the first time through a pipe.
  EXPECT_TRUE(proves(start, "one"));
  replace(top_with("two"));
  {
    const NoMoreFiles none;
    EXPECT_TRUE(proves(start, "one"));
    EXPECT_TRUE(proves(start + IdentityStore::kFirstPause, "one"));
  }
  EXPECT_TRUE(proves(start + IdentityStore::kFirstPause, "one")) << "the second pause";
  EXPECT_FALSE(proves(start + 3 * IdentityStore::kFirstPause, "one"));
  EXPECT_TRUE(proves(start + 3 * IdentityStore::kFirstPause, "two"));
  EXPECT_THAT(told, ElementsAre(HasSubstr("open files")));
}

TEST_F(Store, ReadsAgainAfterAReloadThatFailed) {
  write(top_with("one"));
  IdentityStore store(config(), "");
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  replace(top_with("two"));
  {
    const NoMoreFiles none;
    EXPECT_FALSE(store.reload(error_, warnings_));
  }
  const auto later = IdentityStore::Clock::now() + IdentityStore::kFirstPause;
  EXPECT_NE(store.current(later)->authenticate("cn=root", "two"), nullptr);
}

TEST_F(Store, PausesLongerEachTimeButReadsAtOnceWhatIsNew) {
  auto now = IdentityStore::Clock::now();
  write(top_with("one"));
  int attempts = 0;
  IdentityStore store(config(), "", {}, [&] {
    ++attempts;
    return false;
  });
  const auto attempts_by = [&](std::chrono::seconds later) {
    store.current(now + later);
    return attempts;
  };
  using std::chrono::seconds;
  EXPECT_EQ(attempts_by(seconds(0)), 1);
  EXPECT_EQ(attempts_by(seconds(0)), 1);
  EXPECT_EQ(attempts_by(seconds(1)), 2);
  EXPECT_EQ(attempts_by(seconds(2)), 2);
  EXPECT_EQ(attempts_by(seconds(3)), 3);
  EXPECT_EQ(attempts_by(seconds(6)), 3);
  EXPECT_EQ(attempts_by(seconds(7)), 4);
  for (int i = 1; i <= 10; ++i) {
    now += IdentityStore::kLongestPause;
    EXPECT_EQ(attempts_by(seconds(7)), 4 + i) << "no pause is longer";
  }
  replace(top_with("two"));
  EXPECT_EQ(attempts_by(seconds(7)), 15);
  EXPECT_EQ(attempts_by(seconds(8)), 16) << "and the pauses begin anew";
}

TEST_F(Store, HasOthersFollowEachReadingBeforeItServes) {
  write(top_with("one"));
  int followed = 0;
  IdentityStore store(config(), "", {}, [&] {
    ++followed;
    return true;
  });
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  EXPECT_EQ(followed, 1);
  store.current();
  EXPECT_EQ(followed, 1);
  replace(top_with("two"));
  EXPECT_TRUE(binds(store, "two"));
  EXPECT_EQ(followed, 2);
  replace("damaged\n");
  store.current();
  EXPECT_EQ(followed, 2);
}

TEST_F(Store, TellsTheSameCauseOnceHoweverOftenItTries) {
  const auto start = IdentityStore::Clock::now();
  write(top_with("one"));
  int told = 0;
  IdentityStore store(config(), "", [&](const std::string&, const auto&) { ++told; });
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  replace("damaged\n");
  for (int hour = 0; hour < 5; ++hour) store.current(start + std::chrono::hours(hour));
  EXPECT_EQ(told, 1);
}

TEST_F(Store, NoticesThatAMissingFileCameAndWentAgain) {
  write(top_with("one"));
  int told = 0;
  IdentityStore store(config(), "", [&](const std::string&, const auto&) { ++told; });
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  std::filesystem::remove(config());
  store.current();
  store.current();
  EXPECT_EQ(told, 1);
  replace(top_with("one"));
  store.current();
  std::filesystem::remove(config());
  store.current();
  EXPECT_EQ(told, 2);
}

}  // namespace
}  // namespace orv::server
