// Suppliers of suffixes, and the failures and lockouts of administrators.

#include "slapi/administrators.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <thread>

#include "configuration_file.h"
#include "messages.h"
#include "slapi/codepage.h"
#include "slapi/services.h"

namespace orv {
namespace {

using std::chrono::seconds;
using testing::ElementsAre;
using testing::IsEmpty;

constexpr const char* kTop = "dn: CN=CONFIGURATION\nobjectClass: orv-slapdTop\ncn: Configuration\n";
constexpr const char* kRoot = "orv-slapdAdminDN: cn=root\norv-slapdAdminPW: one\n";
constexpr const char* kGroup =
    "\ndn: CN=ADMINGROUP,CN=CONFIGURATION\nobjectClass: container\ncn: AdminGroup\n";
constexpr const char* kReplication =
    "\ndn: CN=REPLICATION,CN=CONFIGURATION\nobjectClass: container\ncn: Replication\n";

std::string member(const std::string& name, const std::string& settings) {
  return "\ndn: cn=" + name +
         ",CN=ADMINGROUP,CN=CONFIGURATION\nobjectClass: orv-slapdAdminGroupMember\ncn: " + name +
         "\n" + settings;
}

std::string master_server(const std::string& settings) {
  return "\ndn: CN=MASTER SERVER,CN=CONFIGURATION\nobjectClass: orv-slapdReplication\n"
         "cn: Master Server\n" +
         settings;
}

std::string supplier(const std::string& name, const std::string& settings) {
  return "\ndn: cn=" + name +
         ",CN=REPLICATION,CN=CONFIGURATION\nobjectClass: orv-slapdSupplier\ncn: " + name + "\n" +
         settings;
}

int load(const std::string& ldif) {
  test::ConfigurationFile file(ldif);
  return load_administrators(file.session());
}

class Administrators : public testing::Test {
 protected:
  void SetUp() override {
    strict_ = getGlobalAdminPWDPolicyLocal();
    ASSERT_EQ(load(kTop), 0);
  }
  void TearDown() override {
    ASSERT_EQ(load(kTop), 0);
    ASSERT_EQ(set_admin_password_policy(strict_), 0);
  }

  static void put(const std::function<void(_Admin_pwdPolicy&)>& change) {
    _Admin_pwdPolicy policy{};
    policy.pwdLockout = 1;
    policy.pwdMaxFailure = 3;
    policy.pwdFailureCountInterval = 100;
    policy.pwdLockoutDuration = 1000;
    change(policy);
    ASSERT_EQ(set_admin_password_policy(policy), 0);
  }
  static void put() {
    put([](_Admin_pwdPolicy&) {});
  }

  bool fail(const char* dn = "cn=root") { return settle_administrator_bind(dn, false, now_); }
  bool succeed(const char* dn = "cn=root") { return settle_administrator_bind(dn, true, now_); }
  bool locked(const char* dn = "cn=root") { return is_administrator_locked_out(dn, now_); }
  void fail_times(int times) {
    for (int i = 0; i < times; ++i) EXPECT_FALSE(fail());
  }

  _Admin_pwdPolicy strict_{};
  LockoutTime now_ = LockoutTime(seconds(1000000));
  test::MessageRecorder messages_;
};

// ---- Suppliers -------------------------------------------------------------------------------

TEST_F(Administrators, TheMasterServerSuppliesTheWholeServer) {
  ASSERT_EQ(load(kTop + master_server("orv-slapdMasterDN: cn=master\n")), 0);
  EXPECT_NE(checkMasterSrvDn(nullptr, "CN=MASTER"), 0);
  EXPECT_NE(checkMasterSrvDn(nullptr, "cn = Master"), 0);
  EXPECT_EQ(checkMasterSrvDn(nullptr, "CN=OTHER"), 0);
  EXPECT_EQ(checkMasterSrvDn("O=A", "CN=MASTER"), 0) << "it is no supplier of a suffix";
}

TEST_F(Administrators, ASupplierFeedsItsOwnSuffixes) {
  ASSERT_EQ(load(std::string(kTop) + kReplication +
                 supplier("s",
                          "orv-slapdMasterDN: cn=sup\norv-slapdMasterSuffix: o=a\n"
                          "orv-slapdMasterSuffix: o=B\n") +
                 supplier("t", "orv-slapdMasterDN: cn=tap\norv-slapdMasterSuffix: o=c\n") +
                 supplier("u", "orv-slapdMasterDN: cn=none\n")),
            0);
  EXPECT_NE(checkMasterSrvDn("O=A", "CN=SUP"), 0);
  EXPECT_NE(checkMasterSrvDn("o = b", "cn=sup"), 0);
  EXPECT_NE(checkMasterSrvDn("o=c", "CN=TAP"), 0);
  EXPECT_EQ(checkMasterSrvDn("O=C", "CN=SUP"), 0) << "that of another";
  EXPECT_EQ(checkMasterSrvDn("OU=X,O=A", "CN=SUP"), 0) << "below it";
  EXPECT_EQ(checkMasterSrvDn("", "CN=SUP"), 0) << "above it";
  EXPECT_EQ(checkMasterSrvDn("O=A", "CN=NONE"), 0);
  EXPECT_EQ(checkMasterSrvDn(nullptr, "CN=SUP"), 0) << "not of the whole server";
}

TEST_F(Administrators, NobodyIsASupplierByAnotherEntry) {
  ASSERT_EQ(load(std::string(kTop) + kReplication +
                 "\ndn: cn=r,CN=REPLICATION,CN=CONFIGURATION\nobjectClass: orv-slapdReplication\n"
                 "cn: r\norv-slapdMasterDN: cn=r\norv-slapdMasterSuffix: o=a\n" +
                 master_server("objectClass: orv-slapdSupplier\norv-slapdMasterDN: cn=master\n"
                               "orv-slapdMasterSuffix: o=a\n")),
            0);
  EXPECT_EQ(checkMasterSrvDn(nullptr, "CN=R"), 0);
  EXPECT_EQ(checkMasterSrvDn("O=A", "CN=R"), 0);
  EXPECT_EQ(checkMasterSrvDn("O=A", "CN=MASTER"), 0);
  EXPECT_NE(checkMasterSrvDn(nullptr, "CN=MASTER"), 0);
}

TEST_F(Administrators, OnlyTheFirstNameOfASupplierCounts) {
  ASSERT_EQ(load(kTop + master_server("orv-slapdMasterDN: cn=one\norv-slapdMasterDN: cn=two\n")),
            0);
  EXPECT_NE(checkMasterSrvDn(nullptr, "CN=ONE"), 0);
  EXPECT_EQ(checkMasterSrvDn(nullptr, "CN=TWO"), 0);
}

TEST_F(Administrators, NobodyHasAnEmptyNameOrOneInTheConfiguration) {
  EXPECT_EQ(checkMasterSrvDn(nullptr, ""), 0) << "without a master server";
  for (const char* name : {"orv-slapdMasterDN:\n", "orv-slapdMasterDN: cn=x,cn=configuration\n",
                           "orv-slapdMasterDN: no DN\n", ""}) {
    ASSERT_EQ(load(kTop + master_server(name)), 0);
    for (const char* dn : {"", "CN=X,CN=CONFIGURATION", "no DN"})
      EXPECT_EQ(checkMasterSrvDn(nullptr, dn), 0) << name << dn;
  }
  EXPECT_EQ(checkMasterSrvDn(nullptr, nullptr), 0);
  EXPECT_EQ(checkMasterSrvDn("o=a", nullptr), 0);
  EXPECT_EQ(checkMasterSrvDn("no DN", "CN=ROOT"), 0);
}

// ---- Reading ---------------------------------------------------------------------------------

TEST_F(Administrators, OfAFileThatCannotBeReadStayAsTheyWere) {
  ASSERT_EQ(load(std::string(kTop) + kRoot + master_server("orv-slapdMasterDN: cn=master\n")), 0);
  EXPECT_EQ(load("dn: o=other\nobjectClass: organization\no: other\n"), 32);
  EXPECT_EQ(load_administrators(nullptr), 1);
  EXPECT_NE(checkMasterSrvDn(nullptr, "CN=MASTER"), 0);
  EXPECT_NE(findAdminPWDPAttrib("cn=root"), nullptr);
}

TEST_F(Administrators, EachIdentityHasARecordOfItsOwn) {
  ASSERT_EQ(load(std::string(kTop) + kRoot + kGroup + member("m", "orv-slapdAdminDN: cn=m\n") +
                 master_server("orv-slapdMasterDN: cn=master\n") + kReplication +
                 supplier("s", "orv-slapdMasterDN: cn=sup\n")),
            0);
  AdminPasswordRecord* const root = findAdminPWDPAttrib("CN=Root");
  ASSERT_NE(root, nullptr);
  EXPECT_EQ(root->changed, 0);
  EXPECT_EQ(findAdminPWDPAttrib("cn = root"), root);
  for (const char* dn : {"cn=m", "cn=master", "cn=sup"}) {
    EXPECT_NE(findAdminPWDPAttrib(dn), nullptr) << dn;
    EXPECT_NE(findAdminPWDPAttrib(dn), root) << dn;
  }
}

TEST_F(Administrators, TheContainerOfTheGroupDefinesNobody) {
  ASSERT_EQ(load(std::string(kTop) + kRoot + kGroup +
                 "objectClass: orv-slapdAdminGroupMember\norv-slapdAdminDN: cn=boss\n"),
            0);
  EXPECT_EQ(findAdminPWDPAttrib("cn=boss"), nullptr);
  EXPECT_NE(findAdminPWDPAttrib("cn=root"), nullptr);
}

TEST_F(Administrators, NobodyElseHasARecord) {
  ASSERT_EQ(load(std::string(kTop) + kRoot + kGroup), 0);
  for (const char* dn : {"cn=stranger", "", "no DN", "CN=CONFIGURATION"})
    EXPECT_EQ(findAdminPWDPAttrib(dn), nullptr) << dn;
  EXPECT_EQ(findAdminPWDPAttrib(nullptr), nullptr);
  ASSERT_EQ(load(kTop), 0);
  EXPECT_EQ(findAdminPWDPAttrib("cn=root"), nullptr) << "the file has no such identity any more";
}

TEST_F(Administrators, ARecordLivesAsLongAsTheProcess) {
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  AdminPasswordRecord* const root = findAdminPWDPAttrib("cn=root");
  ASSERT_EQ(load(kTop), 0);
  root->changed = 1;
  settle_password_changes(true);
  EXPECT_EQ(root->changed, 0);
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  EXPECT_EQ(findAdminPWDPAttrib("cn=root"), root);
}

TEST_F(Administrators, AreFoundInTheCodePageOfTheFile) {
  ASSERT_EQ(load(std::string(kTop) + "orv-slapdAdminDN:: Y249csO2b3Q=\n"), 0);  // cn=r(o diaer.)ot
  EXPECT_NE(findAdminPWDPAttrib("cn=R\xC3\x96ot"), nullptr);
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  EXPECT_NE(findAdminPWDPAttrib("cn=R\xD6ot"), nullptr);
  EXPECT_EQ(findAdminPWDPAttrib("cn=R\xC3\x96ot"), nullptr);
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
}

// ---- Lockout ---------------------------------------------------------------------------------

TEST_F(Administrators, AreLockedOutAfterTheLastAllowedFailure) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(2);
  EXPECT_FALSE(locked());
  EXPECT_THAT(messages_.take(), IsEmpty());
  fail_times(1);
  EXPECT_TRUE(locked());
  EXPECT_THAT(messages_.take(), ElementsAre("10/10 'CN=ROOT' is locked out after 3 failed binds."));
  EXPECT_FALSE(succeed()) << "with the right password too";
}

TEST_F(Administrators, AreLockedOutUnderEachSpellingOfTheirName) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  for (const char* spelling : {"CN=ROOT", "cn = root", "2.5.4.3=root"})
    EXPECT_FALSE(fail(spelling));
  EXPECT_TRUE(locked());
}

TEST_F(Administrators, ASuccessForgetsFailures) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(2);
  EXPECT_TRUE(succeed());
  fail_times(2);
  EXPECT_FALSE(locked());
}

TEST_F(Administrators, TimeForgetsFailures) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(2);
  now_ += seconds(99);
  fail_times(1);
  EXPECT_TRUE(locked()) << "within the interval";
  now_ += seconds(1000);
  fail_times(2);
  now_ += seconds(100);
  fail_times(2);
  EXPECT_FALSE(locked());
}

TEST_F(Administrators, TimeForgetsNoFailuresWithoutAnInterval) {
  put([](_Admin_pwdPolicy& p) { p.pwdFailureCountInterval = 0; });
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(2);
  now_ += seconds(1000000000);
  fail_times(1);
  EXPECT_TRUE(locked());
}

TEST_F(Administrators, ALockoutLastsForItsDuration) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(3);
  now_ += seconds(999);
  fail_times(5);
  EXPECT_FALSE(succeed());
  now_ += seconds(1);
  EXPECT_FALSE(locked()) << "failures in between do not make it longer";
  fail_times(2);
  EXPECT_TRUE(succeed()) << "counting began anew";
}

TEST_F(Administrators, ALockoutWithoutADurationLastsUntilThePasswordIsSet) {
  put([](_Admin_pwdPolicy& p) { p.pwdLockoutDuration = 0; });
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(3);
  now_ += seconds(1000000000);
  EXPECT_FALSE(succeed());
  findAdminPWDPAttrib("cn=root")->changed = 1;
  settle_password_changes(true);
  EXPECT_TRUE(succeed());
}

TEST_F(Administrators, APasswordThatWasNotWrittenEndsNoLockout) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(3);
  AdminPasswordRecord* const root = findAdminPWDPAttrib("cn=root");
  root->changed = 1;
  settle_password_changes(false);
  EXPECT_EQ(root->changed, 0);
  settle_password_changes(true);
  EXPECT_TRUE(locked());
}

TEST_F(Administrators, ANewPasswordInTheFileEndsALockout) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(3);
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  EXPECT_TRUE(locked()) << "the same password";
  ASSERT_EQ(load(std::string(kTop) + "orv-slapdAdminDN: cn=root\norv-slapdAdminPW: two\n"), 0);
  EXPECT_FALSE(locked());
}

TEST_F(Administrators, WhoWasTakenOutAndPutBackBeginsAnew) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(3);
  ASSERT_EQ(load(kTop), 0);
  EXPECT_FALSE(locked());
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  EXPECT_FALSE(locked());
}

TEST_F(Administrators, AreNotLockedOutWhileThePolicySaysSo) {
  put([](_Admin_pwdPolicy& p) { p.pwdLockout = 0; });
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(20);
  EXPECT_FALSE(locked());
  EXPECT_TRUE(succeed());
  put();
  fail_times(2);
  EXPECT_FALSE(locked()) << "what was not counted does not count later";
}

TEST_F(Administrators, ABindWithoutALockoutForgetsFailures) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(2);
  put([](_Admin_pwdPolicy& p) { p.pwdLockout = 0; });
  fail_times(1);
  put();
  fail_times(2);
  EXPECT_FALSE(locked());
}

TEST_F(Administrators, AreLetInWhenTheLockoutIsSwitchedOff) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  fail_times(3);
  put([](_Admin_pwdPolicy& p) { p.pwdLockout = 0; });
  EXPECT_FALSE(locked());
  EXPECT_TRUE(succeed());
}

TEST_F(Administrators, OneIsNotLockedOutByTheFailuresOfAnother) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot + kGroup + member("m", "orv-slapdAdminDN: cn=m\n")), 0);
  fail_times(3);
  EXPECT_TRUE(succeed("cn=m"));
  EXPECT_FALSE(locked("cn=m"));
}

TEST_F(Administrators, NamesOfNobodyAreNotCounted) {
  put();
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  for (const char* dn : {"cn=stranger", "no DN", ""}) {
    for (int i = 0; i < 20; ++i) EXPECT_FALSE(fail(dn));
    EXPECT_FALSE(locked(dn)) << dn;
    EXPECT_TRUE(succeed(dn)) << dn;
  }
  EXPECT_THAT(messages_.take(), IsEmpty());
}

TEST_F(Administrators, OfManyBindsAtOnceNoMoreFailThanAreAllowed) {
  put([](_Admin_pwdPolicy& p) { p.pwdMaxFailure = 1000; });
  ASSERT_EQ(load(std::string(kTop) + kRoot), 0);
  const auto fail_often = [this] {
    for (int i = 0; i < 500; ++i) settle_administrator_bind("cn=root", false, now_);
  };
  std::thread other(fail_often);
  fail_often();
  other.join();
  EXPECT_TRUE(locked()) << "each was counted";
}

}  // namespace
}  // namespace orv
