#include "cfg/secret.h"

#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/rand.h>

#ifdef ORV_HAS_CRYPT
#include <crypt.h>
#endif

#include <array>
#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <new>
#include <utility>

#include "cfg/openssl_owners.h"
#include "cfg/result_codes.h"
#include "cfg/text.h"
#include "characters.h"
#include "secret_key.h"

namespace orv::cfg {

void wipe(void* memory, std::size_t length) noexcept {
  if (memory != nullptr) OPENSSL_cleanse(memory, length);
}

void wipe(std::string& text) noexcept {
  // The capacity too: a text that shrank leaves its tail behind.
  text.resize(text.capacity());
  wipe(text.data(), text.size());
  text.clear();
}

namespace {

const unsigned char* bytes_of(std::string_view text) noexcept {
  return reinterpret_cast<const unsigned char*>(text.data());
}
unsigned char* bytes_of(std::string& text) noexcept {
  return reinterpret_cast<unsigned char*>(text.data());
}

// ---- Schemes ----

// The name between the braces at the start of a stored value; false when there is none.
bool split_scheme(std::string_view stored, std::string_view& scheme,
                  std::string_view& rest) noexcept {
  if (stored.empty() || stored.front() != '{') return false;
  const std::size_t end = stored.find('}');
  if (end == std::string_view::npos || end == 1) return false;
  scheme = stored.substr(1, end - 1);
  for (const char c : scheme) {
    const bool name = is_ascii_letter(c) || is_ascii_digit(c) || c == '-' || c == '_' || c == '.' ||
                      c == '/' || c == '+';
    if (!name) return false;
  }
  rest = stored.substr(end + 1);
  return true;
}

std::string with_scheme(std::string_view scheme, std::string_view rest) {
  std::string stored(1, '{');
  stored += scheme;
  stored += '}';
  stored += rest;
  return stored;
}

constexpr std::string_view kSealedScheme = "AES256";

// ---- Digests ----

using DigestContext = std::unique_ptr<EVP_MD_CTX, Releaser<EVP_MD_CTX_free>>;

struct Digest {
  std::array<unsigned char, EVP_MAX_MD_SIZE> bytes{};
  unsigned length = 0;
};

// Digest of the two texts one after the other.
bool digest(const EVP_MD* type, std::string_view first, std::string_view second,
            Digest& out) noexcept {
  const DigestContext context(EVP_MD_CTX_new());
  return context != nullptr && EVP_DigestInit_ex(context.get(), type, nullptr) == 1 &&
         EVP_DigestUpdate(context.get(), first.data(), first.size()) == 1 &&
         EVP_DigestUpdate(context.get(), second.data(), second.size()) == 1 &&
         EVP_DigestFinal_ex(context.get(), out.bytes.data(), &out.length) == 1;
}

// Compares texts of any lengths in a time that depends on neither's content. Throws std::bad_alloc.
bool same_text(std::string_view a, std::string_view b) {
  Digest digest_a;
  Digest digest_b;
  if (!digest(EVP_sha256(), a, "", digest_a) || !digest(EVP_sha256(), b, "", digest_b)) {
    throw std::bad_alloc();
  }
  const bool same =
      CRYPTO_memcmp(digest_a.bytes.data(), digest_b.bytes.data(), digest_a.length) == 0;
  wipe(&digest_a, sizeof digest_a);
  wipe(&digest_b, sizeof digest_b);
  return same && a.size() == b.size();
}

// ---- Sealed values ----
//
// {AES256} base64 of: version byte, 16 bytes that name the place, nonce, ciphertext, tag. Version
// and place are authenticated with the text.

constexpr unsigned char kSealVersion = 1;
constexpr std::size_t kPlaceLength = 16;
constexpr std::size_t kHeaderLength = 1 + kPlaceLength;
constexpr std::size_t kNonceLength = 12;
constexpr std::size_t kTagLength = 16;
constexpr std::size_t kMinSealedLength = kHeaderLength + kNonceLength + kTagLength;

using CipherContext = std::unique_ptr<EVP_CIPHER_CTX, Releaser<EVP_CIPHER_CTX_free>>;

// The header of a value sealed for `place`.
bool make_header(SecretPlace place, std::array<unsigned char, kHeaderLength>& header) {
  std::string type(place.type);
  for (char& c : type) c = ascii_lower(c);
  type += '\0';
  Digest name;
  if (!digest(EVP_sha256(), type, place.normal_dn, name)) return false;
  header[0] = kSealVersion;
  for (std::size_t i = 0; i < kPlaceLength; ++i) header[1 + i] = name.bytes[i];
  return true;
}

bool seal(const Key& key, SecretPlace place, std::string_view clear, std::string& sealed) {
  std::array<unsigned char, kHeaderLength> header{};
  std::array<unsigned char, kNonceLength> nonce{};
  std::array<unsigned char, kTagLength> tag{};
  if (clear.size() > INT32_MAX || !make_header(place, header) ||
      RAND_bytes(nonce.data(), static_cast<int>(nonce.size())) != 1) {
    return false;
  }
  std::string text(clear.size(), '\0');
  const CipherContext context(EVP_CIPHER_CTX_new());
  int length = 0;
  const bool done =
      context != nullptr &&
      EVP_EncryptInit_ex(context.get(), EVP_aes_256_gcm(), nullptr, key.data(), nonce.data()) ==
          1 &&
      EVP_EncryptUpdate(context.get(), nullptr, &length, header.data(),
                        static_cast<int>(header.size())) == 1 &&
      EVP_EncryptUpdate(context.get(), bytes_of(text), &length, bytes_of(clear),
                        static_cast<int>(clear.size())) == 1 &&
      EVP_EncryptFinal_ex(context.get(), bytes_of(text) + length, &length) == 1 &&
      EVP_CIPHER_CTX_ctrl(context.get(), EVP_CTRL_GCM_GET_TAG, kTagLength, tag.data()) == 1;
  if (!done) return false;
  sealed.assign(header.begin(), header.end());
  sealed.append(nonce.begin(), nonce.end());
  sealed += text;
  sealed.append(tag.begin(), tag.end());
  return true;
}

// Opens the bytes of a sealed value, wherever it was sealed for. Throws std::bad_alloc.
bool open_sealed(const Key& key, std::string_view sealed, std::string& clear) {
  if (sealed.size() < kMinSealedLength || sealed.size() > INT32_MAX ||
      static_cast<unsigned char>(sealed[0]) != kSealVersion) {
    return false;
  }
  const std::string_view header = sealed.substr(0, kHeaderLength);
  const std::string_view nonce = sealed.substr(kHeaderLength, kNonceLength);
  const std::string_view text =
      sealed.substr(kHeaderLength + kNonceLength, sealed.size() - kMinSealedLength);
  std::string tag(sealed.substr(sealed.size() - kTagLength));
  std::string out(text.size() + kTagLength, '\0');
  const WipeAtEnd wiped(out);
  const CipherContext context(EVP_CIPHER_CTX_new());
  int length = 0;
  int rest = 0;
  const bool ready =
      context != nullptr &&
      EVP_DecryptInit_ex(context.get(), EVP_aes_256_gcm(), nullptr, key.data(), bytes_of(nonce)) ==
          1 &&
      EVP_DecryptUpdate(context.get(), nullptr, &length, bytes_of(header),
                        static_cast<int>(header.size())) == 1 &&
      EVP_DecryptUpdate(context.get(), bytes_of(out), &length, bytes_of(text),
                        static_cast<int>(text.size())) == 1 &&
      EVP_CIPHER_CTX_ctrl(context.get(), EVP_CTRL_GCM_SET_TAG, kTagLength, tag.data()) == 1;
  // Only the last step looks at the value; what the others want is memory.
  if (!ready) throw std::bad_alloc();
  if (EVP_DecryptFinal_ex(context.get(), bytes_of(out) + length, &rest) != 1) return false;
  wipe(clear);
  clear.assign(out, 0, text.size());
  return true;
}

// Throws std::bad_alloc.
bool decode_base64(std::string_view text, std::string& bytes) {
  std::size_t error_at = 0;
  const int rc = base64_decode(text, bytes, error_at);
  if (rc == result::no_memory) throw std::bad_alloc();
  return rc == result::success;
}

bool verify_sealed(const Key* key, SecretPlace place, std::string_view encoded,
                   std::string_view clear) {
  std::string sealed;
  std::string opened;
  const WipeAtEnd wiped(opened);
  std::array<unsigned char, kHeaderLength> header{};
  if (key == nullptr || !decode_base64(encoded, sealed)) return false;
  if (!make_header(place, header)) throw std::bad_alloc();
  if (!open_sealed(*key, sealed, opened)) return false;
  const bool here = CRYPTO_memcmp(sealed.data(), header.data(), header.size()) == 0;
  return same_text(opened, clear) && here;
}

// Where others keep passwords, this one keeps somebody out.
constexpr std::string_view kNobodys = "*";

// ---- Hashed values ----

constexpr std::size_t kMaxSaltLength = 256;

struct SaltedScheme {
  std::string_view name;
  const EVP_MD* (*type)();
};
constexpr SaltedScheme kSaltedSchemes[] = {{"SSHA512", &EVP_sha512},
                                           {"SSHA384", &EVP_sha384},
                                           {"SSHA256", &EVP_sha256},
                                           {"SSHA", &EVP_sha1}};

bool verify_salted(const EVP_MD* type, std::string_view encoded, std::string_view clear) {
  std::string stored;
  if (!decode_base64(encoded, stored)) return false;
  const auto length = static_cast<std::size_t>(EVP_MD_get_size(type));
  if (stored.size() <= length || stored.size() > length + kMaxSaltLength) return false;
  Digest made;
  if (!digest(type, clear, std::string_view(stored).substr(length), made)) throw std::bad_alloc();
  return CRYPTO_memcmp(made.bytes.data(), stored.data(), length) == 0;
}

constexpr SaltedScheme kPbkdf2Schemes[] = {{"PBKDF2-SHA256", &EVP_sha256},
                                           {"PBKDF2-SHA512", &EVP_sha512}};
constexpr int kMaxIterations = 10'000'000;

// A decimal number between 1 and kMaxIterations; 0 for anything else.
int read_iterations(std::string_view text) noexcept {
  if (text.empty() || text.size() > 8 || text.front() == '0') return 0;
  int value = 0;
  for (const char c : text) {
    if (!is_ascii_digit(c)) return 0;
    value = value * 10 + (c - '0');
  }
  return value <= kMaxIterations ? value : 0;
}

bool decode_unpadded(std::string_view text, std::string& bytes) {
  std::string padded(text);
  if (padded.find('=') != std::string::npos) return false;
  padded.append((4 - padded.size() % 4) % 4, '=');
  return decode_base64(padded, bytes);
}

bool verify_pbkdf2(const EVP_MD* type, std::string_view rest, std::string_view clear) {
  const std::size_t first = rest.find('$');
  const std::size_t second = first == std::string_view::npos ? first : rest.find('$', first + 1);
  if (second == std::string_view::npos || clear.size() > INT32_MAX) return false;
  const int iterations = read_iterations(rest.substr(0, first));
  std::string salt;
  std::string hash;
  if (iterations == 0 || !decode_unpadded(rest.substr(first + 1, second - first - 1), salt) ||
      !decode_unpadded(rest.substr(second + 1), hash)) {
    return false;
  }
  std::array<unsigned char, EVP_MAX_MD_SIZE> made{};
  // A shorter hash is the beginning of the whole one, so one that was cut would match as well.
  if (salt.empty() || salt.size() > kMaxSaltLength ||
      hash.size() != static_cast<std::size_t>(EVP_MD_get_size(type))) {
    return false;
  }
  if (PKCS5_PBKDF2_HMAC(clear.data(), static_cast<int>(clear.size()), bytes_of(salt),
                        static_cast<int>(salt.size()), iterations, type,
                        static_cast<int>(hash.size()), made.data()) != 1) {
    throw std::bad_alloc();
  }
  return CRYPTO_memcmp(made.data(), hash.data(), hash.size()) == 0;
}

// ---- crypt(3) ----

constexpr std::string_view kCryptScheme = "CRYPT";

#ifdef ORV_HAS_CRYPT

// What a text of crypt(3) costs, in iterations of a hash function: some of its methods carry a
// number that takes hours, or all memory, to compute. 0: too much, or a text that is none.
class CryptCost {
 public:
  static std::uint64_t of(std::string_view text) noexcept {
    if (text.empty() || text.front() == '*') return 0;
    if (text.front() == '_') return kDes;
    if (text.front() != '$') return text.size() == kDesLength ? kDes : 0;
    for (const Method& method : kMethods)
      if (text.starts_with(method.prefix)) return method.cost(text.substr(method.prefix.size()));
    return 0;
  }

 private:
  struct Method {
    std::string_view prefix;
    std::uint64_t (*cost)(std::string_view rest) noexcept;
  };

  static constexpr std::uint64_t kDes = 1000;
  static constexpr std::size_t kDesLength = 13;

  static std::uint64_t of_rounds(std::string_view rest) noexcept {
    constexpr std::string_view kRounds = "rounds=";
    constexpr std::uint64_t kDefault = 5000;
    if (!rest.starts_with(kRounds)) return kDefault;
    rest.remove_prefix(kRounds.size());
    return of_number(rest);
  }

  static std::uint64_t of_number(std::string_view rest) noexcept {
    return static_cast<std::uint64_t>(read_iterations(rest.substr(0, rest.find('$'))));
  }

  static std::uint64_t of_blowfish(std::string_view rest) noexcept {
    constexpr int kMost = 16;
    constexpr std::uint64_t kWork = 64;
    if (rest.size() < 3 || rest[2] != '$' || !is_ascii_digit(rest[0]) || !is_ascii_digit(rest[1]))
      return 0;
    const int cost = (rest[0] - '0') * 10 + (rest[1] - '0');
    return cost > kMost ? 0 : kWork << cost;
  }

  // 64 digits, from "." to "z".
  static int digit(char c) noexcept {
    constexpr std::string_view kDigits =
        "./0123456789ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz";
    const std::size_t at = kDigits.find(c);
    return at == std::string_view::npos ? 64 : static_cast<int>(at);
  }

  static std::uint64_t of_memory(int exponent) noexcept {
    constexpr int kMost = 16;  // 256 MiB with the usual block size
    constexpr std::uint64_t kWork = 10;
    return exponent > kMost ? 0 : kWork << exponent;
  }

  // Only the form that the platform makes itself: flags, size and block size, a character each.
  static std::uint64_t of_yescrypt(std::string_view rest) noexcept {
    constexpr int kLargestBlock = 48;
    if (rest.size() < 4 || rest[3] != '$' || digit(rest[2]) >= kLargestBlock) return 0;
    return of_memory(digit(rest[1]) + 1);
  }

  static std::uint64_t of_scrypt(std::string_view rest) noexcept {
    if (rest.size() < 11 || rest.substr(1, 10) != "U..../....") return 0;
    return of_memory(digit(rest[0]));
  }

  static std::uint64_t of_little(std::string_view) noexcept { return kDes; }

  static constexpr Method kMethods[] = {
      {"$1$", of_little},    {"$3$", of_little},    {"$5$", of_rounds},    {"$6$", of_rounds},
      {"$2a$", of_blowfish}, {"$2b$", of_blowfish}, {"$2x$", of_blowfish}, {"$2y$", of_blowfish},
      {"$y$", of_yescrypt},  {"$gy$", of_yescrypt}, {"$7$", of_scrypt},    {"$sha1$", of_number},
      {"$md5,", of_rounds},
  };
};

struct CryptDeleter {
  void operator()(crypt_data* data) const noexcept {
    wipe(data, sizeof *data);
    std::free(data);
  }
};

// The text that crypt(3) makes of a password by a setting (a method with its salt, or a text made
// before). 0; 90; 53 the platform does not know the setting; 19 a password it cannot take.
int run_crypt(const std::string& clear, const std::string& setting, std::string& made) {
  if (clear.size() >= CRYPT_MAX_PASSPHRASE_SIZE || clear.find('\0') != std::string::npos)
    return result::constraint_violation;
  const std::unique_ptr<crypt_data, CryptDeleter> data(
      static_cast<crypt_data*>(std::calloc(1, sizeof(crypt_data))));
  if (data == nullptr) return result::no_memory;
  errno = 0;
  const char* const text = crypt_r(clear.c_str(), setting.c_str(), data.get());
  // What begins with "*" stands for a failure.
  if (text == nullptr || *text == '*')
    return errno == ENOMEM ? result::no_memory : result::unwilling_to_perform;
  made = text;
  return result::success;
}

int make_crypt(std::string_view clear, std::string& stored) {
  char setting[CRYPT_GENSALT_OUTPUT_SIZE] = "";
  // The platform's best method, its usual cost, random bytes of its own.
  if (crypt_gensalt_rn(nullptr, 0, nullptr, 0, setting, sizeof setting) == nullptr)
    return errno == ENOMEM ? result::no_memory : result::unwilling_to_perform;
  std::string password(clear);
  const WipeAtEnd wiped(password);
  std::string made;
  const int rc = run_crypt(password, setting, made);
  if (rc == result::success) stored = with_scheme(kCryptScheme, made);
  return rc;
}

bool verify_crypt(std::string_view stored, std::string_view clear) {
  if (CryptCost::of(stored) == 0) return false;
  std::string password(clear);
  const WipeAtEnd wiped(password);
  std::string made;
  const int rc = run_crypt(password, std::string(stored), made);
  if (rc == result::no_memory) throw std::bad_alloc();
  return rc == result::success && made.size() == stored.size() &&
         CRYPTO_memcmp(made.data(), stored.data(), made.size()) == 0;
}

std::uint64_t cost_of_crypt(std::string_view stored) noexcept {
  return CryptCost::of(stored);
}

#else

std::uint64_t cost_of_crypt(std::string_view) noexcept {
  return 0;
}
int make_crypt(std::string_view, std::string&) {
  return result::unwilling_to_perform;
}
bool verify_crypt(std::string_view, std::string_view) {
  return false;
}

#endif

bool verify_scheme(const Key* key, SecretPlace place, std::string_view scheme,
                   std::string_view rest, std::string_view clear) {
  if (equals_ignore_ascii_case(scheme, kSealedScheme)) {
    return verify_sealed(key, place, rest, clear);
  }
  for (const SaltedScheme& known : kSaltedSchemes) {
    if (equals_ignore_ascii_case(scheme, known.name)) {
      return verify_salted(known.type(), rest, clear);
    }
  }
  for (const SaltedScheme& known : kPbkdf2Schemes) {
    if (equals_ignore_ascii_case(scheme, known.name)) {
      return verify_pbkdf2(known.type(), rest, clear);
    }
  }
  return equals_ignore_ascii_case(scheme, kCryptScheme) && verify_crypt(rest, clear);
}

// ---- Making ----

constexpr std::size_t kSaltLength = 16;

bool make_salt(std::string& salt) {
  salt.assign(kSaltLength, '\0');
  return RAND_bytes(bytes_of(salt), static_cast<int>(salt.size())) == 1;
}

int make_salted(const SaltedScheme& scheme, std::string_view clear, std::string& stored) {
  std::string salt;
  std::string encoded;
  Digest made;
  if (!make_salt(salt) || !digest(scheme.type(), clear, salt, made)) return result::no_memory;
  const std::string bytes(made.bytes.begin(), made.bytes.begin() + made.length);
  if (base64_encode(bytes + salt, encoded) != result::success) return result::no_memory;
  stored = with_scheme(scheme.name, encoded);
  return result::success;
}

bool encode_unpadded(std::string_view bytes, std::string& text) {
  if (base64_encode(bytes, text) != result::success) return false;
  while (text.ends_with('=')) text.pop_back();
  return true;
}

int make_pbkdf2(const SaltedScheme& scheme, int iterations, std::string_view clear,
                std::string& stored) {
  if (clear.size() > INT32_MAX) return result::constraint_violation;
  std::string salt;
  std::string salt_text;
  std::string hash_text;
  std::array<unsigned char, EVP_MAX_MD_SIZE> made{};
  const EVP_MD* const type = scheme.type();
  const int length = EVP_MD_get_size(type);
  if (!make_salt(salt) || PKCS5_PBKDF2_HMAC(clear.data(), static_cast<int>(clear.size()),
                                            bytes_of(salt), static_cast<int>(salt.size()),
                                            iterations, type, length, made.data()) != 1) {
    return result::no_memory;
  }
  const std::string hash(made.begin(), made.begin() + length);
  if (!encode_unpadded(salt, salt_text) || !encode_unpadded(hash, hash_text)) {
    return result::no_memory;
  }
  stored = with_scheme(scheme.name, std::to_string(iterations));
  for (const std::string& part : {salt_text, hash_text}) (stored += '$') += part;
  return result::success;
}

}  // namespace

int seal_secret(const Key& key, SecretPlace place, std::string_view clear,
                std::string& stored) noexcept try {
  std::string sealed;
  std::string encoded;
  if (!seal(key, place, clear, sealed) || base64_encode(sealed, encoded) != result::success) {
    return result::no_memory;
  }
  stored = with_scheme(kSealedScheme, encoded);
  return result::success;
} catch (...) {
  return result::no_memory;
}

OpenResult open_secret(const Key* key, std::string_view stored, std::string& clear) noexcept try {
  std::string_view scheme;
  std::string_view rest;
  if (!split_scheme(stored, scheme, rest) || !equals_ignore_ascii_case(scheme, kSealedScheme)) {
    return OpenResult::not_sealed;
  }
  std::string sealed;
  if (key == nullptr || !decode_base64(rest, sealed) || !open_sealed(*key, sealed, clear)) {
    return OpenResult::broken;
  }
  return OpenResult::opened;
} catch (...) {
  return OpenResult::broken;
}

Match match_secret(const Key* key, SecretPlace place, std::string_view stored,
                   std::string_view clear) noexcept try {
  if (clear.empty() || stored == kNobodys) return Match::no;
  std::string_view scheme;
  std::string_view rest;
  const bool same = split_scheme(stored, scheme, rest)
                        ? verify_scheme(key, place, scheme, rest, clear)
                        : same_text(stored, clear);
  return same ? Match::yes : Match::no;
} catch (...) {
  return Match::no_memory;
}

bool verify_secret(const Key* key, SecretPlace place, std::string_view stored,
                   std::string_view clear) noexcept {
  return match_secret(key, place, stored, clear) == Match::yes;
}

std::uint64_t verification_cost(std::string_view stored) noexcept {
  std::string_view scheme;
  std::string_view rest;
  if (!split_scheme(stored, scheme, rest)) return 0;
  if (equals_ignore_ascii_case(scheme, kCryptScheme)) return cost_of_crypt(rest);
  for (const SaltedScheme& known : kPbkdf2Schemes) {
    if (equals_ignore_ascii_case(scheme, known.name)) {
      return static_cast<std::uint64_t>(read_iterations(rest.substr(0, rest.find('$'))));
    }
  }
  return 0;
}

void verify_nothing(std::string_view clear) noexcept try {
  // The work of the sealed form, which new instances use.
  static const Key key{Key::Bytes{}};
  static const std::string sealed = [] {
    std::string stored;
    seal_secret(key, {"none", "CN=NONE"}, "none", stored);
    return stored;
  }();
  verify_secret(&key, {"none", "CN=NONE"}, sealed, clear);
} catch (...) {
}

int make_secret(SecretMethod method, std::string_view clear, std::string& stored) noexcept try {
  switch (method) {
    case SecretMethod::ssha256:
      return make_salted({"SSHA256", &EVP_sha256}, clear, stored);
    case SecretMethod::ssha384:
      return make_salted({"SSHA384", &EVP_sha384}, clear, stored);
    case SecretMethod::ssha512:
      return make_salted({"SSHA512", &EVP_sha512}, clear, stored);
    case SecretMethod::pbkdf2_sha256:
      return make_pbkdf2({"PBKDF2-SHA256", &EVP_sha256}, 600'000, clear, stored);
    case SecretMethod::pbkdf2_sha512:
      return make_pbkdf2({"PBKDF2-SHA512", &EVP_sha512}, 210'000, clear, stored);
    case SecretMethod::crypt:
      return make_crypt(clear, stored);
    case SecretMethod::clear:
      stored = clear;
      return result::success;
    case SecretMethod::sealed:
      break;
  }
  return result::unwilling_to_perform;
} catch (...) {
  return result::no_memory;
}

int hash_secret(std::string_view clear, std::string& stored) noexcept {
  return make_secret(SecretMethod::ssha512, clear, stored);
}

bool can_make_secret(SecretMethod method) noexcept {
#ifdef ORV_HAS_CRYPT
  static_cast<void>(method);
  return true;
#else
  return method != SecretMethod::crypt;
#endif
}

// ---- Protecting ----

namespace {

std::atomic<SecretMethod> current_method{SecretMethod::sealed};

}  // namespace

void set_secret_method(SecretMethod method) noexcept {
  current_method.store(method, std::memory_order_relaxed);
}

SecretMethod secret_method() noexcept {
  return current_method.load(std::memory_order_relaxed);
}

int protect_secret(const Key* key, SecretPlace place, std::string_view clear,
                   std::string& stored) noexcept {
  const SecretMethod method = secret_method();
  if (method != SecretMethod::sealed) return make_secret(method, clear, stored);
  return key == nullptr ? hash_secret(clear, stored) : seal_secret(*key, place, clear, stored);
}

bool names_scheme(std::string_view value) noexcept {
  std::string_view scheme;
  std::string_view rest;
  return split_scheme(value, scheme, rest);
}

}  // namespace orv::cfg
