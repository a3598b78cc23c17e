// What connections and operations use of the server. Made once before the listeners open;
// everything in it outlives every connection and is thread-safe.
#pragma once

#include <asio/thread_pool.hpp>
#include <atomic>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "auth/identities.h"
#include "logs.h"
#include "ops/backend_host.h"
#include "slapi/owners.h"
#include "slapi/schema.h"

namespace orv::server {

// Proves who a client is.
class Authenticator {
 public:
  virtual ~Authenticator() = default;
  // The identity that name (any spelling) and password prove, or null. May take long and read
  // files.
  virtual std::shared_ptr<const Identity> authenticate(std::string_view name,
                                                       std::string_view password) = 0;
};

// Entries of the server's own outside every backend; null without memory.
struct Publications {
  std::function<EntryPtr()> root_dse;
  std::function<EntryPtr()> subschema;
};

struct Services {
  const Schema& schema;
  BackendHost& backend;
  Authenticator& authenticator;
  Publications publications;
  Logs& logs;
  std::vector<std::string> supported_controls;
  // For what waits: changes, which flush to disk, and password checks, which cost time by
  // intention. Apart, because whoever holds the gate must not queue behind strangers who try
  // passwords.
  asio::thread_pool& changes;
  asio::thread_pool& verifiers;
  std::atomic<bool> stopping{false};  // running searches end
};

}  // namespace orv::server
