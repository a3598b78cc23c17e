// Requests built from raw tags, well formed and not.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <string>
#include <string_view>

#include "protocol/decoder.h"

namespace orv::server::raw {

using namespace std::string_literals;  // NOLINT: texts with NUL octets

// Tag and minimal length of an element.
inline std::string header(int tag, std::size_t length) {
  const auto first = static_cast<char>(tag);
  if (length < 0x80) return {first, static_cast<char>(length)};
  std::string octets;
  for (std::size_t rest = length; rest != 0; rest >>= 8) {
    octets.insert(octets.begin(), static_cast<char>(rest & 0xFF));
  }
  return std::string{first, static_cast<char>(0x80 | octets.size())} + octets;
}

inline std::string tlv(int tag, std::string_view contents) {
  return header(tag, contents.size()).append(contents);
}

// An element whose length is spelled in a fixed number of octets.
inline std::string tlv_long(int tag, std::string_view contents, int length_octets) {
  std::string element{static_cast<char>(tag), static_cast<char>(0x80 | length_octets)};
  for (int i = length_octets; i-- > 0;) {
    const std::size_t octet = i >= 8 ? 0 : contents.size() >> (8 * i) & 0xFF;
    element += static_cast<char>(octet);
  }
  return element.append(contents);
}

inline std::string join(std::initializer_list<std::string> parts) {
  std::string all;
  for (const std::string& part : parts) all += part;
  return all;
}

inline std::string integer(std::int32_t value, int tag = 0x02) {
  std::string octets;
  do {
    octets.insert(octets.begin(), static_cast<char>(value & 0xFF));
    value >>= 8;
  } while (value != 0);
  if ((octets.front() & 0x80) != 0) octets.insert(octets.begin(), '\0');
  return tlv(tag, octets);
}
inline std::string enumerated(std::int32_t value) {
  return integer(value, 0x0A);
}
inline std::string boolean(bool value) {
  return tlv(0x01, value ? "\xFF"s : "\0"s);
}
inline std::string octets(std::string_view bytes) {
  return tlv(0x04, bytes);
}
inline std::string sequence(std::initializer_list<std::string> parts) {
  return tlv(0x30, join(parts));
}
inline std::string set(std::initializer_list<std::string> parts) {
  return tlv(0x31, join(parts));
}

inline std::string message(const std::string& operation, const std::string& controls = "",
                           std::int32_t id = 7) {
  return tlv(0x30, integer(id) + operation + controls);
}
inline std::string controls(std::initializer_list<std::string> list) {
  return tlv(0xA0, join(list));
}

// ---- Whole operations

inline std::string simple_bind(std::string_view dn, std::string_view password, int version = 3) {
  return tlv(0x60, integer(version) + octets(dn) + tlv(0x80, password));
}
inline std::string search(const std::string& filter, const std::string& selectors = "",
                          const std::string& base = "cn=configuration") {
  return tlv(0x63, join({octets(base), enumerated(2), enumerated(0), integer(0), integer(0),
                         boolean(false), filter, tlv(0x30, selectors)}));
}
inline std::string presence(std::string_view type = "objectClass") {
  return tlv(0x87, type);
}
inline std::string equality(std::string_view type, std::string_view value) {
  return tlv(0xA3, octets(type) + octets(value));
}
inline std::string attribute(std::string_view type, std::initializer_list<std::string> values) {
  return sequence({octets(type), set(values)});
}
inline std::string add(const std::string& dn, std::initializer_list<std::string> attributes) {
  return tlv(0x68, octets(dn) + sequence(attributes));
}
inline std::string change(int code, const std::string& attribute) {
  return sequence({enumerated(code), attribute});
}
inline std::string modify(const std::string& dn, std::initializer_list<std::string> changes) {
  return tlv(0x66, octets(dn) + sequence(changes));
}
inline std::string del(std::string_view dn) {
  return tlv(0x4A, dn);
}
inline std::string modify_dn(std::string_view dn) {
  return tlv(0x6C, octets(dn) + octets("cn=new") + boolean(true));
}
inline std::string compare(std::string_view dn) {
  return tlv(0x6E, octets(dn) + sequence({octets("cn"), octets("x")}));
}
inline std::string abandon(std::int32_t id) {
  return integer(id, 0x50);
}
inline std::string extended(std::string_view oid) {
  return tlv(0x77, tlv(0x80, oid));
}

// ---- What becomes of them

struct Outcome {
  Decoded decoded;
  Message message;
};

inline Outcome decode(const std::string& frame, const DecoderLimits& limits = {}) {
  Outcome outcome;
  // A copy of exactly the frame's size, so that a sanitizer sees a look beyond its end.
  const std::string exact(frame);
  outcome.decoded = server::decode(exact, limits, outcome.message);
  return outcome;
}

}  // namespace orv::server::raw
