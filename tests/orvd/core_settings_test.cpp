// Settings: bounds, reading from a file, and the logs they name.
#include "settings.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <set>

#include "../temporary_directory.h"
#include "cfg/attribute_table.h"
#include "logs.h"
#include "slapi/schema.h"

namespace orv::server {
namespace {

class SettingsTest : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }
  std::string configuration(const std::string& more, const std::string& entries = "") {
    return directory.write("config.ldif",
                           "dn: cn=configuration\nobjectClass: top\nobjectClass: orv-slapdTop\n"
                           "cn: configuration\norv-slapdAdminDN: cn=root\n" +
                               more + "\n" + entries);
  }
  const orv::test::TemporaryDirectory directory;
  Settings settings;
  std::string error;
};

TEST_F(SettingsTest, EveryRowAcceptsItsBoundsAndRefusesWhatIsBeyond) {
  std::set<std::string_view> names;
  for (const SettingRow& row : setting_rows()) {
    SCOPED_TRACE(row.name);
    EXPECT_TRUE(names.insert(row.name).second);
    EXPECT_NE(builtin_schema().attribute(row.name), nullptr);
    EXPECT_GE(settings.*row.member, row.minimum);
    EXPECT_LE(settings.*row.member, row.maximum);
    for (const std::int64_t bound : {row.minimum, row.maximum}) {
      EXPECT_TRUE(apply_setting(row, std::to_string(bound), settings, error));
      EXPECT_EQ(settings.*row.member, bound);
    }
    for (const std::string& bad :
         {std::to_string(row.minimum - 1), std::to_string(row.maximum + 1), std::string(""),
          std::string("1x"), std::string(" 1"), std::string("99999999999999999999")}) {
      error.clear();
      EXPECT_FALSE(apply_setting(row, bad, settings, error)) << bad;
      EXPECT_NE(error.find(row.name), std::string::npos);
    }
    EXPECT_EQ(settings.*row.member, row.maximum);
  }
}

TEST_F(SettingsTest, AreReadFromTheFileWithDefaultsForWhatItLacks) {
  const std::string file = configuration(
      "orv-slapdPort: 1389\norv-slapdIpAddress: 127.0.0.1\norv-slapdIpAddress: ::1\n",
      "dn: cn=log management,cn=configuration\nobjectClass: container\ncn: log management\n\n"
      "dn: cn=access,cn=log management,cn=configuration\nobjectClass: orv-slapdLogSettings\n"
      "cn: access\norv-slapdLog: /var/log/orv/access.log\n");
  ASSERT_TRUE(read_settings(file, "", settings, error)) << error;
  EXPECT_EQ(settings.port, 1389);
  EXPECT_EQ(settings.time_limit, 60);
  EXPECT_EQ(settings.addresses, (std::vector<std::string>{"127.0.0.1", "::1"}));
  EXPECT_EQ(settings.access_log, "/var/log/orv/access.log");
  EXPECT_EQ(settings.access_log_level, "info");
  EXPECT_EQ(settings.error_log, "");
}

TEST_F(SettingsTest, OfADamagedFileAreRefusedWithItsPlaceAndCause) {
  const std::string file =
      directory.write("config.ldif", "dn: cn=configuration\ncn: configuration\nno colon here\n");
  EXPECT_FALSE(read_settings(file, "", settings, error));
  EXPECT_NE(error.find(file), std::string::npos) << error;
  EXPECT_NE(error.find("3"), std::string::npos) << error;
  EXPECT_EQ(settings.port, Settings().port);
}

TEST_F(SettingsTest, WithoutTheTopEntryAreRefused) {
  const std::string file = directory.write("config.ldif", "dn: cn=other\ncn: other\n");
  EXPECT_FALSE(read_settings(file, "", settings, error));
  EXPECT_NE(error.find("CN=CONFIGURATION"), std::string::npos) << error;
}

TEST_F(SettingsTest, OutOfBoundsAreRefusedByName) {
  EXPECT_FALSE(read_settings(configuration("orv-slapdPort: 65536\n"), "", settings, error));
  EXPECT_NE(error.find("orv-slapdPort"), std::string::npos) << error;
}

TEST_F(SettingsTest, RelativeLogPathIsRefused) {
  const std::string file = configuration(
      "",
      "dn: cn=log management,cn=configuration\nobjectClass: container\ncn: log management\n\n"
      "dn: cn=default,cn=log management,cn=configuration\n"
      "objectClass: orv-slapdLogSettings\ncn: default\norv-slapdLog: error.log\n");
  EXPECT_FALSE(read_settings(file, "", settings, error));
  EXPECT_NE(error.find("absolute"), std::string::npos) << error;
}

TEST_F(SettingsTest, OfTheListenersNeedARestart) {
  Settings wanted;
  wanted.size_limit = 5;
  EXPECT_TRUE(restart_needed(settings, wanted).empty());
  wanted.port = 1;
  wanted.addresses = {"::1"};
  EXPECT_EQ(restart_needed(settings, wanted),
            (std::vector<std::string_view>{"orv-slapdPort", "orv-slapdIpAddress"}));
  wanted = settings;
  wanted.secure_port = 1;
  wanted.local_socket = "/x";
  EXPECT_EQ(restart_needed(settings, wanted),
            (std::vector<std::string_view>{"orv-slapdSecurePort", "orv-slapdLocalSocket"}));
}

// ---- TLS

std::string group(const std::string& values) {
  return "dn: cn=admingroup,cn=configuration\nobjectClass: container\n"
         "objectClass: orv-slapdAdminGroupSettings\ncn: admingroup\n" +
         values;
}

TEST_F(SettingsTest, OfTlsAreReadFromTheContainerOfTheGroup) {
  const std::string file = configuration(
      "orv-slapdSecurePort: 1636\norv-slapdLocalSocket: /run/orv/ldapi\n",
      group("orv-slapdTlsCertificateFile: /c\norv-slapdTlsKeyFile: /k\norv-slapdTlsCaFile: /a\n"
            "orv-slapdTlsCrlFile: /r\n"
            "orv-slapdTlsClientCertificate: Required\norv-slapdTlsMinimumVersion: 1.3\n"
            "orv-slapdTlsForPasswords: FALSE\norv-slapdTlsForLocalPasswords: TRUE\n"));
  ASSERT_TRUE(read_settings(file, "", settings, error)) << error;
  EXPECT_EQ(settings.secure_port, 1636);
  EXPECT_EQ(settings.local_socket, "/run/orv/ldapi");
  EXPECT_EQ(settings.tls,
            (TlsSettings{"/c", "/k", "/a", ClientCertificates::required, false, "/r"}));
  EXPECT_FALSE(settings.tls_for_passwords);
  EXPECT_TRUE(settings.tls_for_local_passwords);
}

TEST_F(SettingsTest, OfTlsAreOfNoEffectAnywhereElse) {
  const std::string file = configuration(
      "orv-slapdTlsCertificateFile: /c\n"
      "orv-slapdTlsForPasswords: FALSE\n");
  ASSERT_TRUE(read_settings(file, "", settings, error)) << error;
  EXPECT_EQ(settings.tls, TlsSettings());
  EXPECT_TRUE(settings.tls_for_passwords);
  EXPECT_FALSE(settings.tls_for_local_passwords);
}

TEST_F(SettingsTest, OfTlsThatAreNoneAreRefusedByName) {
  for (const std::string name :
       {"orv-slapdTlsClientCertificate", "orv-slapdTlsMinimumVersion", "orv-slapdTlsCaFile",
        "orv-slapdTlsKeyFile", "orv-slapdTlsCrlFile"}) {
    const std::string file = configuration("", group(name + ": 1.1\n"));
    EXPECT_FALSE(read_settings(file, "", settings, error));
    EXPECT_NE(error.find(name), std::string::npos) << error;
  }
}

// ---- SASL

TEST_F(SettingsTest, OfSaslAreReadWhereTheyBelong) {
  const std::string digest =
      "\ndn: cn=digest,cn=configuration\nobjectClass: orv-slapdDigest\ncn: digest\n"
      "orv-slapdDigestRealm: The Realm\n";
  const std::string file = configuration(
      "", group("orv-slapdSaslMechanisms: external\norv-slapdSaslMechanisms: Digest-MD5\n"
                "orv-slapdKrbKeytab: /k\n") +
              digest);
  ASSERT_TRUE(read_settings(file, "", settings, error)) << error;
  EXPECT_EQ(settings.sasl, (SaslSettings{{"EXTERNAL", "DIGEST-MD5"}, "The Realm", "/k"}));
  // Members may write to the entry at the top, which decides nothing.
  const std::string top = configuration(
      "orv-slapdSaslMechanisms: none\norv-slapdKrbKeytab: /x\norv-slapdDigestRealm: x\n");
  ASSERT_TRUE(read_settings(top, "", settings, error)) << error;
  EXPECT_EQ(settings.sasl, SaslSettings());
}

TEST_F(SettingsTest, OfSaslThatAreNoneAreRefusedByName) {
  for (const std::string line : {"orv-slapdSaslMechanisms: PLAIN",
                                 "orv-slapdSaslMechanisms: ", "orv-slapdKrbKeytab: relative"}) {
    EXPECT_FALSE(read_settings(configuration("", group(line + "\n")), "", settings, error)) << line;
    EXPECT_NE(error.find(line.substr(0, line.find(':'))), std::string::npos) << error;
  }
  for (const std::string& realm :
       {std::string("a\"b"), std::string("a\\b"), std::string("\xc3\xa4"), std::string(256, 'x')}) {
    const std::string digest =
        "dn: cn=digest,cn=configuration\nobjectClass: orv-slapdDigest\ncn: digest\n"
        "orv-slapdDigestRealm: ";
    EXPECT_FALSE(read_settings(configuration("", digest + realm + "\n"), "", settings, error));
    EXPECT_NE(error.find("orv-slapdDigestRealm"), std::string::npos) << error;
  }
}

// ---- logs

TEST_F(SettingsTest, LogsAreOpenedAgainWhenTheirFilesWereMovedAway) {
  settings.error_log = directory.file("error.log");
  {
    Logs logs;
    EXPECT_TRUE(logs.open(settings).empty());
    logs.error("before");
    ASSERT_EQ(rename(settings.error_log.c_str(), directory.file("old.log").c_str()), 0);
    EXPECT_TRUE(logs.open(settings).empty());
    logs.error("after");
  }
  EXPECT_NE(directory.read("old.log").find("before"), std::string::npos);
  EXPECT_EQ(directory.read("old.log").find("after"), std::string::npos);
  EXPECT_NE(directory.read("error.log").find("after"), std::string::npos);
}

TEST_F(SettingsTest, LogIsNeverAFileOfTheServersOwnOrNoFileAtAll) {
  const std::string config = configuration("");
  const std::string before = directory.read("config.ldif");
  ASSERT_EQ(link(config.c_str(), directory.file("alias").c_str()), 0);
  ASSERT_EQ(mkfifo(directory.file("pipe").c_str(), 0600), 0);
  Logs logs({{config}, {}});
  for (const std::string& target : {config, directory.file("alias"), directory.file("pipe"),
                                    directory.file("missing/error.log")}) {
    settings.error_log = target;
    EXPECT_EQ(logs.open(settings).size(), 1U) << target;
  }
  logs.finish();
  EXPECT_EQ(directory.read("config.ldif"), before);
}

TEST_F(SettingsTest, AccessLinesCarryTimeAndConnectionAndNoControlCharacters) {
  settings.access_log = directory.file("access.log");
  settings.access_log_level = "info";
  {
    Logs logs;
    ASSERT_TRUE(logs.open(settings).empty());
    AccessLane lane(logs);
    ASSERT_TRUE(lane.enabled());
    append_quoted(lane.begin(7), "a\nb\"c");
    lane.end();
  }
  const std::string lines = directory.read("access.log");
  EXPECT_NE(lines.find("Z conn=7 \"a\\0Ab\\22c\"\n"), std::string::npos) << lines;
}

}  // namespace
}  // namespace orv::server
