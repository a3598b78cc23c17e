// The lines of LDIF text (RFC 2849): logical lines, which may be folded over several physical ones.
//
// Texts scanned here lie in a FileText: a newline and 63 readable bytes stand behind their end, so
// that no function has to look for the end and the newline both.
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "characters.h"

#if defined(__SSE2__)
#include <emmintrin.h>
#endif

namespace orv::cfg {

inline constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";

#if defined(__SSE2__)

namespace simd {

inline __m128i load(const char* p) noexcept {
  return _mm_loadu_si128(reinterpret_cast<const __m128i*>(p));
}

// One bit for each byte of the 16 that is a newline.
inline std::uint64_t newlines(const char* p) noexcept {
  return static_cast<std::uint32_t>(
      _mm_movemask_epi8(_mm_cmpeq_epi8(load(p), _mm_set1_epi8('\n'))));
}

// One bit for each byte of the 16 that is no letter, digit or hyphen.
inline std::uint32_t others(const char* p) noexcept {
  // Signed comparisons: bytes from 0x80 are negative and so below every range.
  const auto between = [](__m128i block, char low, char high) {
    return _mm_and_si128(_mm_cmpgt_epi8(block, _mm_set1_epi8(static_cast<char>(low - 1))),
                         _mm_cmplt_epi8(block, _mm_set1_epi8(static_cast<char>(high + 1))));
  };
  const __m128i block = load(p);
  const __m128i folded = _mm_or_si128(block, _mm_set1_epi8(0x20));
  const __m128i name =
      _mm_or_si128(_mm_or_si128(between(folded, 'a', 'z'), between(block, '0', '9')),
                   _mm_cmpeq_epi8(block, _mm_set1_epi8('-')));
  return ~static_cast<std::uint32_t>(_mm_movemask_epi8(name)) & 0xFFFF;
}

}  // namespace simd

// One bit for each byte of the 64 that is a newline.
inline std::uint64_t newlines_in_block(const char* p) noexcept {
  return simd::newlines(p) | simd::newlines(p + 16) << 16 | simd::newlines(p + 32) << 32 |
         simd::newlines(p + 48) << 48;
}

// The first byte at or behind `p` that is no letter, digit or hyphen.
inline const char* skip_name(const char* p) noexcept {
  while (true) {
    const std::uint32_t found = simd::others(p);
    if (found != 0) return p + std::countr_zero(found);
    p += 16;
  }
}

#else

inline std::uint64_t newlines_in_block(const char* p) noexcept {
  std::uint64_t found = 0;
  for (int i = 0; i < 64; ++i) found |= std::uint64_t{p[i] == '\n'} << i;
  return found;
}

inline const char* skip_name(const char* p) noexcept {
  while (is_ascii_letter(*p) || is_ascii_digit(*p) || *p == '-') ++p;
  return p;
}

#endif

// Gives the newlines from `at` on, one after the other. It runs ahead of whoever uses it a block at
// a time: where one line ends must not have to be known before the search for the next can begin.
class Newlines {
 public:
  explicit Newlines(const char* at) noexcept : next_block_(at) {}

  const char* next() noexcept {
    while (found_ == 0) {
      block_ = next_block_;
      next_block_ += 64;
      found_ = newlines_in_block(block_);
    }
    const char* const newline = block_ + std::countr_zero(found_);
    found_ &= found_ - 1;
    return newline;
  }

 private:
  const char* block_ = nullptr;
  const char* next_block_;
  std::uint64_t found_ = 0;
};

enum class ValueKind { plain, base64, url };

// One "type: value" line. The views point into the text, or into the reader's scratch memory when
// the line is folded before its value begins.
struct AttributeLine {
  std::string_view type;
  std::string_view value;  // as in the text: folded when `folded`, encoded when `kind` says so
  ValueKind kind = ValueKind::plain;
  bool folded = false;
  bool has_colon = true;
  bool plain_name = false;  // `type` holds nothing but letters, digits and hyphens
};

// The names of lines that are no attributes: the DN, and what begins a change record.
inline constexpr std::string_view kDnName = "dn";
inline constexpr std::string_view kChangeTypeName = "changetype";
inline constexpr std::string_view kControlName = "control";

// Whether a text is a name or numeric identifier of an attribute type (RFC 4512, 1.4), without
// options.
bool is_attribute_name(std::string_view text) noexcept;

// Joins a folded text: drops each line end together with the blank that continues the line.
void unfold(std::string_view text, std::string& unfolded);

// Walks logical lines, one block (the lines up to the next blank line) at a time.
class LineReader {
 public:
  LineReader(const char* at, const char* end) noexcept : at_(at), end_(end), newlines_(at) {}

  // Goes on to the next content line of the block, over comments; false at a blank line or the end
  // of the text. Throws std::bad_alloc.
  bool next(AttributeLine& line) {
    while (at_ < end_ && *at_ == '#') skip_comment();
    if (at_ >= end_ || *at_ == '\n' || (*at_ == '\r' && at_[1] == '\n')) return false;
    read(line);
    return true;
  }

  // Passes a "dn:" line of the plainest kind, not folded and in clear; false, standing where it
  // stood, for any other line.
  bool pass_plain_dn(std::string_view& dn) noexcept {
    if (end_ - at_ < 4 || at_[0] != 'd' || at_[1] != 'n' || at_[2] != ':') return false;
    Newlines ahead = newlines_;
    const char* const newline = ahead.next();
    const char* value = at_ + 3;
    while (*value == ' ') ++value;
    if (*value == ':' || *value == '<' || *value == '\n' || newline[1] == ' ') return false;
    const char* const stop = newline[-1] == '\r' ? newline - 1 : newline;
    dn = {value, static_cast<std::size_t>(stop - value)};
    newlines_ = ahead;
    at_ = newline + 1;
    return true;
  }

  // Passes comments and the lines of the plainest kind that follow, not folded and their value in
  // clear, as long as `accept` wants their type and what stands behind the colon up to the newline;
  // the result is the number of the latter. Nearly all lines of a file need no more. Works on
  // copies of the reader's state, which the compiler keeps in registers.
  template <class Accept>
  std::size_t pass_plain_lines(Accept accept) noexcept {
    Newlines newlines = newlines_;
    const char* at = at_;
    std::size_t count = 0;
    while (at < end_) {
      if (*at == '#') {
        do {
          at = newlines.next() + 1;
        } while (at < end_ && *at == ' ');
        continue;
      }
      Newlines ahead = newlines;
      const char* const newline = ahead.next();
      const char* const colon = skip_name(at);
      if (*colon != ':' || colon[1] == ':' || colon[1] == '<' || newline[1] == ' ') break;
      if (!accept(std::string_view(at, static_cast<std::size_t>(colon - at)),
                  std::string_view(colon + 1, static_cast<std::size_t>(newline - colon - 1)))) {
        break;
      }
      newlines = ahead;
      at = newline + 1;
      ++count;
    }
    newlines_ = newlines;
    at_ = at;
    return count;
  }

  // Where the reader stands: behind the last line read.
  [[nodiscard]] const char* position() const noexcept { return at_; }

  // Over a comment and its continuation lines; the reader stands at the "#".
  void skip_comment() noexcept {
    do {
      at_ = newlines_.next() + 1;
    } while (at_ < end_ && *at_ == ' ');
  }

  // Over the blank line at which `next` stopped.
  void skip_blank_line() noexcept { at_ = newlines_.next() + 1; }

 private:
  void read(AttributeLine& line) {
    const char* const start = at_;
    const char* colon = skip_name(start);
    const char* stop = newlines_.next();
    at_ = stop + 1;
    if (stop > start && stop[-1] == '\r') --stop;
    line.folded = at_ < end_ && *at_ == ' ';
    line.plain_name = *colon == ':';
    if (!line.plain_name) {
      colon = find_colon(start, stop);
      if (colon == nullptr) return read_unusual(line, start, stop);
    }
    const char* value = colon + 1;
    line.kind = ValueKind::plain;
    if (value < stop && (*value == ':' || *value == '<')) {
      line.kind = *value++ == ':' ? ValueKind::base64 : ValueKind::url;
    }
    while (value < stop && *value == ' ') ++value;
    if (line.folded) {
      if (value >= stop) return read_unusual(line, start, stop);
      stop = skip_continuations();
    }
    line.has_colon = true;
    line.type = {start, static_cast<std::size_t>(colon - start)};
    line.value = {value, static_cast<std::size_t>(stop - value)};
  }

  static const char* find_colon(const char* start, const char* stop) noexcept;
  // The end of the folded line's last physical line, at which the reader then stands behind.
  const char* skip_continuations() noexcept;
  // A line without a colon in its first physical line, or folded before its value begins.
  void read_unusual(AttributeLine& line, const char* start, const char* stop);
  void split(AttributeLine& line, std::string_view text) noexcept;

  const char* at_;
  const char* end_;
  Newlines newlines_;  // the first one it gives ends the line at `at_`
  std::string scratch_;
};

// The value as it is meant: unfolded and decoded. The result points into the text or into
// `scratch`. False when base64 is damaged, with the offset of the first offending character of the
// unfolded value in `error_at`. Throws std::bad_alloc.
bool decode_value(const AttributeLine& line, std::string& scratch, std::string_view& value,
                  std::size_t& error_at);

// For lines that were checked when the file was read.
inline std::string_view decoded(const AttributeLine& line, std::string& scratch) {
  if (line.kind == ValueKind::plain && !line.folded) return line.value;
  std::string_view value;
  std::size_t error_at = 0;
  decode_value(line, scratch, value, error_at);
  return value;
}

}  // namespace orv::cfg
