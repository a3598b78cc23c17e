// One BER element at a time, read in place with liblber.
//
// Nothing is copied: the views point into the bytes that were given. liblber's cursor is re-aimed
// for each element instead of being walked, because its walking functions look at the octet after
// the element they return, which at the end of a message is not ours to read.
//
// Threads: a parser belongs to one thread at a time.
#pragma once

#include <lber.h>

#include <cstdint>
#include <memory>
#include <string_view>

namespace orv::server {

struct Element {
  ber_tag_t tag;              // all octets of the tag, as liblber packs them
  unsigned char first_octet;  // of the tag: class and form
  std::string_view contents;
};

class BerParser {
 public:
  // Throws std::bad_alloc.
  BerParser();

  // Takes the first element off the front of `rest`. False (with `rest` unchanged) when there is
  // none: no bytes, a tag or length that is cut short, an indefinite length, a length of more than
  // eight octets, or contents beyond the end of `rest`.
  bool take(std::string_view& rest, Element& element) noexcept;

  // Skips what later versions of the protocol may append to a SEQUENCE: well-formed elements whose
  // tags are not of the universal class (RFC 4511, 4). False when anything else is left.
  bool skip_extensions(std::string_view rest) noexcept;

 private:
  struct Release {
    void operator()(BerElement* ber) const noexcept { ber_free(ber, 0); }
  };
  std::unique_ptr<BerElement, Release> cursor_;
};

enum class IntegerState { good, empty, out_of_range };

// The value of an INTEGER or ENUMERATED of at most four octets that is not negative: every integer
// of the protocol lies in 0..2^31-1. Leading zero octets are accepted within the four, as common
// encoders emit them.
IntegerState read_integer(std::string_view contents, std::int32_t& value) noexcept;

}  // namespace orv::server
