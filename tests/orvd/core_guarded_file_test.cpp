// Files to append to: what is opened, what is made, and what is refused.
#include "guarded_file.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "../temporary_directory.h"

namespace orv::server {
namespace {

using orv::test::content_of;

class GuardedFile : public testing::TestWithParam<int> {
 protected:
  std::string open(const GuardedFiles& guarded = {}) {
    return open_to_append(path, GetParam(), guarded, file);
  }
  bool follows_links() const { return (GetParam() & O_NOFOLLOW) == 0; }
  static void fill(const std::string& name, const char* text) { std::ofstream(name) << text; }
  static FileIdentity identity(const std::string& name) {
    struct stat status {};
    EXPECT_EQ(stat(name.c_str(), &status), 0);
    return {status.st_dev, status.st_ino};
  }

  const orv::test::TemporaryDirectory folder;
  std::string path = folder.file("log");
  AppendedFile file;
};

TEST_P(GuardedFile, IsMadeForItsOwnerOnly) {
  const mode_t before = umask(0);
  EXPECT_EQ(open(), "");
  umask(before);
  struct stat status {};
  ASSERT_EQ(stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600U);
  EXPECT_EQ(file.identity, identity(path));
  EXPECT_EQ(file.size, 0);
}

TEST_P(GuardedFile, IsAppendedTo) {
  fill(path, "before ");
  ASSERT_EQ(open(), "");
  EXPECT_EQ(file.size, 7);
  ASSERT_EQ(lseek(file.descriptor.number(), 0, SEEK_SET), 0);
  ASSERT_EQ(write(file.descriptor.number(), "after", 5), 5);
  EXPECT_EQ(content_of(path), "before after");
}

TEST_P(GuardedFile, IsNotHandedOnToProgramsThatAreStarted) {
  ASSERT_EQ(open(), "");
  EXPECT_NE(fcntl(file.descriptor.number(), F_GETFD) & FD_CLOEXEC, 0);
}

TEST_P(GuardedFile, ThatCannotBeOpenedSaysWhy) {
  path = folder.file("missing/log");
  EXPECT_EQ(open(), "No such file or directory");
  path = folder.path();
  EXPECT_EQ(open(), "Is a directory");
  EXPECT_EQ(file.descriptor.number(), -1);
}

TEST_P(GuardedFile, IsARegularFile) {
  ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
  const int reader = ::open(path.c_str(), O_RDONLY | O_NONBLOCK);
  EXPECT_EQ(open(), "not a regular file");
  close(reader);
  path = "/dev/null";
  EXPECT_EQ(open(), "not a regular file");
}

TEST_P(GuardedFile, DoesNotWaitForTheReaderOfAPipe) {
  ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
  EXPECT_NE(open(), "");
}

TEST_P(GuardedFile, IsNoGuardedFileUnderAnotherName) {
  const std::string other = folder.file("config.ldif");
  fill(other, "precious");
  ASSERT_EQ(link(other.c_str(), path.c_str()), 0);
  EXPECT_EQ(open({{"", folder.file("missing"), other}, {}}), "the same file as " + other);
  EXPECT_EQ(content_of(other), "precious");
}

TEST_P(GuardedFile, IsNoFileInUseEvenWithoutItsName) {
  fill(path, "");
  const FileIdentity used = identity(path);
  const std::string moved = folder.file("moved");
  ASSERT_EQ(rename(path.c_str(), moved.c_str()), 0);
  path = moved;
  EXPECT_EQ(open({{}, {{used, "the audit log"}}}), "the same file as the audit log");
  EXPECT_TRUE(std::filesystem::exists(moved));
}

TEST_P(GuardedFile, IsGoneAgainWhenItWasMadeToBeRefused) {
  EXPECT_EQ(open({{path}, {}}), "the same file as " + path);
  EXPECT_FALSE(std::filesystem::exists(path));
}

TEST_P(GuardedFile, StaysWhenItWasThereAndIsRefused) {
  fill(path, "precious");
  EXPECT_NE(open({{path}, {}}), "");
  EXPECT_EQ(content_of(path), "precious");
}

TEST_P(GuardedFile, LeavesWhatWasOpenWhenItIsRefused) {
  ASSERT_EQ(open(), "");
  const int number = file.descriptor.number();
  const FileIdentity before = file.identity;
  EXPECT_NE(open({{path}, {}}), "");
  EXPECT_EQ(file.descriptor.number(), number);
  EXPECT_EQ(file.identity, before);
}

TEST_P(GuardedFile, FollowsASymbolicLinkOnlyWhereThatIsWanted) {
  const std::string target = folder.file("target");
  fill(target, "x");
  ASSERT_EQ(symlink(target.c_str(), path.c_str()), 0);
  EXPECT_EQ(open(), follows_links() ? "" : "a symbolic link");
  EXPECT_EQ(file.identity, follows_links() ? identity(target) : FileIdentity{});
}

TEST_P(GuardedFile, FollowsALinkThatLeadsNowhereYet) {
  const std::string target = folder.file("target");
  ASSERT_EQ(symlink(target.c_str(), path.c_str()), 0);
  EXPECT_EQ(open(), follows_links() ? "" : "a symbolic link");
  EXPECT_EQ(std::filesystem::exists(target), follows_links());
}

TEST_P(GuardedFile, OfALinkToItselfIsRefused) {
  ASSERT_EQ(symlink(path.c_str(), path.c_str()), 0);
  EXPECT_NE(open(), "");
}

TEST_P(GuardedFile, IsNoGuardedFileThroughALink) {
  const std::string other = folder.file("config.ldif");
  fill(other, "precious");
  ASSERT_EQ(symlink(other.c_str(), path.c_str()), 0);
  EXPECT_EQ(open({{other}, {}}), follows_links() ? "the same file as " + other : "a symbolic link");
}

INSTANTIATE_TEST_SUITE_P(WithEveryAccess, GuardedFile,
                         testing::Values(O_WRONLY, O_RDWR | O_NOFOLLOW),
                         [](const testing::TestParamInfo<int>& tested) {
                           return tested.param == O_WRONLY ? "Writing" : "ReadingWithoutLinks";
                         });

TEST(RegularFileOf, IsNoneForWhatIsNoFile) {
  int ends[2];
  ASSERT_EQ(pipe(ends), 0);
  EXPECT_FALSE(regular_file_of(ends[0]));
  close(ends[0]);
  close(ends[1]);
  EXPECT_FALSE(regular_file_of(-1));
}

TEST(RegularFileOf, IsTheFileThatADescriptorLeadsTo) {
  char name[] = "/tmp/orv-guarded-XXXXXX";
  const Descriptor file(mkstemp(name));
  struct stat status {};
  ASSERT_EQ(stat(name, &status), 0);
  unlink(name);
  EXPECT_EQ(regular_file_of(file.number()), (FileIdentity{status.st_dev, status.st_ino}));
}

}  // namespace
}  // namespace orv::server
