// The audit log: what a record shows of a change, what it hides, and how it gets into its file.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "../temporary_directory.h"
#include "audit/log.h"
#include "audit/record.h"
#include "audit/record_file.h"
#include "cfg/attribute_table.h"
#include "cfg/text.h"
#include "core_fake_backend.h"
#include "core_hung_disk.h"
#include "slapi/schema.h"

namespace orv::server {
namespace {

using orv::test::content_of;

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

TEST_F(AuditRecord, DoesNotShowAValueThatNamesAPassword) {
  for (const char* value :
       {"ldap://h/orv-slapdAdminPW=open-sesame??sub", "ORV-SLAPDADMINPW = open-sesame,,"})
    EXPECT_TRUE(shows(added("description", value), "\ndescription: ********\n")) << value;
  EXPECT_TRUE(shows(added("description", "see orv-slapdAdminPW"), "see orv-slapdAdminPW"));
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

TEST_F(AuditRecord, SaysWhereItWasWhatAnOutsidersModificationLacks) {
  ModifyRequest request{
      "cn=x,cn=configuration",
      {{1, {"description", {std::string(5000, 'x'), std::string(5000, 'y')}}}, {0, {"cn", {"a"}}}}};
  for (int i = 0; i < 3; ++i)
    request.modifications.push_back({2, {"cn", {std::string(2000, 'z')}}});
  const std::string text = describe_change(builtin_schema(), request, AuditDetail::brief);
  EXPECT_TRUE(shows(text,
                    "delete: description\n# cut: 2 values are not shown\n-\n"
                    "add: cn\ncn: a\n-\n"))
      << text;
  EXPECT_LT(text.size(), 2 * kBriefBytes);
  request.modifications.assign(2000, {2, {"cn", {"b"}}});
  EXPECT_TRUE(shows(describe_change(builtin_schema(), request, AuditDetail::brief),
                    " modifications are not shown\n"));
}

TEST_F(AuditRecord, ShowsARename) {
  ModifyDnRequest request{"cn=x,cn=configuration", "cn=y", true, std::nullopt};
  EXPECT_EQ(describe_change(builtin_schema(), request, AuditDetail::whole),
            "dn: cn=x,cn=configuration\nchangetype: modrdn\nnewrdn: cn=y\ndeleteoldrdn: 1\n");
  request.new_superior = "";
  EXPECT_TRUE(
      shows(describe_change(builtin_schema(), request, AuditDetail::whole), "\nnewsuperior:\n"));
}

TEST_F(AuditRecord, MasksSecretsInTheNewNamesOfARename) {
  const ModifyDnRequest request{"cn=x", "orv-slapdAdminPW=open-sesame", false,
                                "cn=a,orv-slapdMasterPW=open-sesame"};
  EXPECT_EQ(describe_change(builtin_schema(), request, AuditDetail::whole),
            "dn: cn=x\nchangetype: modrdn\nnewrdn: orv-slapdAdminPW=********\n"
            "deleteoldrdn: 0\nnewsuperior: cn=a,orv-slapdMasterPW=********\n");
  EXPECT_EQ(describe_change(builtin_schema(),
                            ModifyDnRequest{"open-sesame", "open-sesame", false, "open-sesame"},
                            AuditDetail::whole),
            "# target: not a DN\ndn:\nchangetype: modrdn\n# newrdn: not a DN\nnewrdn:\n"
            "deleteoldrdn: 0\n# newsuperior: not a DN\nnewsuperior:\n");
}

TEST_F(AuditRecord, AnOutsiderCannotMakeARenameLong) {
  const std::string name = "cn=" + std::string(3000, 'x');
  const std::string text = describe_change(
      builtin_schema(), ModifyDnRequest{name, name, false, name}, AuditDetail::brief);
  EXPECT_LT(text.size(), 2 * kBriefBytes);
  EXPECT_TRUE(shows(text, "\n# newrdn: cut, too long\nnewrdn:\n"));
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

// Files written by this process can be no longer than `bytes`, as on a full disk: a write is cut
// short, then refused.
class FullDisk {
 public:
  explicit FullDisk(std::size_t bytes) {
    std::signal(SIGXFSZ, SIG_IGN);
    EXPECT_EQ(getrlimit(RLIMIT_FSIZE, &before_), 0);
    const rlimit small{bytes, before_.rlim_max};
    EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &small), 0);
  }
  ~FullDisk() { EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &before_), 0); }

 private:
  rlimit before_{};
};

class AuditFile : public testing::Test {
 protected:
  std::vector<std::string> told() {
    const std::lock_guard lock(mutex);
    return complaints;
  }
  void write_and_wait(const std::string& text) {
    test::Event written;
    log->when_written(log->write(text), [&written] { written.happen(); });
    EXPECT_TRUE(written.wait());
  }

  const orv::test::TemporaryDirectory folder;
  const std::string path = folder.file("audit.log");
  std::mutex mutex;
  std::vector<std::string> complaints;
  std::optional<AuditLog> log{std::in_place, [this](std::string_view line) {
                                const std::lock_guard lock(mutex);
                                complaints.emplace_back(line);
                              }};
};

TEST_F(AuditFile, IsMadeForItsOwnerOnly) {
  const mode_t before = umask(0);
  EXPECT_EQ(log->open(path, {}), "");
  umask(before);
  struct stat status {};
  ASSERT_EQ(stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600U);
}

TEST_F(AuditFile, HoldsARecordWhenTheWaitForItIsOver) {
  ASSERT_EQ(log->open(path, {}), "");
  write_and_wait("dn: cn=a\nchangetype: delete\n\n");
  EXPECT_EQ(content_of(path), "version: 1\n\ndn: cn=a\nchangetype: delete\n\n");
}

TEST_F(AuditFile, KeepsWhatItHeld) {
  std::ofstream(path) << "dn: cn=old\nchangetype: delete\n";
  ASSERT_EQ(log->open(path, {}), "");
  write_and_wait("dn: cn=a\nchangetype: delete\n\n");
  EXPECT_EQ(content_of(path), "dn: cn=old\nchangetype: delete\n\ndn: cn=a\nchangetype: delete\n\n");
}

TEST_F(AuditFile, BeginsANewLineBehindWhatWasCutOff) {
  std::ofstream(path) << "dn: cn=old\nchangety";
  ASSERT_EQ(log->open(path, {}), "");
  write_and_wait("dn: cn=a\n\n");
  EXPECT_EQ(content_of(path), "dn: cn=old\nchangety\n\ndn: cn=a\n\n");
}

TEST_F(AuditFile, IsMadeAnewWhenItWasMovedAway) {
  ASSERT_EQ(log->open(path, {}), "");
  write_and_wait("dn: cn=a\n\n");
  ASSERT_EQ(rename(path.c_str(), (path + ".1").c_str()), 0);
  ASSERT_EQ(log->open(path, {}), "");
  write_and_wait("dn: cn=b\n\n");
  EXPECT_EQ(content_of(path + ".1"), "version: 1\n\ndn: cn=a\n\n");
  EXPECT_EQ(content_of(path), "version: 1\n\ndn: cn=b\n\n");
}

TEST_F(AuditFile, IsNotASymbolicLink) {
  std::ofstream(folder.file("target")) << "precious\n";
  ASSERT_EQ(symlink(folder.file("target").c_str(), path.c_str()), 0);
  EXPECT_EQ(log->open(path, {}), "a symbolic link");
  write_and_wait("dn: cn=a\n\n");
  EXPECT_EQ(content_of(folder.file("target")), "precious\n");
}

TEST_F(AuditFile, IsARegularFile) {
  ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
  EXPECT_EQ(log->open(path, {}), "not a regular file");
  EXPECT_NE(log->open(folder.path(), {}), "");
  EXPECT_EQ(log->open("audit.log", {}), "not an absolute path");
}

TEST_F(AuditFile, IsNoGuardedFileUnderAnotherName) {
  const std::string guarded = folder.file("config.ldif");
  std::ofstream(guarded) << "dn: cn=configuration\n";
  ASSERT_EQ(link(guarded.c_str(), path.c_str()), 0);
  EXPECT_EQ(log->open(path, {{guarded}, {}}), "the same file as " + guarded);
}

TEST_F(AuditFile, StaysWhereItWasWhenTheNewPlaceIsRefused) {
  ASSERT_EQ(log->open(path, {}), "");
  EXPECT_NE(log->open(folder.file("missing/audit.log"), {}), "");
  write_and_wait("dn: cn=a\n\n");
  EXPECT_EQ(content_of(path), "version: 1\n\ndn: cn=a\n\n");
}

TEST_F(AuditFile, WithoutAFileRecordsAreMissedOutLoud) {
  EXPECT_NE(log->open(folder.file("missing/audit.log"), {}), "");
  EXPECT_TRUE(log->enabled());
  write_and_wait("dn: cn=a\n\n");
  write_and_wait("dn: cn=b\n\n");
  ASSERT_EQ(told().size(), 1U);
  ASSERT_EQ(log->open(path, {}), "");
  write_and_wait("dn: cn=c\n\n");
  ASSERT_TRUE(log->finish());
  EXPECT_EQ(told().back(), "the audit log is written again; records lost: 2");
  EXPECT_EQ(content_of(path), "version: 1\n\ndn: cn=c\n\n");
}

TEST_F(AuditFile, CanBeSwitchedOff) {
  ASSERT_EQ(log->open(path, {}), "");
  ASSERT_EQ(log->open("", {}), "");
  EXPECT_FALSE(log->enabled());
}

TEST_F(AuditFile, IsWrittenToTheEndBeforeTheProcessEnds) {
  ASSERT_EQ(log->open(path, {}), "");
  for (int i = 0; i < 100; ++i) log->write("dn: cn=" + std::to_string(i) + "\n\n");
  ASSERT_TRUE(log->finish());
  const std::string text = content_of(path);
  EXPECT_NE(text.find("dn: cn=0\n"), std::string::npos);
  EXPECT_NE(text.find("dn: cn=99\n"), std::string::npos);
}

TEST_F(AuditFile, KeepsNoPartOfARecordThatDoesNotFit) {
  ASSERT_EQ(log->open(path, {}), "");
  write_and_wait("dn: cn=a\n\n");
  const std::string before = content_of(path);
  {
    const FullDisk full(before.size() + 10);
    write_and_wait("dn: cn=" + std::string(100, 'b') + "\n\n");
  }
  EXPECT_EQ(content_of(path), before);
  EXPECT_EQ(told().size(), 1U);
  write_and_wait("dn: cn=c\n\n");
  EXPECT_EQ(content_of(path), before + "dn: cn=c\n\n");
}

TEST_F(AuditFile, TellsWhichFileItHasOpen) {
  EXPECT_TRUE(log->files_in_use().empty());
  ASSERT_EQ(log->open(path, {}), "");
  ASSERT_NE(log->open(folder.path(), {}), "");
  struct stat status {};
  ASSERT_EQ(stat(path.c_str(), &status), 0);
  ASSERT_EQ(log->files_in_use().size(), 1U);
  EXPECT_EQ(log->files_in_use().front().file, (FileIdentity{status.st_dev, status.st_ino}));
  EXPECT_EQ(log->files_in_use().front().as, "the audit log");
  ASSERT_EQ(log->open("", {}), "");
  EXPECT_TRUE(log->files_in_use().empty());
}

TEST_F(AuditFile, MakesNobodyWaitForARecordThatWasGivenUp) {
  bool called = false;
  log->when_written(0, [&called] { called = true; });
  EXPECT_TRUE(called);
}

// A file that cannot be made shorter again: what was written in part stays.
TEST(RecordFile, BeginsBehindAnEmptyLineWhenAPartCouldNotBeTakenBack) {
  const int number = memfd_create("records", MFD_ALLOW_SEALING | MFD_CLOEXEC);
  ASSERT_GE(number, 0);
  ASSERT_EQ(fcntl(number, F_ADD_SEALS, F_SEAL_SHRINK), 0);
  ASSERT_EQ(fcntl(number, F_SETFL, O_APPEND), 0);
  AppendedFile opened;
  opened.descriptor = Descriptor(number);
  RecordFile file("records", std::move(opened));
  const std::string first = "version: 1\n\ndn: cn=a\n\n";
  ASSERT_EQ(file.append("dn: cn=a\n\n"), 0);
  {
    const FullDisk full(first.size() + 10);
    EXPECT_EQ(file.append("dn: cn=bbbbbbbbb\n\n"), EFBIG);
  }
  ASSERT_EQ(file.append("dn: cn=c\n\n"), 0);
  ASSERT_EQ(file.append("dn: cn=d\n\n"), 0);
  EXPECT_EQ(content_of("/proc/self/fd/" + std::to_string(number)),
            first + "dn: cn=bbb\n\ndn: cn=c\n\ndn: cn=d\n\n");
}

TEST(RecordFile, SaysItsVersionAgainWhenThatCouldNotBeWritten) {
  char name[] = "/tmp/orv-records-XXXXXX";
  AppendedFile opened;
  opened.descriptor = Descriptor(mkostemp(name, O_APPEND));
  RecordFile file(name, std::move(opened));
  {
    const FullDisk full(4);
    EXPECT_EQ(file.append("dn: cn=a\n\n"), EFBIG);
  }
  EXPECT_EQ(content_of(name), "");
  ASSERT_EQ(file.append("dn: cn=b\n\n"), 0);
  EXPECT_EQ(content_of(name), "version: 1\n\ndn: cn=b\n\n");
  unlink(name);
}

// ---- a disk that hangs

using test::HungDisk;

class HungAuditFile : public AuditFile {
 protected:
  HungAuditFile() {
    EXPECT_EQ(log->open(path, {}), "");
    hung.emplace(path);
  }
  ~HungAuditFile() override {
    hung.reset();
    log.reset();
  }
  std::optional<HungDisk> hung;
};

TEST_F(HungAuditFile, EndsTheWaitForARecordAfterAMoment) {
  const auto before = std::chrono::steady_clock::now();
  write_and_wait("dn: cn=a\n\n");
  EXPECT_GE(std::chrono::steady_clock::now() - before, AuditLog::kPatience);
  EXPECT_EQ(HungDisk::written(path), "");
}

TEST_F(HungAuditFile, MakesTheNextNotWaitAtAll) {
  write_and_wait("dn: cn=a\n\n");
  const auto called = std::make_shared<std::atomic<bool>>(false);
  log->when_written(log->write("dn: cn=b\n\n"), [called] { *called = true; });
  EXPECT_TRUE(*called);
}

TEST_F(HungAuditFile, WritesWhatIsQueuedWhenItGoesOnAndMakesThemWaitAgain) {
  write_and_wait("dn: cn=a\n\n");
  log->write("dn: cn=b\n\n");
  hung.reset();
  // The call that hung has failed.
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (told().size() < 2 && std::chrono::steady_clock::now() < end) std::this_thread::yield();
  ASSERT_EQ(told().size(), 2U);
  EXPECT_EQ(told().back(), "the audit log is written again; records lost: 1");
  write_and_wait("dn: cn=c\n\n");
  EXPECT_EQ(HungDisk::written(path), "version: 1\n\ndn: cn=b\n\ndn: cn=c\n\n");
}

TEST_F(HungAuditFile, HasSettledWhenNobodyWaitsAnyMore) {
  std::atomic<int> called{0};
  for (int i = 0; i < 3; ++i)
    log->when_written(log->write("dn: cn=a\n\n"), [&called] { ++called; });
  EXPECT_EQ(called, 0);
  log->settle();
  EXPECT_EQ(called, 3);
}

TEST_F(HungAuditFile, IsLeftBehindInSilence) {
  log->write("dn: cn=a\n\n");
  EXPECT_FALSE(log->finish(std::chrono::milliseconds(10)));
  log.reset();
  const std::size_t before = told().size();
  hung->release_and_join("audit-log");
  EXPECT_EQ(told().size(), before);
}

TEST_F(HungAuditFile, SaysAtItsEndWhatIsNotWritten) {
  log->write("dn: cn=a\n\n");
  log->write("dn: cn=b\n\n");
  log->write("dn: cn=c\n\n");
  log.reset();
  ASSERT_EQ(told().size(), 1U);
  EXPECT_EQ(told().front(), "records of the audit log not written: 3");
  hung->release_and_join("audit-log");
}

TEST_F(HungAuditFile, KeepsAdministratorsRecordsInAFloodOfStrangers) {
  const std::string stranger = "dn: cn=stranger\nsn: " + std::string(4000, 'x') + "\n\n";
  const std::string administrator = "dn: cn=admin\nsn: " + std::string(4000, 'x') + "\n\n";
  const std::size_t fit = AuditLog::kMaxStrangersBytes / stranger.size();
  std::size_t taken = 0;
  for (std::size_t i = 0; i < 10 * fit; ++i)
    if (log->write(stranger, Attempt::of_stranger) != 0) ++taken;
  EXPECT_LE(taken, fit + 1);  // one is being written
  EXPECT_GT(taken, fit / 2);
  const std::size_t room = AuditLog::kMaxQueuedBytes / (administrator.size() + 256);
  for (std::size_t i = 0; i < room; ++i) EXPECT_NE(log->write(administrator), 0U);
  EXPECT_EQ(told().size(), 1U) << "not for every record";
  hung.reset();
  ASSERT_TRUE(log->finish(std::chrono::seconds(30)));
  const std::string text = HungDisk::written(path);
  std::size_t found = 0;
  for (std::size_t at = 0; (at = text.find("dn: cn=admin\n", at)) != std::string::npos; ++at)
    ++found;
  EXPECT_EQ(found, room);
  ASSERT_FALSE(told().empty());
  EXPECT_EQ(told().back(),
            "the audit log cannot keep up with attempts from outside; records given up: " +
                std::to_string(10 * fit - taken - 1));
}

}  // namespace
}  // namespace orv::server
