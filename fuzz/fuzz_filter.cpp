// Filter parser and evaluation: the first line is the filter, the rest an entry to try it on.
#include <cstdint>
#include <string>

#include "file_text.h"
#include "filter.h"
#include "ldif_index.h"

using namespace orv::cfg;

namespace {

const char kEntry[] =
    "dn: cn=Fuzz+ou=X,o=Top\nobjectClass: top\ncn: Fuzz\ncn: a  b*c\\d\nou: X\n"
    "description:: w6TDtsO8\nlong: a\n b\n c\n\n";

void register_types() {
  std::vector<AttributeType> types(9);
  const char* names[] = {"cn", "ex", "oct", "member", "num", "flag", "objectClass", "tel", "at"};
  for (std::size_t i = 0; i < types.size(); ++i) {
    types[i].name = names[i];
    types[i].equality = static_cast<MatchingRule>(i);
  }
  AttributeType secret;
  secret.name = "secret";
  secret.secret = true;
  types.push_back(secret);
  register_attribute_types(std::move(types));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static const bool registered = (register_types(), true);
  static_cast<void>(registered);
  const std::string input(reinterpret_cast<const char*>(data), size);
  const std::size_t line = std::min(input.find('\n'), input.size());
  Filter filter;
  if (!filter.parse(std::string_view(input).substr(0, line))) return 0;

  FileText text;
  FileFault fault;
  LdifIndex index;
  const std::string body = line < input.size() ? input.substr(line + 1) : "";
  text.assign(body.data(), body.size());
  if (!index.build(text, fault)) {
    text.assign(kEntry, sizeof kEntry - 1);
    if (!index.build(text, fault)) __builtin_trap();
  }
  for (std::uint32_t entry = 0; entry < index.size(); ++entry) {
    static_cast<void>(filter.matches(index, entry));
  }
  return 0;
}
