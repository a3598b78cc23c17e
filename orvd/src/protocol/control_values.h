// Values of the controls and extended operations that a client may send, and of those that it gets
// back.
//
// What cannot be read is the client's mistake (2), never the connection's end: the value is a
// string of octets to the message around it. Nothing behind the last element is accepted. Functions
// do not throw; thread-safe.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "protocol/filter_text.h"
#include "protocol/message.h"

namespace orv::server {

inline constexpr const char* kAssertionOid = "1.3.6.1.1.12";               // RFC 4528
inline constexpr const char* kPreReadOid = "1.3.6.1.1.13.1";               // RFC 4527
inline constexpr const char* kPostReadOid = "1.3.6.1.1.13.2";              // RFC 4527
inline constexpr const char* kPagedResultsOid = "1.2.840.113556.1.4.319";  // RFC 2696
inline constexpr const char* kCancelOid = "1.3.6.1.1.8";                   // RFC 3909
inline constexpr const char* kWhoAmIOid = "1.3.6.1.4.1.4203.1.11.3";       // RFC 4532

// The filter of an assertion, as text (protocol/filter_text.h). 0; 2; 11 beyond a limit; 90.
int read_assertion(std::string_view value, const FilterLimits& limits,
                   std::string& filter) noexcept;

// The names of a pre-read or post-read, in any spelling, at most `most`. 0; 2; 11 too many; 90.
int read_attribute_selection(std::string_view value, std::size_t most,
                             std::vector<std::string>& names) noexcept;

struct PagedResultsControl {
  std::int32_t size = 0;  // entries of a page, 0 or more
  std::string cookie;     // "": the first page
};

// 0; 2, also for a negative size; 90.
int read_paged_results(std::string_view value, PagedResultsControl& control) noexcept;

// The control that goes with a page: how many entries there are in all, and what asks for the next
// page ("" behind the last). Throws std::bad_alloc.
Control paged_results_answer(std::int32_t total, std::string_view cookie);

// Which operation is to be canceled. 0; 2; 90.
int read_cancel(std::string_view value, std::int32_t& message_id) noexcept;

}  // namespace orv::server
