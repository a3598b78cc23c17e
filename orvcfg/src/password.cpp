#include "password.h"

#include <sys/random.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <string_view>

#include "cfg/secret.h"
#include "new_file.h"

namespace orv::orvcfg {

namespace {

// Sixty-four characters: six bits of a random byte choose one without bias.
constexpr std::string_view kAlphabet =
    "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-_";
static_assert(kAlphabet.size() == 64);

bool fill_random(std::array<unsigned char, kPasswordLength>& bytes) {
  std::size_t filled = 0;
  while (filled < bytes.size()) {
    const ssize_t count = ::getrandom(bytes.data() + filled, bytes.size() - filled, 0);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return false;
    filled += static_cast<std::size_t>(count);
  }
  return true;
}

bool is_capital(char c) {
  return c >= 'A' && c <= 'Z';
}
bool is_small(char c) {
  return c >= 'a' && c <= 'z';
}
bool is_other(char c) {
  return !is_capital(c) && !is_small(c);
}

bool is_acceptable(const std::string& password) {
  const auto occurs = [&](char c) { return std::count(password.begin(), password.end(), c); };
  const auto count = [&](auto kind) {
    return std::count_if(password.begin(), password.end(), kind);
  };
  return count(is_capital) >= 2 && count(is_small) >= 2 && count(is_other) >= 2 &&
         std::all_of(password.begin(), password.end(), [&](char c) { return occurs(c) <= 2; });
}

}  // namespace

bool generate_password(std::string& password, std::string& why) {
  std::array<unsigned char, kPasswordLength> bytes{};
  // Whole candidates are thrown away, not single characters mended: mending would make some
  // passwords likelier than others. About two in five pass.
  do {
    if (!fill_random(bytes)) {
      why = system_failure("cannot make a password", "getrandom");
      return false;
    }
    password.resize(bytes.size());
    std::transform(bytes.begin(), bytes.end(), password.begin(),
                   [](unsigned char byte) { return kAlphabet[byte & 63U]; });
  } while (!is_acceptable(password));
  cfg::wipe(bytes.data(), bytes.size());
  return true;
}

}  // namespace orv::orvcfg
