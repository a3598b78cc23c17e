// What a request asks for by its controls (RFC 4511, 4.1.11).
//
// A control that the server does not know, that is not for the operation, or that is switched off
// is left out when it is not critical and refuses the request with 12 when it is. Of those that are
// used, a malformed value, a value where there is none, one control twice, and combinations that
// nobody has given a meaning refuse it with 2, critical or not.
//
// Threads: functions without state.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "ops/persistent_search.h"
#include "ops/refusal.h"
#include "protocol/control_values.h"
#include "protocol/decoder.h"
#include "protocol/message.h"

namespace orv::server {

inline constexpr const char* kManageDsaItOid = "2.16.840.1.113730.3.4.2";  // RFC 3296

// A persistent search that a message asks for.
struct PersistentWish {
  bool wanted = false;
  bool critical = false;
  PersistentSearchControl control;
};

// A copy of the entry before or after a change (RFC 4527).
struct ReadWish {
  bool critical = false;
  std::vector<std::string> attributes;  // in any spelling; empty: all user attributes
};

struct RequestControls {
  PersistentWish persistent;
  std::optional<PagedResultsControl> paged;
  std::optional<std::string> assertion;  // the text of a filter
  std::optional<ReadWish> pre_read;
  std::optional<ReadWish> post_read;
};

// Reads the controls of a message. `supported`: what this connection is offered. 0, 2, 11 a value
// beyond the limits of messages, or 12. Throws std::bad_alloc.
Refusal read_controls(const Message& message, const std::vector<std::string>& supported,
                      const DecoderLimits& limits, RequestControls& controls);

// For the access log: " assertion" and so on; "" without any.
std::string describe_controls(const RequestControls& controls);

}  // namespace orv::server
