// String preparation for comparison (RFC 4518), as DNs and matching rules share it.
#pragma once

#include <string>
#include <string_view>

namespace orv::cfg {

enum class LetterCase { kept, folded };

// Prepares a value: characters without meaning are dropped, compatibility forms composed, letters
// upper-cased by full Unicode rules when `letter_case` says so. Blanks are left to the functions
// below. Text that is not UTF-8 (a file in another code page) has its ASCII letters folded and is
// otherwise taken byte for byte. Throws std::bad_alloc.
std::string prepare(std::string_view value, LetterCase letter_case);

// Folds each run of blanks to one, including a run at the start or the end.
void fold_blanks(std::string& value) noexcept;

// Removes blanks at both ends.
std::string_view trim_blanks(std::string_view value) noexcept;

// Whether every byte is ASCII.
bool is_all_ascii(std::string_view value) noexcept;

}  // namespace orv::cfg
