// The system calls that the serving process has left.
//
// A process that was taken over from outside can do no more than this: it cannot start programs,
// look into others, connect to another host over TCP, or make memory executable that it wrote.
//
// Threads: any; in force for all of them.
#pragma once

#include <string>

namespace orv::server {

enum class CallFilter {
  on,
  refused,   // the kernel has no filters, or does not let us; `why` says what it said
  unusable,  // a sanitizer is built in, whose reports need what is forbidden
};

// Puts the filter in force, once the server listens; before, it needs more. There is no way back.
CallFilter restrict_calls(std::string& why);

}  // namespace orv::server
