// A list with the name of one attribute, in the form that a search takes.
#pragma once

#include <cstdlib>

#include "slapi/strings.h"

namespace orv {

// Owns the null-terminated list and the copy of the name in it.
class NameList {
 public:
  explicit NameList(const char* name) : list_(static_cast<char**>(std::calloc(2, sizeof(char*)))) {
    if (list_ != nullptr) list_[0] = slapi_ch_strdup(name);
  }
  ~NameList() {
    if (list_ != nullptr) std::free(list_[0]);
    std::free(list_);
  }
  NameList(const NameList&) = delete;
  NameList& operator=(const NameList&) = delete;

  // False without memory.
  [[nodiscard]] bool complete() const noexcept { return list_ != nullptr && list_[0] != nullptr; }
  [[nodiscard]] char** get() const noexcept { return list_; }

 private:
  char** list_;
};

}  // namespace orv
