// A file that somebody writes in place: a reader waits for him, and he for the reader.
#include <fcntl.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <thread>

#include "change_fixture.h"
#include "faulty_files.h"
#include "file_text.h"

namespace orv::cfg_test {
namespace {

constexpr const char* kHalf = "dn: cn=top\ncn: top\n\n";
constexpr const char* kRest = "dn: cn=a,cn=top\ncn: a\n";
constexpr const char* kWhole = "dn: cn=top\ncn: top\n\ndn: cn=a,cn=top\ncn: a\n";

// Opens a file for writing, as an editor does who does not put another in its place.
class InPlaceWriter {
 public:
  explicit InPlaceWriter(const std::string& path)
      : file_(::open(path.c_str(), O_WRONLY | O_TRUNC | O_CLOEXEC)) {
    EXPECT_GE(file_, 0);
  }
  ~InPlaceWriter() { close(); }
  InPlaceWriter(const InPlaceWriter&) = delete;
  InPlaceWriter& operator=(const InPlaceWriter&) = delete;

  void write(std::string_view text) const {
    EXPECT_EQ(::write(file_, text.data(), text.size()), static_cast<ssize_t>(text.size()));
  }
  void close() {
    if (file_ >= 0) ::close(file_);
    file_ = -1;
  }

 private:
  int file_;
};

// Tells how a reader waits. His clock shows the time of the file's last write, and `age` more.
class ReadersCalls : public ObservedFiles {
 public:
  explicit ReadersCalls(std::string path, long age = 0) : path_(std::move(path)), age_(age) {}

  int before_call(const char* name, const std::string& /*subject*/) override {
    const std::string_view call = name;
    if (call == "pause_for_writer") {
      ++pauses;
      if (on_pause) on_pause();
    } else if (call == "hold_writers_off") {
      ++holds;
      return hold_error;
    } else if (call == "let_writers_in") {
      ++releases;
      if (on_release) on_release();
    }
    return 0;
  }
  timespec now() override {
    struct stat status {};
    EXPECT_EQ(::stat(path_.c_str(), &status), 0);
    constexpr long kSecond = 1'000'000'000;
    timespec time = status.st_mtim;
    const long part = time.tv_nsec + age_ % kSecond;  // less than a second to either side
    time.tv_sec += age_ / kSecond + (part >= kSecond ? 1 : 0) - (part < 0 ? 1 : 0);
    time.tv_nsec = (part + kSecond) % kSecond;
    return time;
  }

  int pauses = 0;
  int holds = 0;
  int releases = 0;
  int hold_error = 0;
  std::function<void()> on_pause;
  std::function<void()> on_release;

 private:
  const std::string path_;
  const long age_;
};

class WrittenInPlaceTest : public ChangeTest {
 protected:
  // The names of the entries that a session finds which asks by these calls; none if it is refused.
  Values entries_read(cfg::FileCalls& calls) {
    const CfgSession session = unbound();
    write_through(session, calls);
    if (cfg_bind_s(session.get(), nullptr, nullptr, 128) != 0) return {};
    return dns(search(session, "cn=top", 2, nullptr));
  }

  const Values whole_{"cn=top", "cn=a,cn=top"};
  const Values half_{"cn=top"};
};

// ---- A reader waits ----

TEST_F(WrittenInPlaceTest, AHalfIsWaitedForUntilItIsWhole) {
  write_file(path_, kWhole);
  InPlaceWriter writer(path_);
  writer.write(kHalf);
  ReadersCalls calls(path_);
  calls.on_pause = [&] {
    if (calls.pauses == 3) writer.write(kRest);
    if (calls.pauses == 5) writer.close();
  };
  EXPECT_EQ(entries_read(calls), whole_);
  EXPECT_EQ(calls.pauses, 5);
  EXPECT_EQ(calls.holds, 6);
  EXPECT_EQ(calls.releases, 1);
}

TEST_F(WrittenInPlaceTest, AFileThatHasJustBeenEmptiedIsWaitedFor) {
  write_file(path_, kWhole);
  InPlaceWriter writer(path_);
  ReadersCalls calls(path_);
  calls.on_pause = [&] {
    writer.write(kWhole);
    writer.close();
  };
  EXPECT_EQ(entries_read(calls), whole_);
  EXPECT_EQ(calls.pauses, 1);
}

TEST_F(WrittenInPlaceTest, AFilePutInPlaceMeanwhileIsReadInstead) {
  write_file(path_, kHalf);
  const std::string next = directory_.file("next");
  write_file(next, kWhole);
  InPlaceWriter writer(path_);
  writer.write(kHalf);
  ReadersCalls calls(path_);
  calls.on_pause = [&] { ASSERT_EQ(std::rename(next.c_str(), path_.c_str()), 0); };
  EXPECT_EQ(entries_read(calls), whole_);
  EXPECT_EQ(calls.pauses, 1);
}

TEST_F(WrittenInPlaceTest, AWriterWhoDoesNotEndIsNotWaitedForForEver) {
  write_file(path_, kWhole);
  InPlaceWriter writer(path_);
  writer.write(kHalf);
  ReadersCalls calls(path_);
  EXPECT_EQ(entries_read(calls), half_);
  EXPECT_EQ(calls.pauses, cfg::FileText::kWriterPauses);
  EXPECT_EQ(calls.releases, 0);
}

TEST_F(WrittenInPlaceTest, AFileThatIsOpenButWasNotWrittenLatelyIsReadAtOnce) {
  write_file(path_, kWhole);
  const InPlaceWriter writer(path_);
  writer.write(kHalf);
  constexpr long kSecond = 1'000'000'000;
  for (const long age :
       {cfg::FileText::kWriterPause, -cfg::FileText::kWriterPause, 2 * kSecond, -2 * kSecond}) {
    ReadersCalls calls(path_, age);
    EXPECT_EQ(entries_read(calls), half_);
    EXPECT_EQ(calls.holds, 0) << age;
    EXPECT_EQ(calls.pauses, 0) << age;
  }
}

TEST_F(WrittenInPlaceTest, AWriterWhoStopsWritingIsWaitedForByTheSystemsClock) {
  write_file(path_, kWhole);
  const InPlaceWriter writer(path_);
  writer.write(kHalf);
  EXPECT_EQ(entries_read(cfg::system_file_calls()), half_);
}

TEST_F(WrittenInPlaceTest, APauseLastsAMillisecond) {
  const auto begin = std::chrono::steady_clock::now();
  cfg::system_file_calls().pause_for_writer();
  EXPECT_GE(std::chrono::steady_clock::now() - begin, std::chrono::milliseconds(1));
}

TEST_F(WrittenInPlaceTest, AnEmptyFileIsWaitedForLonger) {
  write_file(path_, kWhole);
  InPlaceWriter writer(path_);
  ReadersCalls late(path_, cfg::FileText::kEmptyPause);
  EXPECT_EQ(entries_read(late), Values());
  EXPECT_EQ(late.holds, 0);
  ReadersCalls calls(path_, cfg::FileText::kEmptyPause - 1);
  calls.on_pause = [&] {
    writer.write(kWhole);
    writer.close();
  };
  EXPECT_EQ(entries_read(calls), whole_);
  EXPECT_EQ(calls.pauses, 1);
}

TEST_F(WrittenInPlaceTest, LatelyIsByTheNanosecondOnEitherSide) {
  write_file(path_, kWhole);
  for (const long age : {cfg::FileText::kWriterPause - 1, 1 - cfg::FileText::kWriterPause}) {
    ReadersCalls calls(path_, age);
    EXPECT_EQ(entries_read(calls), whole_);
    EXPECT_EQ(calls.holds, 1) << age;
    EXPECT_EQ(calls.releases, 1) << age;
    EXPECT_EQ(calls.pauses, 0) << age;
  }
}

TEST_F(WrittenInPlaceTest, WhereTheSystemCannotTellTheFileIsReadAtOnce) {
  write_file(path_, kWhole);
  for (const int error : {EACCES, EINVAL, ENOSYS, ENOMEM, EPERM}) {
    ReadersCalls calls(path_);
    calls.hold_error = error;
    EXPECT_EQ(entries_read(calls), whole_) << error;
    EXPECT_EQ(calls.pauses, 0) << error;
    EXPECT_EQ(calls.releases, 0) << error;
  }
}

// Does something to the file between the reader's first look at it and his last.
class Meddling : public ReadersCalls {
 public:
  Meddling(const std::string& path, std::function<void()> meddle)
      : ReadersCalls(path), meddle_(std::move(meddle)) {
    hold_error = EINVAL;
  }
  int hold_writers_off(int file) override {
    meddle_();
    return ReadersCalls::hold_writers_off(file);
  }

 private:
  std::function<void()> meddle_;
};

TEST_F(WrittenInPlaceTest, AFileThatChangesDuringEachAttemptIsRefused) {
  write_file(path_, kWhole);
  Meddling calls(path_, [&] { std::ofstream(path_, std::ios::app) << "# more\n"; });
  const CfgSession session = unbound();
  write_through(session, calls);
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 1);
  EXPECT_EQ(cfg_dump_exception(session.get()),
            path_ + ": the file kept changing while it was read");
  EXPECT_EQ(calls.holds, 20);
  EXPECT_EQ(calls.pauses, 0);
}

TEST_F(WrittenInPlaceTest, ATextOfTheSameLengthIsAChangeToo) {
  write_file(path_, kWhole);
  bool is_changed = false;
  Meddling calls(path_, [&] {
    if (std::exchange(is_changed, true)) return;
    const timespec times[] = {{0, UTIME_OMIT}, {1'000'000'000, 0}};
    EXPECT_EQ(::utimensat(AT_FDCWD, path_.c_str(), times, 0), 0);
  });
  EXPECT_EQ(entries_read(calls), whole_);
  EXPECT_EQ(calls.holds, 2);
}

// ---- Writers wait ----

TEST_F(WrittenInPlaceTest, AWriterIsHeldOffUntilTheFileIsRead) {
  write_file(path_, kWhole);
  ReadersCalls calls(path_);
  int error = 0;
  // He asks without waiting, when the file has been read.
  calls.on_release = [&] {
    EXPECT_EQ(::open(path_.c_str(), O_WRONLY | O_TRUNC | O_NONBLOCK | O_CLOEXEC), -1);
    error = errno;
  };
  EXPECT_EQ(entries_read(calls), whole_);
  EXPECT_EQ(error, EWOULDBLOCK);
  InPlaceWriter(path_).write(kHalf);  // nobody holds him off any more
  EXPECT_EQ(read_file(path_), kHalf);
}

TEST_F(WrittenInPlaceTest, ADescriptorThatIsInheritedMeanwhileHoldsNobodyOff) {
  write_file(path_, kWhole);
  int copy = -1;
  class Inherited : public ReadersCalls {
   public:
    Inherited(const std::string& path, int& copy) : ReadersCalls(path), copy_(copy) {}
    int hold_writers_off(int file) override {
      copy_ = ::fcntl(file, F_DUPFD_CLOEXEC, 0);
      return ReadersCalls::hold_writers_off(file);
    }

   private:
    int& copy_;
  } calls(path_, copy);
  EXPECT_EQ(entries_read(calls), whole_);
  const int file = ::open(path_.c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC);
  EXPECT_GE(file, 0);
  ::close(file);
  ::close(copy);
}

TEST_F(WrittenInPlaceTest, WhatCannotBeHeldIsAnError) {
  cfg::FileCalls calls;
  EXPECT_EQ(calls.hold_writers_off(-1), -1);
  EXPECT_EQ(errno, EBADF);
  calls.let_writers_in(-1);
}

TEST_F(WrittenInPlaceTest, EachReadIsOfAWholeVersion) {
  constexpr int kVersions = 300;
  write_file(path_, kWhole);
  std::mutex mutex;
  std::condition_variable settled;
  bool is_writing = false;
  bool is_done = false;
  std::thread writer([&] {
    for (int i = 0; i < kVersions; ++i) {
      {
        const std::lock_guard lock(mutex);
        is_writing = true;
      }
      InPlaceWriter file(path_);
      file.write(kHalf);
      std::this_thread::yield();
      file.write(kRest);
      file.close();
      const std::lock_guard lock(mutex);
      is_writing = false;
      settled.notify_all();
    }
    const std::lock_guard lock(mutex);
    is_done = true;
  });
  ReadersCalls calls(path_);
  // However slow the machine: a pause ends when the writer has.
  calls.on_pause = [&] {
    std::unique_lock lock(mutex);
    settled.wait(lock, [&] { return !is_writing; });
  };
  for (bool last = false; !last;) {
    {
      const std::lock_guard lock(mutex);
      last = is_done;
    }
    EXPECT_EQ(entries_read(calls), whole_);
    if (HasFailure()) break;
  }
  writer.join();
}

// ---- The server's own changes ----

TEST_F(WrittenInPlaceTest, NobodyWaitsForAChangeThatIsInPlace) {
  const CfgSession session = open_for_change(kHalf);
  // Looks at the file when it has been exchanged: as the version before is compared, and as the
  // names are flushed.
  class Looking : public ObservedFiles {
   public:
    std::function<void()> look;
    int looks = 0;

    int before_call(const char* name, const std::string& /*subject*/) override {
      if (is_in_place_) {
        ++looks;
        look();
      }
      is_in_place_ |= name == std::string_view("exchange");
      return 0;
    }

   private:
    bool is_in_place_ = false;
  } saver;
  saver.look = [&] {
    ReadersCalls calls(path_);
    EXPECT_EQ(entries_read(calls), whole_);
    EXPECT_EQ(calls.holds, 1);
    EXPECT_EQ(calls.pauses, 0);
  };
  write_through(session, saver);
  EXPECT_EQ(add(session, "cn=a,cn=top", {{"cn", {"a"}}}), 0);
  EXPECT_GT(saver.looks, 5);
}

}  // namespace
}  // namespace orv::cfg_test
