#include "cfg/ldif.h"

#include <new>

#include "cfg/result_codes.h"
#include "file_text.h"
#include "filter.h"
#include "ldif_index.h"
#include "ldif_write.h"

namespace orv::cfg {

void append_ldif_line(std::string& out, std::string_view type, std::string_view value) {
  append_line(out, type, value, "\n");
}

int ldif_record_matches(std::string_view record, const char* filter, bool& matches) noexcept {
  try {
    FileText text;
    text.assign(record.data(), record.size());
    LdifIndex index;
    FileFault fault;
    if (!index.build(text, fault) || index.size() != 1) return result::operations_error;
    Filter parsed;
    if (!parsed.parse(filter)) return result::protocol_error;
    const Filter::Match match = parsed.match(index, 0);
    if (match == Filter::Match::interrupted) return result::time_limit_exceeded;
    matches = match == Filter::Match::yes;
    return result::success;
  } catch (const std::bad_alloc&) {
    return result::no_memory;
  }
}

}  // namespace orv::cfg
