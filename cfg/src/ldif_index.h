// The entries of a configuration file: where each begins, whose child it is, and how to find it by
// its DN. Built in one pass that also checks the whole file.
//
// The index holds 12 bytes an entry (15 while it grows) and a hash table of at most 11; values are
// neither copied nor decoded. DNs are not kept: a match of hashes is confirmed on the text.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "file_text.h"
#include "ldif_lines.h"

namespace orv::cfg {

// Why a file was refused. `line` and `column` count from 1, bytes and without a byte-order mark;
// both are 0 when the cause is not in one place.
struct FileFault {
  std::string cause;
  std::size_t line = 0;
  std::size_t column = 0;
};

class LdifIndex {
 public:
  static constexpr std::uint32_t kNone = 0xFFFFFFFF;

  // Reads `text`, which must outlive the index. The file holds one tree: its first entry is the
  // top, every other stands behind its parent. False with `fault`; throws std::bad_alloc.
  bool build(const FileText& text, FileFault& fault);

  [[nodiscard]] std::uint32_t size() const noexcept { return size_; }

  // The entry with this DN (in normal form), or kNone. Throws std::bad_alloc.
  [[nodiscard]] std::uint32_t find(std::string_view normal_dn) const;

  // The entry directly above; kNone for the first entry. A parent comes before its children.
  [[nodiscard]] std::uint32_t parent(std::uint32_t entry) const noexcept {
    return entries()[entry].parent;
  }

  // The line of its "dn:", counted from 1.
  [[nodiscard]] std::size_t line(std::uint32_t entry) const noexcept;

  // A reader that stands before the entry's "dn:" line.
  [[nodiscard]] LineReader lines(std::uint32_t entry) const noexcept {
    return {text_->begin() + entries()[entry].offset, text_->end()};
  }

  // The text that the index is of.
  [[nodiscard]] const char* text_begin() const noexcept { return text_->begin(); }
  [[nodiscard]] const char* text_end() const noexcept { return text_->end(); }

  // The DN as spelled; points into the text or into `scratch`.
  std::string_view dn(std::uint32_t entry, std::string& scratch) const;

 private:
  struct Entry {
    std::uint32_t offset;
    std::uint32_t hash;
    std::uint32_t parent;
  };
  class Builder;

  [[nodiscard]] Entry* entries() const noexcept { return static_cast<Entry*>(entries_.data()); }
  [[nodiscard]] std::uint32_t* table() const noexcept {
    return static_cast<std::uint32_t*>(table_.data());
  }
  [[nodiscard]] std::uint32_t find(std::string_view normal_dn, std::uint32_t hash) const;
  // Appends; false when an entry has this DN already, with its number in `existing`.
  bool append(const Entry& entry, std::string_view dn, std::uint32_t& existing);
  void grow_table();
  [[nodiscard]] bool has_dn(std::uint32_t entry, std::string_view normal_dn) const;

  const FileText* text_ = nullptr;
  RecycledMemory entries_{MemoryKind::entries};
  RecycledMemory table_{MemoryKind::table};
  std::uint32_t size_ = 0;
  std::uint32_t table_size_ = 0;  // a power of two, at most three quarters full
};

}  // namespace orv::cfg
