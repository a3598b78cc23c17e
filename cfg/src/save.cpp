#include "save.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <memory>
#include <new>

#include "cfg/result_codes.h"
#include "diagnostics_line.h"

namespace orv::cfg {

namespace {

// What went wrong, in a form that needs no memory: after the exchange nothing may depend on that.
struct Failure {
  int code = result::success;
  const char* file = "";
  const char* what = "";
  int error = 0;  // errno, 0 when there is none

  [[nodiscard]] bool happened() const noexcept { return code != result::success; }
};

constexpr Failure kNone{};

int code_of(int error) noexcept {
  switch (error) {
    case ENOMEM:
      return result::no_memory;
    case EROFS:
    case EACCES:
    case EPERM:
      return result::unwilling_to_perform;
    default:
      return result::other;
  }
}

// Of the call that just failed.
Failure failed(const std::string& file, const char* what) noexcept {
  return {code_of(errno), file.c_str(), what, errno};
}

std::string describe(const Failure& failure) {
  std::string text = std::string(failure.file) + ": " + failure.what;
  if (failure.error != 0) {
    std::array<char, 128> buffer{};
    text += ": ";
    text += ::strerror_r(failure.error, buffer.data(), buffer.size());
  }
  return text;
}

// Repeats a call that a signal interrupted; not for ever, should something interrupt them all.
template <class Call>
auto uninterrupted(Call call) {
  constexpr int kAttempts = 16;
  auto result = call();
  for (int i = 1; i < kAttempts && result < 0 && errno == EINTR; ++i) result = call();
  return result;
}

// A descriptor that is closed through the seam.
class OpenFile {
 public:
  explicit OpenFile(FileCalls& files) noexcept : files_(files) {}
  ~OpenFile() { close(); }
  OpenFile(const OpenFile&) = delete;
  OpenFile& operator=(const OpenFile&) = delete;

  bool open(const char* path, int flags, mode_t mode = 0) {
    close();
    value_ = uninterrupted([&] { return files_.open(path, flags | O_CLOEXEC, mode); });
    return value_ >= 0;
  }
  void close() noexcept {
    if (value_ >= 0) files_.close(value_);
    value_ = -1;
  }
  [[nodiscard]] int get() const noexcept { return value_; }

 private:
  FileCalls& files_;
  int value_ = -1;
};

constexpr int kReadFlags = O_RDONLY | O_NOCTTY | O_NONBLOCK;

bool is_same_inode(const struct stat& a, const struct stat& b) noexcept {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

bool cannot_exchange(int error) noexcept {
  return error == EINVAL || error == ENOSYS || error == ENOTSUP;
}

// Whether a file system that cannot make this hard link may still be written to.
bool cannot_link(int error) noexcept {
  return error == EXDEV || error == EPERM || error == EMLINK || error == ENOTSUP || error == ENOSYS;
}

std::string directory_of(const std::string& path) {
  const std::size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

class Saver {
 public:
  Saver(FileCalls& files, const SaveJob& job)
      : files_(files),
        job_(job),
        save_(job.save_file),
        save_new_(save_ + ".new"),
        save_directory_(directory_of(save_)),
        lock_file_(files),
        old_file_(files),
        new_file_(files),
        kept_open_(files) {}

  // Every step that can be refused by the disk but one comes before the exchange: a failure is then
  // nothing but a leftover to remove.
  Failure run() {
    Failure failure = name_files();
    if (!failure.happened()) failure = lock();
    if (!failure.happened()) failure = recover();
    if (!failure.happened()) failure = check_unchanged();
    if (!failure.happened()) failure = write_new();
    if (!failure.happened()) failure = keep_previous();
    if (failure.happened()) {
      if (wrote_new_) files_.remove(new_.c_str());
      return failure;
    }
    failure = put_in_place();
    if (failure.happened()) return failure;
    failure = check_replaced();
    if (!failure.happened()) failure = flush_names();
    if (failure.happened()) {
      take_back();
      return failure;
    }
    // It has done its duty; should it stay, the next writer knows it by the save file.
    files_.remove(swap_.c_str());
    job_.after.set_identity(identity_of(new_status_));
    return kNone;
  }

 private:
  Failure name_files() {
    if (files_.resolve(job_.config_file, config_) != 0) {
      return {code_of(errno), job_.config_file, "cannot be found", errno};
    }
    directory_ = directory_of(config_);
    new_ = config_ + ".new";
    swap_ = config_ + ".swap";
    lock_ = config_ + ".lock";
    rescued_ = config_ + ".rescued";
    // Where a number comes behind it, no memory may be needed any more.
    first_rescued_ = rescued_.size();
    rescued_.reserve(first_rescued_ + kRescueDigits);
    return kNone;
  }

  // -- The lock --

  // A lock file that was removed or replaced while we waited excludes nobody.
  Failure lock() {
    constexpr int kReplacements = 8;
    for (int i = 0; i < kReplacements; ++i) {
      if (!lock_file_.open(lock_.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK, 0600)) {
        return failed(lock_, "cannot be opened");
      }
      const Failure failure = wait_for_lock();
      if (failure.happened()) return failure;
      struct stat held {};
      struct stat named {};
      if (files_.status(lock_file_.get(), held) != 0) return failed(lock_, "cannot be examined");
      if (files_.status_of(lock_.c_str(), named) == 0 && is_same_inode(held, named)) {
        share_lock_file(held);
        return kNone;
      }
    }
    return {result::busy, lock_.c_str(), "keeps being replaced", 0};
  }

  Failure wait_for_lock() {
    constexpr int kAttempts = 300;  // three seconds
    for (int i = 0; i < kAttempts; ++i) {
      if (uninterrupted([&] { return files_.lock(lock_file_.get()); }) == 0) return kNone;
      if (errno != EWOULDBLOCK) return failed(lock_, "cannot be locked");
      files_.pause();
    }
    return {result::busy, lock_.c_str(), "another writer holds the lock", 0};
  }

  // Whoever may write the configuration may lock it, also if another user's tool came first. What
  // is not allowed to us is for the owner to mend.
  void share_lock_file(const struct stat& lock) {
    struct stat config {};
    if (files_.status_of(config_.c_str(), config) != 0) return;
    if (lock.st_uid != config.st_uid || lock.st_gid != config.st_gid) {
      files_.set_owner(lock_file_.get(), config.st_uid, config.st_gid);
    }
    const mode_t mode = config.st_mode & 0666;
    if ((lock.st_mode & 07777) != mode) files_.set_mode(lock_file_.get(), mode);
  }

  // -- Leftovers of a writer that was stopped --

  Failure recover() {
    if (!remove_leftover(new_)) return failed(new_, "a leftover cannot be removed");
    if (!save_.empty() && !remove_leftover(save_new_)) {
      return failed(save_new_, "a leftover cannot be removed");
    }
    struct stat swap {};
    if (files_.status_of(swap_.c_str(), swap) != 0) {
      return errno == ENOENT ? kNone : failed(swap_, "cannot be examined");
    }
    bool known = false;
    const Failure failure = is_version_of_ours(known);
    if (failure.happened()) return failure;
    if (known) return remove_leftover(swap_) ? kNone : failed(swap_, "cannot be removed");
    if (!rescue()) return failed(swap_, "an edit that a stopped change left there cannot be kept");
    const std::string line = rescued_ + ": holds what a change that was stopped had found in place";
    write_diagnostics_line(line.c_str());
    return kNone;
  }

  // Keeps the ".swap" file under the first name that is free; false with errno.
  bool rescue() noexcept {
    constexpr int kMost = 9999;
    for (int number = 1; number <= kMost; ++number) {
      name_rescued(number);
      struct stat status {};
      if (files_.status_of(rescued_.c_str(), status) == 0) continue;
      return errno == ENOENT && files_.rename(swap_.c_str(), rescued_.c_str()) == 0;
    }
    errno = EEXIST;
    return false;
  }

  void name_rescued(int number) noexcept {
    rescued_.resize(first_rescued_);
    if (number == 1) return;
    std::array<char, kRescueDigits> ending{'-'};
    const auto end = std::to_chars(ending.data() + 1, ending.data() + ending.size(), number).ptr;
    rescued_.append(ending.data(), end);
  }

  bool remove_leftover(const std::string& path) {
    return files_.remove(path.c_str()) == 0 || errno == ENOENT;
  }

  // Whether nothing is lost with the ".swap" file: the version before the change, which is kept as
  // the save file; or the change itself, if the version before is still in place.
  Failure is_version_of_ours(bool& known) {
    Failure failure = is_same(config_, swap_, known);
    if (known || failure.happened() || save_.empty()) return failure;
    failure = is_same(save_, swap_, known);
    if (known || failure.happened()) return failure;
    return is_same(save_, config_, known);
  }

  // Whether two names are those of one file, or of files with the same content.
  Failure is_same(const std::string& a, const std::string& b, bool& same) {
    same = false;
    OpenFile file_a(files_);
    OpenFile file_b(files_);
    struct stat status_a {};
    struct stat status_b {};
    if (!file_a.open(a.c_str(), kReadFlags)) {
      return errno == ENOENT ? kNone : failed(a, "cannot be opened");
    }
    if (!file_b.open(b.c_str(), kReadFlags)) return failed(b, "cannot be opened");
    if (files_.status(file_a.get(), status_a) != 0) return failed(a, "cannot be examined");
    if (files_.status(file_b.get(), status_b) != 0) return failed(b, "cannot be examined");
    if (!is_same_inode(status_a, status_b)) {
      if (status_a.st_size != status_b.st_size) return kNone;
      return compare(a, file_a.get(), b, file_b.get(), same);
    }
    same = true;
    return kNone;
  }

  Failure compare(const std::string& a, int file_a, const std::string& b, int file_b, bool& same) {
    while (true) {
      const ssize_t got_a = read_block(file_a, first_block_);
      if (got_a < 0) return failed(a, "cannot be read");
      const ssize_t got_b = read_block(file_b, second_block_);
      if (got_b < 0) return failed(b, "cannot be read");
      if (got_a != got_b) return kNone;
      const auto size = static_cast<std::size_t>(got_a);
      if (std::memcmp(first_block_.data(), second_block_.data(), size) != 0) return kNone;
      if (size < first_block_.size()) break;
    }
    same = true;
    return kNone;
  }

  using Block = std::array<char, 64 * 1024>;

  // Fewer bytes than the block has only at the end of the file.
  ssize_t read_block(int file, Block& block) {
    std::size_t done = 0;
    while (done < block.size()) {
      const ssize_t n = uninterrupted(
          [&] { return files_.read(file, block.data() + done, block.size() - done); });
      if (n < 0) return -1;
      if (n == 0) break;
      done += static_cast<std::size_t>(n);
    }
    return static_cast<ssize_t>(done);
  }

  // -- The old version --

  Failure check_unchanged() {
    if (!old_file_.open(config_.c_str(), kReadFlags)) return failed(config_, "cannot be opened");
    if (files_.status(old_file_.get(), old_status_) != 0) {
      return failed(config_, "cannot be examined");
    }
    if (!S_ISREG(old_status_.st_mode)) {
      return {result::unwilling_to_perform, config_.c_str(), "is not a regular file", 0};
    }
    if (identity_of(old_status_) == job_.before.identity()) return kNone;
    return check_is_before(config_, old_file_.get());
  }

  [[nodiscard]] Failure changed_by_others() const noexcept {
    return {result::busy, config_.c_str(), "was changed by somebody else", 0};
  }

  // Whether an open file holds what was read; 51 when it does not.
  Failure check_is_before(const std::string& name, int file) {
    const char* expected = job_.before.begin();
    std::size_t left = job_.before.size();
    while (true) {
      const ssize_t got = read_block(file, first_block_);
      if (got < 0) return failed(name, "cannot be read");
      const auto size = static_cast<std::size_t>(got);
      if (size > left || std::memcmp(first_block_.data(), expected, size) != 0) {
        return changed_by_others();
      }
      expected += size;
      left -= size;
      if (size < first_block_.size()) return left == 0 ? kNone : changed_by_others();
    }
  }

  // A name under which the old version stays to be had: the same file where the file system can do
  // that, else a copy.
  Failure keep_old_as(const std::string& path) {
    if (files_.link(config_.c_str(), path.c_str()) == 0) return check_linked(path);
    if (!cannot_link(errno)) return failed(path, "cannot be linked");
    OpenFile copy(files_);
    struct stat status {};
    Failure failure = write_unflushed(path, job_.before, copy);
    if (!failure.happened()) failure = flush_version(path, copy, status);
    if (failure.happened() && copy.get() >= 0) files_.remove(path.c_str());
    return failure;
  }

  // A link is made by name, and somebody may have put another file there.
  Failure check_linked(const std::string& path) {
    struct stat status {};
    Failure failure = changed_by_others();
    if (files_.status_of(path.c_str(), status) != 0) {
      failure = failed(path, "cannot be examined");
    } else if (is_same_inode(status, old_status_)) {
      return kNone;
    }
    files_.remove(path.c_str());
    return failure;
  }

  // A failed change leaves the version before the last good one where it is, if the disk refuses to
  // take the new one.
  Failure keep_previous() {
    if (save_.empty()) return kNone;
    struct stat status {};
    if (files_.status_of(save_.c_str(), status) == 0 && is_same_inode(status, old_status_)) {
      return kNone;  // two names of one file cannot be renamed to each other
    }
    Failure failure = keep_old_as(save_new_);
    if (failure.happened()) return failure;
    if (files_.rename(save_new_.c_str(), save_.c_str()) == 0) return kNone;
    failure = failed(save_, "cannot be replaced");
    files_.remove(save_new_.c_str());
    return failure;
  }

  // -- The new version --

  Failure write_new() {
    Failure failure = write_unflushed(new_, job_.after, new_file_);
    wrote_new_ = new_file_.get() >= 0;
    if (failure.happened()) return failure;
    failure = check_new();
    if (!failure.happened()) failure = flush_version(new_, new_file_, new_status_);
    return failure.happened() ? failure : stop_writing();
  }

  // The file stays open, lest its number becomes another file's while it is compared; but not for
  // writing: whoever reads it in its place would wait for us.
  Failure stop_writing() {
    if (!kept_open_.open(new_.c_str(), kReadFlags | O_NOFOLLOW)) {
      return failed(new_, "cannot be opened");
    }
    new_file_.close();
    return kNone;
  }

  Failure check_new() noexcept try {
    if (job_.is_acceptable()) return kNone;
    return {result::other, config_.c_str(), "would not be well formed after the change", 0};
  } catch (...) {
    return {result::no_memory, config_.c_str(), "cannot be checked for want of memory", 0};
  }

  // Writes a version to a file of its own, which nobody else can read before it has the permissions
  // of the configuration file.
  Failure write_unflushed(const std::string& path, const FileText& text, OpenFile& file) {
    constexpr int kFlags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW;
    if (!file.open(path.c_str(), kFlags, 0600)) return failed(path, "cannot be created");
    Failure failure = write_text(path, text, file.get());
    if (failure.happened()) return failure;
    return keep_permissions(path, file.get());
  }

  // After a failed flush what is on the disk is unknown, and another flush would only say that
  // nothing is left to write; the file is given up.
  Failure flush_version(const std::string& path, const OpenFile& file, struct stat& status) {
    if (files_.flush(file.get()) != 0) return failed(path, "cannot be flushed");
    if (files_.status(file.get(), status) != 0) return failed(path, "cannot be examined");
    return kNone;
  }

  Failure write_text(const std::string& path, const FileText& text, int file) {
    constexpr std::size_t kPiece = std::size_t{1} << 20;
    const char* from = text.begin();
    std::size_t left = text.size();
    while (left > 0) {
      const std::size_t piece = std::min(left, kPiece);
      const ssize_t n = uninterrupted([&] { return files_.write(file, from, piece); });
      if (n == 0) errno = EIO;
      if (n <= 0) return failed(path, "cannot be written");
      files_.start_flush(file);
      from += n;
      left -= static_cast<std::size_t>(n);
    }
    return kNone;
  }

  // The owner first: a change of it takes bits off the mode.
  Failure keep_permissions(const std::string& path, int file) {
    struct stat status {};
    if (files_.status(file, status) != 0) return failed(path, "cannot be examined");
    if (status.st_uid != old_status_.st_uid || status.st_gid != old_status_.st_gid) {
      if (files_.set_owner(file, old_status_.st_uid, old_status_.st_gid) != 0) {
        return failed(path, "cannot be given to the owner and group of the configuration file");
      }
    }
    if (files_.copy_access_list(old_file_.get(), file) != 0) {
      return failed(path, "cannot be given the access list of the configuration file");
    }
    if (files_.set_mode(file, old_status_.st_mode & 07777) != 0) {
      return failed(path, "cannot be given the permissions of the configuration file");
    }
    return kNone;
  }

  // -- The exchange --

  // Under the name ".new" a file is unfinished, under ".swap" it is whole: whoever finds one of
  // them later must know.
  Failure put_in_place() {
    if (files_.rename(new_.c_str(), swap_.c_str()) != 0) {
      const Failure failure = failed(swap_, "cannot be made");
      files_.remove(new_.c_str());
      return failure;
    }
    if (files_.exchange(config_.c_str(), swap_.c_str()) == 0) return kNone;
    Failure failure = failed(config_, "cannot be replaced");
    if (cannot_exchange(failure.error)) {
      failure = rename_into_place();
      if (!failure.happened()) return kNone;
    }
    files_.remove(swap_.c_str());
    return failure;
  }

  // Where there is no exchange: comes to the same names. An edit that comes between the last look
  // at the file and the renaming, with no call in between, is lost; only if it was written into the
  // old file, and the old file has another name by a hard link, it is found there and put back.
  Failure rename_into_place() {
    if (files_.rename(swap_.c_str(), new_.c_str()) != 0) return failed(new_, "cannot be made");
    OpenFile file(files_);
    Failure failure = keep_old_as(swap_);
    if (!failure.happened()) failure = check_in_place(file);
    if (!failure.happened() && files_.rename(new_.c_str(), config_.c_str()) != 0) {
      failure = failed(config_, "cannot be replaced");
    }
    if (failure.happened()) files_.remove(new_.c_str());
    return failure;
  }

  // Whether the file that is about to be replaced is the one that was read. It is left open:
  // closing it would come between.
  Failure check_in_place(OpenFile& file) {
    if (!file.open(config_.c_str(), kReadFlags)) return failed(config_, "cannot be opened");
    struct stat read {};
    if (files_.status(file.get(), read) != 0) return failed(config_, "cannot be examined");
    if (!S_ISREG(read.st_mode)) return changed_by_others();
    const Failure failure = check_is_before(config_, file.get());
    if (failure.happened()) return failure;
    struct stat named {};
    if (files_.status_of(config_.c_str(), named) != 0) return failed(config_, "cannot be examined");
    return identity_of(named) == identity_of(read) ? kNone : changed_by_others();
  }

  // Whether the file that was replaced is the one that was read.
  Failure check_replaced() {
    OpenFile file(files_);
    if (!file.open(swap_.c_str(), kReadFlags)) return failed(swap_, "cannot be opened");
    struct stat status {};
    if (files_.status(file.get(), status) != 0) return failed(swap_, "cannot be examined");
    if (!S_ISREG(status.st_mode)) return changed_by_others();
    return check_is_before(swap_, file.get());
  }

  Failure flush_names() {
    const Failure failure = flush_directory(directory_);
    if (failure.happened() || save_.empty() || save_directory_ == directory_) return failure;
    return flush_directory(save_directory_);
  }

  Failure flush_directory(const std::string& path) {
    OpenFile directory(files_);
    if (!directory.open(path.c_str(), O_RDONLY | O_DIRECTORY)) {
      return failed(path, "cannot be opened");
    }
    // Some file systems have nothing to flush there, and say so.
    if (files_.flush(directory.get()) == 0 || errno == EINVAL) return kNone;
    return failed(path, "cannot be flushed");
  }

  // Puts what was replaced back in place. If that fails as well, the disk is beyond help; the
  // change is answered with its failure and may be seen all the same.
  void take_back() {
    if (!exchange_back()) {
      write_diagnostics_line(
          "a change of the configuration that failed could not be taken back, and may be in place");
    }
    flush_directory(directory_);
  }

  bool exchange_back() {
    if (files_.exchange(config_.c_str(), swap_.c_str()) != 0) return rename_back();
    struct stat out {};
    if (files_.status_of(swap_.c_str(), out) != 0) return true;
    if (is_same_inode(out, new_status_)) {
      files_.remove(swap_.c_str());
    } else {
      // Somebody replaced our version meanwhile: his is the latest, and belongs in place.
      files_.exchange(config_.c_str(), swap_.c_str());
      rescue();
    }
    return true;
  }

  bool rename_back() {
    struct stat in_place {};
    if (files_.status_of(config_.c_str(), in_place) == 0 && !is_same_inode(in_place, new_status_)) {
      // Somebody replaced our version meanwhile. What to do with ".swap", the next writer sees.
      return true;
    }
    return files_.rename(swap_.c_str(), config_.c_str()) == 0;
  }

  FileCalls& files_;
  const SaveJob& job_;
  std::string config_;  // without symbolic links
  std::string directory_;
  std::string new_;
  std::string swap_;
  std::string lock_;
  static constexpr std::size_t kRescueDigits = 8;
  std::string rescued_;  // for an edit that is not to be lost: the name, or a number behind it
  std::size_t first_rescued_ = 0;
  const std::string save_;
  const std::string save_new_;
  const std::string save_directory_;
  OpenFile lock_file_;
  OpenFile old_file_;
  OpenFile new_file_;
  OpenFile kept_open_;  // the same file
  struct stat old_status_ {};
  struct stat new_status_ {};
  bool wrote_new_ = false;
  Block first_block_;
  Block second_block_;
};

}  // namespace

int save(FileCalls& files, const SaveJob& job, std::string& cause) noexcept try {
  cause.clear();
  const auto saver = std::make_unique<Saver>(files, job);
  const Failure failure = saver->run();
  if (failure.happened()) {
    try {
      cause = describe(failure);
    } catch (const std::bad_alloc&) {
      // The code has to do.
    }
  }
  return failure.code;
} catch (...) {
  return result::no_memory;
}

}  // namespace orv::cfg
