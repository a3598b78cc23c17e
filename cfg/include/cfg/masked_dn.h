// DNs, and other texts, as they may be shown in a log: without the passwords that somebody put into
// them.
//
// Thread-safe.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace orv::cfg {

// What stands in the place of a value that is not shown.
inline constexpr std::string_view kMask = "********";

// What becomes of the values of types that are not in the table. One may be a password whose type
// was misspelled, or has another name elsewhere: hidden is for names that a client sent, of which
// nothing is lost, since no entry here is named by such a type. In settings they name entries of
// other servers.
enum class UnknownTypes { shown, hidden };

// Writes a DN with the values of secret types (cfg/attribute_table.h) replaced by kMask, and so the
// values that are DNs themselves and hold one; those of unknown types as it is said, but shown in
// DNs within values: what looks like one there need not be one. A DN without any is written as it
// was. 0; 34 `dn` is no DN, so that nobody knows what it holds; 90. `shown` is unchanged on
// failure. Does not throw.
int mask_dn(std::string_view dn, UnknownTypes unknown, std::string& shown) noexcept;

// For a DN in normal form, and much cheaper: whether mask_dn, told to hide the values of unknown
// types, may have something to replace.
bool normal_dn_may_need_mask(std::string_view normal) noexcept;

struct TextPart {
  std::size_t begin;
  std::size_t end;
};

// The next password, from `from` on, that stands in a text of any kind as "type=value": in what was
// meant for a DN, in a filter, in a URL. The part is the value; it reaches to where the next part
// of a DN begins or the filter's item ends, or to the end of the text but for a newline there:
// rather too far than not far enough. Does not throw or allocate.
std::optional<TextPart> find_secret(std::string_view text, std::size_t from) noexcept;

}  // namespace orv::cfg
