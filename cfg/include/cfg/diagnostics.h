// Where the library writes what `cfg_perror` says: standard error, until a program gives it a sink.
#pragma once

namespace orv::cfg {

// Receives one line without its newline. Must not throw, and must not call the library.
using DiagnosticsSink = void (*)(const char* line) noexcept;

// Replaces the process-wide sink; null restores standard error. Thread-safe.
void set_diagnostics_sink(DiagnosticsSink sink) noexcept;

}  // namespace orv::cfg
