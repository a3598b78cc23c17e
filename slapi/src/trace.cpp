#include "slapi/trace.h"

#include <cstring>

#include "equality.h"
#include "record_writer.h"

namespace orv {

std::atomic<std::uint32_t> trcEvents{0};

namespace {

// How plug-ins write "name: value" records: the name first, then the value, both texts.
constexpr const char* kNamedValueFormats[] = {trace::name_and_value, trace::attribute_and_value};
constexpr char kMask[] = "********";

bool trace_has(std::uint32_t bits) noexcept {
  return (trcEvents.load(std::memory_order_relaxed) & bits) != 0;
}

bool has_named_value(const char* format) noexcept {
  for (const char* known : kNamedValueFormats)
    if (std::strcmp(format, known) == 0) return true;
  return false;
}

// While no schema is in force nobody can tell a secret from another value.
bool may_be_secret(const char* name) noexcept {
  return slapi::schema_if_loaded() == nullptr || name == nullptr || slapi::is_secret_type(name);
}

// `format` is one of those above, with `value` in the place of the second argument.
void add_named_value(slapi::Record& record, const char* format, const char* name,
                     const char* value) noexcept {
  if (std::strcmp(format, kNamedValueFormats[0]) == 0)
    record.add(trace::name_and_value, name, value);
  else
    record.add(trace::attribute_and_value, name, value);
}

void add_text(slapi::Record& record, const char* format, std::va_list arguments) noexcept {
  if (!has_named_value(format)) return record.add_list(format, arguments);
  std::va_list copy;
  va_copy(copy, arguments);
  const char* const name = va_arg(copy, const char*);
  const char* const value = va_arg(copy, const char*);
  va_end(copy);
  add_named_value(record, format, name == nullptr ? "(null)" : name,
                  may_be_secret(name) ? kMask : (value == nullptr ? "(null)" : value));
}

}  // namespace

void ldtr_write_entry(std::uint32_t function, const char* format, std::va_list arguments) {
  slapi::Record record;
  record.add("%08X entry ", function);
  if (format != nullptr) add_text(record, format, arguments);
  record.write();
}

void ldtr_write_exit(std::uint32_t function, int code) {
  slapi::Record record;
  record.add("%08X exit rc=%d", function, code);
  record.write();
}

void ldtr_write_debug(std::uint32_t function, std::uint32_t category, const char* format,
                      std::va_list arguments) {
  if (format == nullptr) return;
  slapi::Record record;
  record.add("%08X debug %08X ", function, category);
  add_text(record, format, arguments);
  record.write();
}

namespace {

// An entry record without a text; a list of arguments comes from a variadic call only.
void write_plain_entry(std::uint32_t function, ...) noexcept {
  std::va_list none;
  va_start(none, function);
  ldtr_write_entry(function, nullptr, none);
  va_end(none);
}

}  // namespace

ldtr_function_local::ldtr_function_local(std::uint32_t function) noexcept : function_(function) {
  if (trace_has(kTraceEntry)) write_plain_entry(function);
}

ldtr_function_local::ldtr_function_local(std::uint32_t function, const char* format, ...) noexcept
    : function_(function) {
  if (!trace_has(kTraceEntry)) return;
  std::va_list arguments;
  va_start(arguments, format);
  ldtr_write_entry(function, format, arguments);
  va_end(arguments);
}

ldtr_function_local::~ldtr_function_local() {
  if (trace_has(kTraceExit)) ldtr_write_exit(function_, code_);
}

void ldtr_function_local::debug(std::uint32_t category, const char* format, ...) const noexcept {
  if (!debugging()) return;
  std::va_list arguments;
  va_start(arguments, format);
  ldtr_write_debug(function_, category, format, arguments);
  va_end(arguments);
}

int set_trace_file(const char* path) {
  return slapi::set_record_file(path);
}

}  // namespace orv
