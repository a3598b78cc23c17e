// What Cyrus SASL asks during an exchange: who a name is, and what the password is.
//
// Threads: of the exchange.
#pragma once

#include <sasl/sasl.h>
#include <sasl/saslplug.h>

#include <array>
#include <string_view>

namespace orv::server {

// A row of the library's tables, which keep functions of every type as one.
template <typename Function>
sasl_callback_t sasl_callback_of(unsigned long id, Function* function, void* context) noexcept {
  return {id, reinterpret_cast<int (*)()>(reinterpret_cast<void (*)()>(function)), context};
}

// One exchange, as the library's callbacks see it. The results are codes of the library.
class SaslClaimant {
 public:
  virtual ~SaslClaimant() = default;
  // The name that the client proves, as it sent it.
  virtual int claim_name(std::string_view name) noexcept = 0;
  // As whom it wants to act, if it says so.
  virtual int claim_authorization(std::string_view authorization_id) noexcept = 0;
  // Of the name that was claimed: NUL-terminated, not empty.
  virtual const char* password() const noexcept = 0;
};

using SaslCallbacks = std::array<sasl_callback_t, 3>;

// The callbacks of a connection of the library, which refers to them as long as it lives.
SaslCallbacks callbacks_of(SaslClaimant& claimant) noexcept;

// The source of passwords, which asks the claimant: its name and how the library starts it.
inline constexpr const char* kPasswordSource = "orvd";
inline constexpr const char* kPasswordProperty = SASL_AUX_PASSWORD;
int init_password_source(const sasl_utils_t* utils, int max_version, int* version,
                         sasl_auxprop_plug_t** plugin, const char* name);

}  // namespace orv::server
