// What the sessions under test stand on: the real backend on a file of its own, identities of that
// file, logs, and one worker of each kind.
//
// The backend and its file are there once in a process, because a plug-in is started once; `Round`
// is what one input gets, and brings the file back to what it was.
#pragma once

#include <asio/thread_pool.hpp>
#include <memory>
#include <string>
#include <string_view>

#include "audit/log.h"
#include "auth/identities.h"
#include "auth/sasl_external.h"
#include "ops/backend_host.h"
#include "ops/services.h"
#include "settings.h"

namespace orv::fuzz {

inline constexpr const char* kRoot = "cn=root";
inline constexpr const char* kMember = "cn=member";
inline constexpr const char* kSupplier = "cn=supplier";
inline constexpr const char* kSecret = "abcd1234!?xyz";

// Ends the process, with a line that says what does not hold.
void require(bool holds, const char* what);

class Round {
 public:
  Round();
  ~Round();

  server::Services& services() { return services_; }
  server::AccessLane& lane() { return lane_; }
  const server::Settings& settings() const { return settings_; }
  server::Gate& gate() { return host_.gate(); }

  // What somebody does to the file by hand.
  void damage_file();
  void mend_file();

  // Returns when the workers and the audit log have done all that they were given so far.
  void wait_for_workers();

  // That nothing is left of all connections, which have ended.
  void check_rest();

 private:
  class Identities;

  server::Settings settings_;
  server::BackendHost host_;
  std::unique_ptr<Identities> identities_;
  server::SaslMechanisms mechanisms_;
  asio::thread_pool changes_{1};
  asio::thread_pool verifiers_{1};
  server::Services services_;
  server::AccessLane lane_;
};

}  // namespace orv::fuzz
