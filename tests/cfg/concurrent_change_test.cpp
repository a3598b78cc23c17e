// Writers, readers and editors at the same time; what a change keeps of the file besides its text.
#include <fcntl.h>
#include <sys/file.h>
#include <sys/wait.h>
#include <sys/xattr.h>

#include <atomic>
#include <cstring>
#include <thread>

#include "change_fixture.h"
#include "faulty_files.h"

namespace orv::cfg_test {
namespace {

constexpr const char* kBefore = "dn: cn=top\ncn: top\n";
const NewEntry kEntry = {{"cn", {"a"}}};
constexpr const char* kAfter = "dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\ncn: a\n";

class ConcurrentChangeTest : public ChangeTest {
 protected:
  // Adds until it is in; false when it is refused for another reason than another writer.
  bool add_in_turn(const std::string& dn) {
    while (true) {
      CfgSession session(cfg_init(nullptr, 0));
      cfg_set_option(session.get(), kCfgOptConfigFile, path_.c_str());
      cfg_set_option(session.get(), kCfgOptSaveFile, save_.c_str());
      if (cfg_bind_s(session.get(), nullptr, nullptr, 128) != 0) return false;
      Mods mods(NewEntry{{"ou", {dn}}});
      const int rc = cfg_add_s(session.get(), dn.c_str(), mods.get());
      if (rc != 51) return rc == 0;
    }
  }

  // Replaces the file as editors do.
  void replace_file(const std::string& content) {
    const std::string draft = directory_.file("draft");
    write_file(draft, content);
    ASSERT_EQ(std::rename(draft.c_str(), path_.c_str()), 0);
  }

  int add_with(cfg::FileCalls& files) {
    const CfgSession session = reopen();
    write_through(session, files);
    return add(session, "cn=a,cn=top", kEntry);
  }

  void expect_tidy() {
    for (const char* leftover : {".new", ".swap", ".save.new"}) {
      EXPECT_FALSE(exists(path_ + leftover)) << leftover;
    }
  }

  static constexpr const char* kEdited = "dn: cn=top\ncn: top\n# edited\n";
};

// ---- Writers ----

TEST_F(ConcurrentChangeTest, TwoProcessesThatWriteLoseNothing) {
  constexpr int kEach = 20;
  write_file(path_, kBefore);
  std::vector<pid_t> children;
  for (int writer = 0; writer < 2; ++writer) {
    children.push_back(::fork());
    ASSERT_GE(children.back(), 0);
    if (children.back() != 0) continue;
    for (int i = 0; i < kEach; ++i) {
      const std::string dn = "cn=" + std::to_string(writer) + "-" + std::to_string(i) + ",cn=top";
      if (!add_in_turn(dn)) ::_exit(1);
    }
    ::_exit(0);
  }
  // Meanwhile each reader finds a whole file, and never fewer entries than before.
  std::size_t seen = 0;
  for (std::size_t done = 0; done < children.size();) {
    const std::size_t found = search(reopen(), "cn=top", 2, nullptr).size();
    EXPECT_GE(found, seen);
    seen = found;
    int status = 0;
    if (::waitpid(children[done], &status, WNOHANG) == 0) continue;
    EXPECT_EQ(status, 0);
    ++done;
  }
  EXPECT_EQ(search(reopen(), "cn=top", 2, nullptr).size(), 1U + 2 * kEach);
  expect_tidy();
}

TEST_F(ConcurrentChangeTest, ThreadsThatWriteLoseNothing) {
  constexpr int kEach = 10;
  write_file(path_, kBefore);
  std::atomic<int> failed{0};
  std::vector<std::thread> threads;
  for (int writer = 0; writer < 3; ++writer) {
    threads.emplace_back([&, writer] {
      for (int i = 0; i < kEach; ++i) {
        const std::string dn = "cn=" + std::to_string(writer) + "-" + std::to_string(i) + ",cn=top";
        if (!add_in_turn(dn)) ++failed;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failed.load(), 0);
  EXPECT_EQ(search(reopen(), "cn=top", 2, nullptr).size(), 1U + 3 * kEach);
}

TEST_F(ConcurrentChangeTest, ALockThatIsNotGivenUpIsNotWaitedForForEver) {
  write_file(path_, kBefore);
  const int lock = ::open((path_ + ".lock").c_str(), O_RDWR | O_CREAT, 0600);
  ASSERT_EQ(::flock(lock, LOCK_EX), 0);
  FaultyFiles files;  // its pauses take no time
  EXPECT_EQ(add_with(files), 51);
  EXPECT_EQ(read_file(path_), kBefore);
  ::close(lock);
  EXPECT_EQ(add_with(files), 0);
}

TEST_F(ConcurrentChangeTest, ALockThatIsGivenUpIsTaken) {
  write_file(path_, kBefore);
  int lock = ::open((path_ + ".lock").c_str(), O_RDWR | O_CREAT, 0600);
  ASSERT_EQ(::flock(lock, LOCK_EX), 0);
  InterposedFiles files("pause", 3, [&] { ::close(lock); });
  EXPECT_EQ(add_with(files), 0);
  EXPECT_EQ(read_file(path_), kAfter);
}

TEST_F(ConcurrentChangeTest, ALockFileThatIsRemovedMeanwhileIsTakenAnew) {
  write_file(path_, kBefore);
  InterposedFiles files("lock", 0, [&] { ::unlink((path_ + ".lock").c_str()); });
  EXPECT_EQ(add_with(files), 0);
  EXPECT_TRUE(exists(path_ + ".lock"));
}

TEST_F(ConcurrentChangeTest, ALockFileThatIsALinkIsNotFollowed) {
  write_file(path_, kBefore);
  ASSERT_EQ(::symlink("elsewhere", (path_ + ".lock").c_str()), 0);
  const CfgSession session = reopen();
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 80);
  EXPECT_FALSE(exists(directory_.file("elsewhere")));
}

// ---- Editors ----

TEST_F(ConcurrentChangeTest, AnEditSinceTheFileWasReadIsNotOverwritten) {
  const CfgSession session = open_for_change(kBefore);
  replace_file(kEdited);
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 51);
  EXPECT_EQ(read_file(path_), kEdited);
  EXPECT_FALSE(exists(save_));
  EXPECT_EQ(add(reopen(), "cn=a,cn=top", kEntry), 0);
  EXPECT_EQ(read_file(path_), std::string(kEdited) + "\ndn: cn=a,cn=top\ncn: a\n");
}

TEST_F(ConcurrentChangeTest, AnEditInPlaceIsNotOverwritten) {
  const CfgSession session = open_for_change(kBefore);
  write_file(path_, kEdited);
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 51);
  EXPECT_EQ(read_file(path_), kEdited);
}

TEST_F(ConcurrentChangeTest, AnEditThatLeavesSizeAndTimeIsNotOverwritten) {
  const CfgSession session = open_for_change(kBefore);
  struct stat status {};
  ASSERT_EQ(::stat(path_.c_str(), &status), 0);
  const std::string edited = "dn: cn=top\ncn: TOP\n";
  write_file(path_, edited);
  const timespec times[] = {status.st_atim, status.st_mtim};
  ASSERT_EQ(::utimensat(AT_FDCWD, path_.c_str(), times, 0), 0);
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 51);
  EXPECT_EQ(read_file(path_), edited);
  expect_tidy();
}

TEST_F(ConcurrentChangeTest, AFileThatWasOnlyTouchedIsChanged) {
  const CfgSession session = open_for_change(kBefore);
  replace_file(kBefore);
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 0);
  EXPECT_EQ(read_file(path_), kAfter);
}

TEST_F(ConcurrentChangeTest, AFileThatIsGoneIsNotMadeAnew) {
  const CfgSession session = open_for_change(kBefore);
  ASSERT_EQ(::unlink(path_.c_str()), 0);
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 80);
  EXPECT_FALSE(exists(path_));
}

TEST_F(ConcurrentChangeTest, AnEditAtAnyMomentOfASaveIsNotOverwritten) {
  for (const char* call : {"lock", "open", "write", "flush", "link", "rename", "exchange"}) {
    for (int number = 0; number < 4; ++number) {
      SCOPED_TRACE(::testing::Message() << call << " " << number);
      ::unlink(path_.c_str());
      write_file(path_, kBefore);
      bool edited = false;
      InterposedFiles files(call, number, [&] {
        replace_file(kEdited);
        edited = true;
      });
      const int rc = add_with(files);
      if (!edited) break;
      // Behind the exchange the edit replaces the change, as any later edit does.
      EXPECT_TRUE(rc == 51 || rc == 0) << rc;
      EXPECT_EQ(read_file(path_), kEdited);
      EXPECT_EQ(reopen()->key, nullptr);
      expect_tidy();
    }
  }
}

// Edits before the exchange, and again before the edit is put back in place.
class TwiceEdited : public ObservedFiles {
 public:
  explicit TwiceEdited(std::function<void(int)> edit) : edit_(std::move(edit)) {}
  int before_call(const char* name, const std::string& /*subject*/) override {
    if (name == std::string("exchange") && ++exchanges_ <= 2) edit_(exchanges_);
    return 0;
  }

 private:
  std::function<void(int)> edit_;
  int exchanges_ = 0;
};

TEST_F(ConcurrentChangeTest, OfTwoEditsDuringASaveTheLaterIsInPlace) {
  write_file(path_, kBefore);
  const std::string later = std::string(kEdited) + "# again\n";
  TwiceEdited files([&](int time) { replace_file(time == 1 ? kEdited : later); });
  EXPECT_EQ(add_with(files), 51);
  EXPECT_EQ(read_file(path_), later);
  EXPECT_EQ(read_file(path_ + ".rescued"), kEdited);
  expect_tidy();
}

TEST_F(ConcurrentChangeTest, WhatAStoppedWriterFoundInPlaceIsKept) {
  write_file(path_, kBefore);
  write_file(save_, "dn: cn=older\n");
  write_file(path_ + ".swap", kEdited);
  EXPECT_EQ(add(reopen(), "cn=a,cn=top", kEntry), 0);
  EXPECT_EQ(read_file(path_ + ".rescued"), kEdited);
  EXPECT_NE(told.find(".rescued"), std::string::npos);
  expect_tidy();
}

// ---- What is kept ----

TEST_F(ConcurrentChangeTest, PermissionsAndOwnerAreKept) {
  for (const mode_t mode : {0600U, 0640U, 0664U, 0444U}) {
    ::unlink(path_.c_str());
    write_file(path_, kBefore);
    const bool root = ::geteuid() == 0;
    if (root) {
      ASSERT_EQ(::chown(path_.c_str(), 1234, 2345), 0);
    }
    ASSERT_EQ(::chmod(path_.c_str(), mode), 0);
    EXPECT_EQ(add(reopen(), "cn=a,cn=top", kEntry), 0);
    EXPECT_EQ(read_file(path_), kAfter);
    for (const std::string& path : {path_, save_}) {
      struct stat status {};
      ASSERT_EQ(::stat(path.c_str(), &status), 0);
      EXPECT_EQ(status.st_mode & 07777, mode);
      EXPECT_EQ(status.st_uid, root ? 1234 : ::geteuid());
      EXPECT_EQ(status.st_gid, root ? 2345 : ::getegid());
    }
  }
}

// An access list: owner rw, the user 1234 rw, group none, mask rw, others none.
constexpr unsigned char kAccessList[] = {2,  0, 0, 0,                       // version
                                         1,  0, 6, 0, 255, 255, 255, 255,   // owner
                                         2,  0, 6, 0, 210, 4,   0,   0,     // user 1234
                                         4,  0, 0, 0, 255, 255, 255, 255,   // group
                                         16, 0, 6, 0, 255, 255, 255, 255,   // mask
                                         32, 0, 0, 0, 255, 255, 255, 255};  // others

TEST_F(ConcurrentChangeTest, AnAccessListIsKept) {
  constexpr const char* kName = "system.posix_acl_access";
  write_file(path_, kBefore);
  if (::setxattr(path_.c_str(), kName, kAccessList, sizeof kAccessList, 0) != 0) {
    ASSERT_EQ(errno, ENOTSUP);
    GTEST_SKIP() << "this file system has no access lists";
  }
  EXPECT_EQ(add(reopen(), "cn=a,cn=top", kEntry), 0);
  unsigned char list[256];
  ASSERT_EQ(::getxattr(path_.c_str(), kName, list, sizeof list),
            static_cast<ssize_t>(sizeof kAccessList));
  EXPECT_EQ(std::memcmp(list, kAccessList, sizeof kAccessList), 0);
}

TEST_F(ConcurrentChangeTest, ASymbolicLinkStaysAndItsTargetChanges) {
  const std::string target = directory_.file("real.ldif");
  write_file(target, kBefore);
  ASSERT_EQ(::symlink("real.ldif", path_.c_str()), 0);
  EXPECT_EQ(add(reopen(), "cn=a,cn=top", kEntry), 0);
  EXPECT_EQ(read_file(target), kAfter);
  struct stat status {};
  ASSERT_EQ(::lstat(path_.c_str(), &status), 0);
  EXPECT_TRUE(S_ISLNK(status.st_mode));
  EXPECT_TRUE(exists(target + ".lock"));
}

TEST_F(ConcurrentChangeTest, TheSaveFileIsTheFileBefore) {
  write_file(path_, kBefore);
  struct stat before {};
  ASSERT_EQ(::stat(path_.c_str(), &before), 0);
  const CfgSession session = reopen();
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 0);
  struct stat saved {};
  ASSERT_EQ(::stat(save_.c_str(), &saved), 0);
  EXPECT_EQ(saved.st_ino, before.st_ino);
  EXPECT_EQ(saved.st_nlink, 1U);
  EXPECT_EQ(remove(session, "cn=a,cn=top"), 0);
  EXPECT_EQ(read_file(save_), kAfter);
}

TEST_F(ConcurrentChangeTest, WithoutASaveFileNoneIsMade) {
  const CfgSession session = open(kBefore);
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 0);
  EXPECT_EQ(remove(session, "cn=a,cn=top"), 0);
  EXPECT_EQ(read_file(path_), kBefore);
  EXPECT_FALSE(exists(save_));
  expect_tidy();
}

TEST_F(ConcurrentChangeTest, ASaveFileMayLieInAnotherDirectory) {
  const TemporaryDirectory other(memory_directory());
  write_file(path_, kBefore);
  CfgSession session = unbound();
  ASSERT_EQ(cfg_set_option(session.get(), kCfgOptSaveFile, other.file("kept").c_str()), 0);
  ASSERT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 0);
  EXPECT_EQ(read_file(other.file("kept")), kBefore);
}

TEST_F(ConcurrentChangeTest, ASaveFileThatCannotBeMadeRefusesTheChange) {
  write_file(path_, kBefore);
  CfgSession session = unbound();
  ASSERT_EQ(cfg_set_option(session.get(), kCfgOptSaveFile, "/nowhere/at/all"), 0);
  ASSERT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 80);
  EXPECT_EQ(read_file(path_), kBefore);
  expect_tidy();
}

// Lets a test act as an ordinary user, also when root runs it.
class OrdinaryUser {
 public:
  OrdinaryUser() {
    if (::geteuid() == 0) static_cast<void>(::seteuid(65534));
  }
  ~OrdinaryUser() {
    if (::getuid() == 0) static_cast<void>(::seteuid(0));
  }
  OrdinaryUser(const OrdinaryUser&) = delete;
  OrdinaryUser& operator=(const OrdinaryUser&) = delete;
};

TEST_F(ConcurrentChangeTest, AChangeInADirectoryThatMayNotBeWrittenIsRefused) {
  write_file(path_, kBefore);
  const CfgSession session = reopen();
  ASSERT_EQ(::chmod(directory_.file("").c_str(), 0555), 0);
  {
    const OrdinaryUser user;
    EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 53);
  }
  ASSERT_EQ(::chmod(directory_.file("").c_str(), 0700), 0);
  EXPECT_EQ(read_file(path_), kBefore);
}

TEST_F(ConcurrentChangeTest, AFileWhoseOwnerCannotBeKeptIsNotChanged) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can make a file of another user";
  write_file(path_, kBefore);
  const CfgSession session = reopen();
  ASSERT_EQ(::chmod(path_.c_str(), 0666), 0);
  ASSERT_EQ(::chmod(directory_.file("").c_str(), 0777), 0);
  {
    const OrdinaryUser user;
    EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 53);
  }
  EXPECT_EQ(read_file(path_), kBefore);
  expect_tidy();
}

}  // namespace
}  // namespace orv::cfg_test
