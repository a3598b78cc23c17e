// The key stash file: one line with the key in hexadecimal, readable by its owner alone.
#include <fcntl.h>
#include <openssl/rand.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <mutex>
#include <new>
#include <utility>

#include "cfg/result_codes.h"
#include "cfg/secret.h"
#include "characters.h"
#include "file_descriptor.h"
#include "secret_key.h"

namespace orv::cfg {

namespace {

constexpr std::string_view kPrefix = "orv-key-1 ";
constexpr std::size_t kDigits = 64;
constexpr std::size_t kLineLength = kPrefix.size() + kDigits;

// The line while it is in memory; one byte more than a good file has shows a longer one.
struct Line {
  char text[kLineLength + 2] = {};
  std::size_t length = 0;

  Line() = default;
  ~Line() { wipe(text, sizeof text); }
  Line(const Line&) = delete;
  Line& operator=(const Line&) = delete;
};

int refuse(const char* path, const std::string& cause, std::string& why) {
  why = std::string(path) + ": " + cause;
  return result::operations_error;
}

int refuse_errno(const char* path, const char* what, std::string& why) {
  const int error = errno;
  char buffer[128] = {};
  return refuse(path, std::string(what) + ": " + ::strerror_r(error, buffer, sizeof buffer), why);
}

// Why a file with this status must not be trusted; null when it may be.
const char* distrust(const struct stat& status) noexcept {
  if (!S_ISREG(status.st_mode)) return "the key stash is not a regular file";
  if ((status.st_mode & 077) != 0) return "the key stash is open to others than its owner";
  const uid_t me = ::geteuid();
  if (status.st_uid != me && status.st_uid != 0 && me != 0) {
    return "the key stash belongs to another user";
  }
  return nullptr;
}

bool read_line(int file, Line& line) noexcept {
  while (line.length < sizeof line.text) {
    const ssize_t n = ::read(file, line.text + line.length, sizeof line.text - line.length);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    if (n == 0) break;
    line.length += static_cast<std::size_t>(n);
  }
  return true;
}

bool decode(const Line& line, Key::Bytes& bytes) noexcept {
  std::string_view text(line.text, line.length);
  if (!text.empty() && text.back() == '\n') text.remove_suffix(1);
  if (text.size() != kLineLength || text.substr(0, kPrefix.size()) != kPrefix) return false;
  text.remove_prefix(kPrefix.size());
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    const int high = hex_digit(text[2 * i]);
    const int low = hex_digit(text[2 * i + 1]);
    if (high < 0 || low < 0) return false;
    bytes[i] = static_cast<unsigned char>(high << 4 | low);
  }
  return true;
}

void encode(const Key::Bytes& bytes, Line& line) noexcept {
  constexpr char kHex[] = "0123456789abcdef";
  std::memcpy(line.text, kPrefix.data(), kPrefix.size());
  char* out = line.text + kPrefix.size();
  for (const unsigned char byte : bytes) {
    *out++ = kHex[byte >> 4];
    *out++ = kHex[byte & 15];
  }
  *out = '\n';
  line.length = kLineLength + 1;
}

bool write_line(int file, const Line& line) noexcept {
  std::size_t done = 0;
  while (done < line.length) {
    const ssize_t n = ::write(file, line.text + done, line.length - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    done += static_cast<std::size_t>(n);
  }
  return ::fsync(file) == 0;
}

// `status` receives the file's status from before it was read.
int load(const char* path, struct stat& status, KeyPtr& key, std::string& why) {
  const FileDescriptor file(::open(path, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (!file.is_open()) return refuse_errno(path, "the key stash cannot be opened", why);
  if (::fstat(file.get(), &status) != 0) {
    return refuse_errno(path, "the key stash cannot be examined", why);
  }
  const char* const cause = distrust(status);
  if (cause != nullptr) return refuse(path, cause, why);
  Line line;
  if (!read_line(file.get(), line)) {
    return refuse_errno(path, "the key stash cannot be read", why);
  }
  Key::Bytes bytes{};
  const bool good = decode(line, bytes);
  if (good) key.reset(new (std::nothrow) Key(bytes));
  wipe(bytes.data(), bytes.size());
  if (!good) return refuse(path, "the key stash does not hold a key", why);
  return key != nullptr ? result::success : result::no_memory;
}

// ---- The key read last ----

bool is_same(const timespec& a, const timespec& b) noexcept {
  return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

// Whether a file with these two statuses cannot have been changed, or replaced, in between.
bool is_same_file(const struct stat& a, const struct stat& b) noexcept {
  return a.st_ino == b.st_ino && a.st_dev == b.st_dev && a.st_size == b.st_size &&
         a.st_mode == b.st_mode && a.st_uid == b.st_uid && is_same(a.st_mtim, b.st_mtim) &&
         is_same(a.st_ctim, b.st_ctim);
}

// Whether the file was changed so lately that another change might leave it the same times. A time
// in the future tells nothing.
bool is_fresh(const struct stat& status) noexcept {
  timespec now{};
  ::clock_gettime(CLOCK_REALTIME, &now);
  return now.tv_sec < status.st_ctim.tv_sec + 2;
}

class LastKey {
 public:
  SharedKey find(const struct stat& status) {
    const std::lock_guard lock(mutex_);
    return key_ != nullptr && is_same_file(status, status_) ? key_ : nullptr;
  }

  // Null forgets the key.
  void keep(SharedKey key, const struct stat& status) {
    const std::lock_guard lock(mutex_);
    key_.swap(key);
    status_ = status;
  }

 private:
  std::mutex mutex_;
  SharedKey key_;
  struct stat status_ {};  // of the file it was read from
};

LastKey last_key;

int share(const char* path, SharedKey& key, std::string& why) {
  struct stat status {};
  if (::stat(path, &status) == 0 && distrust(status) == nullptr) {
    key = last_key.find(status);
    if (key != nullptr) return result::success;
  }
  KeyPtr loaded;
  const int rc = load(path, status, loaded, why);
  SharedKey shared(std::move(loaded));
  last_key.keep(rc == result::success && !is_fresh(status) ? shared : nullptr, status);
  if (rc == result::success) key = std::move(shared);
  return rc;
}

int create(const char* path, std::string& why) {
  Key::Bytes bytes{};
  if (RAND_bytes(bytes.data(), static_cast<int>(bytes.size())) != 1) {
    return refuse(path, "there are no random numbers for a key", why);
  }
  Line line;
  encode(bytes, line);
  wipe(bytes.data(), bytes.size());
  const FileDescriptor file(::open(path, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
  if (!file.is_open()) return refuse_errno(path, "the key stash cannot be created", why);
  if (!write_line(file.get(), line)) {
    const int rc = refuse_errno(path, "the key stash cannot be written", why);
    ::unlink(path);
    return rc;
  }
  return result::success;
}

}  // namespace

void KeyDeleter::operator()(const Key* key) const noexcept {
  delete key;
}

int load_key_stash(const char* path, KeyPtr& key, std::string& why) noexcept try {
  if (path == nullptr) return refuse("", "no key stash is named", why);
  struct stat status {};
  return load(path, status, key, why);
} catch (...) {
  return result::no_memory;
}

int share_key_stash(const char* path, SharedKey& key, std::string& why) noexcept try {
  return share(path, key, why);
} catch (...) {
  return result::no_memory;
}

int create_key_stash(const char* path, std::string& why) noexcept try {
  if (path == nullptr) return refuse("", "no key stash is named", why);
  return create(path, why);
} catch (...) {
  return result::no_memory;
}

}  // namespace orv::cfg
