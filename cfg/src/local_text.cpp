#include "local_text.h"

#include <atomic>
#include <new>

#include "cfg/result_codes.h"
#include "dn_text.h"

namespace orv::cfg {

namespace {

std::atomic<TextDecoder> decoder_in_force{nullptr};

// False when the code page has no such text.
bool decode(TextDecoder decoder, std::string_view local, std::string& utf8) {
  const int rc = decoder(local, utf8);
  if (rc == result::no_memory) throw std::bad_alloc();
  return rc == result::success;
}

}  // namespace

void set_text_decoder(TextDecoder decoder) noexcept {
  decoder_in_force.store(decoder, std::memory_order_release);
}

TextDecoder text_decoder() noexcept {
  return decoder_in_force.load(std::memory_order_acquire);
}

std::string_view as_utf8(std::string_view local, std::string& utf8) {
  const TextDecoder decoder = text_decoder();
  if (decoder == nullptr || !decode(decoder, local, utf8)) return local;
  return utf8;
}

bool is_local_text(std::string_view local) {
  std::string utf8;
  const TextDecoder decoder = text_decoder();
  return decoder == nullptr || decode(decoder, local, utf8);
}

bool normalize_local(std::string_view local, std::string& normal) {
  const TextDecoder decoder = text_decoder();
  if (decoder == nullptr) return normalize(local, DnText::any_code_page, normal);
  std::string utf8;
  return decode(decoder, local, utf8) && normalize(utf8, DnText::utf8, normal);
}

bool parse_local(std::string_view local, Dn& dn) {
  const TextDecoder decoder = text_decoder();
  if (decoder == nullptr) return parse(local, DnText::any_code_page, dn);
  std::string utf8;
  return decode(decoder, local, utf8) && parse(utf8, DnText::utf8, dn);
}

}  // namespace orv::cfg
