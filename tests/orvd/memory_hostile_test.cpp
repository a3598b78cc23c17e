// Every allocation of longer exchanges fails once: binds in several steps, persistent searches and
// their notices, controls, abandons, StartTLS, and searches of the real configuration. A client is
// answered or its connection ends, and the gate, the counters and the next client are as before.
#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "../slapi/failing_allocation.h"
#include "core_bare_session.h"
#include "ops/persistent_search.h"

namespace orv::server::test {
namespace {

using orv::test::AllocationFault;

std::string persistent_search(int id, bool changes_only) {
  const std::string only = changes_only ? "\xFF" : std::string(1, '\0');
  const std::string wishes = tlv(0x30, integer(15) + tlv(0x01, only) + tlv(0x01, "\xFF"));
  const std::string control =
      tlv(0x30, tlv(0x04, kPersistentSearchOid) + tlv(0x01, "\xFF") + tlv(0x04, wishes));
  return message(id, search(id, kTop, 2).substr(5), control);
}

// Asks twice and then believes what it hears.
class Steps final : public SaslMechanism {
 public:
  std::string_view name() const noexcept override { return "STEPS"; }
  bool offered(const TransportFacts&) const override { return true; }
  std::unique_ptr<SaslExchange> start(const TransportFacts&) const override {
    class Exchange final : public SaslExchange {
      SaslOutcome step(std::optional<std::string_view>) override {
        SaslOutcome outcome;
        outcome.reply = "a challenge that is not short at all";
        outcome.state = ++steps_ < 3 ? SaslOutcome::State::go_on : SaslOutcome::State::done;
        if (steps_ == 3)
          outcome.identity = std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, ""});
        return outcome;
      }
      int steps_ = 0;
    };
    return std::make_unique<Exchange>();
  }
};

struct Exchange {
  const char* name;
  std::vector<std::string> requests;
};

std::ostream& operator<<(std::ostream& out, const Exchange& exchange) {
  return out << exchange.name;
}

class MemoryOfAnExchange : public BareSessionTest, public testing::WithParamInterface<Exchange> {
 protected:
  MemoryOfAnExchange() {
    services.supported_controls = {kPersistentSearchOid, kEntryChangeOid, kManageDsaIt};
    mechanisms_.push_back(std::make_unique<Steps>());
    services.mechanisms = &mechanisms_;
    // Made beforehand: handlers do not throw.
    backend.on_search = [this](pblock* parameters) {
      const int code = send_test_entry(parameters, *found_);
      return finish_search(parameters, code, code == 0 ? 1 : 0);
    };
    backend.on_change = [](pblock* parameters) { return finish_change(parameters, 0); };
  }

  // As a connection does: no request is handled while one has to wait, and want of memory ends it.
  void play(BareSession& client) {
    for (const std::string& request : GetParam().requests) {
      if (client.ended) return;
      try {
        client.handle(request);
      } catch (const std::bad_alloc&) {
        client.ended = true;
      }
      client.run_until([&] { return client.ended || client.idle(); });
    }
  }

  bool searches_are_gone() {
    PersistentSearch one({}, 1, {}, {}, "", "");
    const bool alone = services.persistent_searches.count(one, 1);
    services.persistent_searches.leave(one);
    return alone;
  }

  const EntryPtr found_ = make_test_entry("CN=X,CN=CONFIGURATION");
  SaslMechanisms mechanisms_;
};

TEST_P(MemoryOfAnExchange, LeavesNothingBehindWhenItFails) {
  for (long n = 1;; ++n) {
    SCOPED_TRACE("allocation " + std::to_string(n));
    auto client = std::make_shared<BareSession>(services, lane, settings);
    session = client;
    bind_as_root();
    AllocationFault fault(n);
    play(*client);
    fault.disarm();
    const bool hit = fault.hit();
    client->output_is(0);
    client->client_left();
    EXPECT_TRUE(client->run_until([&] { return client->idle(); }));
    client->run_posted();
    EXPECT_TRUE(is_open(host.gate()));
    EXPECT_TRUE(searches_are_gone());
    EXPECT_EQ(services.output.room(), OutputMeter::kDefaultCeiling);
    session.reset();
    const std::weak_ptr<BareSession> left = client;
    client.reset();
    // A worker that has handed back what it did may still be about to let go.
    const auto end = Clock::now() + std::chrono::seconds(10);
    while (!left.expired() && Clock::now() < end) std::this_thread::yield();
    EXPECT_TRUE(left.expired()) << "something holds the connection for ever";
    EXPECT_EQ(services.unauthenticated.load(), 0);
    if (!hit || HasFailure()) break;
  }
}

std::vector<Exchange> exchanges() {
  const std::string long_name = "cn=a name that is not short,cn=configuration";
  return {
      {"bind in steps",
       {sasl_bind(2, "STEPS", "an initial response that is not short"),
        sasl_bind(3, "STEPS", "a response that is not short"), sasl_bind(4, "steps", "the last")}},
      {"bind in steps that another request ends",
       {sasl_bind(2, "STEPS", "an initial response that is not short"), search(3, kTop)}},
      {"persistent search of changes",
       {persistent_search(2, true), add_entry(3, long_name, "cn", "a value that is not short"),
        delete_entry(4, long_name), modify(5, kTop, "description", "x"), abandon(6, 2)}},
      {"persistent search of everything",
       {persistent_search(2, false), modify(3, kTop, "description", "x"), bind(4, "", "")}},
      {"controls",
       {message(2, search(2, kTop).substr(5),
                control(kManageDsaIt, true) + control("1.2.3.4.5.6.7.8.9.10.11.12", false)),
        message(3, search(3, kTop).substr(5), control("1.2.3.4.5.6.7.8.9.10.11.12", true))}},
      {"abandon", {search(2, kTop, 2), abandon(3, 2), abandon(4, 4), search(5, kTop)}},
      {"StartTLS", {extended(2, kStartTlsOid), extended(3, kStartTlsOid)}},
      {"failed binds",
       {bind(2, kRoot, "wrong"), bind(3, kRoot, ""), bind(4, "no DN,,", "x"), bind(5, kTop, "x"),
        sasl_bind(6, "NONE")}},
      {"rename",
       {message(2, tlv(0x6C, tlv(0x04, long_name) + tlv(0x04, "cn=x") +
                                 tlv(0x01, std::string(1, '\xFF'))))}},
      {"message id in use", {persistent_search(2, true), search(2, kTop)}},
  };
}

INSTANTIATE_TEST_SUITE_P(Each, MemoryOfAnExchange, testing::ValuesIn(exchanges()));

}  // namespace
}  // namespace orv::server::test
