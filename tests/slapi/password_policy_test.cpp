// The password policy of administrators: where it comes from and which passwords it accepts.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <limits>
#include <string>
#include <thread>
#include <vector>

#include "cfg/secret.h"
#include "configuration_file.h"
#include "messages.h"
#include "slapi/admin_policy.h"
#include "slapi/schema.h"
#include "slapi/services.h"

namespace orv {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

_Admin_pwdPolicy permissive() {
  _Admin_pwdPolicy policy{};
  policy.enabled = 1;
  return policy;
}

class PasswordPolicy : public testing::Test {
 protected:
  void SetUp() override { strict_ = getGlobalAdminPWDPolicyLocal(); }
  void TearDown() override { ASSERT_EQ(set_admin_password_policy(strict_), 0); }

  static int verify(std::string password, const char* old = nullptr) {
    std::string copy(old == nullptr ? "" : old);
    Operation operation;
    operation.bound_dn = "CN=ROOT";
    return verify_admin_password(password.data(), old == nullptr ? nullptr : copy.data(),
                                 &operation);
  }
  static void put(const std::function<void(_Admin_pwdPolicy&)>& change) {
    _Admin_pwdPolicy policy = permissive();
    change(policy);
    ASSERT_EQ(set_admin_password_policy(policy), 0);
  }

  _Admin_pwdPolicy strict_{};
  test::MessageRecorder messages_;
};

// ---- In force --------------------------------------------------------------------------------

TEST_F(PasswordPolicy, IsTheStrictOneBeforeTheFileWasRead) {
  EXPECT_TRUE(pwdIsAdminPolicyOn());
  EXPECT_TRUE(pwdIsAdminPasswordLockoutOn());
  EXPECT_EQ(strict_.pwdMinLength, 12);
  EXPECT_EQ(strict_.passwordMinAlphaChars, 2);
  EXPECT_EQ(strict_.passwordMinOtherChars, 2);
  EXPECT_EQ(strict_.passwordMaxRepeatedChars, 2);
  EXPECT_EQ(strict_.passwordMinDiffChars, 3);
  EXPECT_EQ(strict_.pwdMaxFailure, 10);
  EXPECT_EQ(strict_.pwdFailureCountInterval, 900);
  EXPECT_EQ(strict_.pwdLockoutDuration, 900);
  EXPECT_EQ(validate_new_settings(strict_, true), 0);
}

TEST_F(PasswordPolicy, HasASwitchOfItsOwnForLockouts) {
  put([](_Admin_pwdPolicy& p) { p.enabled = 0; });
  EXPECT_FALSE(pwdIsAdminPolicyOn());
  EXPECT_FALSE(pwdIsAdminPasswordLockoutOn());
  put([](_Admin_pwdPolicy& p) {
    p.enabled = 0;
    p.pwdLockout = 1;
    p.pwdMaxFailure = 1;
  });
  EXPECT_FALSE(pwdIsAdminPolicyOn());
  EXPECT_TRUE(pwdIsAdminPasswordLockoutOn());
}

TEST_F(PasswordPolicy, IsReadWholeWhileItChanges) {
  std::thread writer([] {
    for (int i = 0; i < 2000; ++i)
      put([i](_Admin_pwdPolicy& p) { p.pwdMinLength = p.passwordMinAlphaChars = i % 2 * 100; });
  });
  for (int i = 0; i < 2000; ++i) {
    const _Admin_pwdPolicy seen = getGlobalAdminPWDPolicyLocal();
    ASSERT_TRUE(seen.pwdMinLength == seen.passwordMinAlphaChars || seen.pwdMinLength == 12);
  }
  writer.join();
}

// ---- Limits ----------------------------------------------------------------------------------

TEST(PolicyLimits, HaveRanges) {
  const struct {
    int _Admin_pwdPolicy::*member;
    int most;
  } rows[] = {
      {&_Admin_pwdPolicy::pwdLockoutDuration, 1000000},
      {&_Admin_pwdPolicy::pwdMaxFailure, 1000000},
      {&_Admin_pwdPolicy::pwdFailureCountInterval, 1000000},
      {&_Admin_pwdPolicy::pwdMinLength, 256},
      {&_Admin_pwdPolicy::passwordMinAlphaChars, 256},
      {&_Admin_pwdPolicy::passwordMinOtherChars, 256},
      {&_Admin_pwdPolicy::passwordMaxRepeatedChars, 256},
      {&_Admin_pwdPolicy::passwordMinDiffChars, 256},
  };
  for (const auto& row : rows) {
    for (const bool check_all : {false, true}) {
      _Admin_pwdPolicy policy{};
      policy.pwdMinLength = 256;
      EXPECT_EQ(validate_new_settings(policy, check_all), 0);
      policy.*row.member = row.most;
      EXPECT_EQ(validate_new_settings(policy, check_all), 0);
      for (const int bad :
           {row.most + 1, -1, std::numeric_limits<int>::min(), std::numeric_limits<int>::max()}) {
        policy.*row.member = bad;
        EXPECT_EQ(validate_new_settings(policy, check_all), 19) << bad;
      }
    }
  }
}

TEST(PolicyLimits, MustNotContradictOneAnother) {
  _Admin_pwdPolicy policy{};
  policy.pwdMinLength = 8;
  policy.passwordMinAlphaChars = 4;
  policy.passwordMinOtherChars = 4;
  policy.passwordMinDiffChars = 8;
  EXPECT_EQ(validate_new_settings(policy, true), 0);
  policy.passwordMinOtherChars = 5;
  EXPECT_EQ(validate_new_settings(policy, true), 19);
  EXPECT_EQ(validate_new_settings(policy, false), 0);
  policy.passwordMinOtherChars = 4;
  policy.passwordMinDiffChars = 9;
  EXPECT_EQ(validate_new_settings(policy, true), 19);
  EXPECT_EQ(validate_new_settings(policy, false), 0);
}

TEST(PolicyLimits, LetAnyDifferenceBeAskedForWithoutALength) {
  _Admin_pwdPolicy policy{};
  policy.passwordMinDiffChars = 5;
  EXPECT_EQ(validate_new_settings(policy, true), 0);
}

TEST(PolicyLimits, NeedAFailureForALockout) {
  _Admin_pwdPolicy policy{};
  policy.pwdLockout = 1;
  EXPECT_EQ(validate_new_settings(policy, true), 19);
  policy.pwdMaxFailure = 1;
  EXPECT_EQ(validate_new_settings(policy, true), 0);
}

TEST_F(PasswordPolicy, ThatIsRefusedIsNotPutInForce) {
  _Admin_pwdPolicy bad = permissive();
  bad.pwdMinLength = 257;
  EXPECT_EQ(set_admin_password_policy(bad), 19);
  EXPECT_EQ(getGlobalAdminPWDPolicyLocal().pwdMinLength, 12);
}

// ---- Passwords -------------------------------------------------------------------------------

TEST_F(PasswordPolicy, AcceptsAPasswordThatMeetsEveryLimit) {
  EXPECT_EQ(verify("correct-h0use"), 0);
  EXPECT_EQ(verify("correct-h0use", "abcdefgh-1234"), 0);
  EXPECT_THAT(messages_.take(), IsEmpty());
}

TEST_F(PasswordPolicy, RefusesNoPassword) {
  EXPECT_EQ(verify_admin_password(nullptr, nullptr, nullptr), 80);
  EXPECT_EQ(verify(""), 19);
  EXPECT_THAT(messages_.take(),
              ElementsAre("10/1 A new password from 'CN=ROOT' was refused: it is empty."));
}

TEST_F(PasswordPolicy, RefusesTheEmptyPasswordUnderAnyPolicy) {
  put([](_Admin_pwdPolicy&) {});
  EXPECT_EQ(verify(""), 19);
  EXPECT_EQ(verify("x"), 0);
}

TEST_F(PasswordPolicy, CountsCharactersAndNotBytes) {
  put([](_Admin_pwdPolicy& p) { p.pwdMinLength = 4; });
  EXPECT_EQ(verify("\xC3\xA4\xC3\xB6\xC3\xBC"), 19);
  EXPECT_EQ(verify("\xC3\xA4\xC3\xB6\xC3\xBC\xC3\x9F"), 0);
  EXPECT_EQ(verify("\xF0\x9F\x98\x80\xF0\x9F\x98\x80\xF0\x9F\x98\x80"), 19);
  EXPECT_EQ(verify("abc"), 19);
  EXPECT_EQ(verify("abcd"), 0);
  EXPECT_THAT(messages_.take(),
              testing::Each("10/2 A new password from 'CN=ROOT' was refused: it has fewer than 4 "
                            "characters."));
}

TEST_F(PasswordPolicy, CountsEachByteThatIsNotUtf8AsACharacterOfItsOwn) {
  put([](_Admin_pwdPolicy& p) {
    p.pwdMinLength = 3;
    p.passwordMinOtherChars = 3;
    p.passwordMaxRepeatedChars = 1;
  });
  for (const char* password : {"\xC3\xFF\x80", "\xE2\x82\xFE", "\xF0\x9F\x98", "\xC0\x81\xF8"})
    EXPECT_EQ(verify(password), 0);
  EXPECT_EQ(verify("\xFF\xFF\x80"), 19);
}

TEST_F(PasswordPolicy, CountsLettersOfEveryScript) {
  put([](_Admin_pwdPolicy& p) {
    p.pwdMinLength = 2;
    p.passwordMinAlphaChars = 2;
  });
  for (const char* good : {"aZ", "12ab", "\xC3\xA4\xC3\x96", "\xD0\x96\xE6\x97\xA5"})
    EXPECT_EQ(verify(good), 0) << good;
  EXPECT_THAT(messages_.take(), IsEmpty());
  for (const char* bad : {"a1", "12", "@[`{", "a\xE2\x82\xAC", "\xF0\x9F\x98\x80\xF0\x9F\x98\x81"})
    EXPECT_EQ(verify(bad), 19) << bad;
  EXPECT_THAT(messages_.take(),
              testing::Each("10/3 A new password from 'CN=ROOT' was refused: it has fewer than 2 "
                            "letters."));
}

TEST_F(PasswordPolicy, CountsWhatIsNoLetter) {
  put([](_Admin_pwdPolicy& p) {
    p.pwdMinLength = 2;
    p.passwordMinOtherChars = 2;
  });
  for (const char* good : {"12", "a1b ", "\xE2\x82\xAC-"}) EXPECT_EQ(verify(good), 0) << good;
  EXPECT_THAT(messages_.take(), IsEmpty());
  for (const char* bad : {"ab", "a1b", "\xC3\xA4\xC3\xB6"}) EXPECT_EQ(verify(bad), 19) << bad;
  EXPECT_THAT(messages_.take(),
              testing::Each("10/4 A new password from 'CN=ROOT' was refused: fewer than 2 of its "
                            "characters are no letters."));
}

TEST_F(PasswordPolicy, LimitsHowOftenACharacterOccurs) {
  put([](_Admin_pwdPolicy& p) { p.passwordMaxRepeatedChars = 2; });
  EXPECT_EQ(verify("abab"), 0);
  EXPECT_EQ(verify("aA"
                   "aA"),
            0);
  EXPECT_THAT(messages_.take(), IsEmpty());
  EXPECT_EQ(verify("ababa"), 19) << "not only in a row";
  EXPECT_EQ(verify("\xC3\xA4\xC3\xA4x\xC3\xA4"), 19);
  EXPECT_THAT(messages_.take(),
              testing::Each("10/5 A new password from 'CN=ROOT' was refused: one character occurs "
                            "more than 2 times."));
  put([](_Admin_pwdPolicy& p) { p.passwordMaxRepeatedChars = 0; });
  EXPECT_EQ(verify("aaaaaaaa"), 0);
}

TEST_F(PasswordPolicy, AsksForCharactersThatTheOldPasswordDoesNotHave) {
  put([](_Admin_pwdPolicy& p) { p.passwordMinDiffChars = 2; });
  EXPECT_EQ(verify("abcxy", "abc"), 0);
  EXPECT_EQ(verify("xy", "abc"), 0);
  EXPECT_EQ(verify("abc\xC3\xA4\xC3\xB6", "abc\xC3\xBC"), 0);
  EXPECT_EQ(verify("aaa"), 0) << "no old password";
  EXPECT_EQ(verify("xy", ""), 0) << "an empty old password";
  EXPECT_THAT(messages_.take(), IsEmpty());
  EXPECT_EQ(verify("abc", "abc"), 19);
  EXPECT_EQ(verify("cbax", "abc"), 19);
  EXPECT_EQ(verify("abcde", "edcba"), 19) << "in any order";
  EXPECT_EQ(verify("xxxx", "abc"), 19) << "different characters count";
  EXPECT_THAT(messages_.take(),
              testing::Each("10/6 A new password from 'CN=ROOT' was refused: fewer than 2 "
                            "different characters are new."));
  put([](_Admin_pwdPolicy& p) { p.passwordMinDiffChars = 0; });
  EXPECT_EQ(verify("abc", "abc"), 0);
}

TEST_F(PasswordPolicy, TellsOfAHashedOldPasswordOnlyWhetherItIsTheSame) {
  std::string hash;
  ASSERT_EQ(cfg::hash_secret("correct-h0use", hash), 0);
  EXPECT_EQ(verify("correct-h0use", hash.c_str()), 19);
  EXPECT_THAT(messages_.take(),
              ElementsAre("10/7 A new password from 'CN=ROOT' was refused: it is the old one."));
  EXPECT_EQ(verify("correct-h0usf", hash.c_str()), 0);
  EXPECT_EQ(verify("correct-h0use", "{AES256}cannot be opened"), 0);
}

TEST_F(PasswordPolicy, ThatAsksForNoDifferenceAcceptsTheSamePasswordHashedOrNot) {
  put([](_Admin_pwdPolicy&) {});
  std::string hash;
  ASSERT_EQ(cfg::hash_secret("correct-h0use", hash), 0);
  EXPECT_EQ(verify("correct-h0use", hash.c_str()), 0);
  EXPECT_EQ(verify("correct-h0use", "correct-h0use"), 0);
}

TEST_F(PasswordPolicy, RefusesAnOldPasswordThatOnlyLooksHashed) {
  EXPECT_EQ(verify("{x}correct-h0s", "{x}correct-h0s"), 19);
}

TEST_F(PasswordPolicy, SaysWhyWithoutThePassword) {
  EXPECT_EQ(verify("sesame", "open"), 19);
  EXPECT_THAT(messages_.take(), ElementsAre(testing::Not(HasSubstr("sesame"))));
}

TEST_F(PasswordPolicy, TakesACallerWithoutAName) {
  char password[] = "short";
  Operation operation;
  operation.bound_dn = nullptr;
  EXPECT_EQ(verify_admin_password(password, nullptr, nullptr), 19);
  EXPECT_EQ(verify_admin_password(password, nullptr, &operation), 19);
  EXPECT_THAT(messages_.take(), testing::Each(HasSubstr("from ''")));
}

TEST_F(PasswordPolicy, KeepsNeitherPassword) {
  char password[] = "correct-h0use";
  char old[] = "other";
  EXPECT_EQ(verify_admin_password(password, old, nullptr), 0);
  EXPECT_STREQ(password, "correct-h0use");
  EXPECT_STREQ(old, "other");
}

// ---- The entry in the file -------------------------------------------------------------------

class PolicyFile : public PasswordPolicy {
 protected:
  static int load(const std::string& settings) {
    test::ConfigurationFile file(
        "dn: CN=CONFIGURATION\nobjectClass: top\nobjectClass: orv-slapdTop\ncn: Configuration\n\n"
        "dn: cn=PwdPolicy Admin,CN=CONFIGURATION\nobjectClass: orv-slapdAdminPolicy\n"
        "cn: PwdPolicy Admin\n" +
        settings);
    return load_admin_password_policy(file.session());
  }
};

TEST_F(PolicyFile, IsPutInForce) {
  EXPECT_EQ(load("orv-slapdAdminPolicyEnabled: FALSE\npwdLockout: FALSE\npwdLockoutDuration: 1\n"
                 "pwdMaxFailure: 2\npwdFailureCountInterval: 3\npwdMinLength: 20\n"
                 "passwordMinAlphaChars: 5\npasswordMinOtherChars: 6\npasswordMaxRepeatedChars: 7\n"
                 "passwordMinDiffChars: 8\n"),
            0);
  const _Admin_pwdPolicy policy = getGlobalAdminPWDPolicyLocal();
  EXPECT_EQ(policy.enabled, 0);
  EXPECT_EQ(policy.pwdLockout, 0);
  EXPECT_EQ(policy.pwdLockoutDuration, 1);
  EXPECT_EQ(policy.pwdMaxFailure, 2);
  EXPECT_EQ(policy.pwdFailureCountInterval, 3);
  EXPECT_EQ(policy.pwdMinLength, 20);
  EXPECT_EQ(policy.passwordMinAlphaChars, 5);
  EXPECT_EQ(policy.passwordMinOtherChars, 6);
  EXPECT_EQ(policy.passwordMaxRepeatedChars, 7);
  EXPECT_EQ(policy.passwordMinDiffChars, 8);
  EXPECT_THAT(messages_.take(), IsEmpty());
}

TEST_F(PolicyFile, HasTheStrictValueForWhatItLacks) {
  ASSERT_EQ(load("pwdMinLength: 30\npasswordMinDiffChars: 30\n"), 0);
  ASSERT_EQ(load("pwdMinLength: 20\n"), 0);
  const _Admin_pwdPolicy policy = getGlobalAdminPWDPolicyLocal();
  EXPECT_EQ(policy.pwdMinLength, 20);
  EXPECT_EQ(policy.passwordMinDiffChars, 3) << "not that of the policy before";
  EXPECT_EQ(policy.enabled, 1);
}

TEST_F(PolicyFile, ThatIsDamagedLeavesThePolicyBeforeInForce) {
  ASSERT_EQ(load("pwdMinLength: 30\n"), 0);
  const struct {
    const char* settings;
    int code;
    const char* reason;
  } rows[] = {
      {"pwdMinLength: ten\n", 21, "the value of pwdMinLength cannot be read"},
      {"pwdMinLength: 10 \n", 21, "the value of pwdMinLength cannot be read"},
      {"pwdMinLength:\n", 21, "the value of pwdMinLength cannot be read"},
      {"pwdMinLength: 99999999999\n", 21, "the value of pwdMinLength cannot be read"},
      {"pwdLockout: yes\n", 21, "the value of pwdLockout cannot be read"},
      {"orv-slapdAdminPolicyEnabled: false\n", 21,
       "the value of orv-slapdAdminPolicyEnabled cannot be read"},
      {"pwdMinLength: 257\n", 19, "a number is out of range"},
      {"pwdMaxFailure: -1\n", 19, "a number is out of range"},
      {"pwdMinLength: 3\n", 19,
       "passwordMinAlphaChars and passwordMinOtherChars together exceed pwdMinLength"},
      {"pwdMinLength: 12\npasswordMinDiffChars: 13\n", 19,
       "passwordMinDiffChars exceeds pwdMinLength"},
      {"pwdMaxFailure: 0\n", 19, "pwdLockout is TRUE and pwdMaxFailure is 0"},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(load(row.settings), row.code) << row.settings;
    EXPECT_THAT(messages_.take(),
                ElementsAre("10/8 The password policy in the configuration file is not put in "
                            "force: " +
                            std::string(row.reason) + ". The one before stays."));
    EXPECT_EQ(getGlobalAdminPWDPolicyLocal().pwdMinLength, 30);
  }
}

TEST(PolicyEntry, IsExaminedWithoutBeingPutInForce) {
  const struct {
    AdminPolicySettings settings;
    const char* problem;
  } rows[] = {
      {{}, ""},
      {{{"orv-slapdAdminPolicyEnabled", "FALSE"}, {"pwdMinLength", "4"}}, ""},
      {{{"description", "x"}}, ""},
      {{{"pwdMinLength", "ten"}}, "the value of pwdMinLength cannot be read"},
      {{{"pwdMinLength", "10 "}}, "the value of pwdMinLength cannot be read"},
      {{{"pwdLockout", "yes"}}, "the value of pwdLockout cannot be read"},
      {{{"pwdMinLength", "257"}}, "a number is out of range"},
      {{{"pwdMinLength", "3"}},
       "passwordMinAlphaChars and passwordMinOtherChars together exceed pwdMinLength"},
      {{{"passwordMinDiffChars", "13"}}, "passwordMinDiffChars exceeds pwdMinLength"},
      {{{"pwdMaxFailure", "0"}}, "pwdLockout is TRUE and pwdMaxFailure is 0"},
      {{{"pwdMaxFailure", "0"}, {"pwdLockout", "FALSE"}}, ""},
  };
  for (const auto& row : rows) EXPECT_EQ(admin_policy_problem(row.settings), row.problem);
  EXPECT_EQ(getGlobalAdminPWDPolicyLocal().pwdMinLength, 12);
}

TEST(PolicyEntry, HasTheSettingsOfItsClass) {
  const ObjectClass* const policy = builtin_schema().object_class("orv-slapdAdminPolicy");
  ASSERT_NE(policy, nullptr);
  for (const std::string_view type : admin_policy_types())
    EXPECT_THAT(policy->may, testing::Contains(type)) << type;
  EXPECT_EQ(admin_policy_types().size(), 10U);
}

TEST_F(PolicyFile, WithoutTheEntryLeavesThePolicyBeforeInForce) {
  ASSERT_EQ(load("pwdMinLength: 30\n"), 0);
  test::ConfigurationFile file("dn: CN=CONFIGURATION\nobjectClass: top\ncn: Configuration\n");
  EXPECT_EQ(load_admin_password_policy(file.session()), 32);
  EXPECT_THAT(messages_.take(), ElementsAre(HasSubstr("there is no such entry")));
  EXPECT_EQ(getGlobalAdminPWDPolicyLocal().pwdMinLength, 30);
}

TEST_F(PolicyFile, WithoutASessionLeavesThePolicyBeforeInForce) {
  EXPECT_EQ(load_admin_password_policy(nullptr), 1);
  EXPECT_THAT(messages_.take(), ElementsAre(HasSubstr("the entry cannot be read")));
  EXPECT_EQ(getGlobalAdminPWDPolicyLocal().pwdMinLength, 12);
}

}  // namespace
}  // namespace orv
