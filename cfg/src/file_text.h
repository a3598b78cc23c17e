// The text of a file, read whole into private memory.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <ctime>
#include <span>
#include <string>
#include <string_view>

#include "file_calls.h"

namespace orv::cfg {

// Memory that one thread uses again and again: each operation of a server reads the configuration
// anew, and fresh pages for it would cost more than reading it. Each thread keeps at most one block
// of each kind, and none that is larger than `max_kept`; larger ones come from the system and go
// back to it at once. A block may be released by another thread than the one that obtained it.
enum class MemoryKind { text, entries, table };

class RecycledMemory {
 public:
  // A configuration of 10,000 entries fits.
  static constexpr std::size_t max_kept(MemoryKind kind) noexcept {
    constexpr std::size_t kKilobyte = 1024;
    return kind == MemoryKind::text ? 5 * 1024 * kKilobyte : 256 * kKilobyte;
  }

  explicit RecycledMemory(MemoryKind kind) noexcept : kind_(kind) {}
  ~RecycledMemory() { release(); }
  RecycledMemory(const RecycledMemory&) = delete;
  RecycledMemory& operator=(const RecycledMemory&) = delete;

  // Makes room for `bytes`, keeping the first `used` ones. Throws std::bad_alloc.
  void reserve(std::size_t bytes, std::size_t used);
  void release() noexcept;

  [[nodiscard]] void* data() const noexcept { return data_; }
  [[nodiscard]] std::size_t capacity() const noexcept { return capacity_; }

 private:
  [[nodiscard]] bool is_mapped() const noexcept { return capacity_ > max_kept(kind_); }
  void reserve_mapped(std::size_t bytes, std::size_t used);
  void free_block() noexcept;

  MemoryKind kind_;
  void* data_ = nullptr;
  std::size_t capacity_ = 0;
};

// What tells one version of a file from the next.
struct FileIdentity {
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;
  timespec modified{};

  bool operator==(const FileIdentity& other) const noexcept {
    return device == other.device && inode == other.inode && size == other.size &&
           modified.tv_sec == other.modified.tv_sec && modified.tv_nsec == other.modified.tv_nsec;
  }
};

inline FileIdentity identity_of(const struct stat& status) noexcept {
  return {status.st_dev, status.st_ino, status.st_size, status.st_mtim};
}

class FileText {
 public:
  static constexpr std::size_t kMaxSize = std::size_t{1} << 30;
  // So many bytes behind the text may be read; the first is a newline.
  static constexpr std::size_t kPadding = 64;

  // Reads the file at `path`, following symbolic links; only a regular file will do. A file that
  // changes while it is read is read again, a few times. False with the cause in words; throws
  // std::bad_alloc.
  //
  // A file that somebody writes in place is waited for, so that it is not taken for whole while
  // half of it is there: as long as he has it open for writing and his last write is younger than
  // kWriterPause (kEmptyPause while the file is empty: to free what was in it may take a busy disk
  // that long), but for no more than kWriterPauses attempts. Then what is there is read. Where the
  // system cannot tell who has it open (FileCalls::hold_writers_off), it is read at once. Of a file
  // that was not written lately only the time is looked at.
  bool read(FileCalls& files, const char* path, std::string& cause);
  static constexpr long kWriterPause = 200'000'000;   // nanoseconds
  static constexpr long kEmptyPause = 1'000'000'000;  // the longest that may be
  static constexpr int kWriterPauses = 1000;          // of a millisecond each

  // Takes a text that is in memory already.
  void assign(const char* text, std::size_t size);
  // Takes pieces of text, none of them in this object, one after the other.
  void assign(std::span<const std::string_view> pieces);

  [[nodiscard]] const char* begin() const noexcept {
    return static_cast<const char*>(memory_.data());
  }
  [[nodiscard]] const char* end() const noexcept { return begin() + size_; }
  [[nodiscard]] std::size_t size() const noexcept { return size_; }
  [[nodiscard]] const FileIdentity& identity() const noexcept { return identity_; }
  void set_identity(const FileIdentity& identity) noexcept { identity_ = identity; }

 private:
  enum class Outcome { read, changed, being_written, failed };
  Outcome read_once(FileCalls& files, const char* path, bool patient, std::string& cause);
  Outcome read_settled(FileCalls& files, int file, bool patient, std::string& cause);
  Outcome read_open(int file, const struct stat& before, std::string& cause);
  void terminate(std::size_t size) noexcept;

  RecycledMemory memory_{MemoryKind::text};
  std::size_t size_ = 0;
  FileIdentity identity_;
};

}  // namespace orv::cfg
