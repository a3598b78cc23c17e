#include "ldif_write.h"

#include <algorithm>
#include <new>

#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "characters.h"

namespace orv::cfg {

namespace {

bool is_blank(char c) noexcept {
  return c == ' ' || c == '\t';
}

// RFC 2849 would allow control characters. Terminals take some of them for commands, and the value
// may be a stranger's.
bool is_shown(char c) noexcept {
  const auto byte = static_cast<unsigned char>(c);
  return is_ascii(c) && (byte >= 0x20 || c == '\t') && byte != 0x7F;
}

// Whether a value reads back the same when it is written as it is (a SAFE-STRING of RFC 2849, and
// no blanks at its ends, which editors and readers take away) and can be looked at.
bool is_safe(std::string_view value) noexcept {
  if (value.empty()) return true;
  const char first = value.front();
  if (is_blank(first) || first == ':' || first == '<' || is_blank(value.back())) return false;
  return std::all_of(value.begin(), value.end(), is_shown);
}

// Where a line that has room for `room` characters of `text` ends: not behind a blank, where that
// can be helped.
std::size_t break_before(std::string_view text, std::size_t room) noexcept {
  std::size_t end = room;
  while (end > 1 && text[end - 1] == ' ') --end;
  return end > 1 ? end : room;
}

void append_folded(std::string& out, std::string_view line, std::string_view line_end) {
  constexpr std::size_t kColumns = 76;
  std::size_t room = kColumns;
  while (line.size() > room) {
    const std::size_t length = break_before(line, room);
    out += line.substr(0, length);
    out += line_end;
    out += ' ';
    line.remove_prefix(length);
    room = kColumns - 1;
  }
  out += line;
  out += line_end;
}

}  // namespace

void append_line(std::string& out, std::string_view type, std::string_view value,
                 std::string_view line_end) {
  std::string line(type);
  line += ':';
  if (is_safe(value)) {
    if (!value.empty()) line += ' ';
    line += value;
  } else {
    std::string encoded;
    if (base64_encode(value, encoded) != result::success) throw std::bad_alloc();
    line += ": ";
    line += encoded;
  }
  append_folded(out, line, line_end);
}

Extent entry_extent(const LdifIndex& index, std::uint32_t entry) {
  LineReader reader = index.lines(entry);
  Extent extent;
  extent.begin = static_cast<std::size_t>(reader.position() - index.text_begin());
  AttributeLine line;
  while (reader.next(line)) {
  }
  // A comment at the end of the text may lack its newline; the reader then stands behind it.
  const char* const end = std::min(reader.position(), index.text_end());
  extent.end = static_cast<std::size_t>(end - index.text_begin());
  return extent;
}

std::string_view line_end_at(const LdifIndex& index, std::size_t offset) noexcept {
  const std::string_view text(
      index.text_begin() + offset,
      static_cast<std::size_t>(index.text_end() - index.text_begin()) - offset);
  const std::size_t newline = text.find('\n');
  const bool crlf = newline != std::string_view::npos && newline > 0 && text[newline - 1] == '\r';
  return crlf ? "\r\n" : "\n";
}

std::size_t edited_size(const FileText& before, const std::vector<Edit>& edits) noexcept {
  std::size_t size = before.size();
  for (const Edit& edit : edits) size += edit.text.size() - (edit.old.end - edit.old.begin);
  return size;
}

void apply_edits(const FileText& before, const std::vector<Edit>& edits, FileText& after) {
  const std::string_view text(before.begin(), before.size());
  std::vector<std::string_view> pieces;
  pieces.reserve(edits.size() * 2 + 1);
  std::size_t done = 0;
  for (const Edit& edit : edits) {
    pieces.push_back(text.substr(done, edit.old.begin - done));
    pieces.push_back(edit.text);
    done = edit.old.end;
  }
  pieces.push_back(text.substr(done));
  after.assign(pieces);
}

}  // namespace orv::cfg
