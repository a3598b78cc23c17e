#include "local_text.h"

#include <new>

#include "cfg/result_codes.h"
#include "memory.h"
#include "slapi/codepage.h"

namespace orv::slapi {

bool has_foreign_texts(const entry& e) noexcept {
  return e.local_code_page && !local_code_page_is_utf8();
}

bool local_to_utf8(std::string_view local, std::string& utf8) {
  char* converted = nullptr;
  std::size_t length = 0;
  const int rc = xlate_localcp_to_utf8(std::string(local).c_str(), &converted, &length);
  const MallocPtr<char> owned(converted);
  if (rc == result::no_memory) throw std::bad_alloc();
  if (rc != result::success) return false;
  utf8 = converted;
  return true;
}

bool text_to_utf8(const entry& e, std::string_view text, std::string& utf8) {
  if (has_foreign_texts(e)) return local_to_utf8(text, utf8);
  utf8 = text;
  return true;
}

}  // namespace orv::slapi
