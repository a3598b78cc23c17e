// The whole protocol engine with the real backend behind it: a few connections that send messages,
// valid and damaged, in any order and without waiting, while they come and go, do not read, or give
// up what they asked for, the file is damaged and mended, and the gate is held. No sockets.
//
// An input is a list of steps. Unless it asks for races, everything comes to rest between them, and
// the same input does the same each time.
#include <array>
#include <cstdint>
#include <memory>
#include <vector>

#include "engine/choices.h"
#include "engine/client.h"
#include "engine/messages.h"
#include "engine/world.h"

namespace {

using namespace orv::fuzz;
using orv::server::Clock;

constexpr int kMostSteps = 48;
constexpr int kMostRounds = 10000;

class Holder final : public orv::server::GateWaiter {
  void gate_decided(orv::server::Verdict) noexcept override {}
};

class Play {
 public:
  Play(const std::uint8_t* data, std::size_t size) : choices_(data, size) {}

  void run() {
    racing_ = choices_.rarely(4);
    for (auto& client : clients_) client = connect();
    for (int step = 0; step < kMostSteps && choices_.left(); ++step) {
      take_step();
      if (!racing_) come_to_rest();
    }
    finish();
  }

 private:
  std::shared_ptr<FuzzedClient> connect() {
    orv::server::TransportFacts facts;
    facts.loopback = true;
    switch (choices_.below(4)) {
      case 1:
        facts.local = true;
        facts.peer_uid = 0;
        break;
      case 2:
        facts.tls_version = "TLSv1.3";
        break;
      case 3:
        facts.loopback = false;
        break;
      default:
        break;
    }
    return std::make_shared<FuzzedClient>(round_, ++connections_, facts);
  }

  void take_step() {
    std::shared_ptr<FuzzedClient>& client = clients_[choices_.below(clients_.size())];
    switch (choices_.below(24)) {
      case 0:
        client->stop_reading();
        break;
      case 1:
        client->go_on_reading();
        break;
      case 2:
        client->leave();
        keep(std::exchange(client, connect()));
        break;
      case 3:
        hold_gate();
        break;
      case 4:
        release_gate();
        break;
      case 5:
        round_.gate().expire(Clock::time_point::max());
        break;
      case 6:
        round_.damage_file();
        break;
      case 7:
        round_.mend_file();
        break;
      case 8:
        client->run_one();
        break;
      case 9:
        client->look_after();
        break;
      case 10:
        come_to_rest();
        break;
      default:
        send(client);
    }
  }

  // One message or several at once.
  void send(std::shared_ptr<FuzzedClient>& client) {
    if (!client->open()) keep(std::exchange(client, connect()));
    std::string bytes;
    do {
      const bool again = choices_.rarely(8);
      const std::int32_t id =
          again ? static_cast<std::int32_t>(choices_.below(8)) : client->next_id();
      // Mostly the own cookie, sometimes another connection's.
      const auto& asked = choices_.rarely(8) ? clients_[choices_.below(clients_.size())] : client;
      bytes += make_message(choices_, id, asked->cookie());
    } while (choices_.rarely(4));
    client->receive(bytes);
  }

  // What a connection that has ended has outstanding goes on without it.
  void keep(std::shared_ptr<FuzzedClient> gone) {
    if (!gone->settled_already()) gone_.push_back(std::move(gone));
  }

  void hold_gate() {
    if (holding_) return;
    const auto holder = std::make_shared<Holder>();
    const auto entry = round_.gate().enter(holder, Clock::time_point::max());
    // Somebody was inside; he may have left by now, and then it is the holder's turn.
    holding_ = entry == orv::server::Gate::Entry::inside || !round_.gate().withdraw(*holder);
  }
  void release_gate() {
    if (std::exchange(holding_, false)) round_.gate().leave();
  }

  bool run_posted() {
    bool any = false;
    for (auto& client : clients_)
      while (client->run_one()) any = true;
    for (auto& client : gone_)
      while (client->run_one()) any = true;
    return any;
  }

  void come_to_rest() {
    int quiet = 0;
    for (int rounds = 0; quiet < 2; ++rounds) {
      require(rounds < kMostRounds, "everything comes to rest");
      round_.wait_for_workers();
      quiet = run_posted() ? 0 : quiet + 1;
    }
    std::erase_if(gone_, [](const auto& client) { return client->settled_already(); });
  }

  void finish() {
    release_gate();
    for (auto& client : clients_) client->go_on_reading();
    come_to_rest();
    for (auto& client : clients_) client->look_after();
    come_to_rest();
    for (auto& client : clients_) client->check_answers();
    for (auto& client : clients_) client->leave();
    come_to_rest();
    for (auto& client : clients_) require(client->settled_already(), "every connection settles");
    require(gone_.empty(), "every connection that was left settles");
    clients_ = {};
    round_.check_rest();
  }

  Choices choices_;
  Round round_;
  std::uint64_t connections_ = 0;
  std::array<std::shared_ptr<FuzzedClient>, 3> clients_;
  std::vector<std::shared_ptr<FuzzedClient>> gone_;
  bool racing_ = false;
  bool holding_ = false;
};

}  // namespace

// The backend keeps some memory by intention; the tests under the address sanitizer look for leaks.
extern "C" const char* __asan_default_options() {
  return "detect_leaks=0";
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  Play(data, size).run();
  return 0;
}
