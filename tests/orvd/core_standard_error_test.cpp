// Logs that somebody stopped reading: what is kept, what is given up, and how an end is found.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "../temporary_directory.h"
#include "cfg/text.h"
#include "logs.h"
#include "standard_error.h"
#include "stop_watchdog.h"

namespace orv::server {
namespace {

using orv::test::content_of;
using std::chrono::milliseconds;
using std::chrono::steady_clock;

// Descriptor 2 is the writing end of a small pipe for as long as the object lives.
class StuckStandardError {
 public:
  StuckStandardError() : before_(dup(STDERR_FILENO)) {
    std::signal(SIGPIPE, SIG_IGN);  // as in the server: readers leave while somebody writes
    int ends[2];
    EXPECT_EQ(pipe2(ends, O_CLOEXEC), 0);
    reader_ = ends[0];
    fcntl(ends[1], F_SETPIPE_SZ, 4096);
    dup2(ends[1], STDERR_FILENO);
    close(ends[1]);
  }
  ~StuckStandardError() {
    restore();
    close(reader_);
  }
  void restore() {
    if (before_ < 0) return;
    dup2(before_, STDERR_FILENO);
    close(before_);
    before_ = -1;
  }
  // Everything that was written; ends when descriptor 2 is restored.
  std::string read_all() const {
    std::string text;
    char chunk[65536];
    for (ssize_t n; (n = read(reader_, chunk, sizeof chunk)) > 0;)
      text.append(chunk, static_cast<std::size_t>(n));
    return text;
  }

 private:
  int before_;
  int reader_ = -1;
};

class StuckLogs : public testing::Test {
 protected:
  const std::string line_ = std::string(Logs::kMaxErrorLine, 'x');
};

TEST_F(StuckLogs, HoldNoMoreBytesThanTheirBoundAndSayWhatTheyGaveUp) {
  StuckStandardError stuck;
  Logs logs;
  for (int i = 0; i < 10000; ++i) logs.info(line_);
  EXPECT_LE(logs.queued_bytes(), Logs::kMaxQueuedBytes);
  EXPECT_GT(logs.queued_bytes(), Logs::kMaxQueuedBytes / 2);
  logs.error("the last line");
  std::string text;
  std::thread reader([&] { text = stuck.read_all(); });
  EXPECT_TRUE(logs.finish(milliseconds(60000)));
  stuck.restore();
  reader.join();
  EXPECT_NE(text.find("pieces of log were given up"), std::string::npos);
  EXPECT_NE(text.find("the last line"), std::string::npos);
}

TEST_F(StuckLogs, CutALineThatIsTooLongBetweenCharactersAndTellItsLength) {
  StuckStandardError stuck;
  std::string text;
  std::thread reader([&] { text = stuck.read_all(); });
  for (const char* before : {"", "."}) {
    std::string line = before;
    while (line.size() < 2 * Logs::kMaxQueuedBytes) line += "\u00e4";
    Logs logs;
    logs.info(line);
    EXPECT_TRUE(logs.finish(milliseconds(60000)));
  }
  stuck.restore();
  reader.join();
  EXPECT_LT(text.size(), 2 * (Logs::kMaxErrorLine + 100));
  EXPECT_NE(text.find("\u00e4... (16777216 bytes)"), std::string::npos) << text;
  EXPECT_NE(text.find("\u00e4... (16777217 bytes)"), std::string::npos) << text;
  EXPECT_TRUE(cfg::is_valid_utf8(text));
}

TEST_F(StuckLogs, AreLeftBehindWhenNobodyTakesThem) {
  StuckStandardError stuck;
  std::string text;
  std::thread reader;
  {
    Logs logs;
    for (int i = 0; i < 10; ++i) logs.info(line_);
    const auto started = steady_clock::now();
    EXPECT_FALSE(logs.finish(milliseconds(20)));
    EXPECT_LT(steady_clock::now() - started, std::chrono::seconds(30));
    // The thread that was left behind gets its reader, so that it ends before the test does.
    reader = std::thread([&] { text = stuck.read_all(); });
    while (logs.queued_bytes() > 0) std::this_thread::yield();
  }
  stuck.restore();
  reader.join();
}

TEST(StandardErrorInPlace, MakesNobodyWaitAndTellsWhatWasDropped) {
  StuckStandardError stuck;
  std::string text;
  std::thread reader;
  {
    const StandardError in_place;
    const std::string line(1000, 'y');
    for (int i = 0; i < 10000; ++i) std::fprintf(stderr, "%s\n", line.c_str());
    reader = std::thread([&] { text = stuck.read_all(); });
    drain_standard_error(milliseconds(60000));
    std::fprintf(stderr, "after\n");
  }
  stuck.restore();
  reader.join();
  EXPECT_NE(text.find(" bytes of standard error were dropped"), std::string::npos);
  EXPECT_TRUE(text.ends_with("after\n"))
      << text.substr(text.size() - std::min<std::size_t>(text.size(), 100));
  std::istringstream lines(text);
  for (std::string one; std::getline(lines, one);)
    EXPECT_TRUE(one.size() == 1000 || one == "after" || one.starts_with("orvd: ")) << one;
}

TEST(StandardErrorInPlace, PutsTheOriginalBackAndLosesNothingThatFits) {
  StuckStandardError outer;
  std::string text;
  std::thread reader([&] { text = outer.read_all(); });
  {
    const StandardError in_place;
    for (int i = 0; i < 1000; ++i) std::fprintf(stderr, "line %d\n", i);
  }
  std::fprintf(stderr, "original\n");
  outer.restore();
  reader.join();
  std::string expected;
  for (int i = 0; i < 1000; ++i) expected += "line " + std::to_string(i) + "\n";
  EXPECT_EQ(text, expected + "original\n");
}

TEST(StandardErrorInPlace, GivesUpOnAReaderThatNeverComes) {
  const auto started = steady_clock::now();
  StuckStandardError stuck;
  {
    const StandardError in_place;
    const std::string line(1000, 'z');
    for (int i = 0; i < 100; ++i) std::fprintf(stderr, "%s\n", line.c_str());
  }
  EXPECT_GE(steady_clock::now() - started, StandardError::kPatience);
  EXPECT_LT(steady_clock::now() - started, StandardError::kPatience + std::chrono::seconds(30));
}

// ---- a stop that hangs

TEST(StopWatchdogDeathTest, EndsAProcessWhoseStopHangs) {
  testing::FLAGS_gtest_death_test_style = "threadsafe";
  EXPECT_EXIT(
      {
        const StopWatchdog watchdog(milliseconds(1));
        for (;;) pause();
      },
      testing::ExitedWithCode(1), "");
}

TEST(StopWatchdogTest, DoesNothingOnceTheStopIsDone) {
  const auto started = steady_clock::now();
  { const StopWatchdog watchdog(std::chrono::hours(1)); }
  EXPECT_LT(steady_clock::now() - started, std::chrono::minutes(1));
}

// ---- which files may be logs

class LogFiles : public testing::Test {
 protected:
  void SetUp() override {
    settings_.error_log = file("error.log");
    settings_.access_log = file("access.log");
    settings_.access_log_level = "info";
  }
  std::string file(const std::string& name) const { return folder_.file(name); }

  const orv::test::TemporaryDirectory folder_;
  Settings settings_;
};

TEST_F(LogFiles, AreNeverOneFileUnderTwoNames) {
  Logs logs;
  settings_.access_log = settings_.error_log;
  EXPECT_EQ(logs.open(settings_).size(), 1U);
  EXPECT_FALSE(logs.access_enabled());
  settings_.access_log = file("alias");
  ASSERT_EQ(symlink(settings_.error_log.c_str(), settings_.access_log.c_str()), 0);
  EXPECT_EQ(logs.open(settings_).size(), 1U);
  EXPECT_FALSE(logs.access_enabled());
}

TEST_F(LogFiles, MayChangePlaces) {
  Logs logs;
  ASSERT_TRUE(logs.open(settings_).empty());
  std::swap(settings_.error_log, settings_.access_log);
  EXPECT_TRUE(logs.open(settings_).empty());
  logs.error("an error");
  logs.write_access("an access\n");
  logs.finish();
  EXPECT_NE(content_of(settings_.error_log).find("an error"), std::string::npos);
  EXPECT_NE(content_of(settings_.access_log).find("an access"), std::string::npos);
}

TEST_F(LogFiles, DoNotTakeWhatTheOtherOneKeeps) {
  Logs logs;
  ASSERT_TRUE(logs.open(settings_).empty());
  settings_.error_log = settings_.access_log;
  settings_.access_log = folder_.path();  // refused, so that the access log stays where it is
  EXPECT_EQ(logs.open(settings_).size(), 2U);
  logs.error("an error");
  logs.finish();
  EXPECT_NE(content_of(file("error.log")).find("an error"), std::string::npos);
  EXPECT_EQ(content_of(file("access.log")), "");
}

TEST_F(LogFiles, AreNoFileThatAnotherLogHasOpenUnderWhateverName) {
  const std::string audit = file("audit.log");
  std::ofstream(audit) << "dn: cn=a\n";
  struct stat status {};
  ASSERT_EQ(stat(audit.c_str(), &status), 0);
  const std::vector<FileInUse> others = {{{status.st_dev, status.st_ino}, "the audit log"}};
  ASSERT_EQ(rename(audit.c_str(), file("moved").c_str()), 0);
  Logs logs;
  ASSERT_TRUE(logs.open(settings_, others).empty());
  const Settings before = settings_;
  settings_.error_log = file("moved");
  settings_.access_log = file("moved");
  EXPECT_THAT(logs.open(settings_, others),
              testing::Each(testing::EndsWith("the same file as the audit log")));
  logs.error("an error");
  logs.write_access("an access\n");
  logs.finish();
  EXPECT_EQ(content_of(file("moved")), "dn: cn=a\n");
  EXPECT_NE(content_of(before.error_log).find("an error"), std::string::npos);
  EXPECT_NE(content_of(before.access_log).find("an access"), std::string::npos);
}

TEST_F(LogFiles, AreToldWithWhatTheyAreUsedFor) {
  Logs logs;
  EXPECT_TRUE(logs.files_in_use().empty());
  ASSERT_TRUE(logs.open(settings_).empty());
  const std::vector<FileInUse> files = logs.files_in_use();
  ASSERT_EQ(files.size(), 2U);
  EXPECT_EQ(files[0].as, "the error log");
  EXPECT_EQ(files[1].as, "the access log");
  settings_.error_log = "";
  settings_.access_log_level = "off";
  ASSERT_TRUE(logs.open(settings_).empty());
  EXPECT_TRUE(logs.files_in_use().empty());
}

TEST_F(LogFiles, AreNotMadeInPlaceOfAGuardedFileThatIsMissing) {
  settings_.error_log = file("config.ldif.save");
  Logs logs({{file("config.ldif.save")}, {}});
  EXPECT_EQ(logs.open(settings_).size(), 1U);
  EXPECT_FALSE(std::filesystem::exists(settings_.error_log));
}

}  // namespace
}  // namespace orv::server
