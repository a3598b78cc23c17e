// Entries for tests, built as the server builds them.
#pragma once

#include <cstdlib>
#include <cstring>
#include <initializer_list>
#include <string>
#include <vector>

#include "slapi/owners.h"

namespace orv::server {

inline EntryPtr make_entry(const std::string& dn) {
  EntryPtr e(static_cast<entry*>(std::calloc(1, sizeof(entry))));
  e->dn = strdup(dn.c_str());
  return e;
}

inline void add_values(const EntryPtr& e, const char* type,
                       const std::vector<std::string>& values) {
  std::vector<berval> counted;
  for (const std::string& value : values) {
    counted.push_back({value.size(), const_cast<char*>(value.data())});
  }
  std::vector<berval*> list;
  for (berval& value : counted) list.push_back(&value);
  list.push_back(nullptr);
  if (attr_merge(e.get(), type, list.data(), 1, 1, nullptr) != 0) std::abort();
}

// A null-terminated list of names, as searches carry it.
class Names {
 public:
  Names(std::initializer_list<const char*> names) : texts_(names.begin(), names.end()) {
    for (std::string& text : texts_) list_.push_back(text.data());
    list_.push_back(nullptr);
  }
  char** get() noexcept { return list_.data(); }

 private:
  std::vector<std::string> texts_;
  std::vector<char*> list_;
};

}  // namespace orv::server
