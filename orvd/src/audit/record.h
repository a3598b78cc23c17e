// A change as a record of the audit log: LDIF (RFC 2849) that says in comments who attempted it,
// when, from where and with what result, and below them what was to be changed.
//
//   # time: 2026-01-31T12:00:00.123456Z
//   # bind-dn: CN=ROOT
//   # client: 127.0.0.1:40112
//   # connection: 7
//   # message-id: 2
//   # operation: delete
//   # result: 0
//   dn: cn=alice,cn=admingroup,cn=configuration
//   changetype: delete
//
// Passwords are never in it: values of secret types, under whatever name the client gave them and
// also where they stand in DNs, are replaced by asterisks; so are the values of types that the
// schema does not know, since a mistyped name does not make a password less secret.
//
// Threads: functions without state. They throw std::bad_alloc.
#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>

#include "protocol/message.h"
#include "slapi/schema.h"

namespace orv::server {

// What is kept of a request at most: all of it, or so much that somebody who has no rights here
// cannot fill a disk quickly.
enum class AuditDetail { whole, brief };
inline constexpr std::size_t kBriefBytes = 4096;

// The lines from "dn:" on, as the client sent the request. A name that is no DN becomes the empty
// one, with a comment.
std::string describe_change(const Schema& schema, const AddRequest& request, AuditDetail detail);
std::string describe_change(const Schema& schema, const DeleteRequest& request, AuditDetail detail);
std::string describe_change(const Schema& schema, const ModifyRequest& request, AuditDetail detail);
std::string describe_change(const Schema& schema, const ModifyDnRequest& request,
                            AuditDetail detail);

struct AuditFacts {
  std::chrono::system_clock::time_point time;  // of the result
  std::string_view bound_dn;                   // "" for the anonymous
  std::string_view client;                     // address and port
  std::uint64_t connection = 0;
  std::int32_t message_id = 0;
  std::string_view operation;
  int code = 0;  // kNotPerformed: nobody waited for it any more, and it was not performed
};
inline constexpr int kNotPerformed = -1;

// The whole record with the blank line that ends it.
std::string audit_record(const AuditFacts& facts, std::string_view change);

}  // namespace orv::server
