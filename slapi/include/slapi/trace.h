// The trace: what every function of the server and its plug-ins did, for the developer of last
// resort. Off unless asked for.
//
// `trcEvents` selects what is written:
//   0x00010000  an entry record for each traced function
//   0x00030000  (either bit) an exit record with the function's return code
//   0x04000000  debug lines, each with a category
// A function carries one `ldtr_function_local` with its identifier: 0x01000000, plus the number of
// its source file shifted left by 16, plus its own number shifted left by 8.
//
// Records go to standard error or to the file given to set_trace_file, one line each, with time,
// thread and identifier; embedded newlines are kept as they are. The writer masks the value of
// "name: value" records whose name is a secret attribute. It never blocks on anything but the file,
// never throws and never allocates.
//
// Threads: everything here may be called from any thread.
#pragma once

#include <atomic>
#include <cstdarg>
#include <cstdint>

namespace orv {

extern std::atomic<std::uint32_t> trcEvents;

inline constexpr std::uint32_t kTraceEntry = 0x00010000;
inline constexpr std::uint32_t kTraceExit = 0x00030000;
inline constexpr std::uint32_t kTraceDebug = 0x04000000;

// Categories of debug lines.
namespace trace {
inline constexpr std::uint32_t error = 0xC8110000;  // texts beginning "Error - " and other failures
inline constexpr std::uint32_t detail = 0xC80D0000;
inline constexpr std::uint32_t info = 0xC8010000;   // general flow
inline constexpr std::uint32_t close = 0xC8030000;  // the close handler's invalid-backend messages

// For a value that may be a secret: the attribute's name, then the value. The writer knows records
// by these texts and masks the value where it has to; with any other text the value would stand
// there.
inline constexpr const char* name_and_value = "%s: %s\n";
inline constexpr const char* attribute_and_value = " Attribute %s: has value %s \n";
}  // namespace trace

// Sinks behind the class below: one call for each record that the mask lets through.
void ldtr_write_entry(std::uint32_t function, const char* format, std::va_list arguments);
void ldtr_write_exit(std::uint32_t function, int code);
void ldtr_write_debug(std::uint32_t function, std::uint32_t category, const char* format,
                      std::va_list arguments);

// The trace object of one function call: writes the entry record when made, the exit record when it
// goes out of scope.
//
//   ldtr_function_local trace(0x01010100, "pb=0x%p", static_cast<void*>(pb));
//   trace.debug(trace::detail, "Save file name: %s\n", name);
//   return trace.exit(rc);
class ldtr_function_local {
 public:
  explicit ldtr_function_local(std::uint32_t function) noexcept;
  [[gnu::format(printf, 3, 4)]] ldtr_function_local(std::uint32_t function, const char* format,
                                                    ...) noexcept;
  ~ldtr_function_local();
  ldtr_function_local(const ldtr_function_local&) = delete;
  ldtr_function_local& operator=(const ldtr_function_local&) = delete;

  // Notes the function's return code for the exit record and hands it back.
  int exit(int code) noexcept { return code_ = code; }

  // Writes a debug line when debugging is on.
  [[gnu::format(printf, 3, 4)]] void debug(std::uint32_t category, const char* format,
                                           ...) const noexcept;

  // Whether debug lines are written: for work that only they need.
  static bool debugging() noexcept {
    return (trcEvents.load(std::memory_order_relaxed) & kTraceDebug) != 0;
  }

 private:
  std::uint32_t function_;
  int code_ = 0;
};

// Where records go: null for standard error. 0, or an errno value when the file cannot be opened
// (records then go where they went before). The file is appended to.
int set_trace_file(const char* path);

}  // namespace orv
