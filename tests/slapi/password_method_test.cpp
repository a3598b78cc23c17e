// How passwords are stored: names, what the configuration forbids, staging, and opening.

#include "slapi/password_method.h"
#include "../temporary_directory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>

#include "cfg/owners.h"
#include "cfg/secret.h"
#include "configuration_file.h"
#include "messages.h"
#include "slapi/owners.h"
#include "slapi/services.h"

namespace orv {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

std::string file_with(const std::string& top, const std::string& group) {
  return "dn: CN=CONFIGURATION\nobjectClass: orv-slapdTop\ncn: Configuration\n" + top +
         "\ndn: CN=ADMINGROUP,CN=CONFIGURATION\nobjectClass: container\ncn: AdminGroup\n" + group;
}

class PasswordMethods : public testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(load(""), 0); }
  void TearDown() override { ASSERT_EQ(load(""), 0); }

  // Reads a file of these settings, in a session that has a key or none.
  int load(const std::string& top, const std::string& group = "", bool with_key = true) {
    const test::TemporaryDirectory directory;
    const std::string config = directory.write("config.ldif", file_with(top, group));
    const CfgSession session(cfg_init(nullptr, 0));
    EXPECT_EQ(cfg_set_option(session.get(), kCfgOptConfigFile, config.c_str()), 0);
    if (with_key) {
      std::string why;
      EXPECT_EQ(cfg::create_key_stash(directory.file("key.stash").c_str(), why), 0) << why;
      EXPECT_EQ(
          cfg_set_option(session.get(), kCfgOptKeyStashFile, directory.file("key.stash").c_str()),
          0);
    }
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
    return load_password_methods(session.get());
  }

  // The number, or minus the answer.
  static int convert(const char* name) {
    int method = password_method::none_converted;
    const int rc = convertPWEncryptionMethod(name, &method);
    return rc == 0 ? method : -rc;
  }

  test::MessageRecorder messages_;
};

TEST_F(PasswordMethods, AreFoundByNameIgnoringLetterCase) {
  EXPECT_EQ(convert("AES256"), password_method::aes256);
  EXPECT_EQ(convert("aes256"), password_method::aes256);
  EXPECT_EQ(convert("SSHA512"), password_method::ssha512);
  EXPECT_EQ(convert("Ssha512"), password_method::ssha512);
}

TEST_F(PasswordMethods, OfUnknownNamesLeaveTheNumberAlone) {
  for (const char* name : {"", " ", "AES", "AES256 ", " AES256", "{AES256}", "SHA", "SSHA", "MD5",
                           "SSHA5120", "AES256\n", "AES256,SSHA512", "clear"})
    EXPECT_EQ(convert(name), password_method::none_converted) << name;
  EXPECT_EQ(convert(nullptr), password_method::none_converted);
  EXPECT_EQ(convertPWEncryptionMethod("AES256", nullptr), 0);
}

TEST_F(PasswordMethods, SealedOnesAreForbiddenWithoutAKey) {
  ASSERT_EQ(load("", "", false), 0);
  EXPECT_EQ(convert("AES256"), -1);
  EXPECT_EQ(convert("SSHA512"), password_method::ssha512);
  int method = password_method::none_converted;
  EXPECT_EQ(convertPWEncryptionMethod("AES256", &method), 1);
  EXPECT_EQ(method, password_method::none_converted);
}

TEST_F(PasswordMethods, ThatAreNotOnTheListAreForbidden) {
  ASSERT_EQ(load("", "orv-slapdPwEncryptionAllowed: aes256\n"), 0);
  EXPECT_EQ(convert("AES256"), password_method::aes256);
  EXPECT_EQ(convert("SSHA512"), -1);
  EXPECT_EQ(convert("MD5"), password_method::none_converted) << "unknown, not forbidden";
  ASSERT_EQ(
      load("", "orv-slapdPwEncryptionAllowed: AES256\norv-slapdPwEncryptionAllowed: SSHA512\n"), 0);
  EXPECT_EQ(convert("SSHA512"), password_method::ssha512);
}

TEST_F(PasswordMethods, OfTheFileAreInForceForTheLibrary) {
  EXPECT_EQ(password_method_in_force(), password_method::aes256) << "the default";
  EXPECT_EQ(cfg::secret_method(), cfg::SecretMethod::sealed);
  ASSERT_EQ(load("orv-slapdPwEncryption: ssha512\n"), 0);
  EXPECT_EQ(password_method_in_force(), password_method::ssha512);
  EXPECT_EQ(cfg::secret_method(), cfg::SecretMethod::hashed);
  ASSERT_EQ(load("orv-slapdPwEncryption: AES256\n"), 0);
  EXPECT_EQ(cfg::secret_method(), cfg::SecretMethod::sealed);
  EXPECT_THAT(messages_.take(), IsEmpty());
}

TEST_F(PasswordMethods, OfAFileWithoutAKeyMayBeSealedAllTheSame) {
  ASSERT_EQ(load("orv-slapdPwEncryption: AES256\n", "", false), 0);
  EXPECT_EQ(password_method_in_force(), password_method::aes256);
  std::string stored;
  ASSERT_EQ(cfg::protect_secret(nullptr, {"orv-slapdAdminPW", "CN=A"}, "clear", stored), 0);
  EXPECT_THAT(stored, testing::StartsWith("{SSHA512}"));
}

TEST_F(PasswordMethods, OfADamagedFileAreNotPutInForce) {
  ASSERT_EQ(load("orv-slapdPwEncryption: SSHA512\n"), 0);
  const struct {
    const char* top;
    const char* group;
    int code;
    const char* reason;
  } rows[] = {
      {"orv-slapdPwEncryption: MD5\n", "", 21, "there is no method \"MD5\""},
      {"orv-slapdPwEncryption:\n", "", 21, "there is no method \"\""},
      {"", "orv-slapdPwEncryptionAllowed: AES256\norv-slapdPwEncryptionAllowed: x\n", 21,
       "there is no method \"x\""},
      {"orv-slapdPwEncryption: AES256\n", "orv-slapdPwEncryptionAllowed: SSHA512\n", 53,
       "orv-slapdPwEncryptionAllowed lacks the method in use"},
      {"", "orv-slapdPwEncryptionAllowed: SSHA512\n", 53,
       "orv-slapdPwEncryptionAllowed lacks the method in use"},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(load(row.top, row.group), row.code) << row.top << row.group;
    EXPECT_THAT(messages_.take(),
                ElementsAre("10/9 The password method in the configuration file is not put in "
                            "force: " +
                            std::string(row.reason) + ". The one before stays."));
    EXPECT_EQ(password_method_in_force(), password_method::ssha512);
    EXPECT_EQ(cfg::secret_method(), cfg::SecretMethod::hashed);
    EXPECT_EQ(convert("AES256"), password_method::aes256) << "what is allowed stays too";
  }
}

TEST_F(PasswordMethods, AreKnownByTheirNamesWhetherAllowedOrNot) {
  for (const char* const name : {"none", "AES256", "ssha512", "PBKDF2-sha256"})
    EXPECT_EQ(password_method_problem(name), "") << name;
  EXPECT_EQ(password_method_problem("crypt").empty(),
            cfg::can_make_secret(cfg::SecretMethod::crypt));
  for (const char* const name : {"", "bogus", "{SSHA512}", "SSHA512 ", "AES256,SSHA512"})
    EXPECT_THAT(password_method_problem(name),
                testing::StartsWith("is none of the methods none AES256 SSHA256 SSHA384 SSHA512 "
                                    "PBKDF2-SHA256 PBKDF2-SHA512"))
        << name;
}

TEST_F(PasswordMethods, WithoutASessionAreNotPutInForce) {
  ASSERT_EQ(load("orv-slapdPwEncryption: SSHA512\n"), 0);
  EXPECT_EQ(load_password_methods(nullptr), 1);
  EXPECT_THAT(messages_.take(), ElementsAre(HasSubstr("the configuration file cannot be read")));
  EXPECT_EQ(password_method_in_force(), password_method::ssha512);
}

TEST_F(PasswordMethods, WithoutTheGroupNothingIsForbidden) {
  test::ConfigurationFile file(
      "dn: CN=CONFIGURATION\nobjectClass: orv-slapdTop\ncn: Configuration\n"
      "orv-slapdPwEncryption: SSHA512\n");
  EXPECT_EQ(load_password_methods(file.session()), 0);
  EXPECT_EQ(password_method_in_force(), password_method::ssha512);
}

TEST_F(PasswordMethods, InClearNeedToBeOnTheList) {
  EXPECT_EQ(convert("none"), -1);
  EXPECT_EQ(load("orv-slapdPwEncryption: none\n"), 53);
  EXPECT_EQ(load("orv-slapdPwEncryption: none\n", "orv-slapdPwEncryptionAllowed: None\n"), 0);
  EXPECT_EQ(convert("NONE"), password_method::none);
  EXPECT_EQ(cfg::secret_method(), cfg::SecretMethod::clear);
  std::string stored;
  ASSERT_EQ(cfg::protect_secret(nullptr, {"orv-slapdAdminPW", "CN=A"}, "secret", stored), 0);
  EXPECT_EQ(stored, "secret");
}

TEST_F(PasswordMethods, EachMakesWhatItVerifies) {
  const struct {
    const char* name;
    int number;
    const char* scheme;
  } rows[] = {
      {"SSHA256", 2, "{SSHA256}"},
      {"SSHA384", 3, "{SSHA384}"},
      {"SSHA512", 4, "{SSHA512}"},
      {"PBKDF2-SHA256", 5, "{PBKDF2-SHA256}600000$"},
      {"PBKDF2-SHA512", 6, "{PBKDF2-SHA512}210000$"},
      {"crypt", 7, "{CRYPT}$"},
  };
  for (const auto& row : rows) {
    if (row.number == 7 && !cfg::can_make_secret(cfg::SecretMethod::crypt)) {
      EXPECT_EQ(convert(row.name), password_method::none_converted);
      continue;
    }
    EXPECT_EQ(convert(row.name), row.number);
    EXPECT_EQ(stage_password_method(row.number, nullptr), 0) << row.name;
    ASSERT_EQ(load(std::string("orv-slapdPwEncryption: ") + row.name + "\n"), 0);
    std::string stored;
    std::string again;
    const cfg::SecretPlace place{"orv-slapdAdminPW", "CN=A"};
    ASSERT_EQ(cfg::protect_secret(nullptr, place, "secret", stored), 0) << row.name;
    ASSERT_EQ(cfg::protect_secret(nullptr, place, "secret", again), 0);
    EXPECT_THAT(stored, testing::StartsWith(row.scheme));
    EXPECT_NE(stored, again) << "the salt is another one";
    EXPECT_TRUE(cfg::verify_secret(nullptr, place, stored, "secret")) << stored;
    EXPECT_FALSE(cfg::verify_secret(nullptr, place, stored, "Secret"));
    stored.back() = stored.back() == 'A' ? 'B' : 'A';
    EXPECT_FALSE(cfg::verify_secret(nullptr, place, stored.substr(0, stored.size() - 1), "secret"));
  }
}

// ---- Staging ---------------------------------------------------------------------------------

TEST_F(PasswordMethods, ThatAreStagedAreNotInForceBeforeTheFileSaysSo) {
  char* text = nullptr;
  EXPECT_EQ(stage_password_method(password_method::ssha512, &text), 0);
  EXPECT_EQ(text, nullptr);
  EXPECT_EQ(staged_password_method(), password_method::ssha512);
  EXPECT_EQ(password_method_in_force(), password_method::aes256);
  EXPECT_EQ(cfg::secret_method(), cfg::SecretMethod::sealed);
  ASSERT_EQ(load("orv-slapdPwEncryption: SSHA512\n"), 0);
  EXPECT_EQ(staged_password_method(), password_method::none_converted);
  EXPECT_EQ(password_method_in_force(), password_method::ssha512);
}

TEST_F(PasswordMethods, ThatWereStagedInVainAreForgotten) {
  ASSERT_EQ(stage_password_method(password_method::ssha512, nullptr), 0);
  ASSERT_EQ(load("orv-slapdPwEncryption: AES256\n"), 0);
  EXPECT_EQ(staged_password_method(), password_method::none_converted);
  EXPECT_EQ(password_method_in_force(), password_method::aes256);
}

TEST_F(PasswordMethods, ThatMayNotBeUsedAreNotStaged) {
  ASSERT_EQ(load("", "", false), 0);
  for (const auto& [number, reason] :
       {std::pair{16, "There is no such password method."},
        std::pair{0, "There is no such password method."},
        std::pair{password_method::aes256,
                  "The configuration does not allow this password method."}}) {
    char* text = nullptr;
    EXPECT_EQ(stage_password_method(number, &text), 53);
    const MallocText owned(text);
    EXPECT_STREQ(text, reason);
    EXPECT_EQ(stage_password_method(number, nullptr), 53);
    EXPECT_EQ(staged_password_method(), password_method::none_converted);
  }
}

// ---- Opening ---------------------------------------------------------------------------------

class StoredPasswords : public testing::Test {
 protected:
  void SetUp() override {
    std::string why;
    ASSERT_EQ(cfg::create_key_stash(directory_.file("key").c_str(), why), 0) << why;
    ASSERT_EQ(cfg::load_key_stash(directory_.file("key").c_str(), key_, why), 0) << why;
  }
  std::string seal(std::string_view clear) {
    std::string stored;
    EXPECT_EQ(cfg::seal_secret(*key_, {"orv-slapdAdminPW", "CN=CONFIGURATION"}, clear, stored), 0);
    return stored;
  }
  // "code text"; "-" for null.
  static std::string open(const std::string& stored, const void* key) {
    char* clear = const_cast<char*>("left over");
    const int rc = unformat_password(stored.c_str(), &clear, key, 0);
    const MallocText owned(clear);
    return std::to_string(rc) + " " + (clear == nullptr ? "-" : clear);
  }

  test::TemporaryDirectory directory_;
  cfg::KeyPtr key_;
};

TEST_F(StoredPasswords, ThatAreSealedOpenWithTheirKey) {
  EXPECT_EQ(open(seal("secret"), key_.get()), "1 secret");
  EXPECT_EQ(open(seal(std::string(5000, 'x')), key_.get()), "1 " + std::string(5000, 'x'));
}

TEST_F(StoredPasswords, ThatAreClearOrHashedAreNotOpened) {
  std::string hashed;
  ASSERT_EQ(cfg::hash_secret("secret", hashed), 0);
  for (const std::string& stored :
       {hashed, std::string("clear"), std::string(), std::string("{AES256"), std::string("{X}y")})
    EXPECT_EQ(open(stored, key_.get()), "0 -") << stored;
}

TEST_F(StoredPasswords, ThatAreBrokenDoNotOpen) {
  const std::string sealed = seal("secret");
  EXPECT_EQ(open(sealed, nullptr), "-1 -");
  EXPECT_EQ(open(sealed.substr(0, sealed.size() - 8), key_.get()), "-1 -");
  EXPECT_EQ(open("{AES256}", key_.get()), "-1 -");
  EXPECT_EQ(open("{AES256}@", key_.get()), "-1 -");
  std::string why;
  cfg::KeyPtr other;
  ASSERT_EQ(cfg::create_key_stash(directory_.file("other").c_str(), why), 0);
  ASSERT_EQ(cfg::load_key_stash(directory_.file("other").c_str(), other, why), 0);
  EXPECT_EQ(open(sealed, other.get()), "-1 -");
  EXPECT_EQ(open(seal(std::string_view("a\0b", 3)), key_.get()), "-1 -");
}

TEST_F(StoredPasswords, NeedBothArguments) {
  char* clear = const_cast<char*>("left over");
  EXPECT_EQ(unformat_password(nullptr, &clear, key_.get(), 0), -1);
  EXPECT_EQ(clear, nullptr);
  EXPECT_EQ(unformat_password("x", nullptr, key_.get(), 0), -1);
}

}  // namespace
}  // namespace orv
