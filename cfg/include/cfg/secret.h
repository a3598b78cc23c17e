// Stored passwords: how they look in the file, how they are sealed, opened and verified.
//
// Forms of a stored value:
//   {AES256}base64   sealed: AES-256-GCM under the key of the stash file; can be opened again
//   {SSHA512}base64  salted SHA-512; also {SSHA384}, {SSHA256}, {SSHA}: can only be verified
//   {PBKDF2-SHA256}iterations$salt$hash (base64 without padding), also -SHA512: can only be
//                    verified
//   {CRYPT}text      as crypt(3) makes it, where the platform has it: can only be verified. Methods
//                    with a count or size that would take minutes to compute never match
//   *                matches nothing, not even itself
//   anything else    the clear text, unless it begins with "{" name "}" of an unknown scheme, which
//                    never matches
//
// A sealed value is bound to the attribute and the entry it stands in (their names are part of what
// is authenticated), so that a sealed text copied into another entry never matches there.
//
// All functions are thread-safe, do not throw, and wipe the clear text they handled in between.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

namespace orv::cfg {

class Key;  // 32 random bytes, wiped on destruction
struct KeyDeleter {
  void operator()(const Key* key) const noexcept;
};
using KeyPtr = std::unique_ptr<const Key, KeyDeleter>;

// Reads a key stash file: "orv-key-1 " and 64 hexadecimal digits on one line. Refused unless it is
// a regular file that only its owner may read or write. 0; 90; 1 with the cause in `why` (names the
// file, never its content).
int load_key_stash(const char* path, KeyPtr& key, std::string& why) noexcept;

// Writes a new key stash with a random key, mode 0600; refuses to overwrite. 0, 90 or 1 with `why`.
int create_key_stash(const char* path, std::string& why) noexcept;

// Where a secret stands: canonical attribute type and normalised DN of its entry.
struct SecretPlace {
  std::string_view type;
  std::string_view normal_dn;
};

// Seals a clear text. 0 or 90.
int seal_secret(const Key& key, SecretPlace place, std::string_view clear,
                std::string& stored) noexcept;

enum class OpenResult { opened, not_sealed, broken };

// Opens a sealed value wherever it came from. `not_sealed` for clear and hashed values; `broken`
// for a damaged value, a null or wrong key. `key` may be null.
OpenResult open_secret(const Key* key, std::string_view stored, std::string& clear) noexcept;

// Whether `clear` is the password stored as `stored` at `place`. Takes the same time for every
// wrong password of the same length. False for an empty clear text, an unknown or malformed scheme,
// a sealed value that belongs elsewhere, a missing key.
bool verify_secret(const Key* key, SecretPlace place, std::string_view stored,
                   std::string_view clear) noexcept;

// What a verification against a stored value costs, in iterations of a hash function, roughly. 0
// for all that costs next to nothing, and for what is never computed: counts and sizes that would
// take minutes, or most of the memory, match nothing.
std::uint64_t verification_cost(std::string_view stored) noexcept;

// Spends the time of a verification on nothing, for identities that do not exist.
void verify_nothing(std::string_view clear) noexcept;

// Makes a salted SHA-512 value. 0 or 90.
int hash_secret(std::string_view clear, std::string& stored) noexcept;

// How a password that is given in clear is stored by a change (cfg_add_s, cfg_modify_s): sealed
// under the key of the session, hashed, or as it is. Without a key, `sealed` means ssha512.
enum class SecretMethod {
  sealed,
  ssha256,
  ssha384,
  ssha512,
  pbkdf2_sha256,  // 600,000 iterations: a quarter of a second of one core
  pbkdf2_sha512,  // 210,000 iterations
  crypt,          // the platform's own choice among its methods
  clear,
  hashed = ssha512,
};

// Whether this host can store passwords that way; all but crypt are always possible.
bool can_make_secret(SecretMethod method) noexcept;

// Makes the stored form that needs no key, with a salt of its own. 0; 90; 19 a password that the
// method cannot take (crypt: longer than 511 bytes); 53 `sealed`, or this host cannot.
int make_secret(SecretMethod method, std::string_view clear, std::string& stored) noexcept;

// Sets the method of the process; `sealed` until then. Thread-safe.
void set_secret_method(SecretMethod method) noexcept;
SecretMethod secret_method() noexcept;

// Protects a clear text with the method in force; `key` may be null. 0; 90; 19 and 53 as in
// make_secret.
int protect_secret(const Key* key, SecretPlace place, std::string_view clear,
                   std::string& stored) noexcept;

// Whether a value begins with "{" name "}", as protected ones do: no password to store may, since
// nobody could tell it from a protected one.
bool names_scheme(std::string_view value) noexcept;

// Overwrites memory in a way that the compiler keeps.
void wipe(void* memory, std::size_t length) noexcept;
void wipe(std::string& text) noexcept;

}  // namespace orv::cfg
