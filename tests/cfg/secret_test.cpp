#include "cfg/secret.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>

#include "cfg/text.h"
#include "cfg_fixture.h"

namespace orv::cfg {
namespace {

class SecretTest : public cfg_test::CfgTest {
 protected:
  void SetUp() override {
    CfgTest::SetUp();
    std::string why;
    ASSERT_EQ(create_key_stash(stash_.c_str(), why), 0) << why;
    ASSERT_EQ(load_key_stash(stash_.c_str(), key_, why), 0) << why;
  }
  int load(const std::string& content, mode_t mode = 0600) {
    const std::string path = directory_.file("other.stash");
    cfg_test::write_file(path, content);
    ::chmod(path.c_str(), mode);
    KeyPtr key;
    why_.clear();
    const int rc = load_key_stash(path.c_str(), key, why_);
    EXPECT_EQ(rc == 0, key != nullptr);
    EXPECT_EQ(rc == 0, why_.empty());
    if (rc != 0) {
      EXPECT_NE(why_.find(path), std::string::npos);
    }
    return rc;
  }

  static constexpr SecretPlace kHere{"orv-slapdAdminPW", "CN=CONFIGURATION"};
  std::string stash_ = directory_.file("key.stash");
  KeyPtr key_;
  std::string why_;
};

TEST_F(SecretTest, ANewStashIsPrivateAndNeverOverwritten) {
  struct stat status {};
  ASSERT_EQ(::stat(stash_.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600U);
  EXPECT_EQ(status.st_size, 75);
  EXPECT_EQ(create_key_stash(stash_.c_str(), why_), 1);
  EXPECT_NE(why_.find(stash_), std::string::npos);
  EXPECT_EQ(create_key_stash(nullptr, why_), 1);
  KeyPtr key;
  EXPECT_EQ(load_key_stash(nullptr, key, why_), 1);
}

TEST_F(SecretTest, AStashIsRefusedUnlessWellFormedAndPrivate) {
  const std::string good = "orv-key-1 " + std::string(64, 'a');
  EXPECT_EQ(load(good + "\n"), 0);
  EXPECT_EQ(load(good), 0);
  EXPECT_EQ(load(good, 0400), 0);
  for (const mode_t mode : {0604, 0640, 0660, 0610, 0601}) EXPECT_EQ(load(good, mode), 1) << mode;
  for (const std::string& content :
       {std::string(), good.substr(1), good + "a", good + "\n\n", good + " ", good.substr(0, 73),
        "orv-key-2 " + std::string(64, 'a'), "orv-key-1 " + std::string(64, 'g')}) {
    EXPECT_EQ(load(content), 1);
    EXPECT_EQ(why_.find("aaaa"), std::string::npos);
  }
  KeyPtr key;
  EXPECT_EQ(load_key_stash(directory_.file("").c_str(), key, why_), 1);
  EXPECT_EQ(load_key_stash(directory_.file("missing").c_str(), key, why_), 1);
}

TEST_F(SecretTest, ASealedValueOpensAndVerifiesAtItsPlaceOnly) {
  for (const std::string& clear : {std::string("secret"), std::string("x"), std::string(10000, 'y'),
                                   std::string("p\xC3\xA4ss w\xC3\xB6rd")}) {
    std::string stored;
    ASSERT_EQ(seal_secret(*key_, kHere, clear, stored), 0);
    EXPECT_EQ(stored.substr(0, 8), "{AES256}");
    std::string again;
    ASSERT_EQ(seal_secret(*key_, kHere, clear, again), 0);
    EXPECT_NE(stored, again);
    std::string opened;
    EXPECT_EQ(open_secret(key_.get(), stored, opened), OpenResult::opened);
    EXPECT_EQ(opened, clear);
    EXPECT_TRUE(verify_secret(key_.get(), kHere, stored, clear));
    EXPECT_TRUE(verify_secret(key_.get(), {"ORV-SLAPDADMINPW", "CN=CONFIGURATION"}, stored, clear));
    EXPECT_FALSE(verify_secret(key_.get(), kHere, stored, clear + "x"));
    EXPECT_FALSE(
        verify_secret(key_.get(), {"orv-slapdMasterPW", "CN=CONFIGURATION"}, stored, clear));
    EXPECT_FALSE(verify_secret(key_.get(), {"orv-slapdAdminPW", "CN=OTHER"}, stored, clear));
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, clear));
  }
}

TEST_F(SecretTest, AnyDamageToASealedValueBreaksIt) {
  std::string stored;
  ASSERT_EQ(seal_secret(*key_, kHere, "secret", stored), 0);
  std::string bytes;
  std::size_t at = 0;
  ASSERT_EQ(base64_decode(stored.substr(8), bytes, at), 0);
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    std::string damaged = bytes;
    damaged[i] = static_cast<char>(damaged[i] ^ 1);
    std::string text;
    ASSERT_EQ(base64_encode(damaged, text), 0);
    std::string clear = "kept";
    EXPECT_EQ(open_secret(key_.get(), "{AES256}" + text, clear), OpenResult::broken) << i;
    EXPECT_EQ(clear, "kept");
    EXPECT_FALSE(verify_secret(key_.get(), kHere, "{AES256}" + text, "secret"));
  }
  for (std::size_t length = 8; length < stored.size(); ++length) {
    std::string clear;
    EXPECT_EQ(open_secret(key_.get(), stored.substr(0, length), clear), OpenResult::broken);
  }
}

TEST_F(SecretTest, AWrongOrMissingKeyOpensNothing) {
  std::string stored;
  ASSERT_EQ(seal_secret(*key_, kHere, "secret", stored), 0);
  const std::string path = directory_.file("second.stash");
  ASSERT_EQ(create_key_stash(path.c_str(), why_), 0);
  KeyPtr other;
  ASSERT_EQ(load_key_stash(path.c_str(), other, why_), 0);
  std::string clear;
  EXPECT_EQ(open_secret(other.get(), stored, clear), OpenResult::broken);
  EXPECT_EQ(open_secret(nullptr, stored, clear), OpenResult::broken);
  EXPECT_FALSE(verify_secret(other.get(), kHere, stored, "secret"));
}

TEST_F(SecretTest, ClearAndHashedValuesAreNotSealed) {
  std::string clear;
  for (const char* stored : {"", "secret", "{SSHA}abc", "{unknown}x", "{AES256", "{}x"}) {
    EXPECT_EQ(open_secret(key_.get(), stored, clear), OpenResult::not_sealed) << stored;
  }
}

TEST_F(SecretTest, ClearValuesVerifyAsTheyAre) {
  EXPECT_TRUE(verify_secret(nullptr, kHere, "secret", "secret"));
  EXPECT_FALSE(verify_secret(nullptr, kHere, "secret", "Secret"));
  EXPECT_FALSE(verify_secret(nullptr, kHere, "secret", "secret "));
  EXPECT_FALSE(verify_secret(nullptr, kHere, "", ""));
  EXPECT_FALSE(verify_secret(nullptr, kHere, "secret", ""));
  EXPECT_TRUE(verify_secret(nullptr, kHere, "{open", "{open"));
  EXPECT_TRUE(verify_secret(nullptr, kHere, "{}x", "{}x"));
}

TEST_F(SecretTest, UnknownSchemesNeverMatch) {
  for (const char* stored : {"{CRYPT}x", "{x}", "{MD5}abc", "{clear}secret"}) {
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, stored)) << stored;
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, "secret")) << stored;
  }
}

TEST_F(SecretTest, HashedValuesVerify) {
  std::string stored;
  ASSERT_EQ(hash_secret("secret", stored), 0);
  EXPECT_EQ(stored.substr(0, 9), "{SSHA512}");
  EXPECT_TRUE(verify_secret(nullptr, kHere, stored, "secret"));
  EXPECT_FALSE(verify_secret(nullptr, kHere, stored, "Secret"));
}

std::string digest_form(const char* scheme, const EVP_MD* type, const std::string& clear,
                        const std::string& salt) {
  unsigned char out[EVP_MAX_MD_SIZE];
  unsigned length = 0;
  const std::string text = clear + salt;
  EVP_Digest(text.data(), text.size(), out, &length, type, nullptr);
  std::string encoded;
  base64_encode(std::string(reinterpret_cast<char*>(out), length) + salt, encoded);
  return scheme + encoded;
}

TEST_F(SecretTest, SaltedDigestsOfOtherToolsVerify) {
  const std::pair<const char*, const EVP_MD*> schemes[] = {{"{SSHA}", EVP_sha1()},
                                                           {"{SSHA256}", EVP_sha256()},
                                                           {"{SSHA512}", EVP_sha512()},
                                                           {"{ssha}", EVP_sha1()}};
  for (const auto& [scheme, type] : schemes) {
    EXPECT_TRUE(
        verify_secret(nullptr, kHere, digest_form(scheme, type, "secret", "salt"), "secret"));
    EXPECT_FALSE(
        verify_secret(nullptr, kHere, digest_form(scheme, type, "secret", "salt"), "wrong"));
    EXPECT_TRUE(verify_secret(
        nullptr, kHere, digest_form(scheme, type, "secret", std::string(256, 's')), "secret"));
    EXPECT_FALSE(verify_secret(nullptr, kHere, digest_form(scheme, type, "secret", ""), "secret"));
    EXPECT_FALSE(verify_secret(
        nullptr, kHere, digest_form(scheme, type, "secret", std::string(257, 's')), "secret"));
  }
}

std::string pbkdf2_form(const char* scheme, const EVP_MD* type, int iterations,
                        std::size_t length) {
  std::string hash(length, '\0');
  PKCS5_PBKDF2_HMAC("secret", 6, reinterpret_cast<const unsigned char*>("salt"), 4, iterations,
                    type, static_cast<int>(length), reinterpret_cast<unsigned char*>(hash.data()));
  std::string text;
  base64_encode(hash, text);
  while (!text.empty() && text.back() == '=') text.pop_back();
  return scheme + std::to_string(iterations) + "$c2FsdA$" + text;
}

TEST_F(SecretTest, Pbkdf2ValuesVerify) {
  for (const std::size_t length : {16U, 20U, 32U, 64U}) {
    const std::string stored = pbkdf2_form("{PBKDF2-SHA256}", EVP_sha256(), 1000, length);
    EXPECT_TRUE(verify_secret(nullptr, kHere, stored, "secret"));
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, "wrong"));
  }
  EXPECT_TRUE(
      verify_secret(nullptr, kHere, pbkdf2_form("{PBKDF2-SHA512}", EVP_sha512(), 1, 64), "secret"));
  EXPECT_FALSE(verify_secret(nullptr, kHere, pbkdf2_form("{PBKDF2-SHA256}", EVP_sha256(), 1000, 15),
                             "secret"));
}

TEST_F(SecretTest, TextsOfCryptVerify) {
  if (!can_make_secret(SecretMethod::crypt)) GTEST_SKIP() << "the platform has none";
  std::string stored;
  ASSERT_EQ(make_secret(SecretMethod::crypt, "secret", stored), 0);
  const SecretPlace place{"orv-slapdAdminPW", "CN=A"};
  EXPECT_TRUE(verify_secret(nullptr, place, stored, "secret"));
  EXPECT_TRUE(verify_secret(nullptr, place, "{crypt}" + stored.substr(7), "secret"));
  EXPECT_FALSE(verify_secret(nullptr, place, stored, "secret "));
  EXPECT_FALSE(verify_secret(nullptr, place, stored, std::string("secret\0", 7)));
  for (const char* broken : {"{CRYPT}", "{CRYPT}*0", "{CRYPT}x", "{CRYPT}$none$x"})
    EXPECT_FALSE(verify_secret(nullptr, place, broken, "secret")) << broken;
  EXPECT_EQ(make_secret(SecretMethod::crypt, std::string(511, 'x'), stored), 0);
  EXPECT_EQ(make_secret(SecretMethod::crypt, std::string(512, 'x'), stored), 19);
}

TEST_F(SecretTest, ASealedValueIsNotMadeWithoutAKey) {
  std::string stored = "kept";
  EXPECT_EQ(make_secret(SecretMethod::sealed, "secret", stored), 53);
  EXPECT_EQ(stored, "kept");
}

TEST_F(SecretTest, MalformedValuesNeverMatch) {
  const std::string hash(22, 'A');
  for (const std::string& stored :
       {std::string("{SSHA}"), std::string("{SSHA}!!!!"), std::string("{SSHA}YWJj"),
        std::string("{AES256}"), std::string("{AES256}YWJj"), std::string("{PBKDF2-SHA256}"),
        std::string("{PBKDF2-SHA256}1"), std::string("{PBKDF2-SHA256}1$c2FsdA"),
        "{PBKDF2-SHA256}0$c2FsdA$" + hash, "{PBKDF2-SHA256}-1$c2FsdA$" + hash,
        "{PBKDF2-SHA256}10000001$c2FsdA$" + hash,
        "{PBKDF2-SHA256}99999999999999999999$c2FsdA$" + hash, "{PBKDF2-SHA256}1x$c2FsdA$" + hash,
        "{PBKDF2-SHA256}1$$" + hash, "{PBKDF2-SHA256}1$c2FsdA==$" + hash,
        std::string("{PBKDF2-SHA256}1$c2FsdA$"), "{PBKDF2-SHA256}1$c2FsdA$" + std::string(100, 'A'),
        "{PBKDF2-SHA256}1$c2FsdA$" + hash + "$x",
        "{PBKDF2-SHA256}1$" + std::string(344, 'A') + "$" + hash}) {
    EXPECT_FALSE(verify_secret(key_.get(), kHere, stored, "secret")) << stored;
    EXPECT_FALSE(verify_secret(key_.get(), kHere, stored, stored)) << stored;
  }
  verify_nothing("anything");
  verify_nothing("");
}

TEST_F(SecretTest, WipingClearsTheWholeBuffer) {
  std::string text(100, 's');
  const char* const data = text.data();
  text.resize(50);
  wipe(text);
  EXPECT_TRUE(text.empty());
  for (int i = 1; i < 100; ++i) ASSERT_EQ(data[i], '\0');
  wipe(nullptr, 0);
}

}  // namespace
}  // namespace orv::cfg
