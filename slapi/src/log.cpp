#include "slapi/log.h"

#include <nl_types.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <string_view>

#include "masked_text.h"
#include "record_writer.h"

namespace orv {
namespace {

std::atomic<bool> debug_on{false};

// ---- Texts -----------------------------------------------------------------------------------

struct Message {
  int set;
  int number;
  std::size_t arguments;  // all of them texts
  const char* text;
};

constexpr std::size_t kMaxArguments = 4;

constexpr std::array kMessages{
    Message{8, 145, 0,
            "The proxy split name in this change is already in use. The change was refused."},
    Message{8, 146, 0,
            "The proxy split name in this entry is already in use. The entry was not added."},
    Message{8, 167, 2,
            "The pass-through subtrees '%s' and '%s' overlap. Each subtree may be passed to one "
            "server only."},
    Message{8, 174, 2,
            "The pass-through entry '%s' covers the reserved suffix '%s', which is never passed "
            "through."},
    Message{8, 179, 1, "The value '%s' of orv-slapdPtaURL is not an LDAP URL."},
    Message{9, 1, 1, "The entry '%s' does not fit the schema: it has no object class."},
    Message{9, 2, 2, "The entry '%s' does not fit the schema: there is no object class '%s'."},
    Message{9, 3, 2, "The entry '%s' does not fit the schema: there is no attribute type '%s'."},
    Message{9, 4, 2, "The entry '%s' does not fit the schema: '%s' has more than one value."},
    Message{9, 5, 3, "The entry '%s' does not fit the schema: a value of '%s' %s."},
    Message{9, 6, 2,
            "The entry '%s' does not fit the schema: its object classes do not allow '%s'."},
    Message{9, 7, 1, "The entry '%s' does not fit the schema: it has no structural object class."},
    Message{9, 8, 3,
            "The entry '%s' does not fit the schema: '%s' and '%s' are structural object classes "
            "of which neither derives from the other."},
    Message{9, 9, 2, "The entry '%s' does not fit the schema: its object classes demand '%s'."},
    Message{9, 10, 2,
            "The entry '%s' does not fit the schema: '%s' is a password and cannot be part of a "
            "name."},
    Message{9, 11, 2,
            "The entry '%s' does not fit the schema: its name has a value of '%s' that the entry "
            "lacks."},
    Message{10, 1, 1, "A new password from '%s' was refused: it is empty."},
    Message{10, 2, 2, "A new password from '%s' was refused: it has fewer than %s characters."},
    Message{10, 3, 2, "A new password from '%s' was refused: it has fewer than %s letters."},
    Message{10, 4, 2,
            "A new password from '%s' was refused: fewer than %s of its characters are no "
            "letters."},
    Message{10, 5, 2,
            "A new password from '%s' was refused: one character occurs more than %s times."},
    Message{10, 6, 2,
            "A new password from '%s' was refused: fewer than %s different characters are new."},
    Message{10, 7, 1, "A new password from '%s' was refused: it is the old one."},
    Message{10, 8, 1,
            "The password policy in the configuration file is not put in force: %s. The one "
            "before stays."},
    Message{10, 9, 1,
            "The password method in the configuration file is not put in force: %s. The one "
            "before stays."},
    Message{10, 10, 2, "'%s' is locked out after %s failed binds."},
};

const Message* find_message(int set, int number) noexcept {
  for (const Message& message : kMessages)
    if (message.set == set && message.number == number) return &message;
  return nullptr;
}

// ---- Catalogue -------------------------------------------------------------------------------

const nl_catd kNoCatalogue = reinterpret_cast<nl_catd>(-1);

std::atomic<nl_catd>& catalogue() noexcept {
  static std::atomic<nl_catd> opened{kNoCatalogue};
  return opened;
}

// One conversion of a text. `argument` is its place, from 0; `length` that of the conversion
// itself.
struct Conversion {
  bool valid = false;
  bool positional = false;
  bool percent_sign = false;
  std::size_t argument = 0;
  std::size_t length = 0;
};

// Reads "%s", "%2$s" or "%%" at `text`, which begins with "%". A plain one takes `next_argument`.
Conversion read_conversion(std::string_view text, std::size_t next_argument) noexcept {
  if (text.starts_with("%%"))
    return {.valid = true, .positional = false, .percent_sign = true, .argument = 0, .length = 2};
  if (text.starts_with("%s"))
    return {.valid = true,
            .positional = false,
            .percent_sign = false,
            .argument = next_argument,
            .length = 2};
  const bool positional =
      text.size() >= 4 && text[1] >= '1' && text[1] <= '9' && text.substr(2, 2) == "$s";
  if (!positional) return {};
  return {.valid = true,
          .positional = true,
          .percent_sign = false,
          .argument = static_cast<std::size_t>(text[1] - '1'),
          .length = 4};
}

// Whether a text takes exactly `arguments` texts: each once in their order, or each by its place.
bool takes_arguments(std::string_view text, std::size_t arguments) noexcept {
  std::array<bool, kMaxArguments> used{};
  std::size_t plain = 0;
  std::size_t positional = 0;
  for (std::size_t at = text.find('%'); at != std::string_view::npos; at = text.find('%', at)) {
    const Conversion conversion = read_conversion(text.substr(at), plain);
    if (!conversion.valid) return false;
    at += conversion.length;
    if (conversion.percent_sign) continue;
    ++(conversion.positional ? positional : plain);
    if (conversion.argument >= arguments) return false;
    used[conversion.argument] = true;
  }
  if (plain != 0 && positional != 0) return false;
  return std::count(used.begin(), used.end(), true) == static_cast<std::ptrdiff_t>(arguments);
}

std::string_view without_newline(std::string_view text) noexcept {
  while (text.ends_with('\n')) text.remove_suffix(1);
  return text;
}

std::string_view text_of(const Message& message) noexcept {
  const nl_catd opened = catalogue().load(std::memory_order_acquire);
  if (opened == kNoCatalogue) return message.text;
  const std::string_view text =
      without_newline(catgets(opened, message.set, message.number, message.text));
  return takes_arguments(text, message.arguments) ? text : message.text;
}

// ---- Writing ---------------------------------------------------------------------------------

// A finished message. Arguments come from clients and files, so that control characters in them are
// written as "\XX": a message is one line, whatever it tells.
class Line {
 public:
  void add(std::string_view text) noexcept {
    for (const char c : text) put(c);
  }
  // Without the passwords in it: what somebody named, and is told of, may hold one.
  void add_argument(const char* text) noexcept {
    const std::size_t begin = length_;
    for (const char c : std::string_view(text == nullptr ? "(null)" : text)) {
      if (static_cast<unsigned char>(c) < 0x20 || c == 0x7F)
        add_hex(static_cast<unsigned char>(c));
      else
        put(c);
    }
    length_ = slapi::mask_secrets(text_, begin, length_, sizeof text_ - 1);
  }
  const char* c_str() noexcept {
    if (cut_) std::memcpy(text_ + length_ - 3, "...", 3);
    text_[length_] = '\0';
    return text_;
  }

 private:
  void put(char c) noexcept {
    if (length_ + 1 < sizeof text_)
      text_[length_++] = c;
    else
      cut_ = true;
  }
  void add_hex(unsigned char byte) noexcept {
    static constexpr char kDigits[] = "0123456789ABCDEF";
    put('\\');
    put(kDigits[byte >> 4]);
    put(kDigits[byte & 0xF]);
  }
  char text_[8192];
  std::size_t length_ = 0;
  bool cut_ = false;
};

using Arguments = std::array<const char*, kMaxArguments>;

void compose(std::string_view text, const Arguments& arguments, Line& line) noexcept {
  std::size_t next = 0;
  for (;;) {
    const std::size_t at = text.find('%');
    line.add(text.substr(0, at));
    if (at == std::string_view::npos) return;
    text.remove_prefix(at);
    const Conversion conversion = read_conversion(text, next);
    text.remove_prefix(conversion.length);
    if (conversion.percent_sign) {
      line.add("%");
      continue;
    }
    line.add_argument(arguments[conversion.argument]);
    ++next;
  }
}

void write_to_standard_error(int /*severity*/, int set, int number, const char* text) noexcept {
  char prefix[32];
  const int prefix_length = std::snprintf(prefix, sizeof prefix, "%d-%d ", set, number);
  char newline[] = "\n";
  const std::array parts{iovec{prefix, static_cast<std::size_t>(prefix_length)},
                         iovec{const_cast<char*>(text), std::strlen(text)}, iovec{newline, 1}};
  while (writev(STDERR_FILENO, parts.data(), static_cast<int>(parts.size())) < 0 &&
         errno == EINTR) {
  }
}

std::atomic<MessageSink>& message_sink() noexcept {
  static std::atomic<MessageSink> sink{write_to_standard_error};
  return sink;
}

}  // namespace

bool read_ldap_debug() {
  return debug_on.load(std::memory_order_relaxed);
}

void set_ldap_debug(bool on) {
  debug_on.store(on, std::memory_order_relaxed);
}

void PrintDebug(std::uint32_t category, const char* format, ...) {
  if (format == nullptr) return;
  slapi::Record record;
  record.add("debug %08X ", category);
  std::va_list arguments;
  va_start(arguments, format);
  record.add_list(format, arguments);
  va_end(arguments);
  record.write();
}

void PrintMessage(int severity, int set, int number, ...) {
  const Message* const message = find_message(set, number);
  Line line;
  if (message == nullptr) {
    // Nobody knows what arguments it has, so that they are left alone.
    line.add("A message without a text.");
  } else {
    Arguments arguments{};
    std::va_list list;
    va_start(list, number);
    for (std::size_t i = 0; i < message->arguments; ++i) arguments[i] = va_arg(list, const char*);
    va_end(list);
    compose(text_of(*message), arguments, line);
  }
  message_sink().load(std::memory_order_acquire)(severity, set, number, line.c_str());
}

bool open_message_catalogue(const char* path) {
  const nl_catd opened = catopen(path == nullptr ? "orvd" : path, 0);
  const nl_catd before = catalogue().exchange(opened, std::memory_order_acq_rel);
  if (before != kNoCatalogue) catclose(before);
  return opened != kNoCatalogue;
}

void set_message_sink(MessageSink sink) noexcept {
  message_sink().store(sink == nullptr ? write_to_standard_error : sink, std::memory_order_release);
}

}  // namespace orv
