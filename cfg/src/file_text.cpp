#include "file_text.h"

#include <fcntl.h>
#include <sched.h>
#include <sys/mman.h>
#include <sys/stat.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <new>
#include <optional>
#include <utility>

#include "file_descriptor.h"

namespace orv::cfg {

// ---- Recycled memory ----

namespace {

struct Block {
  void* data = nullptr;
  std::size_t capacity = 0;
};

struct SpareBlocks {
  std::array<Block, 3> blocks;

  SpareBlocks() = default;
  ~SpareBlocks() {
    for (const Block& block : blocks) std::free(block.data);
  }
  SpareBlocks(const SpareBlocks&) = delete;
  SpareBlocks& operator=(const SpareBlocks&) = delete;
};

thread_local SpareBlocks spare_blocks;

}  // namespace

void RecycledMemory::reserve(std::size_t bytes, std::size_t used) {
  if (bytes <= capacity_) return;
  if (data_ == nullptr) {
    const Block spare =
        std::exchange(spare_blocks.blocks[static_cast<std::size_t>(kind_)], Block{});
    data_ = spare.data;
    capacity_ = spare.capacity;
    if (bytes <= capacity_) return;
  }
  if (bytes > max_kept(kind_)) return reserve_mapped(bytes, used);
  // Nothing to keep: realloc would copy for nothing.
  if (used == 0) free_block();
  void* const grown = std::realloc(data_, bytes);
  if (grown == nullptr) throw std::bad_alloc();
  data_ = grown;
  capacity_ = bytes;
}

// A block of the C library's would go back to its own store, and stay there.
void RecycledMemory::reserve_mapped(std::size_t bytes, std::size_t used) {
  if (used == 0) free_block();
  void* grown = MAP_FAILED;
  if (is_mapped()) {
    grown = ::mremap(data_, capacity_, bytes, MREMAP_MAYMOVE);
    if (grown == MAP_FAILED) throw std::bad_alloc();
  } else {
    grown = ::mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (grown == MAP_FAILED) throw std::bad_alloc();
    // Few large pages cost less than many small ones; it does without if there are none.
    ::madvise(grown, bytes, MADV_HUGEPAGE);
    if (used > 0) std::memcpy(grown, data_, used);
    free_block();
  }
  data_ = grown;
  capacity_ = bytes;
}

void RecycledMemory::free_block() noexcept {
  if (is_mapped()) {
    ::munmap(data_, capacity_);
  } else {
    std::free(data_);
  }
  data_ = nullptr;
  capacity_ = 0;
}

void RecycledMemory::release() noexcept {
  Block& spare = spare_blocks.blocks[static_cast<std::size_t>(kind_)];
  if (!is_mapped() && capacity_ > spare.capacity) {
    std::swap(spare.data, data_);
    std::swap(spare.capacity, capacity_);
  }
  free_block();
}

// ---- File ----

namespace {

std::string system_cause(const char* what, int error) {
  std::array<char, 128> buffer{};
  return std::string(what) + ": " + ::strerror_r(error, buffer.data(), buffer.size());
}

// Reads up to `wanted` bytes; fewer only at the end of the file. -1 with errno.
ssize_t read_fully(int file, char* to, std::size_t wanted) noexcept {
  std::size_t done = 0;
  while (done < wanted) {
    const ssize_t n = ::read(file, to + done, wanted - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return -1;
    done += static_cast<std::size_t>(n);
    // A regular file reads short only at its end (or at a signal, where the next call tells).
    if (n == 0) break;
    if (done + 1 == wanted) break;
  }
  return static_cast<ssize_t>(done);
}

// Whether somebody who wrote the file then may not be done with it. A clock that was set back a
// little leaves times that lie ahead.
bool is_recent(const struct stat& status, const timespec& now) noexcept {
  constexpr long kSecond = 1'000'000'000;
  const timespec& written = status.st_mtim;
  if (written.tv_sec < now.tv_sec - 1 || written.tv_sec > now.tv_sec + 1) return false;
  const long age = (now.tv_sec - written.tv_sec) * kSecond + now.tv_nsec - written.tv_nsec;
  const long pause = status.st_size == 0 ? FileText::kEmptyPause : FileText::kWriterPause;
  return age < pause && age > -pause;
}

// While this stands, nobody begins to write the file; should the system be able to see to that.
class HeldWriters {
 public:
  HeldWriters(FileCalls& files, int file)
      : files_(files), file_(file), error_(files.hold_writers_off(file) == 0 ? 0 : errno) {}
  ~HeldWriters() {
    if (error_ == 0) files_.let_writers_in(file_);
  }
  HeldWriters(const HeldWriters&) = delete;
  HeldWriters& operator=(const HeldWriters&) = delete;

  // Whether somebody began before.
  [[nodiscard]] bool are_at_work() const noexcept { return error_ == EAGAIN; }

 private:
  FileCalls& files_;
  const int file_;
  const int error_;
};

}  // namespace

bool FileText::read(FileCalls& files, const char* path, std::string& cause) {
  constexpr int kAttempts = 20;
  int pauses = kWriterPauses;
  for (int attempt = 0; attempt < kAttempts;) {
    const Outcome outcome = read_once(files, path, pauses > 0, cause);
    if (outcome == Outcome::being_written) {
      --pauses;
      files.pause_for_writer();
      continue;
    }
    if (outcome != Outcome::changed) return outcome == Outcome::read;
    ++attempt;
    ::sched_yield();
  }
  cause = "the file kept changing while it was read";
  return false;
}

FileText::Outcome FileText::read_once(FileCalls& files, const char* path, bool patient,
                                      std::string& cause) {
  // O_NONBLOCK: opening a pipe that nobody writes to must not stop the server.
  const FileDescriptor file(::open(path, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (!file.is_open()) {
    cause = system_cause("cannot be opened", errno);
    return Outcome::failed;
  }
  return read_settled(files, file.get(), patient, cause);
}

FileText::Outcome FileText::read_settled(FileCalls& files, int file, bool patient,
                                         std::string& cause) {
  struct stat before {};
  if (::fstat(file, &before) != 0) {
    cause = system_cause("cannot be examined", errno);
    return Outcome::failed;
  }
  if (!S_ISREG(before.st_mode)) {
    cause =
        S_ISDIR(before.st_mode) ? "is a directory, not a regular file" : "is not a regular file";
    return Outcome::failed;
  }
  if (static_cast<std::size_t>(before.st_size) > kMaxSize) {
    cause = "is larger than 1 GiB";
    return Outcome::failed;
  }
  std::optional<HeldWriters> writers;
  if (is_recent(before, files.now())) {
    writers.emplace(files, file);
    if (patient && writers->are_at_work()) return Outcome::being_written;
  }
  return read_open(file, before, cause);
}

FileText::Outcome FileText::read_open(int file, const struct stat& before, std::string& cause) {
  const auto expected = static_cast<std::size_t>(before.st_size);
  memory_.reserve(expected + kPadding, 0);
  // One byte more than expected shows a file that has grown.
  const ssize_t got = read_fully(file, static_cast<char*>(memory_.data()), expected + 1);
  if (got < 0) {
    cause = system_cause("cannot be read", errno);
    return Outcome::failed;
  }
  struct stat after {};
  if (::fstat(file, &after) != 0) {
    cause = system_cause("cannot be examined", errno);
    return Outcome::failed;
  }
  identity_ = identity_of(before);
  if (static_cast<std::size_t>(got) != expected || !(identity_of(after) == identity_)) {
    return Outcome::changed;
  }
  terminate(expected);
  return Outcome::read;
}

void FileText::assign(const char* text, std::size_t size) {
  const std::string_view whole(text, size);
  assign({&whole, 1});
}

void FileText::assign(std::span<const std::string_view> pieces) {
  std::size_t size = 0;
  for (const std::string_view piece : pieces) size += piece.size();
  memory_.reserve(size + kPadding, 0);
  auto* to = static_cast<char*>(memory_.data());
  for (const std::string_view piece : pieces) {
    if (!piece.empty()) std::memcpy(to, piece.data(), piece.size());
    to += piece.size();
  }
  terminate(size);
}

void FileText::terminate(std::size_t size) noexcept {
  size_ = size;
  char* const end = static_cast<char*>(memory_.data()) + size;
  std::memset(end, 0, kPadding);
  *end = '\n';
}

}  // namespace orv::cfg
