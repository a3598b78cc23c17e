#include "publish/entry_builder.h"

#include <cstdlib>
#include <cstring>
#include <new>

namespace orv::server {
namespace {

char* copy_text(std::string_view text) {
  auto* copy = static_cast<char*>(std::malloc(text.size() + 1));
  if (copy == nullptr) throw std::bad_alloc();
  std::memcpy(copy, text.data(), text.size());
  copy[text.size()] = '\0';
  return copy;
}

}  // namespace

EntryBuilder::EntryBuilder(std::string_view dn, std::string_view normal_dn)
    : entry_(static_cast<entry*>(std::calloc(1, sizeof(entry)))) {
  if (!entry_) throw std::bad_alloc();
  entry_->dn = copy_text(dn);
  entry_->normalized_dn = copy_text(normal_dn);
}

EntryBuilder& EntryBuilder::add(const char* type, const std::vector<std::string>& values) {
  if (values.empty()) return *this;
  std::vector<berval> counted(values.size());
  std::vector<berval*> list;
  for (std::size_t i = 0; i < values.size(); ++i) {
    // attr_merge copies; the type has no const arm.
    counted[i] = {values[i].size(), const_cast<char*>(values[i].data())};
    list.push_back(&counted[i]);
  }
  list.push_back(nullptr);
  if (attr_merge(entry_.get(), type, list.data(), 1, 1, nullptr) != 0) throw std::bad_alloc();
  return *this;
}

EntryBuilder& EntryBuilder::add(const char* type, std::string_view value) {
  return value.empty() ? *this : add(type, std::vector<std::string>{std::string(value)});
}

}  // namespace orv::server
