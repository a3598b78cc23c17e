// From bytes to messages, in two steps: framing (is a whole message there?), then meaning.
//
// Limits are tested before anything is copied. Nothing here throws; functions are pure and
// thread-safe.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "protocol/message.h"

namespace orv::server {

struct DecoderLimits {
  std::size_t message_bytes = 1 << 20;  // whole message, header included
  int filter_depth = 32;
  int filter_items = 4096;
  int controls = 32;
  int attributes = 1024;  // attributes of an add, modifications of a modify, names of a search
  int values = 10000;     // in one message
};

enum class FrameState {
  need_more,  // not whole yet; `length` is what is known to be needed, or 0
  complete,   // `length` bytes make one message
  too_big,    // its announced length is beyond the limit
  malformed,  // not the start of an LDAPMessage: wrong tag, indefinite or over-long length
};
struct Frame {
  FrameState state;
  std::size_t length;
};

// Looks at the start of the received bytes.
Frame next_frame(std::string_view received, std::size_t message_bytes) noexcept;

enum class DecodeState {
  decoded,
  refused,  // the message id and operation are known: answer `code` and go on
  fatal,    // nothing sensible can be answered: notice of disconnection with `code`, then close
};
struct Decoded {
  DecodeState state;
  int code = 0;          // LDAP result code when not decoded
  int response_tag = 0;  // protocol tag of the answer to `refused`
  std::string text;      // reason for the client, never content of the message
};

// Decodes one whole frame. On `refused`, `message.id` is set.
Decoded decode(std::string_view frame, const DecoderLimits& limits, Message& message) noexcept;

}  // namespace orv::server
