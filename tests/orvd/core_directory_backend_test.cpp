// The directory's own backend as the rules of the configuration meet it: it checks and stages a new
// password method, which is in force when the file says so.
#include "directory_backend.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <optional>
#include <stdexcept>
#include <string>

#include "../temporary_directory.h"
#include "cfg/attribute_table.h"
#include "cfg/secret.h"
#include "settings.h"
#include "slapi/owners.h"
#include "slapi/password_method.h"
#include "slapi/schema.h"
#include "slapi/services.h"

namespace orv::server {
namespace {

constexpr const char* kLocalhost = "CN=LOCALHOST";

class DirectoryBackendTest : public testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
    std::string why;
    ASSERT_EQ(cfg::create_key_stash(stash().c_str(), why), 0) << why;
    ASSERT_EQ(read("AES256"), 0);
  }
  void TearDown() override { read("AES256"); }

  std::string stash() const { return folder_.file("key.stash"); }

  // The server reads a file that says this.
  int read(const std::string& method, const std::string& group = "") {
    const std::string file = folder_.file("config.ldif");
    std::ofstream(file, std::ios::trunc)
        << "dn: CN=CONFIGURATION\nobjectClass: orv-slapdTop\ncn: Configuration\n"
           "orv-slapdAdminDN: cn=root\norv-slapdPwEncryption: "
        << method
        << "\n\ndn: CN=ADMINGROUP,CN=CONFIGURATION\nobjectClass: container\ncn: AdminGroup\n"
        << group;
    std::string error;
    return renew_password_methods(file, stash(), error);
  }

  // What a rule does that looks for the function.
  static int take(int method, std::string& reason) {
    Backend* const backend = select_backend_opt(kLocalhost);
    PluginFunction* functions = nullptr;
    if (!backend ||
        getAllPluginFuncs(backend, DirectoryBackend::kTakePasswordMethod, &functions) != 0)
      return -1;
    EXPECT_TRUE(functions[0]);
    EXPECT_FALSE(functions[1]);
    char* text = nullptr;
    const int code = functions[0](backend, method, &text);
    const MallocText owned(text);
    reason = text ? text : "";
    return code;
  }

  const orv::test::TemporaryDirectory folder_;
  std::string reason_;
};

TEST_F(DirectoryBackendTest, IsFoundWhileItExists) {
  {
    DirectoryBackend directory;
    EXPECT_EQ(select_backend_opt(kLocalhost), &directory.record());
    EXPECT_EQ(select_backend_opt("cn=anything, cn=localhost"), &directory.record());
  }
  EXPECT_EQ(select_backend_opt(kLocalhost), nullptr);
  EXPECT_EQ(take(password_method::ssha512, reason_), -1);
}

TEST_F(DirectoryBackendTest, IsTheOnlyOneOfItsSuffix) {
  const DirectoryBackend first;
  EXPECT_THROW(DirectoryBackend(), std::runtime_error);
  EXPECT_EQ(take(password_method::ssha512, reason_), 0) << "the first one stays";
}

TEST_F(DirectoryBackendTest, StagesAMethodThatIsInForceWhenTheFileSaysSo) {
  const DirectoryBackend directory;
  EXPECT_EQ(take(password_method::ssha512, reason_), 0);
  EXPECT_EQ(reason_, "");
  EXPECT_EQ(staged_password_method(), password_method::ssha512);
  EXPECT_EQ(password_method_in_force(), password_method::aes256);
  ASSERT_EQ(read("SSHA512"), 0);  // the change was written
  EXPECT_EQ(password_method_in_force(), password_method::ssha512);
  EXPECT_EQ(staged_password_method(), password_method::none_converted);
}

TEST_F(DirectoryBackendTest, LeavesTheMethodBeforeWhenTheChangeIsNotWritten) {
  const DirectoryBackend directory;
  ASSERT_EQ(take(password_method::ssha512, reason_), 0);
  ASSERT_EQ(read("AES256"), 0);  // the file stayed as it was
  EXPECT_EQ(password_method_in_force(), password_method::aes256);
  EXPECT_EQ(staged_password_method(), password_method::none_converted);
}

TEST_F(DirectoryBackendTest, RefusesWhatTheConfigurationForbidsAndStagesNothing) {
  const DirectoryBackend directory;
  ASSERT_EQ(
      read("AES256",
           "objectClass: orv-slapdAdminGroupSettings\norv-slapdPwEncryptionAllowed: AES256\n"),
      0);
  for (const int method : {password_method::ssha512, password_method::none}) {
    EXPECT_EQ(take(method, reason_), 53);
    EXPECT_NE(reason_, "");
  }
  EXPECT_EQ(take(password_method::none_converted, reason_), 53);
  EXPECT_EQ(staged_password_method(), password_method::none_converted);
  EXPECT_EQ(password_method_in_force(), password_method::aes256);
}

TEST_F(DirectoryBackendTest, KeepsWhatIsInForceWhenTheFileNamesWhatNobodyKnows) {
  const DirectoryBackend directory;
  ASSERT_EQ(take(password_method::ssha512, reason_), 0);
  EXPECT_EQ(read("ROT13"), 21);
  EXPECT_EQ(password_method_in_force(), password_method::aes256);
}

}  // namespace
}  // namespace orv::server
