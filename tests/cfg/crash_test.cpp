// The writer stops at any call of a save: by being killed, or with the machine, which then has of
// what was not flushed nothing, a part, or the later without the earlier. A reader finds the old
// file or the new one, whole, and the next write works.
#include <sys/wait.h>

#include <algorithm>
#include <map>
#include <optional>
#include <set>

#include "change_fixture.h"
#include "faulty_files.h"

namespace orv::cfg_test {
namespace {

// ---- A disk ----

using Inode = int;
using Names = std::map<std::string, Inode>;  // by the path's last part

// What a file holds: what is flushed, and the writes since.
struct Content {
  std::string durable;
  std::string pending;
};

// How a power failure treats what was not flushed.
enum class Data { kept, dropped, torn, zeroed, reordered };

// Performs the calls and keeps the story of names and contents.
class Recorder : public cfg::FileCalls {
 public:
  // One moment: the names as they are, as they were at each moment since the last flush of them,
  // and the contents.
  struct Moment {
    std::vector<Names> since_flush;  // the oldest first; the last is what a reader sees
    std::map<Inode, Content> contents;
    std::string call;
  };

  explicit Recorder(const std::vector<std::string>& paths) {
    for (const std::string& path : paths) {
      if (!exists(path)) continue;
      names_[last_part(path)] = next_;
      contents_[next_++].durable = read_file(path);
    }
    since_flush_ = {names_};
    keep("start");
  }

  [[nodiscard]] const std::vector<Moment>& moments() const { return moments_; }

  int open(const char* path, int flags, mode_t mode) override {
    const int file = FileCalls::open(path, flags, mode);
    if (file < 0) return file;
    const std::string name = last_part(path);
    if ((flags & O_DIRECTORY) == 0 && names_.find(name) == names_.end()) {
      names_[name] = next_++;
      note_names("open");
    }
    inodes_[file] = (flags & O_DIRECTORY) != 0 ? 0 : names_[name];
    return file;
  }
  ssize_t write(int file, const void* from, std::size_t size) override {
    // Piece by piece, so that there are moments between.
    const ssize_t done = FileCalls::write(file, from, std::min<std::size_t>(size, 64));
    if (done > 0) {
      contents_[inodes_[file]].pending.append(static_cast<const char*>(from),
                                              static_cast<std::size_t>(done));
    }
    keep("write");
    return done;
  }
  int flush(int file) override {
    if (inodes_[file] == 0) {
      since_flush_ = {names_};
    } else {
      Content& content = contents_[inodes_[file]];
      content.durable += content.pending;
      content.pending.clear();
    }
    keep("flush");
    return 0;
  }
  int link(const char* from, const char* to) override {
    if (!links) return errno = EPERM, -1;
    const int rc = FileCalls::link(from, to);
    if (rc == 0) names_[last_part(to)] = names_[last_part(from)];
    note_names("link");
    return rc;
  }
  int rename(const char* from, const char* to) override {
    const int rc = FileCalls::rename(from, to);
    if (rc == 0 && names_[last_part(from)] != names_[last_part(to)]) {
      names_[last_part(to)] = names_[last_part(from)];
      names_.erase(last_part(from));
    }
    note_names("rename");
    return rc;
  }
  int exchange(const char* a, const char* b) override {
    if (!exchanges) return errno = EINVAL, -1;
    const int rc = FileCalls::exchange(a, b);
    if (rc == 0) std::swap(names_[last_part(a)], names_[last_part(b)]);
    note_names("exchange");
    return rc;
  }
  int remove(const char* path) override {
    const int rc = FileCalls::remove(path);
    if (rc == 0) names_.erase(last_part(path));
    note_names("remove");
    return rc;
  }

  bool exchanges = true;
  bool links = true;

 private:
  static std::string last_part(const std::string& path) { return path.substr(path.rfind('/') + 1); }

  void note_names(const char* call) {
    since_flush_.push_back(names_);
    keep(call);
  }
  void keep(const char* call) { moments_.push_back({since_flush_, contents_, call}); }

  Inode next_ = 1;
  Names names_;
  std::vector<Names> since_flush_;
  std::map<Inode, Content> contents_;
  std::map<int, Inode> inodes_;
  std::vector<Moment> moments_;
};

std::string survives(const Content& content, Data data) {
  const std::string& pending = content.pending;
  switch (data) {
    case Data::kept:
      return content.durable + pending;
    case Data::dropped:
      return content.durable;
    case Data::torn:
      return content.durable + pending.substr(0, pending.size() / 2);
    case Data::zeroed:
      return content.durable + std::string(pending.size(), '\0');
    case Data::reordered:
      return content.durable + std::string(pending.size() / 2, '\0') +
             pending.substr(pending.size() / 2);
  }
  return {};
}

// A state in which the disk may be found.
struct Found {
  Names names;
  std::map<Inode, std::string> contents;
};

bool operator<(const Found& a, const Found& b) {
  return std::tie(a.names, a.contents) < std::tie(b.names, b.contents);
}

// All combinations of what each name may stand for, on its own: the disk keeps no order among
// names.
void combine(const std::map<std::string, std::set<Inode>>& choices,
             std::map<std::string, std::set<Inode>>::const_iterator at, Names names,
             std::vector<Names>& all) {
  if (at == choices.end()) {
    all.push_back(std::move(names));
    return;
  }
  for (const Inode inode : at->second) {
    Names chosen = names;
    if (inode != 0) chosen[at->first] = inode;
    combine(choices, std::next(at), std::move(chosen), all);
  }
}

std::vector<Names> possible_names(const Recorder::Moment& moment) {
  std::map<std::string, std::set<Inode>> choices;
  for (const Names& names : moment.since_flush) {
    for (const auto& [name, inode] : names) choices[name].insert(inode);
  }
  for (auto& [name, inodes] : choices) {
    for (const Names& names : moment.since_flush) {
      if (names.find(name) == names.end()) inodes.insert(0);
    }
  }
  std::vector<Names> all;
  combine(choices, choices.begin(), {}, all);
  return all;
}

Found found_with(const Names& names, const Recorder::Moment& moment, Data data) {
  Found found{names, {}};
  for (const auto& [name, inode] : names) {
    const auto content = moment.contents.find(inode);
    found.contents[inode] = content == moment.contents.end() ? "" : survives(content->second, data);
  }
  return found;
}

std::set<Found> after_power_failure(const Recorder::Moment& moment) {
  std::set<Found> all;
  for (const Names& names : possible_names(moment)) {
    for (const Data data : {Data::kept, Data::dropped, Data::torn, Data::zeroed, Data::reordered}) {
      all.insert(found_with(names, moment, data));
    }
  }
  return all;
}

Found after_kill(const Recorder::Moment& moment) {
  return found_with(moment.since_flush.back(), moment, Data::kept);
}

// ---- The tests ----

constexpr const char* kOlder = "dn: cn=top\ncn: top\nou: older\n";
constexpr const char* kBefore = "# a\ndn: cn=top\ncn: top\n\n# b\n";
constexpr const char* kAfter =
    "# a\ndn: cn=top\ncn: top\n\ndn: cn=a,cn=top\ncn: a\nou: a longer text, so that the file is "
    "written in several pieces\n\n# b\n";
const NewEntry kEntry = {{"cn", {"a"}},
                         {"ou", {"a longer text, so that the file is written in several pieces"}}};

constexpr const char* kModified =
    "# a\ndn: cn=top\ncn: top\nou: a longer text, so that the file is written in several pieces\n\n"
    "# b\n";

class CrashTest : public ChangeTest {
 protected:
  CrashTest() : ChangeTest(memory_directory()) {}

  [[nodiscard]] std::vector<std::string> all_paths() const {
    return {path_,          save_,           path_ + ".new",    path_ + ".swap",
            save_ + ".new", path_ + ".lock", path_ + ".rescued"};
  }

  void put_on_disk(const Found& found) {
    for (const std::string& path : all_paths()) ::unlink(path.c_str());
    std::map<Inode, std::string> first_name;
    for (const auto& [name, inode] : found.names) {
      const std::string path = directory_.file(name);
      const auto known = first_name.find(inode);
      if (known != first_name.end()) {
        ASSERT_EQ(::link(known->second.c_str(), path.c_str()), 0);
        continue;
      }
      write_file(path, found.contents.at(inode));
      first_name[inode] = path;
    }
  }

  // The change that is stopped, and one that undoes it.
  int change(const CfgSession& session) const {
    if (modifies_) return modify(session, "cn=top", {{"ou", kEntry[1].values, true}});
    return add(session, "cn=a,cn=top", kEntry);
  }
  int undo(const CfgSession& session) const {
    if (modifies_) return modify(session, "cn=top", {{"ou", {}, true, kModReplace}});
    return remove(session, "cn=a,cn=top");
  }
  [[nodiscard]] const char* after() const { return modifies_ ? kModified : kAfter; }

  void start_anew() {
    put_on_disk({{{"config.ldif", 1}, {"config.ldif.save", 2}}, {{1, kBefore}, {2, kOlder}}});
  }

  std::vector<Recorder::Moment> record_change(Abilities abilities) {
    const CfgSession session = reopen();
    Recorder recorder(all_paths());
    recorder.exchanges = abilities.exchange;
    recorder.links = abilities.link;
    write_through(session, recorder);
    EXPECT_EQ(change(session), 0) << told;
    EXPECT_EQ(read_file(path_), after());
    return recorder.moments();
  }

  // What a reader finds, and what the next writer makes of it.
  void check(const Found& found, bool acknowledged) {
    put_on_disk(found);
    const std::string content = read_file(path_);
    if (acknowledged || content != kBefore) {
      ASSERT_EQ(content, after());
    }
    check_next_write(content == after());
  }

  void check_next_write(bool changed) {
    FaultyFiles quick;  // nothing fails, nothing is flushed
    const CfgSession session = reopen();
    write_through(session, quick);
    ASSERT_EQ(changed ? undo(session) : change(session), 0) << told;
    ASSERT_EQ(read_file(path_), changed ? kBefore : after());
    ASSERT_EQ(read_file(save_), changed ? after() : kBefore);
    for (const char* leftover : {".new", ".swap", ".save.new"}) {
      ASSERT_FALSE(exists(path_ + leftover)) << leftover;
    }
  }

  bool modifies_ = false;

  void crash_everywhere(Abilities abilities) {
    start_anew();
    const auto moments = record_change(abilities);
    std::size_t states = 0;
    std::size_t commit = moments.size();
    while (moments[--commit].call != "flush") {
    }
    for (std::size_t i = 0; i < moments.size() && !HasFatalFailure(); ++i) {
      SCOPED_TRACE(::testing::Message() << "stopped after call " << i << " " << moments[i].call);
      check(after_kill(moments[i]), i >= commit);
      for (const Found& found : after_power_failure(moments[i])) {
        check(found, i >= commit);
        if (HasFatalFailure()) return;
        ++states;
      }
    }
    EXPECT_GT(states, 100U);
  }
};

TEST_F(CrashTest, TheOldFileOrTheNewIsFoundWhole) {
  crash_everywhere({});
}

TEST_F(CrashTest, TheOldFileOrTheNewIsFoundWholeWhereThereIsNoExchange) {
  crash_everywhere({false, true});
}

TEST_F(CrashTest, TheOldFileOrTheNewIsFoundWholeWhereThereAreNoHardLinks) {
  crash_everywhere({true, false});
}

TEST_F(CrashTest, TheOldFileOrTheNewIsFoundWholeWhereThereIsNeither) {
  crash_everywhere({false, false});
}

TEST_F(CrashTest, AModifyLeavesTheOldFileOrTheNewWhole) {
  modifies_ = true;
  crash_everywhere({});
}

TEST_F(CrashTest, AModifyLeavesTheOldFileOrTheNewWholeWhereThereIsNeither) {
  modifies_ = true;
  crash_everywhere({false, false});
}

TEST_F(CrashTest, TheNextWriterMayFailAndMayBeStoppedToo) {
  start_anew();
  const auto moments = record_change({});
  for (std::size_t i = 0; i < moments.size() && !HasFatalFailure(); ++i) {
    const Found found = after_kill(moments[i]);
    // It fails at every call.
    for (std::size_t number = 0;; ++number) {
      SCOPED_TRACE(::testing::Message() << "stopped after call " << i << ", then call " << number);
      put_on_disk(found);
      const std::string content = read_file(path_);
      const bool changed = content == after();
      FaultyFiles files;
      files.fail_at(number, EIO, FaultyFiles::Lasting::once);
      const CfgSession session = reopen();
      write_through(session, files);
      const int rc = changed ? undo(session) : change(session);
      if (!files.has_failed()) break;
      ASSERT_EQ(read_file(path_), (rc == 0) != changed ? after() : kBefore);
      check_next_write((rc == 0) != changed);
      if (HasFatalFailure()) return;
    }
    // It is stopped at every call, by a power failure.
    put_on_disk(found);
    if (read_file(path_) != kBefore) continue;
    for (const Recorder::Moment& moment : record_change({})) {
      check(found_with(moment.since_flush.back(), moment, Data::torn), false);
      check(found_with(moment.since_flush.front(), moment, Data::dropped), false);
      if (HasFatalFailure()) return;
    }
  }
}

// ---- A process that is killed ----

class Killer : public ObservedFiles {
 public:
  explicit Killer(int calls) : left_(calls) {}
  int before_call(const char* /*name*/, const std::string& /*subject*/) override {
    if (left_-- == 0) ::_exit(42);
    return 0;
  }

 private:
  int left_;
};

TEST_F(CrashTest, AProcessThatIsKilledLeavesNoLockBehind) {
  for (int calls = 0; calls < 200; ++calls) {
    start_anew();
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      Killer files(calls);
      const CfgSession session = reopen();
      write_through(session, files);
      ::_exit(change(session));
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status));
    const std::string content = read_file(path_);
    if (WEXITSTATUS(status) == 0 || content != kBefore) {
      ASSERT_EQ(content, after());
    }
    check_next_write(content == after());
    if (HasFatalFailure()) FAIL() << "killed at call " << calls;
    if (WEXITSTATUS(status) == 0) return;
  }
  FAIL() << "it was never done";
}

}  // namespace
}  // namespace orv::cfg_test
