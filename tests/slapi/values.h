// Value lists for calls, and entries as text for comparisons.
#pragma once

#include <initializer_list>
#include <string>
#include <string_view>
#include <vector>

#include "slapi/entry.h"

namespace orv::test {

// A null-terminated list of counted values over texts of its own.
class Values {
 public:
  Values(std::initializer_list<std::string> texts) : Values(std::vector<std::string>(texts)) {}
  explicit Values(std::vector<std::string> texts) : texts_(std::move(texts)) {
    counted_.reserve(texts_.size());
    for (std::string& text : texts_) counted_.push_back({text.size(), text.data()});
    for (berval& value : counted_) list_.push_back(&value);
    list_.push_back(nullptr);
  }
  Values(const Values&) = delete;
  Values& operator=(const Values&) = delete;

  berval** list() { return list_.data(); }

 private:
  std::vector<std::string> texts_;
  std::vector<berval> counted_;
  std::vector<berval*> list_;
};

inline std::vector<std::string> texts_of(const attr* a) {
  std::vector<std::string> texts;
  for (berval** value = a == nullptr ? nullptr : a->values; value != nullptr && *value != nullptr;
       ++value)
    texts.emplace_back((*value)->bv_val, (*value)->bv_len);
  return texts;
}

// "type=value|value; type=" and so on, in order.
inline std::string to_text(const entry& e) {
  std::string text;
  for (const attr* a = e.attributes; a != nullptr; a = a->next) {
    text += std::string(a->type) + "=";
    for (const std::string& value : texts_of(a)) text += value + "|";
    text += "; ";
  }
  return text;
}

inline std::vector<std::string> texts_of(const ShortValue* list) {
  std::vector<std::string> texts;
  for (; list != nullptr && list->bytes != nullptr; ++list)
    texts.emplace_back(list->bytes, list->length);
  return texts;
}

}  // namespace orv::test
