#include "slapi/codepage.h"

#include <iconv.h>
#include <langinfo.h>
#include <locale.h>
#include <pthread.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <string>
#include <string_view>
#include <utility>

#include "cfg/code_page.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "memory.h"
#include "slapi/strings.h"

namespace orv {
namespace {

using slapi::MallocPtr;

constexpr char kUtf8[] = "UTF-8";
constexpr std::size_t kNameSize = 64;

// ---- The code page in force ------------------------------------------------------------------

struct CodePage {
  char requested[kNameSize] = "";  // by set_local_code_page
  bool request_too_long = false;
  char name[kNameSize] = "UTF-8";
  std::atomic<bool> utf8{true};
  std::atomic<std::uint32_t> generation{1};  // tells threads that their descriptors are of old
};

CodePage& page() noexcept {
  static CodePage current;
  return current;
}

// Names of UTF-8 and of code pages whose every text is UTF-8 already.
bool means_utf8(const char* name) noexcept {
  static constexpr const char* kNames[] = {
      "UTF-8", "UTF8", "ANSI_X3.4-1968", "US-ASCII", "ASCII", "646", "ISO646-US", "C", "POSIX", ""};
  for (const char* known : kNames)
    if (kel_strcasecmp(name, known) == 0) return true;
  return false;
}

// The name of the locale in the environment, by the precedence of POSIX.
const char* environment_locale() noexcept {
  for (const char* variable : {"LC_ALL", "LC_CTYPE", "LANG"}) {
    const char* const value = std::getenv(variable);
    if (value != nullptr && *value != '\0') return value;
  }
  return "C";
}

void copy_name(char (&target)[kNameSize], std::string_view name) noexcept {
  const std::size_t length = name.size() < kNameSize ? name.size() : kNameSize - 1;
  std::memcpy(target, name.data(), length);
  target[length] = '\0';
}

// A locale that is not installed still says its codeset in its name:
// language_AREA.CODESET@modifier.
void codeset_in_name(std::string_view locale, char (&name)[kNameSize]) noexcept {
  const std::size_t dot = locale.find('.');
  if (dot == std::string_view::npos) return copy_name(name, kUtf8);
  locale.remove_prefix(dot + 1);
  copy_name(name, locale.substr(0, locale.find('@')));
}

void environment_code_page(char (&name)[kNameSize]) noexcept {
  const char* const locale = environment_locale();
  const locale_t handle = newlocale(LC_CTYPE_MASK, locale, nullptr);
  if (handle == static_cast<locale_t>(nullptr)) return codeset_in_name(locale, name);
  copy_name(name, nl_langinfo_l(CODESET, handle));
  freelocale(handle);
}

// ---- Descriptors -----------------------------------------------------------------------------

class Descriptor {
 public:
  Descriptor() = default;
  Descriptor(const char* to, const char* from) noexcept : handle_(iconv_open(to, from)) {}
  ~Descriptor() { close(); }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(Descriptor&& other) noexcept {
    std::swap(handle_, other.handle_);
    return *this;
  }
  [[nodiscard]] bool is_open() const noexcept { return handle_ != kClosed; }
  [[nodiscard]] iconv_t get() const noexcept { return handle_; }
  void close() noexcept {
    if (is_open()) iconv_close(handle_);
    handle_ = kClosed;
  }

 private:
  // iconv_open's failure value; no pointer has it.
  inline static const iconv_t kClosed = reinterpret_cast<iconv_t>(-1);
  iconv_t handle_ = kClosed;
};

struct ThreadDescriptors {
  std::uint32_t generation = 0;
  Descriptor to_utf8;
  Descriptor from_utf8;
};

// The descriptors of a thread hang on a key of the threads library and not on a thread_local: the
// registration of a thread_local's destructor ends the process when it meets a lack of memory.
pthread_key_t descriptors_key;
bool descriptors_key_made = false;

void release_descriptors(void* descriptors) {
  delete static_cast<ThreadDescriptors*>(descriptors);
}

void make_descriptors_key() {
  descriptors_key_made = pthread_key_create(&descriptors_key, release_descriptors) == 0;
}

ThreadDescriptors* thread_descriptors() noexcept {
  static pthread_once_t once = PTHREAD_ONCE_INIT;
  pthread_once(&once, make_descriptors_key);
  if (!descriptors_key_made) return nullptr;
  if (void* const existing = pthread_getspecific(descriptors_key); existing != nullptr)
    return static_cast<ThreadDescriptors*>(existing);
  std::unique_ptr<ThreadDescriptors> made(new (std::nothrow) ThreadDescriptors);
  if (made == nullptr || pthread_setspecific(descriptors_key, made.get()) != 0) return nullptr;
  return made.release();
}

// The calling thread's descriptor for one direction, in its initial state; null without memory:
// that the system knows the code page was found when it was set up.
Descriptor* descriptor(bool to_utf8) noexcept {
  ThreadDescriptors* const mine = thread_descriptors();
  if (mine == nullptr) return nullptr;
  const std::uint32_t generation = page().generation.load(std::memory_order_acquire);
  if (mine->generation != generation) {
    mine->to_utf8.close();
    mine->from_utf8.close();
    mine->generation = generation;
  }
  Descriptor& wanted = to_utf8 ? mine->to_utf8 : mine->from_utf8;
  if (!wanted.is_open())
    wanted = to_utf8 ? Descriptor(kUtf8, page().name) : Descriptor(page().name, kUtf8);
  if (!wanted.is_open()) return nullptr;
  iconv(wanted.get(), nullptr, nullptr, nullptr, nullptr);
  return &wanted;
}

// ---- Conversion ------------------------------------------------------------------------------

// An output text that grows as it is written.
class Output {
 public:
  bool reserve(std::size_t capacity) noexcept {
    void* const grown = std::realloc(text_.get(), capacity);
    if (grown == nullptr) return false;
    (void)text_.release();
    text_.reset(static_cast<char*>(grown));
    capacity_ = capacity;
    return true;
  }
  bool grow() noexcept { return reserve(capacity_ * 2); }

  // One call of iconv that writes after what was written so far; a null input ends the text.
  std::size_t convert(iconv_t handle, char** input, std::size_t* input_left) noexcept {
    char* end = text_.get() + length_;
    std::size_t room = capacity_ - length_ - 1;  // one byte stays for the NUL
    const std::size_t outcome = iconv(handle, input, input_left, &end, &room);
    length_ = static_cast<std::size_t>(end - text_.get());
    return outcome;
  }

  // Hands the text over, NUL-terminated; `length` counts the NUL.
  char* finish(std::size_t* length) noexcept {
    text_.get()[length_] = '\0';
    *length = length_ + 1;
    return text_.release();
  }

 private:
  MallocPtr<char> text_;
  std::size_t capacity_ = 0;
  std::size_t length_ = 0;
};

constexpr auto kFailed = static_cast<std::size_t>(-1);

// Runs the text through, then brings the output back to its initial shift state.
int convert_all(iconv_t handle, const char* text, std::size_t length, Output& output) noexcept {
  char* input = const_cast<char*>(text);  // iconv's declaration; it does not write there
  std::size_t left = length;
  bool ending = false;
  for (;;) {
    const std::size_t outcome =
        ending ? output.convert(handle, nullptr, nullptr) : output.convert(handle, &input, &left);
    if (outcome == kFailed) {
      if (errno != E2BIG) return result::invalid_attribute_syntax;
      if (!output.grow()) return result::no_memory;
      continue;
    }
    // Characters that were replaced or dropped, because the other side lacks them.
    if (outcome != 0) return result::invalid_attribute_syntax;
    if (ending) return result::success;
    ending = true;
  }
}

int convert(bool to_utf8, const char* text, char** result, std::size_t* length) noexcept {
  Descriptor* const open = descriptor(to_utf8);
  if (open == nullptr) return result::no_memory;
  const std::size_t text_length = std::strlen(text);
  Output output;
  if (!output.reserve(text_length + text_length / 2 + 8)) return result::no_memory;
  if (const int rc = convert_all(open->get(), text, text_length, output); rc != result::success)
    return rc;
  *result = output.finish(length);
  return result::success;
}

// As the configuration-file library compares texts.
int decode_for_library(std::string_view text, std::string& utf8) noexcept try {
  Descriptor* const open = descriptor(true);
  Output output;
  if (open == nullptr || !output.reserve(text.size() + text.size() / 2 + 8)) {
    return result::no_memory;
  }
  const int rc = convert_all(open->get(), text.data(), text.size(), output);
  if (rc != result::success) return rc;
  std::size_t length = 0;
  const MallocPtr<char> converted(output.finish(&length));
  utf8.assign(converted.get(), length - 1);
  return result::success;
} catch (...) {
  return result::no_memory;
}

int checked_copy(const char* text, char** result, std::size_t* length) noexcept {
  const std::string_view bytes(text);
  if (!cfg::is_valid_utf8(bytes)) return result::invalid_attribute_syntax;
  char* const copy = slapi::copy_bytes(bytes);
  if (copy == nullptr) return result::no_memory;
  *result = copy;
  *length = bytes.size() + 1;
  return result::success;
}

int translate(bool to_utf8, const char* text, char** result, std::size_t* length) noexcept {
  if (result != nullptr) *result = nullptr;
  if (length != nullptr) *length = 0;
  if (text == nullptr || result == nullptr || length == nullptr) return result::other;
  if (local_code_page_is_utf8()) return checked_copy(text, result, length);
  return convert(to_utf8, text, result, length);
}

// ---- Set-up ----------------------------------------------------------------------------------

// The file's own syntax is ASCII, and texts end at a NUL: a code page that writes those characters
// in other bytes (UTF-16, EBCDIC) cannot be a configuration file's. The backslash and the tilde are
// left out because common code pages have a currency sign and an overline there.
bool keeps_ascii(iconv_t to_utf8) noexcept {
  static constexpr char kSyntax[] =
      "\n\r "
      "\"#$%&'()*+,-./0123456789:;<=>?@ABCDEFGHIJKLMNOPQRSTUVWXYZ^_`abcdefghijklmnopqrstuvwxyz{|}";
  Output output;
  if (!output.reserve(2 * sizeof kSyntax)) return false;
  if (convert_all(to_utf8, kSyntax, sizeof kSyntax - 1, output) != result::success) return false;
  std::size_t length = 0;
  const MallocPtr<char> converted(output.finish(&length));
  return length == sizeof kSyntax && std::memcmp(converted.get(), kSyntax, length) == 0;
}

int check_code_page(const char* name) noexcept {
  errno = 0;
  const Descriptor to_utf8(kUtf8, name);
  if (!to_utf8.is_open()) return errno == ENOMEM ? result::no_memory : result::other;
  const Descriptor from_utf8(name, kUtf8);
  if (!from_utf8.is_open()) return errno == ENOMEM ? result::no_memory : result::other;
  return keeps_ascii(to_utf8.get()) ? result::success : result::other;
}

void put_in_force(const char* name, bool utf8) noexcept {
  copy_name(page().name, name);
  page().utf8.store(utf8, std::memory_order_release);
  page().generation.fetch_add(1, std::memory_order_release);
  cfg::set_text_decoder(utf8 ? nullptr : &decode_for_library);
}

}  // namespace

void set_local_code_page(const char* name) {
  const std::string_view wanted = name == nullptr ? "" : name;
  page().request_too_long = wanted.size() >= kNameSize;
  copy_name(page().requested, wanted);
}

int initIconvHandle() {
  if (page().request_too_long) return result::other;
  char name[kNameSize];
  copy_name(name, page().requested);
  if (*name == '\0') environment_code_page(name);
  if (means_utf8(name)) {
    put_in_force(kUtf8, true);
    return result::success;
  }
  if (const int rc = check_code_page(name); rc != result::success) return rc;
  put_in_force(name, false);
  return result::success;
}

const char* local_code_page() {
  return page().name;
}

bool local_code_page_is_utf8() {
  return page().utf8.load(std::memory_order_acquire);
}

int xlate_localcp_to_utf8(const char* text, char** result, std::size_t* length) {
  return translate(true, text, result, length);
}

int xlate_utf8_to_localcp(const char* text, char** result, std::size_t* length) {
  return translate(false, text, result, length);
}

}  // namespace orv
