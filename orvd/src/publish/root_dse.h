// The root DSE (RFC 4512, 5.1): what a client learns about the server before it asks for anything
// else. All its attributes but objectClass are operational: a search with "*" (or no selection)
// shows the object class only, "+" or their names show the rest.
//
// Threads: functions without state; the entry belongs to the caller.
#pragma once

#include <string>
#include <vector>

#include "slapi/owners.h"

namespace orv::server {

inline constexpr const char* kSubschemaDn = "cn=subschema";
inline constexpr const char* kSubschemaNormalDn = "CN=SUBSCHEMA";

struct ServerFacts {
  std::vector<std::string> naming_contexts;       // as they are to be shown
  std::vector<std::string> supported_extensions;  // OIDs of extended operations
  std::vector<std::string> supported_features;    // OIDs of RFC 3674, e.g. "+" of RFC 3673
  std::vector<std::string> sasl_mechanisms;       // empty: the attribute is absent
  std::string vendor_name;
  std::string vendor_version;
  std::vector<std::string> restart_settings{};  // that take effect when the server starts
  std::vector<std::string> controls_off{};      // OIDs of controls that are switched off
};

// Makes the entry; the supported controls are those registered so far, without those that are
// switched off. Null without memory.
EntryPtr make_root_dse(const ServerFacts& facts) noexcept;

}  // namespace orv::server
