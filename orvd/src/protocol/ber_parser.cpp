#include "protocol/ber_parser.h"

#include <new>

namespace orv::server {

BerParser::BerParser() : cursor_(ber_alloc_t(0)) {
  if (!cursor_) throw std::bad_alloc();
}

bool BerParser::take(std::string_view& rest, Element& element) noexcept {
  if (rest.empty()) return false;
  // liblber's struct has no const pointer; peeking does not write.
  ::berval bytes{static_cast<ber_len_t>(rest.size()), const_cast<char*>(rest.data())};
  ber_init2(cursor_.get(), &bytes, 0);
  ::berval contents{};
  const ber_tag_t tag = ber_peek_element(cursor_.get(), &contents);
  if (tag == LBER_DEFAULT) return false;
  element.tag = tag;
  element.first_octet = static_cast<unsigned char>(rest.front());
  element.contents = std::string_view(contents.bv_val, contents.bv_len);
  rest.remove_prefix(static_cast<std::size_t>(contents.bv_val - rest.data()) + contents.bv_len);
  return true;
}

bool BerParser::skip_extensions(std::string_view rest) noexcept {
  Element element;
  while (!rest.empty()) {
    if (!take(rest, element)) return false;
    if ((element.first_octet & 0xC0U) == 0) return false;
  }
  return true;
}

IntegerState read_integer(std::string_view contents, std::int32_t& value) noexcept {
  if (contents.empty()) return IntegerState::empty;
  if (contents.size() > sizeof value) return IntegerState::out_of_range;
  if ((static_cast<unsigned char>(contents.front()) & 0x80U) != 0)
    return IntegerState::out_of_range;
  std::uint32_t bits = 0;
  for (const char octet : contents) bits = bits << 8 | static_cast<unsigned char>(octet);
  value = static_cast<std::int32_t>(bits);
  return IntegerState::good;
}

}  // namespace orv::server
