// The further names of identities: of users, for SASL mechanisms with passwords, and of Kerberos.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "auth_identities_fixture.h"
#include "slapi/codepage.h"
#include "slapi/connection.h"

namespace orv::server {
namespace {

using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

std::string digest(const std::string& values) {
  return "\ndn: cn=digest,cn=configuration\nobjectClass: orv-slapdDigest\ncn: digest\n" + values;
}

std::string kerberos(const std::string& name) {
  return "\ndn: cn=Kerberos,cn=configuration\nobjectClass: orv-slapdKerberos\ncn: Kerberos\n"
         "orv-slapdKrbAdminDN: " +
         name + "\n";
}

std::string named_member(const std::string& name, const std::string& more,
                         const std::string& password = "alicepw") {
  return member(name, "cn=" + name, password, kAuditRole + more);
}

std::string user(const std::string& name) {
  return "orv-slapdDigestAdminUser: " + name + "\n";
}

std::string principal(const std::string& name) {
  return "orv-slapdKrbAdminDN: " + name + "\n";
}

class NamesOfAFile : public IdentitiesOfAFile {
 protected:
  void TearDown() override {
    set_local_code_page("UTF-8");
    initIconvHandle();
  }

  std::shared_ptr<const Identities> read(const std::string& text) {
    auto identities = IdentitiesOfAFile::read(text);
    EXPECT_TRUE(identities) << error_;
    return identities;
  }

  // The entry of whoever binds by that name, and the password; "" for nobody.
  std::string found(const Identities& identities, const std::string& name) {
    password_.clear();
    unreadable_.clear();
    const auto identity = identities.of_user(name, password_, unreadable_);
    return identity ? identity->entry_dn : "";
  }

  std::string password_;
  std::string unreadable_;
};

// ---- user names

TEST_F(NamesOfAFile, UserNamesOfThePrimaryAdministratorAndOfMembersBind) {
  const auto identities =
      read(kTop + digest(user("boss")) + kGroup + named_member("alice", user("alice@work")));
  EXPECT_EQ(found(*identities, "boss"), "CN=CONFIGURATION");
  EXPECT_EQ(password_, "rootpw");
  EXPECT_EQ(found(*identities, "alice@work"), "CN=ALICE,CN=ADMINGROUP,CN=CONFIGURATION");
  EXPECT_EQ(password_, "alicepw");
  EXPECT_TRUE(identities->has_users());
  EXPECT_FALSE(identities->has_principals());
  EXPECT_THAT(warnings_, IsEmpty());
}

TEST_F(NamesOfAFile, UserNamesAreComparedByteForByte) {
  const auto identities = read(kTop + digest(user("boss")));
  for (const char* const name : {"", "Boss", "boss ", " boss", "bos", "cn=root", "root"}) {
    EXPECT_EQ(found(*identities, name), "") << name;
    EXPECT_EQ(password_, "");
    EXPECT_EQ(unreadable_, "");
  }
}

TEST_F(NamesOfAFile, OnlyTheFirstUserNameCounts) {
  const auto identities = read(kTop + digest(user("boss") + user("second")));
  EXPECT_EQ(found(*identities, "boss"), "CN=CONFIGURATION");
  EXPECT_EQ(found(*identities, "second"), "");
  EXPECT_THAT(warnings_, Contains(HasSubstr("only the first value")));
}

TEST_F(NamesOfAFile, UserNamesElsewhereAreNobodys) {
  const auto identities = read(
      kTop + digest(user("boss")) +
      "\ndn: cn=x,cn=configuration\nobjectClass: orv-slapdAdminGroupMember\ncn: x\n"
      "orv-slapdAdminDN: cn=x\norv-slapdAdminPW: xpw\n" +
      user("x") + "\ndn: cn=y,cn=configuration\nobjectClass: orv-slapdDigest\ncn: y\n" + user("y"));
  EXPECT_EQ(found(*identities, "x"), "");
  EXPECT_EQ(found(*identities, "y"), "");
}

TEST_F(NamesOfAFile, UserNameThatTwoClaimBindsAsNeither) {
  const auto identities =
      read(kTop + digest(user("same")) + kGroup + named_member("alice", user("same")));
  EXPECT_EQ(found(*identities, "same"), "");
  EXPECT_FALSE(identities->has_users());
  EXPECT_THAT(warnings_, Contains(HasSubstr("has the same orv-slapdDigestAdminUser")));
}

TEST_F(NamesOfAFile, MembersOfAGroupThatIsSwitchedOffBindByNoName) {
  const auto identities =
      read(kTop + "orv-slapdAdminGroupEnabled: FALSE\n" + kGroup +
           named_member("alice", user("alice") + principal("orv-kn=alice@EXAMPLE.COM")));
  EXPECT_EQ(found(*identities, "alice"), "");
  EXPECT_EQ(unreadable_, "");
  EXPECT_EQ(identities->of_principal("alice@EXAMPLE.COM"), nullptr);
  EXPECT_FALSE(identities->has_users());
  EXPECT_FALSE(identities->has_principals());
}

TEST_F(NamesOfAFile, PasswordsThatCannotBeReadBackServeNobody) {
  std::string hashed;
  ASSERT_EQ(cfg::hash_secret("alicepw", hashed), 0);
  for (const std::string& stored :
       {hashed, std::string("*"), std::string("{AES256}AAAA"), std::string("{NONE}alicepw"),
        std::string("{CRYPT}$6$x$y"), std::string("{SSHA}"), "{NO}" + std::string(512, 'x')}) {
    const auto identities = read(kTop + kGroup + named_member("alice", user("alice"), stored));
    EXPECT_EQ(found(*identities, "alice"), "") << stored;
    EXPECT_EQ(unreadable_, "CN=ALICE,CN=ADMINGROUP,CN=CONFIGURATION");
    EXPECT_EQ(password_, "");
    EXPECT_FALSE(identities->has_users());
  }
}

TEST_F(NamesOfAFile, IdentityWithoutPasswordHasNoUserName) {
  const auto identities = read(kTopWithoutPassword + digest(user("boss")));
  EXPECT_EQ(found(*identities, "boss"), "");
  EXPECT_FALSE(identities->has_users());
}

TEST_F(NamesOfAFile, SealedPasswordsAreOpenedWhereTheyBelong) {
  const cfg::KeyPtr key = make_key();
  ASSERT_TRUE(key);
  const std::string stored = sealed(*key, "orv-slapdAdminPW", "CN=CONFIGURATION", "sealed pw");
  const auto identities = read(top_with(stored) + digest(user("boss")) + kGroup +
                               named_member("alice", user("alice"), stored));
  EXPECT_EQ(found(*identities, "boss"), "CN=CONFIGURATION");
  EXPECT_EQ(password_, "sealed pw");
  // Copied from another entry.
  EXPECT_EQ(found(*identities, "alice"), "");
  EXPECT_EQ(password_, "");
}

TEST_F(NamesOfAFile, NamesAndPasswordsOfAnotherCodePageAreHandedOverInUtf8) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  const auto identities = read(kTopWithoutPassword + "orv-slapdAdminPW:: Z3L832U=\n" +
                               digest("orv-slapdDigestAdminUser:: avZyZw==\n"));
  EXPECT_EQ(found(*identities, "j\u00f6rg"), "CN=CONFIGURATION");
  EXPECT_EQ(password_, "gr\u00fc\u00dfe");
}

TEST_F(NamesOfAFile, WhoWasProvedByAUserNameIsNoLongerWhenItIsGone) {
  const auto before = read(kTop + digest(user("boss")));
  const auto bound = before->of_user("boss", password_, unreadable_);
  ASSERT_TRUE(bound);
  EXPECT_TRUE(before->still_valid(*bound));
  EXPECT_FALSE(read(kTop + digest(user("other")))->still_valid(*bound));
  EXPECT_FALSE(read(kTop)->still_valid(*bound));
  EXPECT_FALSE(read(top_with("newpw") + digest(user("boss")))->still_valid(*bound));
  EXPECT_TRUE(read(kTop + digest(user("boss")) + kGroup)->still_valid(*bound));
}

// ---- Kerberos

TEST_F(NamesOfAFile, PrincipalsAreFoundInAnyLetterCaseAndWithEitherPrefix) {
  for (const std::string name :
       {"orv-kn=admin@EXAMPLE.COM", "orv-kerberosName=Admin@example.com",
        "ORV-KN=ADMIN@EXAMPLE.com", "orv-KerberosName = admin@EXAMPLE.COM"}) {
    const auto identities = read(kTop + kerberos(name));
    for (const char* const spelled : {"admin@EXAMPLE.COM", "ADMIN@example.com"}) {
      const auto identity = identities->of_principal(spelled);
      ASSERT_TRUE(identity) << name;
      EXPECT_EQ(identity->entry_dn, "CN=CONFIGURATION");
      EXPECT_EQ(identity->authority, authority::primary_administrator);
    }
    EXPECT_TRUE(identities->has_principals());
    EXPECT_FALSE(identities->has_users());
    EXPECT_THAT(warnings_, IsEmpty());
  }
}

TEST_F(NamesOfAFile, PrincipalsAreComparedWhole) {
  const auto identities = read(kTop + kerberos("orv-kn=admin@EXAMPLE.COM"));
  for (const char* const other :
       {"", "admin", "admin@", "@EXAMPLE.COM", "admin@EXAMPLE.CO", "admin@EXAMPLE.COM ",
        "admin/x@EXAMPLE.COM", "admin@OTHER.COM", "orv-kn=admin@EXAMPLE.COM"})
    EXPECT_EQ(identities->of_principal(other), nullptr) << other;
}

TEST_F(NamesOfAFile, PrincipalThatTwoClaimBindsAsNeither) {
  const auto identities =
      read(kTop + kerberos("orv-kn=same@EXAMPLE.COM") + kGroup +
           named_member("alice", principal("orv-kerberosName=SAME@example.com")));
  EXPECT_EQ(identities->of_principal("same@EXAMPLE.COM"), nullptr);
  EXPECT_FALSE(identities->has_principals());
  EXPECT_THAT(warnings_, Contains(HasSubstr("has the same orv-slapdKrbAdminDN")));
}

TEST_F(NamesOfAFile, WhatIsNoPrincipalIsNobodysAndTold) {
  for (const char* const name : {"cn=admin@EXAMPLE.COM", "admin@EXAMPLE.COM", "orv-kn", "=x"}) {
    const auto identities = read(kTop + kerberos(name));
    EXPECT_EQ(identities->of_principal("admin@EXAMPLE.COM"), nullptr);
    EXPECT_FALSE(identities->has_principals());
    EXPECT_THAT(warnings_, Contains(HasSubstr("is not orv-kerberosName= or orv-kn="))) << name;
  }
}

TEST_F(NamesOfAFile, KerberosNeedsNoPasswordAndGivesTheRoles) {
  const auto identities =
      read(kTop + kGroup +
           "\ndn: cn=bob,cn=AdminGroup,cn=configuration\nobjectClass: orv-slapdAdminGroupMember\n"
           "cn: bob\norv-slapdAdminDN: cn=bob\norv-slapdAdminRole: AuditAdmin\n" +
           principal("orv-kn=bob/admin@EXAMPLE.COM"));
  const auto bob = identities->of_principal("bob/admin@EXAMPLE.COM");
  ASSERT_TRUE(bob);
  EXPECT_EQ(bob->authority, authority::admin_group_member);
  EXPECT_EQ(bob->roles, role::audit);
  EXPECT_TRUE(identities->still_valid(*bob));
  EXPECT_FALSE(read(kTop + kGroup + named_member("bob", ""))->still_valid(*bob));
}

}  // namespace
}  // namespace orv::server
