#include "protocol/control_values.h"

#include <new>

#include "cfg/result_codes.h"
#include "protocol/ber_parser.h"
#include "protocol/syntax.h"

namespace orv::server {
namespace {

constexpr ber_tag_t kSequence = 0x30;

// Runs `read`, which gives a result code and may run out of memory.
template <typename Read>
int guarded(Read read) noexcept {
  try {
    return read();
  } catch (const std::bad_alloc&) {
    return result::no_memory;
  } catch (...) {
    return result::other;
  }
}

bool take(BerParser& parser, std::string_view& rest, ber_tag_t tag, std::string_view& contents) {
  Element element;
  if (!parser.take(rest, element) || element.tag != tag) return false;
  contents = element.contents;
  return true;
}

// The contents of the one SEQUENCE that the value is.
bool take_whole_sequence(BerParser& parser, std::string_view value, std::string_view& contents) {
  return take(parser, value, kSequence, contents) && value.empty();
}

bool take_integer(BerParser& parser, std::string_view& rest, std::int32_t& number) {
  std::string_view contents;
  return take(parser, rest, LBER_INTEGER, contents) &&
         read_integer(contents, number) == IntegerState::good;
}

// ---- Writing, for small values

// An element of at most 127 octets.
std::string short_element(char tag, std::string_view contents) {
  std::string element{tag, static_cast<char>(contents.size())};
  return element.append(contents);
}

std::string integer_element(std::int32_t number) {
  std::string octets;
  for (int shift = 24; shift >= 0; shift -= 8) octets += static_cast<char>(number >> shift & 0xFF);
  // As few as there can be, with the sign's bit clear.
  while (octets.size() > 1 && octets[0] == 0 && (octets[1] & 0x80) == 0) octets.erase(0, 1);
  return short_element(LBER_INTEGER, octets);
}

}  // namespace

int read_assertion(std::string_view value, const FilterLimits& limits,
                   std::string& filter) noexcept {
  return guarded([&]() -> int {
    BerParser parser;
    Element element;
    if (!parser.take(value, element) || !value.empty()) return result::protocol_error;
    std::string text;
    const FilterOutcome outcome = filter_to_text(parser, element, limits, text);
    if (outcome.code != 0 || outcome.broken)
      return outcome.code != 0 ? outcome.code : result::protocol_error;
    filter.swap(text);
    return result::success;
  });
}

int read_attribute_selection(std::string_view value, std::size_t most,
                             std::vector<std::string>& names) noexcept {
  return guarded([&]() -> int {
    BerParser parser;
    std::string_view rest;
    if (!take_whole_sequence(parser, value, rest)) return result::protocol_error;
    std::vector<std::string> read;
    while (!rest.empty()) {
      std::string_view name;
      if (!take(parser, rest, LBER_OCTETSTRING, name) || !is_clean_text(name))
        return result::protocol_error;
      if (read.size() >= most) return result::admin_limit_exceeded;
      read.emplace_back(name);
    }
    names.swap(read);
    return result::success;
  });
}

int read_paged_results(std::string_view value, PagedResultsControl& control) noexcept {
  return guarded([&]() -> int {
    BerParser parser;
    std::string_view rest;
    std::string_view cookie;
    PagedResultsControl read;
    if (!take_whole_sequence(parser, value, rest) || !take_integer(parser, rest, read.size) ||
        !take(parser, rest, LBER_OCTETSTRING, cookie) || !rest.empty())
      return result::protocol_error;
    read.cookie = cookie;
    control = std::move(read);
    return result::success;
  });
}

Control paged_results_answer(std::int32_t total, std::string_view cookie) {
  return {
      kPagedResultsOid, false,
      short_element(kSequence, integer_element(total) + short_element(LBER_OCTETSTRING, cookie))};
}

int read_cancel(std::string_view value, std::int32_t& message_id) noexcept {
  return guarded([&]() -> int {
    BerParser parser;
    std::string_view rest;
    std::int32_t read = 0;
    if (!take_whole_sequence(parser, value, rest) || !take_integer(parser, rest, read) ||
        !rest.empty())
      return result::protocol_error;
    message_id = read;
    return result::success;
  });
}

}  // namespace orv::server
