// Allocations of a whole server fail while a client has a session with it: sockets, TLS, SASL with
// the real library, and what is around them on all threads. The process lives on, each request is
// answered or the connection ends, nobody is left waiting, and the next client is served.
//
// There are too many allocations to let each of them fail: a sample of them does, the same in each
// run. ORV_FAILING_ALLOCATIONS is how many of each session (0: all), ORV_SEED draws another sample.
#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <limits>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "../slapi/failing_allocation.h"
#include "auth/sasl_cyrus.h"
#include "auth/sasl_memory.h"
#include "core_server_fixture.h"
#include "core_tls_client.h"
#include "net/tls.h"
#include "protocol/control_values.h"
#include "sasl_peer.h"

namespace orv::server::test {
namespace {

constexpr long kSeed = 1;

using namespace std::chrono_literals;
using orv::test::AllocationFault;
using orv::test::AllocationFaultElsewhere;

constexpr auto kPatience = 9s;  // less than what the client waits for bytes
constexpr const char* kBox = "cn=box,cn=configuration";

long number_from_environment(const char* name, long otherwise) {
  const char* const text = std::getenv(name);
  return text ? std::strtol(text, nullptr, 10) : otherwise;
}

class Boss final : public SaslIdentities {
 public:
  std::shared_ptr<const Identity> of_user(std::string_view name, std::string& password) override {
    if (name != kUser) return nullptr;
    password = kSecret;
    auto identity = std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, ""});
    identity->user_name = name;
    return identity;
  }
  std::shared_ptr<const Identity> of_principal(std::string_view) override { return nullptr; }
  bool settle(const Identity&, bool proved) noexcept override { return proved; }
  bool has_users() const noexcept override { return true; }
  bool has_principals() const noexcept override { return false; }
};

SaslLogin login(unsigned strength = 0) {
  return {.password = kSecret, .min_strength = strength, .max_strength = strength};
}

// A client with TLS, and with a security layer once it is given one.
class SaslClient final : public TlsClient {
 public:
  explicit SaslClient(std::uint16_t port) : TlsClient(port) {}

  void put_layer(SaslPeer& peer) { layer_ = &peer; }
  void send(std::string_view bytes) override {
    TlsClient::send(layer_ ? layer_->encode(bytes).value_or("") : std::string(bytes));
  }

 protected:
  bool fill() override {
    if (!layer_) return TlsClient::fill();
    const std::string before = std::exchange(received_, {});
    const bool more = TlsClient::fill();
    received_ = before + (more ? layer_->decode(received_).value_or("") : "");
    return more;
  }

 private:
  SaslPeer* layer_ = nullptr;
};

// What a client does, step by step, until the server ends the connection.
class Conversation {
 public:
  explicit Conversation(std::uint16_t port) : client_(port) {}

  // The result code, or -1 when the server has ended the connection.
  int ask(const std::string& request, int id) { return reply_to(request, id).code; }

  Reply reply_to(const std::string& request, int id) {
    if (over_) return {};
    const auto begun = Clock::now();
    client_.send(request);
    const std::vector<Reply> replies = client_.receive_result();
    EXPECT_LT(Clock::now() - begun, kPatience) << "left waiting for an answer to request " << id;
    over_ = replies.empty() || replies.back().id == 0 || replies.back().code < 0;
    if (over_) return {};
    EXPECT_EQ(replies.back().id, id);
    return replies.back();
  }

  bool start_tls(int id) {
    if (ask(extended(id, kStartTlsOid), id) != 0) return false;
    return shake_hands();
  }
  bool shake_hands() {
    const auto begun = Clock::now();
    const bool done = client_.shake_hands();
    EXPECT_LT(Clock::now() - begun, kPatience) << "left waiting in a handshake";
    over_ = over_ || !done;
    return done;
  }

  // As SASL does it, until the server says how it ends.
  int bind(SaslPeer& peer, int& id, bool with_layer) {
    std::optional<std::string> credentials = peer.begin();
    for (;;) {
      const Reply reply = reply_to(sasl_bind(id, peer.mechanism(), credentials), id);
      ++id;
      const std::string challenge = challenge_in(reply);
      if (reply.code == 0 && !challenge.empty()) peer.answer(challenge);
      if (reply.code == 0 && with_layer) client_.put_layer(peer);
      if (reply.code != 14) return reply.code;
      credentials = peer.answer(challenge);
    }
  }

  void leave(int id) {
    if (!over_) client_.send(unbind(id));
    client_.close();
  }
  bool over() const { return over_; }

 private:
  // serverSaslCreds, the last element of a bind's answer; all elements are short.
  static std::string challenge_in(const Reply& reply) {
    std::size_t at = 0;
    while (at + 2 <= reply.body.size()) {
      std::size_t length = static_cast<unsigned char>(reply.body[at + 1]);
      std::size_t head = 2;
      if (length == 0x81) {
        length = static_cast<unsigned char>(reply.body.at(at + 2));
        head = 3;
      }
      if (reply.body[at] == '\x87') return reply.body.substr(at + head, length);
      at += head + length;
    }
    return "";
  }

  SaslClient client_;
  bool over_ = false;
};

// What was answered to each request, as far as it came.
using Codes = std::vector<int>;

class MemoryOfAServer : public LoopbackServer {
 protected:
  static void SetUpTestSuite() {
    LoopbackServer::SetUpTestSuite();
    tested = std::make_unique<TestedSasl>();
  }
  static void TearDownTestSuite() { tested.reset(); }

  MemoryOfAServer() : sasl(tested->server(), boss, [](std::string_view) {}) {
    const Pair own = certificates.self_signed("localhost");
    settings.tls.certificate_file = own.certificate;
    settings.tls.key_file = own.key;
    settings.access_log = certificates.path("access.log");
    settings.access_log_level = "info";
    settings.error_log = certificates.path("error.log");
    settings.error_log_level = "error";
    more.secure_port = 0;
    sasl.add_mechanisms(mechanisms);
    backend.on_search = [this](pblock* parameters) {
      const int code = send_test_entry(parameters, *found_);
      return finish_search(parameters, code, code == 0 ? 1 : 0);
    };
    backend.on_change = [](pblock* parameters) { return finish_change(parameters, 0); };
  }
  // What the mechanisms refer to goes with this class.
  ~MemoryOfAServer() override { stop(); }

  static void work(Conversation& talk, int& id, Codes& codes) {
    const auto ask = [&](std::string (*make)(int)) {
      codes.push_back(talk.ask(make(id), id));
      ++id;
    };
    ask([](int n) { return search(n, kTop, 2); });
    ask([](int n) { return add_entry(n, kBox, "cn", "box"); });
    ask([](int n) { return modify(n, kBox, "description", "a value that is not short at all"); });
    ask([](int n) { return delete_entry(n, kBox); });
    ask([](int n) { return extended(n, kWhoAmIOid); });
  }

  Codes over_tls(bool from_the_start) {
    Codes codes;
    int id = 1;
    Conversation talk(from_the_start ? server->secure_port() : port());
    if (from_the_start ? talk.shake_hands() : talk.start_tls(id++)) {
      codes.push_back(talk.ask(bind(id, kRoot, kSecret), id));
      ++id;
      work(talk, id, codes);
      SaslPeer peer("DIGEST-MD5", login());  // SCRAM hashes so often that nothing else would fail
      codes.push_back(talk.bind(peer, id, false));
      codes.push_back(talk.ask(search(id, kTop), id));
      ++id;
    }
    talk.leave(id);
    return codes;
  }
  Codes with_a_layer() {
    Codes codes;
    int id = 1;
    Conversation talk(port());
    SaslPeer peer("DIGEST-MD5", login(1));
    codes.push_back(talk.bind(peer, id, true));
    if (codes.back() == 0) work(talk, id, codes);
    talk.leave(id);
    return codes;
  }

  void expect_the_next_client_is_served() {
    Conversation talk(port());
    EXPECT_EQ(talk.ask(bind(1, kRoot, kSecret), 1), 0);
    EXPECT_EQ(talk.ask(search(2, kTop), 2), 0);
    talk.leave(3);
  }
  bool everybody_has_gone() {
    const auto end = Clock::now() + 10s;
    while (server->connections() > 0 && Clock::now() < end) std::this_thread::yield();
    return server->connections() == 0;
  }

  void fail_in(const std::function<Codes()>& session) {
    start();
    const Codes undisturbed = session();  // what is made at the first use only
    for (const int code : undisturbed) ASSERT_EQ(code, 0) << "it works when there is memory";
    AllocationFaultElsewhere none(0);
    ASSERT_EQ(session(), undisturbed);
    ASSERT_TRUE(everybody_has_gone());
    none.disarm();
    const long in_all = none.allocations();
    ASSERT_GT(in_all, 100);

    const long seed = number_from_environment("ORV_SEED", kSeed);
    RecordProperty("ORV_SEED", std::to_string(seed));
    SCOPED_TRACE("ORV_SEED=" + std::to_string(seed));
    std::mt19937 chance(static_cast<unsigned>(seed));
    const long wanted = number_from_environment("ORV_FAILING_ALLOCATIONS", 100);
    const long step = wanted > 0 ? (in_all + wanted - 1) / wanted : 1;
    long disturbed = 0;
    for (long n = 1; n <= in_all && !HasFailure(); n += step) {
      const long which = n + std::uniform_int_distribution<long>(0, step - 1)(chance);
      // Want of memory seldom is for one moment only.
      const long times = n / step % 3 == 2 ? 30 : 1;
      SCOPED_TRACE(std::to_string(times) + " from allocation " + std::to_string(which) + " on");
      AllocationFaultElsewhere fault(which, times);
      const Codes codes = session();
      fault.disarm();
      disturbed += codes != undisturbed;
      expect_the_next_client_is_served();
    }
    EXPECT_GT(disturbed, 5) << "nothing of what failed mattered";
    EXPECT_EQ(session(), undisturbed);
    EXPECT_TRUE(everybody_has_gone());
  }

  static inline std::unique_ptr<TestedSasl> tested;
  Certificates certificates;
  Boss boss;
  CyrusSasl sasl;
  const EntryPtr found_ = make_test_entry("CN=X,CN=CONFIGURATION");
};

// What the library allocates, each in its turn: on this thread, so that none is missed.
class MemoryOfAMechanism : public MemoryOfAServer, public testing::WithParamInterface<const char*> {
 protected:
  // Whether the n-th allocation was reached; what the exchange ended with, if it did.
  bool fails(long n, std::optional<SaslOutcome>& last) {
    SaslPeer peer(GetParam(), login());
    const auto exchange = find_mechanism(mechanisms, GetParam(), {})->start({});
    std::optional<std::string> sent = peer.begin();
    bool hit = false;
    for (;;) {
      last.reset();
      AllocationFault fault(n);
      try {
        last = sent ? exchange->step(std::string_view(*sent)) : exchange->step(std::nullopt);
      } catch (const std::bad_alloc&) {
      }
      fault.disarm();
      hit = hit || fault.hit();
      n = fault.hit() ? 0 : n - fault.allocations();
      if (!last || last->state != SaslOutcome::State::go_on) return hit;
      sent = peer.answer(last->reply.value_or(""));
    }
  }
};

TEST_P(MemoryOfAMechanism, ThatFailsProvesNothingThatIsWrongAndHarmsNobody) {
  ASSERT_NE(find_mechanism(mechanisms, GetParam(), {}), nullptr);
  int refused = 0;
  // The thousands of rounds in which a password is hashed are all the same.
  for (long n = 1;; n += n < 40 ? 1 : n / 2) {
    SCOPED_TRACE("allocation " + std::to_string(n));
    std::optional<SaslOutcome> last;
    const bool hit = fails(n, last);
    const bool done = last && last->state == SaslOutcome::State::done;
    EXPECT_TRUE(done || hit);
    EXPECT_EQ(last && last->identity, done);
    if (done) {
      EXPECT_EQ(last->identity->user_name, kUser);
    }
    refused += !done;
    if (!hit || HasFailure()) break;
  }
  EXPECT_GT(refused, 10);
}

INSTANTIATE_TEST_SUITE_P(Each, MemoryOfAMechanism, testing::Values("DIGEST-MD5", "SCRAM-SHA-256"),
                         [](const auto& info) {
                           return std::string(info.param).substr(0, 5) == "SCRAM" ? "Scram"
                                                                                  : "Digest";
                         });

TEST_F(MemoryOfAServer, ThatFailsUnderStartTlsEndsAtMostThatConnection) {
  fail_in([this] { return over_tls(false); });
}

TEST_F(MemoryOfAServer, ThatFailsWhereTlsComesFirstEndsAtMostThatConnection) {
  fail_in([this] { return over_tls(true); });
}

TEST_F(MemoryOfAServer, ThatFailsUnderASecurityLayerEndsAtMostThatConnection) {
  fail_in([this] { return with_a_layer(); });
}

TEST(ReserveOfTheSaslLibrary, GivesNothingWhereThereIsNotSoMuch) {
  AllocationFault fault(1);
  void* const none = allocate_for_sasl(std::numeric_limits<std::size_t>::max() - 10);
  fault.disarm();
  EXPECT_EQ(none, nullptr);
  EXPECT_TRUE(sasl_lacked_memory());
}

}  // namespace
}  // namespace orv::server::test
