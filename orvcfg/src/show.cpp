#include "show.h"

#include <vector>

#include "file_session.h"
#include "ldif_text.h"
#include "slapi/schema.h"

namespace orv::orvcfg {

namespace {

bool append_attribute(std::string& ldif, const FileAttribute& attribute) {
  const SchemaAttribute* type = builtin_schema().attribute(attribute.name);
  if (type != nullptr && type->secret) {
    ldif.append("# ").append(attribute.name).append(" is set, and not shown\n");
    return true;
  }
  for (const std::string& value : attribute.values) {
    if (!append_folded_ldif_line(ldif, attribute.name, value)) return false;
  }
  return true;
}

bool append_entry(std::string& ldif, const FileEntry& entry) {
  if (!append_folded_ldif_line(ldif, "dn", entry.dn)) return false;
  for (const FileAttribute& attribute : entry.attributes) {
    if (!append_attribute(ldif, attribute)) return false;
  }
  ldif.push_back('\n');
  return true;
}

}  // namespace

bool show_entries(const std::string& file, const std::string& base, std::ostream& out,
                  std::string& why) {
  const CfgSession session = open_file(file, "", why);
  std::vector<FileEntry> entries;
  if (!session || !read_entries(session.get(), base, entries, why)) return false;
  std::string ldif;
  for (const FileEntry& entry : entries) {
    if (!append_entry(ldif, entry)) {
      why = "not enough memory";
      return false;
    }
  }
  out << ldif;
  return true;
}

}  // namespace orv::orvcfg
