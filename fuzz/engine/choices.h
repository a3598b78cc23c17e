// The bytes of one input, read as decisions. When they are used up every decision is the first one,
// so that any input means something and short ones stay simple.
#pragma once

#include <cstddef>
#include <cstdint>
#include <iterator>
#include <string>
#include <string_view>

namespace orv::fuzz {

class Choices {
 public:
  Choices(const std::uint8_t* data, std::size_t size)
      : rest_(reinterpret_cast<const char*>(data), size) {}

  bool left() const { return !rest_.empty(); }

  unsigned byte() {
    if (rest_.empty()) return 0;
    const auto value = static_cast<unsigned char>(rest_.front());
    rest_.remove_prefix(1);
    return value;
  }
  // 0 to `count` - 1.
  std::size_t below(std::size_t count) { return byte() % count; }
  // Once in `times`, where it has a say.
  bool rarely(unsigned times) { return byte() % times == 1; }
  std::int32_t number() {
    std::uint32_t value = 0;
    for (int i = 0; i < 4; ++i) value = value << 8 | byte();
    return static_cast<std::int32_t>(value);
  }
  template <typename List>
  std::string_view pick(const List& list) {
    return list[below(std::size(list))];
  }
  // Bytes of the input itself, up to 63.
  std::string raw() {
    const std::size_t length = byte() & 63U;
    const std::string_view taken = rest_.substr(0, length);
    rest_.remove_prefix(taken.size());
    return std::string(taken);
  }

 private:
  std::string_view rest_;
};

}  // namespace orv::fuzz
