// The key for sealed values.
#pragma once

#include <array>

#include "cfg/secret.h"

namespace orv::cfg {

class Key {
 public:
  using Bytes = std::array<unsigned char, 32>;

  explicit Key(const Bytes& bytes) noexcept : bytes_(bytes) {}
  ~Key() { wipe(bytes_.data(), bytes_.size()); }
  Key(const Key&) = delete;
  Key& operator=(const Key&) = delete;

  [[nodiscard]] const unsigned char* data() const noexcept { return bytes_.data(); }

 private:
  Bytes bytes_;
};

// Wipes a buffer when the scope ends.
class WipeAtEnd {
 public:
  explicit WipeAtEnd(std::string& text) noexcept : text_(text) {}
  ~WipeAtEnd() { wipe(text_); }
  WipeAtEnd(const WipeAtEnd&) = delete;
  WipeAtEnd& operator=(const WipeAtEnd&) = delete;

 private:
  std::string& text_;
};

}  // namespace orv::cfg
