// The system calls that the serving process has left.
//
// A process that was taken over from outside can do no more than this: it cannot start programs,
// look into others, connect to anybody, listen anew, or make memory executable that it wrote. The
// connections that clients have made are the only ones it has; there is no name service either.
//
// A filter sees the numbers that a call is given, and no names of files. So it does not keep such a
// process from what belongs to the server: its files, the connections and what is known to it. Nor
// from executing a file: a library that is loaded looks like a file that the process wrote itself.
// That has to be kept out by where it can write, as packaging/orvd.service.in does.
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
