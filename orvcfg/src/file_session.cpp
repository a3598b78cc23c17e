#include "file_session.h"

#include "cfg/attribute_table.h"
#include "cfg/object_class_table.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "slapi/schema.h"

namespace orv::orvcfg {

namespace {

bool set_options(_CFG* session, const std::string& file, const std::string& key_stash) {
  return cfg_set_option(session, kCfgOptDiagnostics, 1) == 0 &&
         cfg_set_option(session, kCfgOptDiagnosticsFile, 1) == 0 &&
         cfg_set_option(session, kCfgOptConfigFile, file.c_str()) == 0 &&
         (key_stash.empty() ||
          cfg_set_option(session, kCfgOptKeyStashFile, key_stash.c_str()) == 0);
}

FileAttribute read_attribute(_CFG* session, _CFGMessage* record, const char* name) {
  FileAttribute attribute{name, {}};
  const CfgValues values(cfg_get_values(session, record, name));
  for (char** value = values.get(); value != nullptr && *value != nullptr; ++value) {
    attribute.values.emplace_back(*value);
  }
  return attribute;
}

FileEntry read_entry(_CFG* session, _CFGMessage* record) {
  FileEntry entry;
  const CfgText dn(cfg_get_dn(session, record));
  if (dn) entry.dn = dn.get();
  _CFGBer* raw_cursor = nullptr;
  CfgText name(cfg_first_attribute(session, record, &raw_cursor));
  const CfgCursor cursor(raw_cursor);
  while (name) {
    entry.attributes.push_back(read_attribute(session, record, name.get()));
    name.reset(cfg_next_attribute(session, record, cursor.get()));
  }
  return entry;
}

std::string describe(int code, const std::string& base) {
  if (code == result::no_such_object) return "there is no entry " + base;
  if (code == result::invalid_dn_syntax) return base + " is not a DN";
  return "reading " + base + " failed with code " + std::to_string(code);
}

}  // namespace

const std::vector<std::string>& FileEntry::values(std::string_view name) const {
  static const std::vector<std::string> none;
  for (const FileAttribute& attribute : attributes) {
    if (cfg::equals_ignore_ascii_case(attribute.name, name)) return attribute.values;
  }
  return none;
}

CfgSession open_file(const std::string& file, const std::string& key_stash, std::string& why) {
  if (cfg::register_attribute_types(builtin_schema().attribute_table()) != 0 ||
      cfg::register_object_classes(builtin_schema().object_class_table()) != 0) {
    why = "not enough memory for the schema";
    return nullptr;
  }
  CfgSession session(cfg_init(nullptr, 0));
  if (!session || !set_options(session.get(), file, key_stash)) {
    why = "not enough memory to open " + file;
    return nullptr;
  }
  constexpr int kReservedFlags = 128;
  if (cfg_bind_s(session.get(), nullptr, nullptr, kReservedFlags) != 0) {
    why = cfg_dump_exception(session.get());
    return nullptr;
  }
  return session;
}

bool read_entries(_CFG* session, const std::string& base, std::vector<FileEntry>& entries,
                  std::string& why) {
  _CFGMessage* raw_chain = nullptr;
  const int code =
      cfg_search_s(session, base.c_str(), kScopeSubtree, nullptr, nullptr, 0, &raw_chain);
  const CfgResult chain(raw_chain);
  if (code != 0) {
    why = describe(code, base);
    return false;
  }
  for (_CFGMessage* record = cfg_first_entry(session, chain.get()); record != nullptr;
       record = cfg_next_entry(session, record)) {
    entries.push_back(read_entry(session, record));
  }
  return true;
}

}  // namespace orv::orvcfg
