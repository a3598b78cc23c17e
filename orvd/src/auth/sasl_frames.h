// Where the frames of a security layer begin and end on the wire: each is four octets of length,
// the highest first, and that many of contents (RFC 4422, 3.7).
//
// Threads: belongs to one thread.
#pragma once

#include <algorithm>
#include <cstdint>
#include <string_view>

namespace orv::server {

class SaslFrames {
 public:
  // Takes note of the next bytes, cut anywhere.
  void pass(std::string_view wire) noexcept {
    while (!wire.empty()) wire.remove_prefix(missing_ > 0 ? pass_contents(wire) : pass_octet(wire));
  }

  // Whether the last frame has begun and is not whole.
  bool has_part() const noexcept { return octets_ > 0 || missing_ > 0; }

 private:
  std::size_t pass_contents(std::string_view wire) noexcept {
    const std::size_t here = std::min<std::size_t>(missing_, wire.size());
    missing_ -= static_cast<std::uint32_t>(here);
    return here;
  }
  std::size_t pass_octet(std::string_view wire) noexcept {
    length_ = length_ << 8 | static_cast<unsigned char>(wire.front());
    if (++octets_ == 4) {
      missing_ = length_;
      length_ = octets_ = 0;
    }
    return 1;
  }

  std::uint32_t length_ = 0;   // what is here of it
  std::uint32_t octets_ = 0;   // of the length, while it is not whole
  std::uint32_t missing_ = 0;  // of the contents
};

}  // namespace orv::server
