// Distinguished names (RFC 4514): the one parser and the one normal form of the whole system.
//
// Normal form: canonical attribute names (cfg/attribute_table.h) in upper case; no blanks around
// "=", ",", "+"; values prepared by RFC 4518 (compatibility composition, inner blanks folded to
// one) and upper-cased by full Unicode rules; inside values the characters , + " \ < > ; = and
// controls, a leading "#", leading and trailing blanks as \XX with upper-case digits, everything
// else as itself; "#hex" values of string types decoded; the parts of a multi-valued RDN sorted by
// type, then value. Two DNs are equal exactly when their normal forms are equal bytes, the form is
// idempotent, and because "=" and "," inside values are escaped no value can imitate an RDN in a
// substring test. The obsolete ";" separator and quoted values of RFC 2253 are refused.
//
// All functions are thread-safe and do not throw.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace orv::cfg {

// One "type=value" of an RDN. `type` is canonical (as registered, or as typed when unknown),
// `value` the raw UTF-8 value with escapes undone.
struct Ava {
  std::string type;
  std::string value;
};
using Rdn = std::vector<Ava>;  // in the order typed
using Dn = std::vector<Rdn>;   // leaf first

// Parses a DN. 0; 34 not a DN (also: invalid UTF-8, NUL, unknown numeric OID in a form that cannot
// be decoded, more than `kMaxDnLength` bytes or `kMaxRdns` components); 90. "" is the empty DN.
inline constexpr std::size_t kMaxDnLength = 64 * 1024;
inline constexpr std::size_t kMaxRdns = 256;
int parse_dn(std::string_view text, Dn& dn) noexcept;

// Writes the normal form. 0, 34 or 90; `normal` is unchanged on failure.
int normalize_dn(std::string_view text, std::string& normal) noexcept;

// The light form: blanks around "=", ",", "+" trimmed, needless escapes undone; letter case, type
// names and order kept. 0, 34 or 90.
int normalize_dn_light(std::string_view text, std::string& light) noexcept;

// The same DN with its attribute types replaced by their canonical names, values as typed. 0,
// 34, 90.
int canonicalize_dn_types(std::string_view text, std::string& canonical) noexcept;

// For DNs in normal form: the parent ("" for a single RDN or the empty DN); whether one equals the
// other or lies below it. Both split only at unescaped commas; the empty DN is above everything.
std::string_view parent_of_normal_dn(std::string_view normal) noexcept;
bool normal_dn_is_at_or_below(std::string_view normal, std::string_view ancestor) noexcept;

}  // namespace orv::cfg
