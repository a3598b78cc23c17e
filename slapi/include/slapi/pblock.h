// The parameter block: how the server hands arguments to a plug-in's handlers and how a plug-in
// hands its handlers to the server. Parameters are known by number.
//
// Threads: a block belongs to one thread at a time, except the global block, whose values are set
// before the listeners open and only read afterwards.
#pragma once

#include <cstddef>

#include "slapi/connection.h"

namespace orv {

// A handler returns the LDAP result code of the operation, which it has also sent.
using Handler = int (*)(pblock*);
// The instance start function takes the backend's record instead of a block.
using InstanceStart = int (*)(Backend*);

namespace parameter {
// arguments of handlers                     value
inline constexpr int target_dn = 50;            // const char*, normalised
inline constexpr int add_entry = 60;            // entry*
inline constexpr int modifications = 90;        // ldapmod*, or null
inline constexpr int search_scope = 110;        // int
inline constexpr int search_filter = 114;       // void*, the parsed filter
inline constexpr int search_filter_text = 115;  // const char*, RFC 4515
inline constexpr int search_attributes = 116;   // char**, or null for all
inline constexpr int search_types_only = 117;   // int
inline constexpr int backend = 130;             // Backend*
inline constexpr int connection = 131;          // Connection*
inline constexpr int operation = 132;           // Operation*
// handlers that a backend stores
inline constexpr int bind_function = 200;
inline constexpr int unbind_function = 201;
inline constexpr int search_function = 202;
inline constexpr int compare_function = 203;
inline constexpr int modify_function = 204;
inline constexpr int modify_rdn_function = 205;
inline constexpr int add_function = 206;
inline constexpr int delete_function = 207;
inline constexpr int abandon_function = 208;
inline constexpr int configuration_function = 209;
inline constexpr int close_function = 210;
inline constexpr int server_function_15 = -15;
inline constexpr int server_function_16 = -16;
inline constexpr int instance_start_function = -19;  // InstanceStart
// server services
inline constexpr int persistent_search_switch = -141;   // int, 1 active; global block
inline constexpr int search_response_control = -145;    // LDAPControl*, or null
inline constexpr int persistent_search_monitor = -146;  // PSearchMonitor*, or null; global block
inline constexpr int entry_before_delete = -157;        // entry*, for persistent searches
}  // namespace parameter

// Makes an empty block; null without memory. Releases one (not what its values point to).
pblock* slapi_pblock_new();
void slapi_pblock_destroy(pblock* pb);

// Copies the value of a parameter into `*value`, a pointer or an int as listed above.
// 0; -1 for a null argument, an unknown number, and for the parameters 50, 60, 130, 131 and 132
// when they are unset: null never comes with 0 there. Other unset parameters give 0 and null or 0.
// `*value` is left alone on failure.
int slapi_pblock_get(pblock* pb, int number, void* value);

// The server's cached form: the same answers.
int slapi_pblock_iget(pblock* pb, int number, void* value);

// Stores a parameter; takes no ownership. 0; -1 for a null block, an unknown number or a value of
// the wrong kind for it.
int slapi_pblock_set(pblock* pb, int number, void* value);
int slapi_pblock_set(pblock* pb, int number, const void* value);
int slapi_pblock_set(pblock* pb, int number, int value);
int slapi_pblock_set(pblock* pb, int number, Handler value);
int slapi_pblock_set(pblock* pb, int number, InstanceStart value);
int slapi_pblock_set(pblock* pb, int number, std::nullptr_t value);

// The handler stored under a number, or null. For the server that calls it.
Handler slapi_pblock_handler(const pblock* pb, int number);
InstanceStart slapi_pblock_instance_start(const pblock* pb);

// The server's global block. Never null.
pblock* getGlobalPBlock();

}  // namespace orv
