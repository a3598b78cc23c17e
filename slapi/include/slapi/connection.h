// The server's records of a backend, a client connection and an operation, as plug-ins see them.
//
// The server makes and owns all three; a plug-in reads what is described here and fills only the
// session slot of the connection and the master-server result of the operation.
//
// Threads: a connection's operations run one at a time inside the backend. `Connection::state` and
// the flags of its auxiliary record are written by the thread that notices that the client left,
// hence atomic (relaxed).
#pragma once

#include <atomic>
#include <cstdint>

#include "cfg/session.h"
#include "slapi/control.h"
#include "slapi/entry.h"

namespace orv {

struct pblock;
struct Connection;
struct Operation;

// Authority flags: what the server grants to a bound identity. Exactly one of these values ever
// reaches a handler.
namespace authority {
inline constexpr unsigned supplier_of_server = 0x01;  // master server identity, whole server
inline constexpr unsigned supplier_of_suffix = 0x02;  // master server identity, one suffix
inline constexpr unsigned administrator = 0x04;       // with one of the next two
inline constexpr unsigned primary = 0x08;
inline constexpr unsigned group_member = 0x10;
inline constexpr unsigned restricted = 0x20;

inline constexpr unsigned primary_administrator = administrator | primary;       // 0x0C
inline constexpr unsigned admin_group_member = administrator | group_member;     // 0x14
inline constexpr unsigned no_configuration_access = administrator | restricted;  // 0x24
}  // namespace authority

// Role bits of administrative group members; 0 for everybody else.
namespace role {
inline constexpr unsigned audit = 0x02;          // AuditAdmin
inline constexpr unsigned replication = 0x0C;    // ReplicationAdmin: 0x04 and 0x08
inline constexpr unsigned schema = 0x10;         // SchemaAdmin
inline constexpr unsigned server_config = 0x20;  // ServerConfigGroupMember
inline constexpr unsigned any_configuration = 0x3E;
}  // namespace role

// A backend instance. `private_data` is the plug-in's own: at instance start it holds a
// `BackendStartup`, afterwards whatever the plug-in's start function put there.
struct Backend {
  void* private_data = nullptr;
  const char* const* suffixes = nullptr;  // normalised naming contexts, null-terminated
  pblock* handlers = nullptr;             // where the plug-in stored its functions
};

// What the server hands to a backend at instance start through `Backend::private_data`: one malloc
// block that the backend releases with free; both texts stay the server's and live as long as it.
struct BackendStartup {
  const char* config_file;     // path of the configuration file
  const char* key_stash_file;  // or null
};

// State of the client that the connection's owner notes beside the connection.
struct ConnectionAux {
  std::atomic<unsigned char> client_gone{0};              // stay silent, nobody listens
  std::atomic<unsigned char> attach_response_control{0};  // entries carry the response control
};

// The send operations of a connection. They never block: they append to the operation's own buffer,
// accept calls on a dead or abandoned connection (and drop them), and never keep an argument.

// Sends one search entry with the requested attributes (null: all; with types_only, names without
// values). 0, or the code that ends the search: 4 past the entry limit, 3 past the deadline, 11
// past the answer's budget, 80 abandoned or gone.
using SendSearchEntry = int (*)(Backend* backend, Connection* connection, Operation* operation,
                                entry* e, char** attributes, int types_only, void* reserved1,
                                void* reserved2, void* reserved3, LDAPControl** controls);
// Sends the final result of a search that may have sent `entries` entries. Texts may be null.
using SendSearchResult = int (*)(Connection* connection, Operation* operation, int code,
                                 const char* matched_dn, const char* text, int entries);
// Sends the result of any operation. Texts may be null.
using SendResult = int (*)(Connection* connection, Operation* operation, int code,
                           const char* matched_dn, const char* text);

struct Connection {
  std::atomic<std::uint16_t> state{1};  // 1 open, 0 gone
  ConnectionAux* aux = nullptr;         // or null
  _CFG* config_session = nullptr;       // the configuration backend's session slot
  unsigned authority = authority::no_configuration_access;  // copy of the operation's
  unsigned roles = 0;                                       // copy of the operation's
  SendSearchEntry send_search_entry = nullptr;
  SendSearchResult send_search_result = nullptr;
  SendResult send_result = nullptr;
  void* server = nullptr;  // the server's own record of the client
};

struct Operation {
  unsigned authority = authority::no_configuration_access;
  unsigned roles = 0;
  const char* bound_dn = "";     // normalised; "" for the anonymous
  int server_kind_marker = 0;    // 1: may search on a server of kind 3
  int master_server_result = 0;  // last answer of checkMasterSrvDn
  pblock* parameters = nullptr;  // the operation's own parameter block
  void* server = nullptr;        // the server's own record of the operation
};

// Sends a plain result through the connection's send operation and returns what that returned; 80,
// without sending, when the connection is null.
int send_ldap_result(Connection* connection, Operation* operation, int code, const char* matched_dn,
                     const char* text);

}  // namespace orv
