// What connections and operations use of the server. Made once before the listeners open;
// everything in it outlives every connection and is thread-safe.
#pragma once

#include <asio/thread_pool.hpp>
#include <atomic>
#include <cstdint>
#include <ctime>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "auth/identities.h"
#include "auth/sasl.h"
#include "cut_off_log.h"
#include "logs.h"
#include "ops/backend_host.h"
#include "ops/consequences.h"
#include "ops/failed_changes.h"
#include "ops/fair_queue.h"
#include "ops/output_meter.h"
#include "ops/paged_results.h"
#include "ops/persistent_search.h"
#include "ops/search_cost.h"
#include "slapi/admin_policy.h"
#include "slapi/owners.h"
#include "slapi/schema.h"

namespace orv::server {

class AuditLog;
class TlsHolder;

// Proves who a client is.
class Authenticator {
 public:
  virtual ~Authenticator() = default;
  // The identity that name (any spelling) and password prove, or null. May take long and read
  // files.
  virtual std::shared_ptr<const Identity> authenticate(std::string_view name,
                                                       std::string_view password) = 0;

  // A number that changes whenever the identities were read anew. Cheap; must not block.
  virtual std::uint64_t generation() const noexcept { return 0; }

  // Whether what an identity proved when it bound still holds by the identities read last: it is
  // there, with the same flags, roles, entry and password. Must not read files.
  virtual bool still_valid(const Identity&) const noexcept { return true; }

  // Whether an entry (a normal form) defines somebody, by the identities read last; true when in
  // doubt. Must not read files.
  virtual bool may_define(std::string_view) const noexcept { return true; }
};

// What one connection is offered, as the root DSE tells it.
struct Offer {
  std::vector<std::string> sasl_mechanisms;
  bool start_tls = false;
  std::vector<std::string> controls_off{};  // known to the server, and switched off
};

// Entries of the server's own outside every backend; null without memory.
struct Publications {
  std::function<std::shared_ptr<const entry>(const Offer&)> root_dse;
  std::function<std::shared_ptr<const entry>()> subschema;
};

struct Services {
  const Schema& schema;
  BackendHost& backend;
  Authenticator& authenticator;
  Publications publications;
  Logs& logs;
  std::vector<std::string> supported_controls;
  // For what takes long: changes, which flush to disk, with long searches, and password checks,
  // which cost time by intention. Apart, because whoever holds the gate must not queue behind
  // strangers who try passwords.
  asio::thread_pool& changes;
  asio::thread_pool& verifiers;
  std::atomic<bool> stopping{false};  // running searches end
  // Told when the backend could not open its session (code 1). May be empty; returns at once.
  std::function<void()> note_failure{};
  OutputMeter output{};
  SearchCost search_cost{};
  // Told of what a change means for the server, inside the gate; `made`: it was reported as made. A
  // failed one may have changed the file all the same. Returns whether there was anything new. May
  // be empty; must not throw.
  std::function<bool(const Consequences&, bool made)> take_over{};
  // Takes the settings of the file over, outside the gate and on a worker. May be empty; must not
  // throw.
  std::function<void()> renew_settings{};
  // Reads the settings that the file has now, of whoever asks. May be empty.
  std::function<bool(Settings&)> read_settings{};
  // Reads the settings of the password policy that the file has now. Inside the gate. May be empty.
  std::function<bool(AdminPolicySettings&)> read_policy{};
  bool guards = true;  // the server's own, in front of the backend
  // How many changes this thread has made to the file, as the library counts them: a backend that
  // reports a change without having made one is not believed. Null: it always is.
  unsigned long (*changes_made)() = nullptr;
  FailedChangesByName failed_changes{};
  PersistentSearches persistent_searches{};
  KeptMeter kept_pages{};
  AuditLog* audit = nullptr;                   // null: changes are not recorded
  const SaslMechanisms* mechanisms = nullptr;  // null: none
  // For binds over Unix sockets, in the place of `verifiers`, so that no stranger keeps out who
  // administers the server on its own host. Null: there is none.
  asio::thread_pool* local_verifiers = nullptr;
  TlsHolder* tls = nullptr;                      // null: TLS is not offered
  std::atomic<std::int64_t> unauthenticated{0};  // TCP, nobody bound
  CutOffLog cut_offs{logs};
  FairQueue binds{verifiers};
  // Seconds of the epoch, for what ends at a date.
  std::function<std::time_t()> wall_time = [] { return std::time(nullptr); };
};

}  // namespace orv::server
