// Writes one record of the trace or of debug output: formats it into a buffer on the stack and
// hands it to the system with one write(2), so that records of several threads never mix.
//
// Nothing here allocates, throws, locks or changes errno.
#pragma once

#include <cstdarg>
#include <cstddef>
#include <cstdint>

namespace orv::slapi {

// A line under construction. What does not fit is cut, and the cut is marked.
class Record {
 public:
  // Begins with the time (UTC) and the calling thread.
  Record() noexcept;

  [[gnu::format(printf, 2, 3)]] void add(const char* format, ...) noexcept;
  void add_list(const char* format, std::va_list arguments) noexcept;

  // Ends the line, unless its text did, and writes it, without the passwords that stand in it as
  // "type=value": in a DN or a filter.
  void write() noexcept;

 private:
  static constexpr std::size_t kSize = 8192;
  static constexpr std::size_t kRoomForEnd = 8;  // mark of a cut, newline, NUL
  char text_[kSize];
  std::size_t length_ = 0;
  bool cut_ = false;
};

// Descriptor that records go to; standard error at first.
int record_descriptor() noexcept;
// Null for standard error. 0 or an errno value.
int set_record_file(const char* path) noexcept;

}  // namespace orv::slapi
