// From answers to bytes: each function appends one LDAPMessage to `out`.
//
// False means that memory ran out; `out` is then unchanged. Nothing throws; thread-safe.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "protocol/message.h"
#include "slapi/control.h"
#include "slapi/entry.h"

namespace orv::server {

// Protocol tags of the answers (RFC 4511, appendix B).
namespace tag {
inline constexpr int bind_response = 0x61;
inline constexpr int search_entry = 0x64;
inline constexpr int search_done = 0x65;
inline constexpr int modify_response = 0x67;
inline constexpr int add_response = 0x69;
inline constexpr int delete_response = 0x6B;
inline constexpr int modify_dn_response = 0x6D;
inline constexpr int compare_response = 0x6F;
inline constexpr int extended_response = 0x78;
}  // namespace tag

// Which attributes of an entry a search asked for: "*" all user attributes, "+" all operational
// ones, "1.1" none, names by any spelling; an empty list is "*".
class AttributeSelection {
 public:
  // `names` is null-terminated or null. Throws nothing; false without memory.
  bool assign(char** names) noexcept;
  bool wants(const char* type) const noexcept;

 private:
  bool all_user_ = true;
  bool all_operational_ = false;
  std::vector<std::string> names_;  // canonical
};

struct ResultAnswer {
  std::int32_t message_id;
  int response_tag;
  int code;
  std::string_view matched_dn;
  std::string_view text;
  std::string_view response_name;                 // extended only, may be empty
  const std::string* response_value = nullptr;    // extended only
  const std::string* sasl_credentials = nullptr;  // bind only
  const std::vector<Control>* controls = nullptr;
};
bool encode_result(std::string& out, const ResultAnswer& answer) noexcept;

// One search entry with the selected attributes.
bool encode_entry(std::string& out, std::int32_t message_id, const entry& e,
                  const AttributeSelection& selection, bool types_only,
                  LDAPControl** controls) noexcept;

// The element of the operation in one whole message that was encoded here; "" when it is none.
std::string_view operation_in(std::string_view message) noexcept;

// The same message under another id, with `controls` (null: none) in place of its own.
bool encode_again(std::string& out, std::string_view message, std::int32_t message_id,
                  const std::vector<Control>* controls) noexcept;

// Notice of disconnection (RFC 4511, 4.4.1).
bool encode_notice_of_disconnection(std::string& out, int code, std::string_view text) noexcept;

}  // namespace orv::server
