// Entries for tests, as the server would build them.
#pragma once

#include <gtest/gtest.h>

#include <initializer_list>
#include <string>
#include <utility>
#include <vector>

#include "slapi/owners.h"
#include "values.h"

namespace orv::test {

using Attributes = std::vector<std::pair<std::string, std::vector<std::string>>>;

inline EntryPtr make_entry(const char* dn, const Attributes& attributes) {
  EntryPtr e(static_cast<entry*>(std::calloc(1, sizeof(entry))));
  if (dn != nullptr) e->dn = strdup(dn);
  for (const auto& [type, texts] : attributes) {
    Values values(texts);
    EXPECT_EQ(attr_merge(e.get(), type.c_str(), values.list(), 1, 0, nullptr), 0) << type;
  }
  return e;
}

// Sets an attribute to other values; none takes it away.
inline void set_values(entry& e, const char* type, const std::vector<std::string>& texts) {
  attr_delete(&e, type, nullptr);
  if (texts.empty()) return;
  Values values(texts);
  EXPECT_EQ(attr_merge(&e, type, values.list(), 1, 0, nullptr), 0) << type;
}

}  // namespace orv::test
