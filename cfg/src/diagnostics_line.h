// The library's side of cfg/diagnostics.h.
#pragma once

namespace orv::cfg {

// Hands one line, without its newline, to the sink.
void write_diagnostics_line(const char* line) noexcept;

}  // namespace orv::cfg
