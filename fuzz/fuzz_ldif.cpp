// LDIF reader: whatever it accepts is a tree in which each entry is found under its own DN.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "cfg/dn.h"
#include "dn_text.h"
#include "file_text.h"
#include "filter.h"
#include "ldif_index.h"

using namespace orv::cfg;

namespace {

void require(bool holds) {
  if (!holds) std::abort();
}

void register_types() {
  std::vector<AttributeType> types(2);
  types[0].name = "cn";
  types[0].oid = "2.5.4.3";
  types[0].aliases = {"commonName"};
  types[1].name = "secret";
  types[1].oid = "1.2.3";
  types[1].secret = true;
  register_attribute_types(std::move(types));
}

void check_entry(const LdifIndex& index, std::uint32_t entry) {
  std::string scratch;
  std::string normal;
  require(normalize(index.dn(entry, scratch), DnText::any_code_page, normal));
  require(index.find(normal) == entry);
  const std::uint32_t parent = index.parent(entry);
  if (entry == 0) {
    require(parent == LdifIndex::kNone);
  } else {
    require(parent < entry && index.find(parent_of_normal_dn(normal)) == parent);
  }
  LineReader reader = index.lines(entry);
  AttributeLine line;
  std::size_t lines = 0;
  while (reader.next(line)) {
    ++lines;
    require(line.has_colon && !line.type.empty() && line.kind != ValueKind::url);
    require(decoded(line, scratch).find('\0') == std::string_view::npos);
  }
  require(lines >= 2);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const bool registered = (register_types(), true);
  static_cast<void>(registered);
  FileText text;
  text.assign(reinterpret_cast<const char*>(data), size);
  LdifIndex index;
  FileFault fault;
  if (!index.build(text, fault)) {
    require(!fault.cause.empty() && (fault.line > 0) == (fault.column > 0));
    return 0;
  }
  require(index.size() > 0);
  for (std::uint32_t entry = 0; entry < index.size(); ++entry) check_entry(index, entry);
  return 0;
}
