#include "masked_text.h"

#include <cstring>
#include <optional>
#include <string_view>

#include "cfg/masked_dn.h"

namespace orv::slapi {

std::size_t mask_secrets(char* text, std::size_t begin, std::size_t length,
                         std::size_t size) noexcept {
  constexpr std::string_view kMask = cfg::kMask;
  for (std::size_t at = begin;;) {
    const std::optional<cfg::TextPart> found =
        cfg::find_secret(std::string_view(text + begin, length - begin), at - begin);
    if (!found) return length;
    char* const value = text + begin + found->begin;
    const char* const rest = text + begin + found->end;
    const std::size_t masked = found->end - found->begin;
    const std::size_t asterisks = length - masked + kMask.size() <= size ? kMask.size() : masked;
    std::memmove(value + asterisks, rest, static_cast<std::size_t>(text + length - rest));
    std::memset(value, kMask.front(), asterisks);
    length = length - masked + asterisks;
    at = begin + found->begin + asterisks;
  }
}

}  // namespace orv::slapi
