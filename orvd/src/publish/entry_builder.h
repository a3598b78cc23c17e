// Putting an entry of the server's own together.
#pragma once

#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "slapi/owners.h"

namespace orv::server {

class EntryBuilder {
 public:
  // Throws std::bad_alloc.
  EntryBuilder(std::string_view dn, std::string_view normal_dn);

  // Adds an attribute; one without values is left out, as an entry has none such. Throws
  // std::bad_alloc.
  EntryBuilder& add(const char* type, const std::vector<std::string>& values);
  EntryBuilder& add(const char* type, std::string_view value);

  EntryPtr take() noexcept { return std::move(entry_); }

 private:
  EntryPtr entry_;
};

}  // namespace orv::server
