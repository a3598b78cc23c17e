#include "ldif_lines.h"

#include <algorithm>
#include <cstring>
#include <new>

#include "cfg/result_codes.h"
#include "cfg/text.h"

namespace orv::cfg {

namespace {

bool is_oid(std::string_view type) noexcept {
  if (type.empty() || !is_ascii_digit(type.front()) || !is_ascii_digit(type.back())) return false;
  if (type.find('.') == std::string_view::npos) return false;
  if (type.find("..") != std::string_view::npos) return false;
  return std::all_of(type.begin(), type.end(),
                     [](char c) { return is_ascii_digit(c) || c == '.'; });
}

bool is_descriptor(std::string_view type) noexcept {
  if (type.empty() || !is_ascii_letter(type.front())) return false;
  return std::all_of(type.begin(), type.end(),
                     [](char c) { return is_ascii_letter(c) || is_ascii_digit(c) || c == '-'; });
}

}  // namespace

bool is_attribute_name(std::string_view text) noexcept {
  return is_descriptor(text) || is_oid(text);
}

void unfold(std::string_view text, std::string& unfolded) {
  unfolded.clear();
  unfolded.reserve(text.size());
  const char* p = text.data();
  const char* const end = p + text.size();
  while (p < end) {
    const void* found = std::memchr(p, '\n', static_cast<std::size_t>(end - p));
    const char* const newline = found != nullptr ? static_cast<const char*>(found) : end;
    const char* stop = newline;
    if (newline != end && stop > p && stop[-1] == '\r') --stop;
    unfolded.append(p, stop);
    if (newline == end) break;
    p = newline + 2;  // over the newline and the blank that continues the line
  }
}

const char* LineReader::find_colon(const char* start, const char* stop) noexcept {
  return static_cast<const char*>(std::memchr(start, ':', static_cast<std::size_t>(stop - start)));
}

const char* LineReader::skip_continuations() noexcept {
  const char* newline = at_;
  do {
    newline = newlines_.next();
    at_ = newline + 1;
  } while (at_ < end_ && *at_ == ' ');
  if (newline > end_) newline = end_;
  return newline[-1] == '\r' ? newline - 1 : newline;
}

void LineReader::read_unusual(AttributeLine& line, const char* start, const char* stop) {
  if (!line.folded) return split(line, {start, static_cast<std::size_t>(stop - start)});
  stop = skip_continuations();
  unfold({start, static_cast<std::size_t>(stop - start)}, scratch_);
  line.folded = false;
  split(line, scratch_);
}

void LineReader::split(AttributeLine& line, std::string_view text) noexcept {
  const std::size_t colon = text.find(':');
  line.has_colon = colon != std::string_view::npos;
  line.plain_name = false;
  line.kind = ValueKind::plain;
  line.type = text.substr(0, colon);
  line.value = {};
  if (!line.has_colon) return;
  std::size_t at = colon + 1;
  if (at < text.size() && (text[at] == ':' || text[at] == '<')) {
    line.kind = text[at++] == ':' ? ValueKind::base64 : ValueKind::url;
  }
  while (at < text.size() && text[at] == ' ') ++at;
  line.value = text.substr(at);
}

bool decode_value(const AttributeLine& line, std::string& scratch, std::string_view& value,
                  std::size_t& error_at) {
  value = line.value;
  if (line.folded) {
    unfold(line.value, scratch);
    value = scratch;
  }
  if (line.kind != ValueKind::base64) return true;
  std::string bytes;
  const int rc = base64_decode(value, bytes, error_at);
  if (rc == result::no_memory) throw std::bad_alloc();
  if (rc != result::success) return false;
  scratch = std::move(bytes);
  value = scratch;
  return true;
}

}  // namespace orv::cfg
