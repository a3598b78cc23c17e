// The LDAP message decoder on foreign bytes: framing first, then meaning, as a connection does it.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "cfg/text.h"
#include "protocol/decoder.h"

namespace {

using namespace orv::server;

void require(bool holds) {
  if (!holds) std::abort();
}

// What everybody behind the decoder takes for granted.
void check_filter(const std::string& filter) {
  require(orv::cfg::is_valid_utf8(filter));
  require(filter.find('\0') == std::string::npos);
  long depth = 0;
  for (const char c : filter) {
    depth += c == '(' ? 1 : 0;
    depth -= c == ')' ? 1 : 0;
    require(depth >= 0);
  }
  require(depth == 0 && filter.front() == '(' && filter.back() == ')');
}

void check_message(const Message& message) {
  require(message.id > 0);
  if (const auto* search = std::get_if<SearchRequest>(&message.request)) {
    require(search->scope >= 0 && search->scope <= 2 && search->size_limit >= 0);
    check_filter(search->filter);
  }
  if (const auto* add = std::get_if<AddRequest>(&message.request)) {
    require(!add->attributes.empty());
    for (const Attribute& attribute : add->attributes) require(!attribute.values.empty());
  }
  if (const auto* modify = std::get_if<ModifyRequest>(&message.request)) {
    for (const Modification& change : modify->modifications) {
      require(change.operation >= 0 && change.operation <= 2);
    }
  }
}

void check_frame(std::string_view frame) {
  // A block of its own, so that a look beyond the end is seen.
  const std::string exact(frame);
  Message message;
  const Decoded decoded = decode(exact, {}, message);
  require((decoded.state == DecodeState::refused) == (decoded.response_tag != 0));
  require((decoded.state == DecodeState::decoded) == (decoded.code == 0));
  if (decoded.state == DecodeState::refused) require(message.id > 0);
  if (decoded.state == DecodeState::decoded) check_message(message);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view received(reinterpret_cast<const char*>(data), size);
  const Frame frame = next_frame(received, DecoderLimits().message_bytes);
  if (frame.state == FrameState::complete) {
    require(frame.length >= 2 && frame.length <= size);
    check_frame(received.substr(0, frame.length));
  } else {
    check_frame(received);
  }
  return 0;
}
