// Binds one after the other: whatever came before, who is bound is whom the last bind proved, and
// nobody when it failed, was refused, or is not finished.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "core_bare_session.h"

namespace orv::server::test {
namespace {

constexpr unsigned kNobody = 0x24;
constexpr unsigned kAdministrator = 0x0C;
constexpr unsigned kGroupMember = 0x14;
constexpr unsigned kBySasl = 0x0C;

// Succeeds in its second step, if that is kSecret.
class TwoSteps final : public SaslMechanism {
 public:
  std::string_view name() const noexcept override { return "STEPS"; }
  bool offered(const TransportFacts&) const override { return true; }
  std::unique_ptr<SaslExchange> start(const TransportFacts&) const override {
    class Exchange final : public SaslExchange {
      SaslOutcome step(std::optional<std::string_view> credentials) override {
        SaslOutcome outcome;
        if (!begun_) {
          begun_ = true;
          outcome.state = SaslOutcome::State::go_on;
          return outcome;
        }
        if (credentials != kSecret) return outcome;
        outcome.state = SaslOutcome::State::done;
        outcome.identity = std::make_shared<Identity>(Identity{"CN=SASL", kBySasl, 0, ""});
        return outcome;
      }
      bool begun_ = false;
    };
    return std::make_unique<Exchange>();
  }
};

std::string bind_of_version(int version) {
  return message(1, tlv(0x60, integer(version) + tlv(0x04, kRoot) + tlv(0x80, kSecret)));
}

std::string bind_with_control(bool critical) {
  return message(1, tlv(0x60, integer(3) + tlv(0x04, kRoot) + tlv(0x80, kSecret)),
                 control("1.2.3.4", critical));
}

// One way to bind: what is sent, its results, and as whom one is bound then.
struct Way {
  const char* name;
  std::vector<std::string> requests;
  std::vector<int> codes;
  unsigned authority;
};

std::vector<Way> ways() {
  const std::string begun = sasl_bind(1, "STEPS", "hello");
  return {
      {"administrator", {bind(1, kRoot, kSecret)}, {0}, kAdministrator},
      {"member", {bind(1, kMember, kSecret)}, {0}, kGroupMember},
      {"anonymous", {bind(1, "", "")}, {0}, kNobody},
      {"wrong password", {bind(1, kRoot, "wrong")}, {49}, kNobody},
      {"unknown name", {bind(1, "cn=x", kSecret)}, {49}, kNobody},
      {"password without a name", {bind(1, "", kSecret)}, {49}, kNobody},
      {"name without a password", {bind(1, kRoot, "")}, {53}, kNobody},
      {"no DN", {bind(1, "root,,", kSecret)}, {34}, kNobody},
      {"in the configuration", {bind(1, kTop, kSecret)}, {49}, kNobody},
      {"version 2", {bind_of_version(2)}, {2}, kNobody},
      {"version 127", {bind_of_version(127)}, {2}, kNobody},
      {"unknown kind",
       {message(1, tlv(0x60, integer(3) + tlv(0x04, kRoot) + tlv(0x85, "x")))},
       {7},
       kNobody},
      {"critical control", {bind_with_control(true)}, {12}, kNobody},
      {"other control", {bind_with_control(false)}, {0}, kAdministrator},
      {"unknown mechanism", {sasl_bind(1, "PLAIN", "x")}, {7}, kNobody},
      {"no mechanism", {sasl_bind(1, "", "x")}, {7}, kNobody},
      {"SASL, begun", {begun}, {14}, kNobody},
      {"SASL, failed", {begun, sasl_bind(1, "STEPS", "wrong")}, {14, 49}, kNobody},
      {"SASL, done", {begun, sasl_bind(1, "STEPS", kSecret)}, {14, 0}, kBySasl},
      {"SASL, another mechanism", {begun, sasl_bind(1, "PLAIN", kSecret)}, {14, 7}, kNobody},
  };
}

class BindAfterBind : public BareSessionTest {
 protected:
  BindAfterBind() {
    mechanisms_.push_back(std::make_unique<TwoSteps>());
    services.mechanisms = &mechanisms_;
    backend.on_bind = [](pblock*) { return 49; };
  }
  ~BindAfterBind() override {
    session->client_left();
    EXPECT_TRUE(session->run_until([this] { return session->idle(); }));
  }

  int code_of(const std::string& request) {
    session->handle(request);
    EXPECT_TRUE(session->run_until([this] { return session->idle(); }));
    const std::string sent = std::exchange(session->sent, {});
    session->output_is(0);
    return sent.size() < 10 ? -1 : result_in(sent).code;
  }
  void take(const Way& way) {
    for (std::size_t i = 0; i < way.requests.size(); ++i)
      EXPECT_EQ(code_of(way.requests[i]), way.codes[i]) << "request " << i;
    EXPECT_EQ(session->connection().authority, way.authority);
    EXPECT_EQ(session->connection().roles == 0, way.authority != kGroupMember);
    EXPECT_EQ(services.unauthenticated.load(), way.authority == kNobody ? 1 : 0);
  }
  // Whether the first request of `second` would be taken for a step of what `first` began.
  static bool goes_on(const Way& first, const Way& second) {
    return first.codes.back() == 14 && second.codes.front() == 14;
  }
  void end_exchange() { EXPECT_EQ(code_of(bind(1, "", "")), 0); }
  SaslMechanisms mechanisms_;
};

TEST_F(BindAfterBind, CarriesNothingOver) {
  const std::vector<Way> all = ways();
  for (const Way& first : all) {
    for (const Way& second : all) {
      SCOPED_TRACE(std::string(first.name) + ", then " + second.name);
      take(first);
      if (goes_on(first, second)) end_exchange();
      take(second);
      end_exchange();
    }
  }
}

// Between the two, requests that fail, each in a way of its own.
TEST_F(BindAfterBind, CarriesNothingOverAFailedRequestOfAnyKind) {
  backend.on_change = [](pblock* parameters) { return finish_change(parameters, 53); };
  backend.on_search = [](pblock* parameters) { return finish_search(parameters, 32, 0); };
  const std::vector<std::string> failing = {search(2, kTop),
                                            search(2, "no DN,,"),
                                            add_entry(2, "cn=x,cn=configuration", "cn", "x"),
                                            modify(2, kTop, "description", "x"),
                                            delete_entry(2, kTop),
                                            compare(2, kTop),
                                            extended(2, "1.2.3"),
                                            extended(2, "1.3.6.1.4.1.1466.20037"),
                                            extended(2, "no OID")};
  for (const Way& way : ways()) {
    for (std::size_t i = 0; i < failing.size(); ++i) {
      SCOPED_TRACE(std::string(way.name) + ", request " + std::to_string(i));
      take(way);
      EXPECT_GT(code_of(failing[i]), 0);
      EXPECT_EQ(session->connection().authority, way.authority);
      end_exchange();
    }
  }
}

}  // namespace
}  // namespace orv::server::test
