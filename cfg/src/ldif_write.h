// Writing into LDIF text (RFC 2849): new lines, and new text out of old.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

#include "file_text.h"
#include "ldif_index.h"

namespace orv::cfg {

// Appends the line "type: value", in base64 where the value could not be read back otherwise,
// folded at 76 columns and ended by `line_end`. Throws std::bad_alloc.
void append_line(std::string& out, std::string_view type, std::string_view value,
                 std::string_view line_end);

// Where something stands in a text: from the first byte to behind the last.
struct Extent {
  std::size_t begin = 0;
  std::size_t end = 0;
};

// The lines of an entry, from its "dn:" line to its last, with the comments between and directly
// behind them. Throws std::bad_alloc.
Extent entry_extent(const LdifIndex& index, std::uint32_t entry);

// How lines end around an offset at which a line begins: "\r\n" or "\n".
std::string_view line_end_at(const LdifIndex& index, std::size_t offset) noexcept;

// A piece of a text, and what stands in its place in the new text.
struct Edit {
  Extent old;
  std::string text;
};

// The length of a text after edits, which are in order and do not overlap.
std::size_t edited_size(const FileText& before, const std::vector<Edit>& edits) noexcept;

// The text after edits. All else stays as it is, byte for byte. Throws std::bad_alloc.
void apply_edits(const FileText& before, const std::vector<Edit>& edits, FileText& after);

}  // namespace orv::cfg
