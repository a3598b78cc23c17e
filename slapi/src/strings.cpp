#include "slapi/strings.h"

#include <algorithm>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "memory.h"

namespace orv {
namespace {

unsigned char folded(char c) noexcept {
  const auto byte = static_cast<unsigned char>(c);
  return byte >= 'A' && byte <= 'Z' ? static_cast<unsigned char>(byte + ('a' - 'A')) : byte;
}

bool starts_with_folded(const char* text, const char* prefix) noexcept {
  for (; *prefix != '\0'; ++text, ++prefix)
    if (folded(*text) != folded(*prefix)) return false;
  return true;
}

bool is_ascii_alphanumeric(char c) noexcept {
  return (c >= '0' && c <= '9') || (folded(c) >= 'a' && folded(c) <= 'z');
}

}  // namespace

int kel_strcasecmp(const char* a, const char* b) {
  if (a == nullptr || b == nullptr) return (a != nullptr) - (b != nullptr);
  while (*a != '\0' && folded(*a) == folded(*b)) {
    ++a;
    ++b;
  }
  return folded(*a) - folded(*b);
}

const char* kel_strcasestr(const char* text, const char* needle) {
  if (text == nullptr || needle == nullptr) return nullptr;
  if (*needle == '\0') return text;
  for (; *text != '\0'; ++text)
    if (starts_with_folded(text, needle)) return text;
  return nullptr;
}

std::size_t kel_strlcpy(char* target, const char* source, std::size_t size) {
  if (source == nullptr) source = "";
  const std::size_t length = std::strlen(source);
  if (target == nullptr || size == 0) return length;
  const std::size_t copied = std::min(length, size - 1);
  std::memcpy(target, source, copied);
  target[copied] = '\0';
  return length;
}

std::size_t kel_strlcat(char* target, const char* source, std::size_t size) {
  if (source == nullptr) source = "";
  if (target == nullptr) return std::strlen(source);
  const std::size_t used = strnlen(target, size);
  if (used == size) return size + std::strlen(source);  // not terminated: nothing to append to
  return used + kel_strlcpy(target + used, source, size - used);
}

int kel_asprintf(char** result, const char* format, ...) {
  if (result == nullptr) return -1;
  *result = nullptr;
  if (format == nullptr) return -1;
  std::va_list arguments;
  std::va_list again;
  va_start(arguments, format);
  va_copy(again, arguments);
  const int length = std::vsnprintf(nullptr, 0, format, arguments);
  va_end(arguments);
  if (length >= 0) *result = static_cast<char*>(std::malloc(static_cast<std::size_t>(length) + 1));
  if (*result != nullptr)
    std::vsnprintf(*result, static_cast<std::size_t>(length) + 1, format, again);
  va_end(again);
  return *result == nullptr ? -1 : length;
}

char* slapi_ch_strdup(const char* text) {
  return text == nullptr ? nullptr : slapi::copy_bytes(text);
}

// A size of 0 asks for the smallest block, never for a release: callers keep what they passed.
void* safe_realloc(void* memory, std::size_t size) {
  return std::realloc(memory, std::max<std::size_t>(size, 1));
}

const char* ldap_getenv(const char* name) {
  return name == nullptr ? nullptr : std::getenv(name);
}

bool is_string_alphanum(const char* text) {
  if (text == nullptr || *text == '\0') return false;
  for (; *text != '\0'; ++text)
    if (!is_ascii_alphanumeric(*text)) return false;
  return true;
}

}  // namespace orv
