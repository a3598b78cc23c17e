// LDAP messages (RFC 4511) after decoding: plain values, no BER left in them.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

namespace orv::server {

struct Control {
  std::string oid;
  bool critical = false;
  std::optional<std::string> value;
};

struct BindRequest {
  std::int32_t version = 0;
  std::string name;
  bool simple = true;
  std::string password;                    // simple; wiped by whoever consumed it
  std::string mechanism;                   // SASL
  std::optional<std::string> credentials;  // SASL
};

struct UnbindRequest {};

struct SearchRequest {
  std::string base;
  int scope = 0;  // 0 base, 1 one level, 2 subtree
  int deref = 0;
  std::int32_t size_limit = 0;  // 0: the server's
  std::int32_t time_limit = 0;  // seconds, 0: the server's
  bool types_only = false;
  // The filter rebuilt as RFC 4515 text: every ( ) * \ and NUL of a value escaped, well-formed
  // UTF-8 left as it is, other bytes as \XX.
  std::string filter;
  std::vector<std::string> attributes;  // empty: all user attributes
};

struct Attribute {
  std::string type;
  std::vector<std::string> values;
};

struct AddRequest {
  std::string dn;
  std::vector<Attribute> attributes;
};

struct DeleteRequest {
  std::string dn;
};

struct Modification {
  int operation = 0;  // 0 add, 1 delete, 2 replace; others are refused by the decoder
  Attribute attribute;
};

struct ModifyRequest {
  std::string dn;
  std::vector<Modification> modifications;
};

struct ModifyDnRequest {
  std::string dn;
  std::string new_rdn;
  bool delete_old_rdn = false;
  std::optional<std::string> new_superior;
};

struct CompareRequest {
  std::string dn;
};

struct AbandonRequest {
  std::int32_t message_id = 0;
};

struct ExtendedRequest {
  std::string oid;
  std::optional<std::string> value;
};

using Request =
    std::variant<BindRequest, UnbindRequest, SearchRequest, AddRequest, DeleteRequest,
                 ModifyRequest, ModifyDnRequest, CompareRequest, AbandonRequest, ExtendedRequest>;

struct Message {
  std::int32_t id = 0;
  Request request;
  std::vector<Control> controls;
};

}  // namespace orv::server
