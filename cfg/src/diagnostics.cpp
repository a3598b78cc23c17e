#include "cfg/diagnostics.h"

#include <atomic>
#include <cstdio>

#include "diagnostics_line.h"

namespace orv::cfg {

namespace {

void write_to_standard_error(const char* line) noexcept {
  std::fprintf(stderr, "%s\n", line);
}

std::atomic<DiagnosticsSink> current_sink{&write_to_standard_error};

}  // namespace

void set_diagnostics_sink(DiagnosticsSink sink) noexcept {
  current_sink.store(sink == nullptr ? &write_to_standard_error : sink);
}

void write_diagnostics_line(const char* line) noexcept {
  current_sink.load()(line);
}

}  // namespace orv::cfg
