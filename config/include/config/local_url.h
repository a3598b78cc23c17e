// The URL of a Unix socket, as LDAP clients take it.
#pragma once

#include <string>
#include <string_view>

namespace orv {

// "ldapi://" and the socket's path, with what is not plain in a URL percent-encoded (RFC
// 3986, 2.1). Throws std::bad_alloc. Thread-safe.
inline std::string local_url(std::string_view path) {
  constexpr std::string_view kPlain =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-._~";
  constexpr char kHex[] = "0123456789ABCDEF";
  std::string url = "ldapi://";
  for (const char c : path) {
    const auto byte = static_cast<unsigned char>(c);
    if (kPlain.find(c) != std::string_view::npos)
      url += c;
    else
      url.append(1, '%').append(1, kHex[byte >> 4]).append(1, kHex[byte & 15]);
  }
  return url;
}

}  // namespace orv
