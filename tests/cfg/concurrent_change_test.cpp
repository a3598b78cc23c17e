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
  ConcurrentChangeTest() : ChangeTest(memory_directory()) {}

  // Adds until it is in; false when it is refused for another reason than another writer.
  bool add_in_turn(const std::string& dn) {
    return in_turn([&](_CFG* session) {
      Mods mods(NewEntry{{"ou", {dn}}});
      return cfg_add_s(session, dn.c_str(), mods.get());
    });
  }

  // The same with a value more for an entry that all writers change.
  bool modify_in_turn(const std::string& value) {
    return in_turn([&](_CFG* session) {
      Mods mods(NewEntry{{"ou", {value}}});
      return cfg_modify_s(session, "cn=top", mods.get());
    });
  }

  template <class Change>
  bool in_turn(Change change) {
    while (true) {
      CfgSession session(cfg_init(nullptr, 0));
      cfg_set_option(session.get(), kCfgOptConfigFile, path_.c_str());
      cfg_set_option(session.get(), kCfgOptSaveFile, save_.c_str());
      if (cfg_bind_s(session.get(), nullptr, nullptr, 128) != 0) return false;
      const int rc = change(session.get());
      if (rc != 51) return rc == 0;
    }
  }

  // Replaces the file as editors do.
  void replace_file(const std::string& content) {
    const std::string draft = directory_.file("draft");
    write_file(draft, content);
    ASSERT_EQ(std::rename(draft.c_str(), path_.c_str()), 0);
  }

  // Somebody else's lock, until the descriptor is closed.
  static int take_lock(const std::string& name) {
    const int lock = ::open(name.c_str(), O_RDWR | O_CREAT, 0600);
    EXPECT_EQ(::flock(lock, LOCK_EX), 0);
    return lock;
  }

  int add_with(cfg::FileCalls& files) {
    const CfgSession session = reopen();
    write_through(session, files);
    return add(session, "cn=a,cn=top", kEntry);
  }

  // Two processes, each of which writes so often, with a mark of its own each time. They end with 0
  // when every write succeeded.
  static void fork_writers(std::vector<pid_t>& children, int each,
                           const std::function<bool(const std::string& mark)>& write) {
    for (int writer = 0; writer < 2; ++writer) {
      children.push_back(::fork());
      ASSERT_GE(children.back(), 0);
      if (children.back() != 0) continue;
      for (int i = 0; i < each; ++i)
        if (!write(std::to_string(writer) + "-" + std::to_string(i))) ::_exit(1);
      ::_exit(0);
    }
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
  fork_writers(children, kEach,
               [this](const std::string& mark) { return add_in_turn("cn=" + mark + ",cn=top"); });
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

TEST_F(ConcurrentChangeTest, TwoProcessesThatModifyOneEntryLoseNothing) {
  constexpr int kEach = 15;
  write_file(path_, kBefore);
  std::vector<pid_t> children;
  fork_writers(children, kEach, [this](const std::string& mark) { return modify_in_turn(mark); });
  for (const pid_t child : children) {
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  }
  const auto attributes = search(reopen(), "cn=top", 0, nullptr)[0].attributes;
  ASSERT_EQ(attributes.size(), 2U);
  EXPECT_EQ(attributes[1].second.size(), 2U * kEach);
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
  const int lock = take_lock(path_ + ".lock");
  FaultyFiles files;  // its pauses take no time
  EXPECT_EQ(add_with(files), 51);
  EXPECT_EQ(read_file(path_), kBefore);
  ::close(lock);
  EXPECT_EQ(add_with(files), 0);
}

TEST_F(ConcurrentChangeTest, ALockThatIsGivenUpIsTaken) {
  write_file(path_, kBefore);
  const int lock = take_lock(path_ + ".lock");
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

// A lock on a file that has lost its name to another excludes nobody.
TEST_F(ConcurrentChangeTest, ALockFileThatIsReplacedMeanwhileIsNotTheLock) {
  write_file(path_, kBefore);
  const std::string name = path_ + ".lock";
  int others = -1;
  InterposedFiles files("lock", 0, [&] {
    ::unlink(name.c_str());
    others = take_lock(name);
  });
  EXPECT_EQ(add_with(files), 51);
  EXPECT_EQ(read_file(path_), kBefore);
  ::close(others);
  EXPECT_EQ(add_with(files), 0);
}

TEST_F(ConcurrentChangeTest, ALockFileThatIsReplacedAgainAndAgainIsGivenUp) {
  write_file(path_, kBefore);
  class ReplacedLock : public ObservedFiles {
   public:
    explicit ReplacedLock(std::string path) : path_(std::move(path)) {}
    int before_call(const char* name, const std::string& /*subject*/) override {
      if (name == std::string("lock")) {
        ::unlink(path_.c_str());
        write_file(path_, "");
      }
      return 0;
    }

   private:
    std::string path_;
  };
  ReplacedLock files(path_ + ".lock");
  EXPECT_EQ(add_with(files), 51);
  EXPECT_NE(told.find("keeps being replaced"), std::string::npos);
  EXPECT_EQ(read_file(path_), kBefore);
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

// The comparison goes by blocks of 64 KiB.
TEST_F(ConcurrentChangeTest, FilesOfAllSizesAreCompared) {
  constexpr std::size_t kBlock = std::size_t{64} * 1024;
  for (const std::size_t size : {kBlock - 1, kBlock, kBlock + 1, 2 * kBlock, 2 * kBlock + 1}) {
    SCOPED_TRACE(size);
    std::string text = std::string(kBefore) + "# ";
    text += std::string(size - text.size() - 1, 'x') + "\n";
    const CfgSession touched = open_for_change(text);
    replace_file(text);
    EXPECT_EQ(add(touched, "cn=a,cn=top", kEntry), 0);
    for (const auto& edited : {text + "\n", text.substr(0, size - 2) + "\n",
                               text.substr(0, size - 2) + "y\n", text.substr(0, text.size() / 2)}) {
      const CfgSession session = open_for_change(text);
      replace_file(edited);
      EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 51);
      EXPECT_EQ(read_file(path_), edited);
    }
  }
}

TEST_F(ConcurrentChangeTest, AnEditThatCannotBeKeptStopsTheNextWriter) {
  write_file(path_, kBefore);
  write_file(save_, "dn: cn=older\n");
  write_file(path_ + ".swap", kEdited);
  FaultyFiles undisturbed;
  // Every call that looks for a name, or gives it.
  for (const char* call : {"rename", "status_of"}) {
    RefusedCalls refusing(call, EACCES, ".rescued");
    EXPECT_EQ(add_with(refusing), 53);
    EXPECT_EQ(read_file(path_ + ".swap"), kEdited);
    EXPECT_EQ(read_file(path_), kBefore);
  }
  EXPECT_EQ(add_with(undisturbed), 0);
  EXPECT_EQ(read_file(path_ + ".rescued"), kEdited);
}

TEST_F(ConcurrentChangeTest, FileSystemsThatCannotExchangeOrLinkSayItInTheirWays) {
  const auto code = [this](const char* call, int error) {
    ::unlink(path_.c_str());
    ::unlink(save_.c_str());
    write_file(path_, kBefore);
    RefusedCalls files(call, error);
    const int rc = add_with(files);
    EXPECT_EQ(read_file(path_), rc == 0 ? kAfter : kBefore);
    if (rc == 0) {
      EXPECT_EQ(read_file(save_), kBefore);
    }
    return rc;
  };
  for (const int error : {EINVAL, ENOSYS, ENOTSUP}) EXPECT_EQ(code("exchange", error), 0);
  for (const int error : {EXDEV, EPERM, EMLINK, ENOTSUP, ENOSYS}) EXPECT_EQ(code("link", error), 0);
  EXPECT_EQ(code("exchange", EIO), 80);
  EXPECT_EQ(code("link", EIO), 80);
  EXPECT_EQ(code("link", EACCES), 53);
}

TEST_F(ConcurrentChangeTest, AFileThatIsGoneIsNotMadeAnew) {
  const CfgSession session = open_for_change(kBefore);
  ASSERT_EQ(::unlink(path_.c_str()), 0);
  EXPECT_EQ(add(session, "cn=a,cn=top", kEntry), 80);
  EXPECT_FALSE(exists(path_));
}

// What file systems can do.
constexpr Abilities kAllAbilities[] = {{true, true}, {true, false}, {false, true}, {false, false}};

// Edits the file before the n-th call of all, on a file system with these abilities.
class EditedMeanwhile : public FaultyFiles {
 public:
  EditedMeanwhile(Abilities abilities, std::size_t number, std::function<void()> edit)
      : FaultyFiles(abilities), number_(number), edit_(std::move(edit)) {}

  int before_call(const char* name, const std::string& subject) override {
    if (calls().size() == number_) {
      edit_();
      edited_ = true;
    }
    return FaultyFiles::before_call(name, subject);
  }
  [[nodiscard]] bool edited() const { return edited_; }

 private:
  std::size_t number_;
  std::function<void()> edit_;
  bool edited_ = false;
};

class EditedSaveTest : public ConcurrentChangeTest, public ::testing::WithParamInterface<bool> {
 protected:
  int change_with(cfg::FileCalls& files) {
    if (!GetParam()) return add_with(files);
    const CfgSession session = reopen();
    write_through(session, files);
    return modify(session, "cn=top", {{"ou", {"y"}}});
  }
  static const char* after() { return GetParam() ? "dn: cn=top\ncn: top\nou: y\n" : kAfter; }

  void start_anew() {
    for (const char* ending : {"", ".save", ".swap", ".rescued", ".lock"}) {
      ::unlink((path_ + ending).c_str());
    }
    write_file(path_, kBefore);
    write_file(save_, kSavedBefore);
  }

  // Whether the call is the one in front of which an edit cannot be noticed any more: a renaming
  // over the file.
  [[nodiscard]] bool is_renaming(const FaultyFiles::Call& call) const {
    return call.name == "rename" && call.subject == path_;
  }

  void expect_next_write() {
    const std::string content = read_file(path_);
    const CfgSession session = reopen();
    EXPECT_EQ(add(session, "cn=n,cn=top", {{"cn", {"n"}}}), 0) << told;
    EXPECT_EQ(read_file(path_), content + "\ndn: cn=n,cn=top\ncn: n\n");
    expect_tidy();
  }

  static constexpr const char* kSavedBefore = "dn: cn=older\ncn: older\n";
};

TEST_P(EditedSaveTest, AnEditAtAnyMomentOfASaveIsNotOverwritten) {
  for (const Abilities abilities : kAllAbilities) {
    std::size_t lost = 0;
    for (std::size_t number = 0;; ++number) {
      SCOPED_TRACE(::testing::Message() << "exchange " << abilities.exchange << ", link "
                                        << abilities.link << ", call " << number);
      start_anew();
      EditedMeanwhile files(abilities, number, [&] { replace_file(kEdited); });
      const int rc = change_with(files);
      if (!files.edited()) break;
      if (!abilities.exchange && is_renaming(files.calls()[number])) {
        // One moment is left where nothing but a renaming can be had.
        EXPECT_EQ(rc, 0);
        ++lost;
        continue;
      }
      // Behind the last comparison the edit replaces the change, as any later edit does.
      EXPECT_TRUE(rc == 51 || rc == 0) << rc;
      EXPECT_EQ(read_file(path_), kEdited);
      EXPECT_FALSE(exists(path_ + ".rescued"));
      expect_next_write();
      if (HasFailure()) return;
    }
    EXPECT_EQ(lost, abilities.exchange ? 0U : 1U);
  }
}

TEST_P(EditedSaveTest, AnEditInPlaceAtAnyMomentOfASaveIsNotOverwritten) {
  for (const Abilities abilities : kAllAbilities) {
    std::size_t lost = 0;
    for (std::size_t number = 0;; ++number) {
      SCOPED_TRACE(::testing::Message() << "exchange " << abilities.exchange << ", link "
                                        << abilities.link << ", call " << number);
      start_anew();
      EditedMeanwhile files(abilities, number, [&] { write_file(path_, kEdited); });
      const int rc = change_with(files);
      if (!files.edited()) break;
      if (!abilities.exchange && !abilities.link && is_renaming(files.calls()[number])) {
        EXPECT_EQ(rc, 0);
        ++lost;
        continue;
      }
      EXPECT_TRUE(rc == 51 || rc == 0) << rc;
      EXPECT_EQ(read_file(path_), kEdited);
      expect_next_write();
      if (HasFailure()) return;
    }
    EXPECT_EQ(lost, abilities.exchange || abilities.link ? 0U : 1U);
  }
}

TEST_P(EditedSaveTest, AnEditWhileAChangeIsTakenBackStays) {
  for (const Abilities abilities : kAllAbilities) {
    start_anew();
    FaultyFiles undisturbed(abilities);
    ASSERT_EQ(change_with(undisturbed), 0);
    std::size_t last_flush = undisturbed.calls().size();
    while (undisturbed.calls()[--last_flush].name != "flush") {
    }
    for (std::size_t number = last_flush;; ++number) {
      SCOPED_TRACE(::testing::Message() << "exchange " << abilities.exchange << ", link "
                                        << abilities.link << ", call " << number);
      start_anew();
      EditedMeanwhile files(abilities, number, [&] { replace_file(kEdited); });
      files.fail_at(last_flush, EIO, FaultyFiles::Lasting::once);
      const int rc = change_with(files);
      if (!files.edited()) break;
      EXPECT_EQ(rc, 80);
      if (!abilities.exchange && is_renaming(files.calls()[number])) continue;
      EXPECT_EQ(read_file(path_), kEdited);
      expect_next_write();
      if (HasFailure()) return;
    }
  }
}

TEST_P(EditedSaveTest, AnEditDoesNotBecomeTheSaveFile) {
  start_anew();
  InterposedFiles files("link", 0, [&] { replace_file(kEdited); });
  EXPECT_EQ(change_with(files), 51);
  EXPECT_EQ(read_file(path_), kEdited);
  EXPECT_EQ(read_file(save_), kSavedBefore);
  expect_tidy();
}

// The change is in place when the disk fails, and stays there when it fails for good.
TEST_P(EditedSaveTest, AChangeThatCannotBeTakenBackIsAnsweredWithAFailureAndToldAbout) {
  for (const Abilities abilities : kAllAbilities) {
    start_anew();
    FaultyFiles undisturbed(abilities);
    ASSERT_EQ(change_with(undisturbed), 0);
    std::size_t last_flush = undisturbed.calls().size();
    while (undisturbed.calls()[--last_flush].name != "flush") {
    }
    start_anew();
    told.clear();
    FaultyFiles files(abilities);
    files.fail_at(last_flush, EIO, FaultyFiles::Lasting::all);
    EXPECT_EQ(change_with(files), 80);
    EXPECT_EQ(read_file(path_), after());
    EXPECT_NE(told.find("could not be taken back"), std::string::npos) << told;
    expect_next_write();
  }
}

TEST_P(EditedSaveTest, WhatIsNoFilePutInPlaceAtAnyMomentStays) {
  for (const Abilities abilities : kAllAbilities) {
    for (std::size_t number = 0;; ++number) {
      SCOPED_TRACE(::testing::Message() << "exchange " << abilities.exchange << ", link "
                                        << abilities.link << ", call " << number);
      start_anew();
      EditedMeanwhile files(abilities, number, [&] {
        ::unlink(path_.c_str());
        ASSERT_EQ(::mkfifo(path_.c_str(), 0600), 0);
      });
      const int rc = change_with(files);
      if (!files.edited()) break;
      if (!abilities.exchange && is_renaming(files.calls()[number])) continue;
      EXPECT_TRUE(rc == 51 || rc == 53 || rc == 0) << rc;
      struct stat status {};
      ASSERT_EQ(::lstat(path_.c_str(), &status), 0);
      EXPECT_TRUE(S_ISFIFO(status.st_mode));
      expect_tidy();
      if (HasFailure()) return;
    }
  }
}

INSTANTIATE_TEST_SUITE_P(AddsAndModifies, EditedSaveTest, ::testing::Bool());

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

TEST_F(ConcurrentChangeTest, WhatWasKeptOnceIsNotOverwritten) {
  write_file(path_, kBefore);
  FaultyFiles files;
  for (int i = 1; i <= 3; ++i) {
    write_file(save_, "dn: cn=older\n");
    write_file(path_ + ".swap", std::string(kEdited) + std::to_string(i));
    const std::string dn = "cn=" + std::to_string(i) + ",cn=top";
    const CfgSession session = reopen();
    write_through(session, files);
    EXPECT_EQ(add(session, dn, kEntry), 0);
  }
  EXPECT_EQ(read_file(path_ + ".rescued"), std::string(kEdited) + "1");
  EXPECT_EQ(read_file(path_ + ".rescued-2"), std::string(kEdited) + "2");
  EXPECT_EQ(read_file(path_ + ".rescued-3"), std::string(kEdited) + "3");
  EXPECT_NE(told.find(".rescued-3: holds"), std::string::npos) << told;
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

TEST_F(ConcurrentChangeTest, AnAccessListThatWasInheritedIsTakenAway) {
  constexpr const char* kName = "system.posix_acl_access";
  write_file(path_, kBefore);
  write_file(save_, kBefore);
  if (::setxattr(save_.c_str(), kName, kAccessList, sizeof kAccessList, 0) != 0) {
    GTEST_SKIP() << "this file system has no access lists";
  }
  cfg::FileCalls& calls = cfg::system_file_calls();
  const int from = calls.open(path_.c_str(), O_RDONLY, 0);
  const int to = calls.open(save_.c_str(), O_WRONLY, 0);
  EXPECT_EQ(calls.copy_access_list(from, to), 0);
  EXPECT_LT(::getxattr(save_.c_str(), kName, nullptr, 0), 0);
  EXPECT_EQ(calls.copy_access_list(from, to), 0);
  EXPECT_EQ(calls.copy_access_list(-1, to), -1);
  EXPECT_EQ(calls.copy_access_list(from, -1), -1);
  calls.close(from);
  calls.close(to);
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
  const TemporaryDirectory other;  // on another file system
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
