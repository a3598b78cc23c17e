#include "cfg/secret.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <atomic>
#include <csignal>
#include <cstring>
#include <ctime>
#include <thread>

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

TEST_F(SecretTest, AStashThatCannotBeWrittenIsTakenAway) {
  const std::string path = directory_.file("full.stash");
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &before), 0);
  const auto handler = ::signal(SIGXFSZ, SIG_IGN);
  const rlimit none{0, before.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &none), 0);
  const int rc = create_key_stash(path.c_str(), why_);
  ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &before), 0);
  ::signal(SIGXFSZ, handler);
  EXPECT_EQ(rc, 1);
  EXPECT_NE(why_.find("cannot be written"), std::string::npos);
  EXPECT_NE(::access(path.c_str(), F_OK), 0);
}

TEST_F(SecretTest, AStashThatCannotBeReadIsRefused) {
  KeyPtr key;
  EXPECT_EQ(load_key_stash("/proc/self/mem", key, why_), 1);
  EXPECT_NE(why_.find("cannot be read"), std::string::npos) << why_;
}

TEST_F(SecretTest, WhatBeginsWithANameInBracesNamesAScheme) {
  for (const char* value : {"{a}", "{A1}x", "{a-b}x", "{a_b}", "{a.b}", "{a/b}", "{a+b}}", "{0}"}) {
    EXPECT_TRUE(names_scheme(value)) << value;
  }
  for (const char* value :
       {"", "{", "{}", "{a", "a{b}", " {a}", "{a b}", "{a{b}", "{\xC3\xA4}", "{a:}"}) {
    EXPECT_FALSE(names_scheme(value)) << value;
    if (*value != '\0') {
      EXPECT_TRUE(verify_secret(nullptr, kHere, value, value));
    }
  }
}

TEST_F(SecretTest, EveryMethodMakesWhatVerifies) {
  for (const auto& [method, scheme] : {std::pair{SecretMethod::ssha256, "{SSHA256}"},
                                       {SecretMethod::ssha384, "{SSHA384}"},
                                       {SecretMethod::ssha512, "{SSHA512}"},
                                       {SecretMethod::pbkdf2_sha256, "{PBKDF2-SHA256}600000$"},
                                       {SecretMethod::pbkdf2_sha512, "{PBKDF2-SHA512}210000$"}}) {
    std::string stored;
    ASSERT_EQ(make_secret(method, "secret", stored), 0);
    EXPECT_EQ(stored.substr(0, std::strlen(scheme)), scheme);
    EXPECT_TRUE(verify_secret(nullptr, kHere, stored, "secret"));
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, "secre"));
    std::string again;
    if (method > SecretMethod::ssha512) continue;
    ASSERT_EQ(make_secret(method, "secret", again), 0);
    EXPECT_NE(stored, again);
  }
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
  EXPECT_FALSE(verify_secret(nullptr, kHere, "*", "*"));
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

std::string unpadded(const std::string& bytes) {
  std::string text;
  EXPECT_EQ(base64_encode(bytes, text), 0);
  while (!text.empty() && text.back() == '=') text.pop_back();
  return text;
}

std::string pbkdf2_form(const char* scheme, const EVP_MD* type, int iterations, std::size_t length,
                        const std::string& salt = "salt") {
  std::string hash(length, '\0');
  PKCS5_PBKDF2_HMAC("secret", 6, reinterpret_cast<const unsigned char*>(salt.data()),
                    static_cast<int>(salt.size()), iterations, type, static_cast<int>(length),
                    reinterpret_cast<unsigned char*>(hash.data()));
  return scheme + std::to_string(iterations) + "$" + unpadded(salt) + "$" + unpadded(hash);
}

TEST_F(SecretTest, Pbkdf2ValuesVerify) {
  const std::string whole = pbkdf2_form("{PBKDF2-SHA256}", EVP_sha256(), 1000, 32);
  EXPECT_TRUE(verify_secret(nullptr, kHere, whole, "secret"));
  EXPECT_FALSE(verify_secret(nullptr, kHere, whole, "wrong"));
  for (const std::size_t length : {1U, 15U, 16U, 31U, 33U, 64U}) {
    const std::string stored = pbkdf2_form("{PBKDF2-SHA256}", EVP_sha256(), 1000, length);
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, "secret")) << length;
  }
  EXPECT_TRUE(
      verify_secret(nullptr, kHere, pbkdf2_form("{PBKDF2-SHA512}", EVP_sha512(), 1, 64), "secret"));
  // Forms that would match if they were not looked at closely.
  const auto altered = [](const char* from, const char* to, int iterations) {
    std::string stored = pbkdf2_form("{PBKDF2-SHA256}", EVP_sha256(), iterations, 32);
    return stored.replace(stored.find(from), std::strlen(from), to);
  };
  EXPECT_TRUE(verify_secret(nullptr, kHere, altered("1000", "1000", 1000), "secret"));
  for (const std::size_t length : {0U, 1U, 256U, 257U}) {
    const std::string stored =
        pbkdf2_form("{PBKDF2-SHA256}", EVP_sha256(), 10, 32, std::string(length, 's'));
    EXPECT_EQ(verify_secret(nullptr, kHere, stored, "secret"), length >= 1 && length <= 256);
  }
  EXPECT_FALSE(verify_secret(nullptr, kHere, altered("82$", "1x$", 82), "secret"));
  EXPECT_FALSE(verify_secret(nullptr, kHere, altered("c2FsdA", "c2FsdA==", 1000), "secret"));
  std::string zero = pbkdf2_form("{PBKDF2-SHA256}", EVP_sha256(), 1000, 32);
  EXPECT_FALSE(verify_secret(nullptr, kHere, zero.insert(15, 1, '0'), "secret"));
}

TEST_F(SecretTest, TextsOfCryptVerify) {
  if (!can_make_secret(SecretMethod::crypt)) GTEST_SKIP() << "the platform has none";
  std::string stored;
  ASSERT_EQ(make_secret(SecretMethod::crypt, "secret", stored), 0);
  const SecretPlace place{"orv-slapdAdminPW", "CN=A"};
  EXPECT_TRUE(verify_secret(nullptr, place, stored, "secret"));
  EXPECT_TRUE(verify_secret(nullptr, place, "{crypt}" + stored.substr(7), "secret"));
  EXPECT_FALSE(verify_secret(nullptr, place, stored, "secret "));
  EXPECT_FALSE(verify_secret(nullptr, place, stored + "x", "secret"));
  EXPECT_FALSE(verify_secret(nullptr, place, stored.substr(0, stored.size() - 1), "secret"));
  EXPECT_FALSE(verify_secret(nullptr, place, stored, std::string("secret\0", 7)));
  for (const char* broken : {"{CRYPT}", "{CRYPT}*0", "{CRYPT}x", "{CRYPT}$none$x"})
    EXPECT_FALSE(verify_secret(nullptr, place, broken, "secret")) << broken;
  EXPECT_EQ(make_secret(SecretMethod::crypt, std::string(511, 'x'), stored), 0);
  EXPECT_EQ(make_secret(SecretMethod::crypt, std::string(512, 'x'), stored), 19);
}

TEST_F(SecretTest, TheCostOfAVerificationIsKnownBeforehand) {
  for (const char* cheap :
       {"", "secret", "*", "{SSHA512}x", "{AES256}x", "{unknown}x", "{PBKDF2-SHA256}x",
        "{PBKDF2-SHA256}99999999$a$b", "{CRYPT}", "{CRYPT}*0", "{CRYPT}$2b$31$x",
        "{CRYPT}$6$rounds=99999999$x", "{CRYPT}$none$x", "{CRYPT}short", "{CRYPT}$2b$ab$x",
        "{CRYPT}$y$", "{CRYPT}$y$j9z$x", "{CRYPT}$7$", "{CRYPT}$7$zU..../....x"}) {
    EXPECT_EQ(verification_cost(cheap), 0U) << cheap;
  }
  EXPECT_EQ(verification_cost("{pbkdf2-sha512}210000$a$b"), 210000U);
  if (!can_make_secret(SecretMethod::crypt)) return;
  EXPECT_EQ(verification_cost("{CRYPT}$6$salt$x"), 5000U);
  EXPECT_EQ(verification_cost("{CRYPT}$5$rounds=70000$salt$x"), 70000U);
  EXPECT_EQ(verification_cost("{CRYPT}$sha1$40000$salt$x"), 40000U);
  EXPECT_GT(verification_cost("{CRYPT}$2b$12$x"), verification_cost("{CRYPT}$2b$11$x"));
  EXPECT_GT(verification_cost("{CRYPT}$y$jBT$x"), verification_cost("{CRYPT}$y$jAT$x"));
  for (const char* known : {"{CRYPT}abRy4/6THFs9U", "{CRYPT}_J9..rasmBYk8r9AiWNc", "{CRYPT}$1$x$y",
                            "{CRYPT}$md5,rounds=100$x", "{CRYPT}$7$CU..../....x"}) {
    EXPECT_GT(verification_cost(known), 0U) << known;
  }
}

// A setting that would keep a core busy for hours is nobody's password.
TEST_F(SecretTest, TextsOfCryptWithAbsurdCostsNeverMatch) {
  const std::string hash(22, 'a');
  for (const std::string& stored :
       {std::string("{CRYPT}$5$rounds=10000001$salt$") + hash,
        "{CRYPT}$6$rounds=999999999$salt$" + hash, "{CRYPT}$6$rounds=1000x$salt$" + hash,
        "{CRYPT}$6$rounds=$salt$" + hash, "{CRYPT}$2b$31$abcdefghijklmnopqrstuu" + hash,
        "{CRYPT}$2y$17$abcdefghijklmnopqrstuu" + hash,
        "{CRYPT}$2b$1$abcdefghijklmnopqrstuuu" + hash, "{CRYPT}$y$jzT$salt$" + hash,
        "{CRYPT}$y$j9z$salt$" + hash, "{CRYPT}$y$j9T/.$salt$" + hash, "{CRYPT}$gy$jzT$salt$" + hash,
        "{CRYPT}$7$zzzzzzzzzzz$" + hash, "{CRYPT}$md5,rounds=4294967295$salt$" + hash,
        "{CRYPT}$sha1$4294967295$salt$" + hash, std::string("{CRYPT}$unknown$x")}) {
    const std::clock_t start = std::clock();
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, "secret")) << stored;
    ASSERT_LT(std::clock() - start, CLOCKS_PER_SEC / 5) << stored;
  }
}

// Made by other programs: python's hashlib and crypt, openssl passwd.
TEST_F(SecretTest, ValuesMadeElsewhereVerify) {
  for (const char* stored : {
           "{SSHA}ea8/8YT41xolqFbK9vh+AsBa+UdzbHQx",
           "{SSHA256}FMa4ATrlqQ1NaQrKMFj2klD7VCPV0TmPSp0FayIliA9zYWx0c2FsdA==",
           "{SSHA384}eVOZkQPYjkq04gsloVZ8HmrVEFJ5Rhpduxue2q2pXz88U8txnjEPfv3vJXQi6FVec2FsdHNhbHQ=",
           "{SSHA512}s3FOPMgVYqBO0w3WzPkne+tyzouHb9eDOJIoRJtla4L0U7+PFku4DOCVwjjDgbe2zKjD8FVOP7/"
           "zXoB2Q34wpHNhbHRzYWx0",
           "{PBKDF2-SHA256}1000$MDEyMzQ1Njc4OWFiY2RlZg$MQe6G4sNOgColz8I3bQ4N92RDQcjI4OwuyxebKzGtdI",
           "{PBKDF2-SHA512}1200$MDEyMzQ1Njc4OWFiY2RlZg$"
           "T9CScuqJDKpWm02fED9SHKgCvXETR9GDTTttLA7c1cBBx/4eBGKLyrszvQjK2VGSQFwGwm7GiRcx9qwFxRvYFw",
           "{CRYPT}$6$rounds=1000$saltstring$viMsCQhhXfhMocxWHP.ZeqoeQPMdtVBMLRi7WuugATMo."
           "NNKBgM0cqKyIMhbV1Y2zixUxhG/Qc7znj7WBPF6M1",
           "{CRYPT}$5$saltstring$kkjeJzcIcoraOI9Wy.Ik/CyqO0UtR1loRaFn/1I2xa7",
           "{CRYPT}$1$saltsalt$2f.bWx.H.UmlFhfc8jBL/.",
           "{CRYPT}$2b$05$abcdefghijklmnopqrstuuEn/eMei1z5h1.4IuwDnjDepo.7LkKxS",
           "{CRYPT}$y$j75$abcdefgh$pNl1lk7SHDZ7/9cmoHsrwegNzwIzj6M0vAywzbZ9Xz0",
           "{CRYPT}$gy$j75$abcdefgh$GUp9dSLH5zcZyTYE5qQDTP6EUuLGZwvdqtTjSOD.5t3",
           "{CRYPT}$6$openssls$10JDW5.zhZmDKAFIJWTAjQVmETVQzC.won8A.6vSWNY5c2HjxtWJI9six4s.LC6vHy."
           "VhkUSaMzDA0Xr.z1li1",
           "{CRYPT}$5$openssls$ne5g9dXPiY9RemH.CuikJo5597njV/YObHWR1jpLbID",
           "{CRYPT}$1$openssls$7AI.iy9IW09GgABrXq4MQ.",
       }) {
    EXPECT_TRUE(verify_secret(nullptr, kHere, stored, "p\xC3\xA4ssword 1")) << stored;
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, "p\xC3\xA4ssword 2")) << stored;
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, "p\xC3\xA4ssword")) << stored;
    EXPECT_FALSE(verify_secret(nullptr, kHere, stored, "")) << stored;
  }
}

// A sealed value with a key and a nonce of another program's making.
TEST_F(SecretTest, ASealedValueIsAesGcmOverItsPlace) {
  std::string digits;
  for (int i = 0; i < 32; ++i) {
    digits += "0123456789abcdef"[i / 16];
    digits += "0123456789abcdef"[i % 16];
  }
  const std::string path = directory_.file("known.stash");
  cfg_test::write_file(path, "orv-key-1 " + digits + "\n");
  ASSERT_EQ(::chmod(path.c_str(), 0600), 0);
  KeyPtr key;
  ASSERT_EQ(load_key_stash(path.c_str(), key, why_), 0) << why_;
  const std::string stored =
      "{AES256}ARfnl2GlfZQGITQ75Kn2BAJkZWZnaGlqa2xtbm842HoVCp457FpC"
      "bqmrucoW+5YewXkpEA8fzdc=";
  std::string clear;
  EXPECT_EQ(open_secret(key.get(), stored, clear), OpenResult::opened);
  EXPECT_EQ(clear, "p\xC3\xA4ssword 1");
  EXPECT_TRUE(verify_secret(key.get(), kHere, stored, clear));
  EXPECT_FALSE(verify_secret(key.get(), kHere, stored, "p\xC3\xA4ssword 2"));
  EXPECT_FALSE(verify_secret(key.get(), {kHere.type, "CN=OTHER"}, stored, clear));
  // The same under another version, which may mean another thing.
  const std::string later =
      "{AES256}Ahfnl2GlfZQGITQ75Kn2BAJkZWZnaGlqa2xtbm842HoVCp457FpC"
      "bhdE0BqKJicg1+6FiNkbqiM=";
  EXPECT_EQ(open_secret(key.get(), later, clear), OpenResult::broken);
}

TEST_F(SecretTest, EveryByteOfAHashCounts) {
  for (const SecretMethod method :
       {SecretMethod::ssha256, SecretMethod::ssha384, SecretMethod::ssha512}) {
    std::string stored;
    ASSERT_EQ(make_secret(method, "secret", stored), 0);
    const std::string scheme = stored.substr(0, 9);
    std::string bytes;
    std::size_t at = 0;
    ASSERT_EQ(base64_decode(stored.substr(9), bytes, at), 0);
    for (char& byte : bytes) {
      byte = static_cast<char>(byte ^ 1);
      std::string text;
      ASSERT_EQ(base64_encode(bytes, text), 0);
      EXPECT_FALSE(verify_secret(nullptr, kHere, scheme + text, "secret"));
      byte = static_cast<char>(byte ^ 1);
    }
    EXPECT_TRUE(verify_secret(nullptr, kHere, stored, "secret"));
  }
}

TEST_F(SecretTest, ThreadsVerifyAndMakeAtOnce) {
  std::atomic<int> wrong{0};
  std::vector<std::thread> threads;
  for (int number = 0; number < 4; ++number) {
    threads.emplace_back([&wrong, number] {
      const std::string clear = "password of thread " + std::to_string(number);
      for (const SecretMethod method :
           {SecretMethod::ssha256, SecretMethod::ssha384, SecretMethod::ssha512,
            SecretMethod::crypt, SecretMethod::crypt}) {
        std::string stored;
        if (!can_make_secret(method)) continue;
        if (make_secret(method, clear, stored) != 0) ++wrong;
        if (!verify_secret(nullptr, kHere, stored, clear)) ++wrong;
        if (verify_secret(nullptr, kHere, stored, clear + "x")) ++wrong;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(wrong.load(), 0);
}

TEST_F(SecretTest, ASealedValueIsNotMadeWithoutAKey) {
  std::string stored = "kept";
  EXPECT_EQ(make_secret(SecretMethod::sealed, "secret", stored), 53);
  EXPECT_EQ(stored, "kept");
}

TEST_F(SecretTest, MalformedValuesNeverMatch) {
  const std::string hash(22, 'A');
  for (const std::string& stored : {std::string("{SSHA}"),
                                    std::string("{SSHA}!!!!"),
                                    std::string("{SSHA}YWJj"),
                                    std::string("{AES256}"),
                                    std::string("{AES256}YWJj"),
                                    std::string("{PBKDF2-SHA256}"),
                                    std::string("{PBKDF2-SHA256}1"),
                                    std::string("{PBKDF2-SHA256}1$c2FsdA"),
                                    "{PBKDF2-SHA256}0$c2FsdA$" + hash,
                                    "{PBKDF2-SHA256}$c2FsdA$" + hash,
                                    "{PBKDF2-SHA256}-1$c2FsdA$" + hash,
                                    "{PBKDF2-SHA256}10000001$c2FsdA$" + hash,
                                    "{PBKDF2-SHA256}99999999999999999999$c2FsdA$" + hash,
                                    "{PBKDF2-SHA256}1x$c2FsdA$" + hash,
                                    "{PBKDF2-SHA256}1$$" + hash,
                                    "{PBKDF2-SHA256}1$c2FsdA==$" + hash,
                                    std::string("{PBKDF2-SHA256}1$c2FsdA$"),
                                    "{PBKDF2-SHA256}1$c2FsdA$" + std::string(100, 'A'),
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
