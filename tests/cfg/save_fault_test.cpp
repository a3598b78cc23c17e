// Every file call of a save fails, with every error, once or for good: the change is refused, the
// old file stands, and the next write works.
#include <dirent.h>

#include <algorithm>
#include <cstring>
#include <new>
#include <set>

#include "change_fixture.h"
#include "faulty_files.h"
#include "file_text.h"
#include "save.h"

namespace orv::cfg_test {
namespace {

using Lasting = FaultyFiles::Lasting;

constexpr const char* kBefore = "# a\ndn: cn=top\ncn: top\n\n# b\n";
constexpr const char* kAfter = "# a\ndn: cn=top\ncn: top\n\ndn: cn=a,cn=top\ncn: a\n\n# b\n";
constexpr const char* kModified = "# a\ndn: cn=top\ncn: top\nou: y\n\n# b\n";
constexpr const char* kSavedBefore = "dn: cn=older\ncn: older\n";

// A change, and what it makes of a file.
struct TriedChange {
  const char* before;
  const char* after;
  int (*run)(const CfgSession& session);
};
constexpr TriedChange kAdd = {kBefore, kAfter, [](const CfgSession& session) {
                                return add(session, "cn=a,cn=top", {{"cn", {"a"}}});
                              }};
constexpr TriedChange kDelete = {
    kAfter, kBefore, [](const CfgSession& session) { return remove(session, "cn=a,cn=top"); }};
constexpr TriedChange kModify = {
    kBefore, kModified, [](const CfgSession& session) {
      return modify(session, "cn=top",
                    {{"o", {"x"}}, {"ou", {"y"}, true}, {"o", {}, true, kModDelete}});
    }};

class SaveFaultTest : public ChangeTest {
 protected:
  SaveFaultTest() : ChangeTest(memory_directory()) {}

  std::set<std::string> names() const {
    std::set<std::string> found;
    DIR* const directory = ::opendir(directory_.file("").c_str());
    while (const dirent* const entry = ::readdir(directory)) found.insert(entry->d_name);
    ::closedir(directory);
    found.erase(".");
    found.erase("..");
    return found;
  }

  void set_up_files(bool leftovers) {
    for (const std::string& name : names()) ::unlink(directory_.file(name).c_str());
    write_file(path_, change_.before);
    write_file(save_, kSavedBefore);
    if (!leftovers) return;
    write_file(path_ + ".new", "dn: cn=to");
    write_file(save_ + ".new", "dn:");
    write_file(path_ + ".swap", kSavedBefore);
  }

  // The calls of a change that nothing disturbs.
  std::vector<FaultyFiles::Call> undisturbed(Abilities abilities, bool leftovers) {
    set_up_files(leftovers);
    FaultyFiles files(abilities);
    const CfgSession session = reopen();
    write_through(session, files);
    EXPECT_EQ(change_.run(session), 0);
    EXPECT_EQ(read_file(path_), change_.after);
    EXPECT_EQ(read_file(save_), change_.before);
    EXPECT_EQ(names(), kTidy);
    return files.calls();
  }

  // The last flush.
  static std::size_t flush_of_names(const std::vector<FaultyFiles::Call>& calls) {
    std::size_t number = calls.size();
    while (calls[--number].name != "flush") {
    }
    return number;
  }

  // The result of an add whose flush of the names fails once.
  int add_with_names_not_flushed(int error) {
    const std::size_t number = flush_of_names(undisturbed({}, false));
    set_up_files(false);
    FaultyFiles files;
    files.fail_at(number, error, Lasting::once);
    const CfgSession session = reopen();
    write_through(session, files);
    return add(session, "cn=a,cn=top", {{"cn", {"a"}}});
  }

  // Whether a change may succeed although this call fails: nothing depends on its answer.
  static bool may_fail(const FaultyFiles::Call& call, std::size_t number, std::size_t commit) {
    if (call.name == "close" || call.name == "pause" || number > commit) return true;
    if (call.name == "status_of" && call.subject.find(".swap") == std::string::npos) return true;
    // A lock file that cannot be shared with the owner, and a leftover that is none.
    return call.name == "set_mode" || call.name == "set_owner";
  }

  // Whether a call that a signal interrupted is made again; a flush never is.
  static bool is_repeated(const std::string& name) {
    return name == "open" || name == "read" || name == "write" || name == "lock";
  }

  void check_refused(int rc, const CfgSession& session, const std::vector<FoundEntry>& shown) {
    EXPECT_TRUE(rc == 51 || rc == 53 || rc == 80 || rc == 90) << rc;
    EXPECT_EQ(read_file(path_), change_.before);
    EXPECT_STRNE(cfg_dump_exception(session.get()), "");
    EXPECT_EQ(search(session, "cn=top", 2, nullptr), shown);
  }

  // An entry more, between what is there and the comment at the end.
  void check_next_write() {
    const std::string content = read_file(path_);
    const CfgSession session = reopen();
    FaultyFiles files;
    write_through(session, files);
    EXPECT_EQ(add(session, "cn=n,cn=top", {{"cn", {"n"}}}), 0) << told;
    const std::string end = "\n# b\n";
    EXPECT_EQ(read_file(path_),
              content.substr(0, content.size() - end.size()) + "\ndn: cn=n,cn=top\ncn: n\n" + end);
    EXPECT_EQ(read_file(save_), content);
    EXPECT_EQ(names(), kTidy);
  }

  // One call fails in one way.
  void try_fault(Abilities abilities, bool leftovers, std::size_t number, int error,
                 Lasting lasting, bool must_refuse) {
    set_up_files(leftovers);
    FaultyFiles files(abilities);
    files.fail_at(number, error, lasting);
    const CfgSession session = reopen();
    write_through(session, files);
    const auto shown = search(session, "cn=top", 2, nullptr);
    const int rc = change_.run(session);
    EXPECT_TRUE(files.has_failed());
    if (must_refuse) {
      EXPECT_NE(rc, 0);
    }
    if (error == EINTR && lasting == Lasting::once && is_repeated(files.calls()[number].name)) {
      EXPECT_EQ(rc, 0);
    }
    if (rc == 0) {
      EXPECT_EQ(read_file(path_), change_.after);
    } else if (lasting == Lasting::all && read_file(path_) != change_.before) {
      // Nothing could be taken back any more; whole it is all the same.
      EXPECT_EQ(read_file(path_), change_.after);
    } else {
      check_refused(rc, session, shown);
    }
    check_next_write();
  }

  void try_every_fault(Abilities abilities, bool leftovers) {
    const auto calls = undisturbed(abilities, leftovers);
    const std::size_t commit = flush_of_names(calls);
    for (std::size_t number = 0; number < calls.size(); ++number) {
      for (const int error : {EIO, ENOSPC, EDQUOT, EROFS, EACCES, EINTR}) {
        for (const Lasting lasting : {Lasting::once, Lasting::kind, Lasting::all}) {
          SCOPED_TRACE(::testing::Message()
                       << "call " << number << " " << calls[number].name << " "
                       << calls[number].subject << ", " << ::strerror(error)
                       << (lasting == Lasting::once ? ", once" : ", from then on"));
          const bool forgiven = may_fail(calls[number], number, commit) ||
                                (error == EINTR && lasting == Lasting::once);
          try_fault(abilities, leftovers, number, error, lasting, !forgiven);
          if (HasFailure()) return;
        }
      }
    }
  }

  TriedChange change_ = kAdd;
  static const std::set<std::string> kTidy;
};

const std::set<std::string> SaveFaultTest::kTidy = {"config.ldif", "config.ldif.lock",
                                                    "config.ldif.save"};

// ---- Failing calls ----

TEST_F(SaveFaultTest, EveryCallFails) {
  try_every_fault({}, false);
}

TEST_F(SaveFaultTest, EveryCallFailsWhereThereIsNoExchange) {
  try_every_fault({false, true}, false);
}

TEST_F(SaveFaultTest, EveryCallFailsWhereThereAreNoHardLinks) {
  try_every_fault({true, false}, false);
}

TEST_F(SaveFaultTest, EveryCallFailsWhereThereIsNeither) {
  try_every_fault({false, false}, false);
}

TEST_F(SaveFaultTest, EveryCallFailsWhileLeftoversAreCleared) {
  try_every_fault({}, true);
}

TEST_F(SaveFaultTest, EveryCallOfADeleteFails) {
  change_ = kDelete;
  try_every_fault({}, false);
}

TEST_F(SaveFaultTest, EveryCallOfAModifyFails) {
  change_ = kModify;
  try_every_fault({}, false);
}

TEST_F(SaveFaultTest, EveryCallOfAModifyFailsWhereThereIsNoExchange) {
  change_ = kModify;
  try_every_fault({false, true}, false);
}

TEST_F(SaveFaultTest, EveryCallOfAModifyFailsWhereThereAreNoHardLinks) {
  change_ = kModify;
  try_every_fault({true, false}, true);
}

TEST_F(SaveFaultTest, EveryCallOfAModifyFailsWhereThereIsNeither) {
  change_ = kModify;
  try_every_fault({false, false}, true);
}

TEST_F(SaveFaultTest, CodesTellWhatAnAdministratorCanDo) {
  const auto code = [this](const char* name, int error) {
    const auto calls = undisturbed({}, false);
    std::size_t number = 0;
    while (calls[number].name != name) ++number;
    set_up_files(false);
    FaultyFiles files;
    files.fail_at(number, error, Lasting::kind);
    const CfgSession session = reopen();
    write_through(session, files);
    return add(session, "cn=a,cn=top", {{"cn", {"a"}}});
  };
  EXPECT_EQ(code("write", ENOSPC), 80);
  EXPECT_EQ(code("flush", EIO), 80);
  EXPECT_EQ(code("open", EROFS), 53);
  EXPECT_EQ(code("exchange", EACCES), 53);
  EXPECT_EQ(code("rename", EPERM), 53);
  EXPECT_EQ(code("write", ENOMEM), 90);
  EXPECT_NE(told.find("No space left on device"), std::string::npos);
}

// ---- Versions that must not be put in place ----

TEST_F(SaveFaultTest, AVersionThatIsNotAcceptableIsNotPutInPlace) {
  for (const bool throws : {false, true}) {
    set_up_files(false);
    cfg::FileText before;
    cfg::FileText after;
    std::string why;
    ASSERT_TRUE(before.read(cfg::system_file_calls(), path_.c_str(), why)) << why;
    after.assign(kAfter, std::strlen(kAfter));
    const cfg::SaveJob job{path_.c_str(), save_.c_str(), before, after, [throws] {
                             if (throws) throw std::bad_alloc();
                             return false;
                           }};
    EXPECT_EQ(cfg::save(cfg::system_file_calls(), job, why), throws ? 90 : 80);
    EXPECT_NE(why.find(path_), std::string::npos);
    EXPECT_EQ(read_file(path_), kBefore);
    EXPECT_EQ(read_file(save_), kSavedBefore);
    EXPECT_EQ(names(), kTidy);
  }
}

// ---- Short writes ----

class ShortWrites : public cfg::FileCalls {
 public:
  explicit ShortWrites(std::size_t most) : most_(most) {}
  ssize_t write(int file, const void* from, std::size_t size) override {
    return most_ == 0 ? 0 : FileCalls::write(file, from, std::min(size, most_));
  }

 private:
  std::size_t most_;
};

TEST_F(SaveFaultTest, ShortWritesAreContinued) {
  for (const std::size_t most : {std::size_t{1}, std::size_t{7}}) {
    set_up_files(false);
    ShortWrites files(most);
    const CfgSession session = reopen();
    write_through(session, files);
    EXPECT_EQ(add(session, "cn=a,cn=top", {{"cn", {"a"}}}), 0);
    EXPECT_EQ(read_file(path_), kAfter);
  }
}

TEST_F(SaveFaultTest, AWriteThatWritesNothingIsAFailure) {
  set_up_files(false);
  ShortWrites files(0);
  const CfgSession session = reopen();
  write_through(session, files);
  EXPECT_EQ(add(session, "cn=a,cn=top", {{"cn", {"a"}}}), 80);
  EXPECT_EQ(read_file(path_), kBefore);
}

// ---- Flushing ----

// The order of flushes and names, and that no descriptor is flushed again after a failure.
class FlushWatch : public cfg::FileCalls {
 public:
  explicit FlushWatch(int failures) : failures_(failures) {}
  int flush(int file) override {
    struct stat status {};
    ::fstat(file, &status);
    flushed.push_back(S_ISDIR(status.st_mode) ? "names" : "content");
    return failures_-- > 0 ? (errno = EIO, -1) : FileCalls::flush(file);
  }
  int exchange(const char* a, const char* b) override {
    flushed.emplace_back("exchange");
    return FileCalls::exchange(a, b);
  }
  std::vector<std::string> flushed;

 private:
  int failures_;
};

TEST_F(SaveFaultTest, ContentIsFlushedBeforeTheExchangeAndNamesBehindIt) {
  set_up_files(false);
  FlushWatch files(0);
  const CfgSession session = reopen();
  write_through(session, files);
  EXPECT_EQ(add(session, "cn=a,cn=top", {{"cn", {"a"}}}), 0);
  EXPECT_EQ(files.flushed, (Values{"content", "exchange", "names"}));
}

TEST_F(SaveFaultTest, AFailedFlushIsNotTriedAgain) {
  set_up_files(false);
  FlushWatch files(1);
  const CfgSession session = reopen();
  write_through(session, files);
  EXPECT_EQ(add(session, "cn=a,cn=top", {{"cn", {"a"}}}), 80);
  EXPECT_EQ(files.flushed, Values{"content"});
  EXPECT_EQ(read_file(path_), kBefore);
  EXPECT_EQ(names(), kTidy);
  EXPECT_EQ(add(session, "cn=a,cn=top", {{"cn", {"a"}}}), 0);
  EXPECT_EQ(read_file(path_), kAfter);
}

TEST_F(SaveFaultTest, AFailedFlushOfTheNamesTakesTheChangeBack) {
  EXPECT_EQ(add_with_names_not_flushed(EIO), 80);
  EXPECT_EQ(read_file(path_), kBefore);
  EXPECT_EQ(names(), kTidy);
}

TEST_F(SaveFaultTest, AFileSystemWhoseNamesNeedNoFlushIsGoodEnough) {
  EXPECT_EQ(add_with_names_not_flushed(EINVAL), 0);
}

}  // namespace
}  // namespace orv::cfg_test
