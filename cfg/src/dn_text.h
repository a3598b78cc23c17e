// DNs as the library itself needs them: in the file's code page, with the hash that the index
// keeps, and a fast path for what nearly all DNs of a configuration look like.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "attribute_lookup.h"
#include "cfg/dn.h"

namespace orv::cfg {

// Which bytes a DN may hold. Outside ASCII, letters of a text that is not UTF-8 are not folded.
enum class DnText { utf8, any_code_page };

// As `normalize_dn`, but throws std::bad_alloc; false when it is not a DN.
bool normalize(std::string_view text, DnText encoding, std::string& normal);

// As `parse_dn`, but throws std::bad_alloc; false when it is not a DN.
bool parse(std::string_view text, DnText encoding, Dn& dn);

// The first RDN of a DN in plain spelling (ASCII, one part, no escapes), normalised. Used for one
// DN after the other it saves looking up a type that is spelled like the one before.
struct LeadingRdn {
  char normal[512];
  char spelled[16];                 // the type as spelled, when it fits
  std::size_t spelled_length = 0;   // 0 when it did not fit
  std::size_t value_at = 0;         // where the value begins in `normal`
  std::size_t length = 0;           // of `normal`
  const KnownType* type = nullptr;  // null when unknown
  std::string_view rest;            // the parent's DN as spelled, without leading blanks
  bool last = false;                // no comma follows
};

// False when the RDN needs the full parser; that says nothing about whether it is well formed.
bool read_plain_rdn(std::string_view text, LeadingRdn& rdn) noexcept;

// Hash of a DN from the hash of its parent and its first RDN in normal form; 0 is the empty DN's.
std::uint32_t combine_dn_hash(std::uint32_t parent_hash, std::string_view normal_rdn) noexcept;

// Hash of a whole DN in normal form.
std::uint32_t hash_normal_dn(std::string_view normal) noexcept;

// The length of the first RDN of a DN in normal form.
std::size_t leading_rdn_length(std::string_view normal) noexcept;

}  // namespace orv::cfg
