// The audit log: what a record shows of a change, what it hides, and how it gets into its file.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <string>
#include <vector>

#include "audit/log.h"
#include "audit/record.h"
#include "cfg/attribute_table.h"
#include "cfg/text.h"
#include "slapi/schema.h"

namespace orv::server {
namespace {

constexpr const char* kSecret = "open-sesame";

class AuditRecord : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }
  static std::string added(const std::string& type, const std::string& value,
                           AuditDetail detail = AuditDetail::whole) {
    return describe_change(builtin_schema(), AddRequest{"cn=x,cn=configuration", {{type, {value}}}},
                           detail);
  }
  static bool shows(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
  }
};

TEST_F(AuditRecord, ShowsAnAddAsTheClientSentIt) {
  const AddRequest request{"CN=x, cn=configuration", {{"CN", {"x", "y"}}, {"description", {"d"}}}};
  EXPECT_EQ(describe_change(builtin_schema(), request, AuditDetail::whole),
            "dn: CN=x, cn=configuration\n"
            "changetype: add\n"
            "CN: x\n"
            "CN: y\n"
            "description: d\n");
}

TEST_F(AuditRecord, ShowsADelete) {
  EXPECT_EQ(
      describe_change(builtin_schema(), DeleteRequest{"cn=x,cn=configuration"}, AuditDetail::whole),
      "dn: cn=x,cn=configuration\nchangetype: delete\n");
}

TEST_F(AuditRecord, ShowsModificationsInTheOrderOfTheClient) {
  const ModifyRequest request{
      "cn=x,cn=configuration",
      {{1, {"description", {}}}, {0, {"description", {"a", "b"}}}, {2, {"cn", {"x"}}}}};
  EXPECT_EQ(describe_change(builtin_schema(), request, AuditDetail::whole),
            "dn: cn=x,cn=configuration\n"
            "changetype: modify\n"
            "delete: description\n-\n"
            "add: description\ndescription: a\ndescription: b\n-\n"
            "replace: cn\ncn: x\n-\n");
}

TEST_F(AuditRecord, MasksASecretUnderEverySpellingOfItsType) {
  const SchemaAttribute* const type = builtin_schema().attribute("orv-slapdAdminPW");
  ASSERT_TRUE(type && type->secret);
  for (const std::string& name : {std::string("orv-slapdAdminPW"), std::string("ORV-SLAPDADMINPW"),
                                  type->oid, std::string("orv-slapdAdminPW;lang-en"),
                                  type->oid + ";x-a;x-b", std::string("orv-slapdMasterPW")}) {
    const std::string text = added(name, kSecret);
    EXPECT_FALSE(shows(text, kSecret)) << name;
    EXPECT_TRUE(shows(text, "\n" + name + ": ********\n")) << name;
  }
}

TEST_F(AuditRecord, MasksASecretThatIsWrittenInBase64) {
  std::string encoded;
  const std::string value = std::string(" ") + kSecret;
  ASSERT_EQ(cfg::base64_encode(value, encoded), 0);
  EXPECT_FALSE(shows(added("orv-slapdAdminPW", value), encoded));
}

TEST_F(AuditRecord, ShowsWhatIsNoSecretUnderOtherNamesToo) {
  EXPECT_TRUE(shows(added("description;lang-de", "Text"), "\ndescription;lang-de: Text\n"));
  EXPECT_TRUE(shows(added("2.5.4.13", "text"), "\n2.5.4.13: text\n"));
}

TEST_F(AuditRecord, MasksTypesThatNobodyKnows) {
  EXPECT_FALSE(shows(added("orv-slapdAdminPassword", kSecret), kSecret));
}

TEST_F(AuditRecord, MasksSecretsInModifications) {
  const ModifyRequest request{"cn=x,cn=configuration",
                              {{1, {"orv-slapdAdminPW", {kSecret}}},
                               {0, {"orv-slapdAdminPW", {std::string("new-") + kSecret}}}}};
  EXPECT_FALSE(shows(describe_change(builtin_schema(), request, AuditDetail::whole), kSecret));
}

TEST_F(AuditRecord, MasksSecretsInTheNameOfTheTarget) {
  const std::string text = describe_change(
      builtin_schema(), DeleteRequest{"orv-slapdAdminPW=open-sesame+cn=a\\2Cb,cn=configuration"},
      AuditDetail::whole);
  EXPECT_EQ(text, "dn: orv-slapdAdminPW=********+cn=a\\2Cb,cn=configuration\nchangetype: delete\n");
}

TEST_F(AuditRecord, MasksSecretsInDnsThatAreValues) {
  EXPECT_FALSE(shows(added("orv-slapdAdminDN", "orv-slapdAdminPW=open-sesame,o=x"), kSecret));
  EXPECT_FALSE(shows(added("description", "ORV-SLAPDADMINPW=open-sesame,o=x"), kSecret));
}

TEST_F(AuditRecord, DoesNotShowWhatShouldBeADnAndIsNot) {
  EXPECT_FALSE(shows(added("orv-slapdAdminDN", "orv-slapdAdminPW=open-sesame,,"), kSecret));
}

TEST_F(AuditRecord, GivesATargetThatIsNoDnTheEmptyName) {
  EXPECT_EQ(describe_change(builtin_schema(), DeleteRequest{"orv-slapdAdminPW=open-sesame,,"},
                            AuditDetail::whole),
            "# target: not a DN\ndn:\nchangetype: delete\n");
}

TEST_F(AuditRecord, NoValueCanPassForALineOfItsOwn) {
  const std::string text = added("description", "a\n\ndn: cn=forged\nchangetype: delete");
  EXPECT_FALSE(shows(text, "forged"));
  EXPECT_TRUE(shows(text, "\ndescription:: "));
}

TEST_F(AuditRecord, AnOutsiderCannotMakeItLong) {
  AddRequest request{"cn=x,cn=configuration", {}};
  request.attributes.push_back({"description", {std::string(1 << 20, 'x')}});
  for (int i = 0; i < 1000; ++i)
    request.attributes.push_back({"cn", {"value " + std::to_string(i)}});
  const std::string brief = describe_change(builtin_schema(), request, AuditDetail::brief);
  EXPECT_LT(brief.size(), 2 * kBriefBytes);
  EXPECT_TRUE(shows(brief, "# cut: "));
  EXPECT_GT(describe_change(builtin_schema(), request, AuditDetail::whole).size(), 1U << 20);
}

TEST_F(AuditRecord, TellsWhoWhenFromWhereAndWithWhatResult) {
  AuditFacts facts{};
  facts.time = std::chrono::system_clock::time_point(std::chrono::microseconds(1000042));
  facts.bound_dn = "CN=ROOT";
  facts.client = "127.0.0.1:4711";
  facts.connection = 7;
  facts.message_id = 3;
  facts.operation = "add";
  facts.code = 68;
  EXPECT_EQ(audit_record(facts, "dn: cn=x\nchangetype: delete\n"),
            "# time: 1970-01-01T00:00:01.000042Z\n"
            "# bind-dn: CN=ROOT\n"
            "# client: 127.0.0.1:4711\n"
            "# connection: 7\n"
            "# message-id: 3\n"
            "# operation: add\n"
            "# result: 68\n"
            "dn: cn=x\nchangetype: delete\n\n");
}

// ---- the file

class AuditFile : public testing::Test {
 protected:
  AuditFile() {
    char name[] = "/tmp/orv-audit-XXXXXX";
    folder = mkdtemp(name);
    path = folder + "/audit.log";
  }
  ~AuditFile() override { std::filesystem::remove_all(folder); }

  static std::string content(const std::string& file) {
    std::ifstream in(file, std::ios::binary);
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
  }
  std::vector<std::string> told() {
    const std::lock_guard lock(mutex);
    return complaints;
  }

  std::string folder;
  std::string path;
  std::mutex mutex;
  std::vector<std::string> complaints;
  AuditLog log{[this](std::string_view line) {
    const std::lock_guard lock(mutex);
    complaints.emplace_back(line);
  }};
};

TEST_F(AuditFile, IsMadeForItsOwnerOnly) {
  const mode_t before = umask(0);
  EXPECT_EQ(log.open(path, {}), "");
  umask(before);
  struct stat status {};
  ASSERT_EQ(stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600U);
}

TEST_F(AuditFile, HoldsARecordWhenTheWaitForItIsOver) {
  ASSERT_EQ(log.open(path, {}), "");
  log.write_and_wait("dn: cn=a\nchangetype: delete\n\n");
  EXPECT_EQ(content(path), "version: 1\n\ndn: cn=a\nchangetype: delete\n\n");
}

TEST_F(AuditFile, KeepsWhatItHeld) {
  std::ofstream(path) << "dn: cn=old\nchangetype: delete\n";
  ASSERT_EQ(log.open(path, {}), "");
  log.write_and_wait("dn: cn=a\nchangetype: delete\n\n");
  EXPECT_EQ(content(path), "dn: cn=old\nchangetype: delete\n\ndn: cn=a\nchangetype: delete\n\n");
}

TEST_F(AuditFile, BeginsANewLineBehindWhatWasCutOff) {
  std::ofstream(path) << "dn: cn=old\nchangety";
  ASSERT_EQ(log.open(path, {}), "");
  log.write_and_wait("dn: cn=a\n\n");
  EXPECT_EQ(content(path), "dn: cn=old\nchangety\n\ndn: cn=a\n\n");
}

TEST_F(AuditFile, IsMadeAnewWhenItWasMovedAway) {
  ASSERT_EQ(log.open(path, {}), "");
  log.write_and_wait("dn: cn=a\n\n");
  ASSERT_EQ(rename(path.c_str(), (path + ".1").c_str()), 0);
  ASSERT_EQ(log.open(path, {}), "");
  log.write_and_wait("dn: cn=b\n\n");
  EXPECT_EQ(content(path + ".1"), "version: 1\n\ndn: cn=a\n\n");
  EXPECT_EQ(content(path), "version: 1\n\ndn: cn=b\n\n");
}

TEST_F(AuditFile, IsNotASymbolicLink) {
  std::ofstream(folder + "/target") << "precious\n";
  ASSERT_EQ(symlink((folder + "/target").c_str(), path.c_str()), 0);
  EXPECT_EQ(log.open(path, {}), "a symbolic link");
  log.write_and_wait("dn: cn=a\n\n");
  EXPECT_EQ(content(folder + "/target"), "precious\n");
}

TEST_F(AuditFile, IsARegularFile) {
  ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
  EXPECT_EQ(log.open(path, {}), "not a regular file");
  EXPECT_NE(log.open(folder, {}), "");
  EXPECT_EQ(log.open("audit.log", {}), "not an absolute path");
}

TEST_F(AuditFile, IsNoGuardedFileUnderAnotherName) {
  const std::string guarded = folder + "/config.ldif";
  std::ofstream(guarded) << "dn: cn=configuration\n";
  ASSERT_EQ(link(guarded.c_str(), path.c_str()), 0);
  EXPECT_EQ(log.open(path, {guarded}), "the same file as " + guarded);
}

TEST_F(AuditFile, StaysWhereItWasWhenTheNewPlaceIsRefused) {
  ASSERT_EQ(log.open(path, {}), "");
  EXPECT_NE(log.open(folder + "/missing/audit.log", {}), "");
  log.write_and_wait("dn: cn=a\n\n");
  EXPECT_EQ(content(path), "version: 1\n\ndn: cn=a\n\n");
}

TEST_F(AuditFile, WithoutAFileRecordsAreMissedOutLoud) {
  EXPECT_NE(log.open(folder + "/missing/audit.log", {}), "");
  EXPECT_TRUE(log.enabled());
  log.write_and_wait("dn: cn=a\n\n");
  log.write_and_wait("dn: cn=b\n\n");
  ASSERT_EQ(told().size(), 1U);
  ASSERT_EQ(log.open(path, {}), "");
  log.write_and_wait("dn: cn=c\n\n");
  ASSERT_TRUE(log.finish());
  EXPECT_EQ(told().back(), "the audit log is written again; records lost: 2");
  EXPECT_EQ(content(path), "version: 1\n\ndn: cn=c\n\n");
}

TEST_F(AuditFile, CanBeSwitchedOff) {
  ASSERT_EQ(log.open(path, {}), "");
  ASSERT_EQ(log.open("", {}), "");
  EXPECT_FALSE(log.enabled());
}

TEST_F(AuditFile, IsWrittenToTheEndBeforeTheProcessEnds) {
  ASSERT_EQ(log.open(path, {}), "");
  for (int i = 0; i < 100; ++i) log.write("dn: cn=" + std::to_string(i) + "\n\n");
  ASSERT_TRUE(log.finish());
  const std::string text = content(path);
  EXPECT_NE(text.find("dn: cn=0\n"), std::string::npos);
  EXPECT_NE(text.find("dn: cn=99\n"), std::string::npos);
}

// The limit on the size of files stands for a full disk: a write is cut short, then refused.
TEST_F(AuditFile, KeepsNoPartOfARecordThatDoesNotFit) {
  ASSERT_EQ(log.open(path, {}), "");
  log.write_and_wait("dn: cn=a\n\n");
  const std::string before = content(path);
  std::signal(SIGXFSZ, SIG_IGN);
  rlimit old{};
  ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &old), 0);
  const rlimit small{before.size() + 10, old.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &small), 0);
  log.write_and_wait("dn: cn=" + std::string(100, 'b') + "\n\n");
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &old), 0);
  EXPECT_EQ(content(path), before);
  EXPECT_EQ(told().size(), 1U);
  log.write_and_wait("dn: cn=c\n\n");
  EXPECT_EQ(content(path), before + "dn: cn=c\n\n");
}

}  // namespace
}  // namespace orv::server
