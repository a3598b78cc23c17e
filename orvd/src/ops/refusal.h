// Why a request goes no further.
#pragma once

#include <string>

namespace orv::server {

// 0, or the code with which a request is refused and a reason for the client.
struct Refusal {
  int code = 0;
  std::string text;
  explicit operator bool() const noexcept { return code != 0; }
};

}  // namespace orv::server
