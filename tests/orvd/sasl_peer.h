// The other side of SASL for tests: Cyrus SASL's own client.
//
// Threads: one `TestedSasl` in a process, made and gone while one thread uses SASL; a `SaslPeer` is
// its thread's own.
#pragma once

#include <gtest/gtest.h>
#include <sasl/sasl.h>

#include <algorithm>
#include <array>
#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "auth/sasl_library.h"

namespace orv::server {

// The library, set up for the server and for clients with DIGEST-MD5 and SCRAM alone: the client's
// parts of other plug-ins do not give all their memory back. Goes after all that uses it.
class TestedSasl {
 public:
  TestedSasl() {
    std::string error;
    server_ = SaslLibrary::open(error);
    EXPECT_NE(server_, nullptr) << error;
    static const sasl_callback_t only_these[] = {
        {SASL_CB_VERIFYFILE,
         reinterpret_cast<int (*)()>(reinterpret_cast<void (*)()>(&is_tested_plugin)), nullptr},
        {SASL_CB_LIST_END, nullptr, nullptr}};
    EXPECT_EQ(sasl_client_init(only_these), SASL_OK);
  }
  ~TestedSasl() { sasl_client_done(); }
  TestedSasl(const TestedSasl&) = delete;
  TestedSasl& operator=(const TestedSasl&) = delete;

  const SaslLibrary& server() const noexcept { return *server_; }

 private:
  static int is_tested_plugin(void*, const char* file, sasl_verify_type_t) {
    const std::string_view name(file);
    const bool tested = name.find("libdigestmd5.") != std::string_view::npos ||
                        name.find("libscram.") != std::string_view::npos;
    return tested ? SASL_OK : SASL_CONTINUE;
  }

  std::unique_ptr<SaslLibrary> server_;
};

inline constexpr const char* kUser = "boss";
inline constexpr const char* kPassword = "Vx7#kq9!Zp3$";

struct SaslLogin {
  std::string user = kUser;
  std::string password = kPassword;
  std::string authorization_id{};
  // Of a security layer, and the longest of its frames that this side takes, in bytes.
  unsigned min_strength = 0;
  unsigned max_strength = 0;
  unsigned longest_frame = 65536;
};

// The client of one bind.
class SaslPeer {
 public:
  SaslPeer(std::string mechanism, SaslLogin login)
      : mechanism_(std::move(mechanism)), login_(std::move(login)) {
    secret_.resize(sizeof(sasl_secret_t) + login_.password.size());
    auto* const secret = reinterpret_cast<sasl_secret_t*>(secret_.data());
    secret->len = login_.password.size();
    std::copy(login_.password.begin(), login_.password.end(), secret->data);
    callbacks_ = {row(SASL_CB_USER, tell_authorization),
                  row(SASL_CB_AUTHNAME, tell_user),
                  row(SASL_CB_PASS, tell_password),
                  {SASL_CB_LIST_END, nullptr, nullptr}};
    EXPECT_EQ(sasl_client_new("ldap", "localhost", nullptr, nullptr, callbacks_.data(),
                              SASL_SUCCESS_DATA, &connection_),
              SASL_OK);
    sasl_security_properties_t wanted{};
    wanted.min_ssf = login_.min_strength;
    wanted.max_ssf = login_.max_strength;
    wanted.maxbufsize = login_.longest_frame;
    EXPECT_EQ(sasl_setprop(connection_, SASL_SEC_PROPS, &wanted), SASL_OK);
  }
  ~SaslPeer() { sasl_dispose(&connection_); }
  SaslPeer(const SaslPeer&) = delete;
  SaslPeer& operator=(const SaslPeer&) = delete;

  const std::string& mechanism() const noexcept { return mechanism_; }

  // The first credentials, if the mechanism has some.
  std::optional<std::string> begin() {
    const char* out = nullptr;
    unsigned length = 0;
    const char* chosen = nullptr;
    code_ = sasl_client_start(connection_, mechanism_.c_str(), nullptr, &out, &length, &chosen);
    EXPECT_TRUE(code_ == SASL_CONTINUE || code_ == SASL_OK) << sasl_errdetail(connection_);
    if (out == nullptr) return std::nullopt;
    return std::string(out, length);
  }

  // The next credentials; "" when the challenge cannot be answered, too.
  std::string answer(const std::string& challenge) {
    const char* out = nullptr;
    unsigned length = 0;
    code_ = sasl_client_step(connection_, challenge.data(), static_cast<unsigned>(challenge.size()),
                             nullptr, &out, &length);
    return out ? std::string(out, length) : std::string();
  }

  // Whether the server proved itself, too.
  bool done() const { return code_ == SASL_OK; }

  // Through the security layer of this side; nothing when it does not take the text.
  std::optional<std::string> encode(std::string_view clear) {
    return convert(sasl_encode, clear, 1000);
  }
  std::optional<std::string> decode(std::string_view wire) {
    return convert(sasl_decode, wire, 60000);
  }

 private:
  template <typename Function>
  std::optional<std::string> convert(Function function, std::string_view from, std::size_t most) {
    std::string to;
    for (std::size_t at = 0; at < from.size(); at += most) {
      const std::string_view piece = from.substr(at, most);
      const char* out = nullptr;
      unsigned length = 0;
      if (function(connection_, piece.data(), static_cast<unsigned>(piece.size()), &out, &length) !=
          SASL_OK)
        return std::nullopt;
      if (length > 0) to.append(out, length);
    }
    return to;
  }

  template <typename Function>
  sasl_callback_t row(unsigned long id, Function* function) {
    return {id, reinterpret_cast<int (*)()>(reinterpret_cast<void (*)()>(function)), this};
  }
  static int tell(const std::string& text, const char** out, unsigned* length) {
    *out = text.c_str();
    if (length) *length = static_cast<unsigned>(text.size());
    return SASL_OK;
  }
  static int tell_user(void* context, int, const char** out, unsigned* length) {
    return tell(static_cast<SaslPeer*>(context)->login_.user, out, length);
  }
  static int tell_authorization(void* context, int, const char** out, unsigned* length) {
    return tell(static_cast<SaslPeer*>(context)->login_.authorization_id, out, length);
  }
  static int tell_password(sasl_conn_t*, void* context, int, sasl_secret_t** secret) {
    *secret = reinterpret_cast<sasl_secret_t*>(static_cast<SaslPeer*>(context)->secret_.data());
    return SASL_OK;
  }

  const std::string mechanism_;
  const SaslLogin login_;
  std::vector<char> secret_;
  std::array<sasl_callback_t, 4> callbacks_{};
  sasl_conn_t* connection_ = nullptr;
  int code_ = SASL_CONTINUE;
};

}  // namespace orv::server
