// Binds by SASL: which requests go on with an exchange and which end it, who the client is in
// between and afterwards, and what a security layer protects.
#include <gtest/gtest.h>

#include <sys/socket.h>

#include <cstdint>
#include <fstream>
#include <sstream>

#include "../temporary_directory.h"
#include "core_bare_session.h"
#include "core_server_fixture.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using test::kMember;
using test::kNotice;
using test::kRoot;
using test::kSecret;
using test::kTop;
using test::Reply;
using test::WireClient;

constexpr int kBindResponse = 0x61;
constexpr int kInProgress = 14;
constexpr char kMask = 0x55;

// Frames of four octets of length and masked contents.
class MaskLayer final : public SecurityLayer {
 public:
  bool wrap(std::string_view clear, std::string& wire) override {
    wire += frame(clear);
    return true;
  }
  bool unwrap(std::string_view wire, std::string& clear) override {
    rest_ += wire;
    while (rest_.size() >= 4) {
      std::size_t length = 0;
      for (int i = 0; i < 4; ++i) length = length << 8 | static_cast<unsigned char>(rest_[i]);
      if (length > 65536) return false;
      if (rest_.size() < 4 + length) return true;
      for (const char c : rest_.substr(4, length)) clear += static_cast<char>(c ^ kMask);
      rest_.erase(0, 4 + length);
    }
    return true;
  }
  bool has_part() const noexcept override { return !rest_.empty(); }
  static std::string frame(std::string_view clear) {
    std::string wire;
    for (int shift = 24; shift >= 0; shift -= 8)
      wire += static_cast<char>(clear.size() >> shift & 0xFF);
    for (const char c : clear) wire += static_cast<char>(c ^ kMask);
    return wire;
  }

 private:
  std::string rest_;
};

// Asks one question, and wants the answer "secret"; "layer" in the first message asks for a layer.
class QuestionExchange final : public SaslExchange {
 public:
  SaslOutcome step(std::optional<std::string_view> credentials) override {
    SaslOutcome outcome;
    outcome.name = "asker";
    if (!asked_) {
      asked_ = true;
      wants_layer_ = credentials == "layer";
      if (credentials == "throw") throw std::bad_alloc();
      outcome.state = SaslOutcome::State::go_on;
      outcome.reply = credentials ? "what?" : "nothing?";
      return outcome;
    }
    if (credentials != kSecret) {
      outcome.reply = "must not be sent";
      return outcome;
    }
    outcome.state = SaslOutcome::State::done;
    outcome.reply = "welcome";
    outcome.identity = std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, ""});
    if (wants_layer_) outcome.layer = std::make_unique<MaskLayer>();
    return outcome;
  }

 private:
  bool asked_ = false;
  bool wants_layer_ = false;
};

class Question final : public SaslMechanism {
 public:
  explicit Question(const char* name, bool is_offered = true) : name_(name), offered_(is_offered) {}
  std::string_view name() const noexcept override { return name_; }
  bool offered(const TransportFacts&) const override { return offered_; }
  std::unique_ptr<SaslExchange> start(const TransportFacts&) const override {
    return std::make_unique<QuestionExchange>();
  }

 private:
  const char* const name_;
  const bool offered_;
};

class SaslTest : public test::LoopbackServer {
 protected:
  SaslTest() {
    mechanisms.push_back(std::make_unique<Question>("QUESTION"));
    mechanisms.push_back(std::make_unique<Question>("OTHER"));
    mechanisms.push_back(std::make_unique<Question>("HIDDEN", false));
  }
  ~SaslTest() override { stop(); }

  static Reply step(WireClient& client, int id, const char* mechanism,
                    const std::optional<std::string>& credentials) {
    client.send(test::sasl_bind(id, mechanism, credentials));
    return client.receive().value_or(Reply{});
  }
  static bool has_credentials(const Reply& reply, const std::string& text) {
    return reply.body.find(test::tlv(0x87, text)) != std::string::npos;
  }
  // 53 when the client is the administrator, 50 when it is anonymous.
  static int try_delete(WireClient& client, int id) {
    return code_of(client, test::delete_entry(id, kTop));
  }
};

TEST_F(SaslTest, StepsLeadToAnIdentity) {
  start();
  WireClient client(port());
  const Reply asked = step(client, 1, "QUESTION", "hello");
  EXPECT_EQ(asked.tag, kBindResponse);
  EXPECT_EQ(asked.code, kInProgress);
  EXPECT_TRUE(has_credentials(asked, "what?"));
  const Reply done = step(client, 2, "QUESTION", kSecret);
  EXPECT_EQ(done.code, 0);
  EXPECT_TRUE(has_credentials(done, "welcome"));
  EXPECT_EQ(try_delete(client, 3), 53);
}

TEST_F(SaslTest, AbsentCredentialsAreNotEmptyOnes) {
  start();
  WireClient client(port());
  EXPECT_TRUE(has_credentials(step(client, 1, "QUESTION", std::nullopt), "nothing?"));
  WireClient other(port());
  EXPECT_TRUE(has_credentials(step(other, 1, "QUESTION", ""), "what?"));
}

TEST_F(SaslTest, NameOfTheMechanismIsFoundInAnyLetterCase) {
  start();
  WireClient client(port());
  EXPECT_EQ(step(client, 1, "question", "hello").code, kInProgress);
  EXPECT_EQ(step(client, 2, "Question", kSecret).code, 0);
}

TEST_F(SaslTest, UnknownMechanismsAndThoseNotOfferedAreRefused) {
  start();
  WireClient client(port());
  for (const char* const name : {"", "PLAIN", "HIDDEN", "QUESTIO", "QUESTIONS"})
    EXPECT_EQ(step(client, 1, name, "hello").code, 7) << name;
}

TEST_F(SaslTest, FailedStepLeavesTheClientAnonymousAndSaysNothingMore) {
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(step(client, 2, "QUESTION", "hello").code, kInProgress);
  const Reply failed = step(client, 3, "QUESTION", "guess");
  EXPECT_EQ(failed.code, 49);
  EXPECT_FALSE(has_credentials(failed, "must not be sent"));
  EXPECT_EQ(try_delete(client, 4), 50);
  // The exchange is over: the next step is a first one.
  EXPECT_EQ(step(client, 5, "QUESTION", kSecret).code, kInProgress);
}

TEST_F(SaslTest, ClientIsAnonymousFromTheFirstStepOn) {
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(step(client, 2, "QUESTION", "hello").code, kInProgress);
  EXPECT_EQ(try_delete(client, 3), 1);
  EXPECT_EQ(try_delete(client, 4), 50);
}

TEST_F(SaslTest, OtherRequestBetweenTheStepsIsRefusedAndEndsTheExchange) {
  start();
  const auto requests = {test::search(2, ""),        test::delete_entry(2, kTop),
                         test::compare(2, kTop),     test::extended(2, kStartTlsOid),
                         test::extended(2, "1.2.3"), test::search(2, "", 9)};  // no such scope
  for (const std::string& request : requests) {
    WireClient client(port());
    EXPECT_EQ(step(client, 1, "QUESTION", "hello").code, kInProgress);
    EXPECT_EQ(code_of(client, request), 1);
    EXPECT_EQ(step(client, 3, "QUESTION", kSecret).code, kInProgress);
  }
}

TEST_F(SaslTest, AbandonBetweenTheStepsHasNoEffect) {
  start();
  WireClient client(port());
  EXPECT_EQ(step(client, 1, "QUESTION", "hello").code, kInProgress);
  client.send(test::abandon(2, 1));
  EXPECT_EQ(step(client, 3, "QUESTION", kSecret).code, 0);
}

TEST_F(SaslTest, OtherMechanismOrSimpleBindEndsTheExchange) {
  start();
  WireClient client(port());
  EXPECT_EQ(step(client, 1, "QUESTION", "hello").code, kInProgress);
  EXPECT_EQ(step(client, 2, "OTHER", kSecret).code, kInProgress);
  EXPECT_EQ(step(client, 3, "HIDDEN", kSecret).code, 7);
  EXPECT_EQ(step(client, 4, "OTHER", kSecret).code, kInProgress);
  client.send(test::bind(5, "", ""));
  EXPECT_EQ(client.receive()->code, 0);
  EXPECT_EQ(step(client, 6, "OTHER", kSecret).code, kInProgress);
  client.send(test::bind(7, kRoot, "wrong"));
  EXPECT_EQ(client.receive()->code, 49);
  EXPECT_EQ(step(client, 8, "OTHER", kSecret).code, kInProgress);
  EXPECT_EQ(step(client, 9, "OTHER", kSecret).code, 0);
}

TEST_F(SaslTest, WantOfMemoryInAStepIsNoWrongPassword) {
  start();
  WireClient client(port());
  EXPECT_EQ(step(client, 1, "QUESTION", "throw").code, 90);
  EXPECT_EQ(step(client, 2, "QUESTION", "hello").code, kInProgress);
}

TEST_F(SaslTest, ExchangeThatIsNotFinishedInTimeEndsTheConnection) {
  settings.bind_timeout = 1;
  start();
  WireClient client(port());
  EXPECT_EQ(step(client, 1, "QUESTION", "hello").code, kInProgress);
  const std::optional<Reply> notice = client.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
  EXPECT_EQ(notice->code, 52);
}

TEST_F(SaslTest, ClientThatLeavesBetweenTheStepsIsForgotten) {
  start();
  {
    WireClient client(port());
    EXPECT_EQ(step(client, 1, "QUESTION", "hello").code, kInProgress);
  }
  const auto end = Clock::now() + 10s;
  while (server->connections() > 0 && Clock::now() < end) std::this_thread::yield();
  EXPECT_EQ(server->connections(), 0);
}

TEST_F(SaslTest, IdentityThatChangedDuringTheExchangeIsNotKept) {
  start();
  WireClient client(port());
  EXPECT_EQ(step(client, 1, "QUESTION", "hello").code, kInProgress);
  authenticator.change(false);
  EXPECT_EQ(step(client, 2, "QUESTION", kSecret).code, 0);
  const std::optional<Reply> notice = client.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
}

TEST_F(SaslTest, AccessLogNamesMechanismClaimAndIdentityButNoCredentials) {
  const orv::test::TemporaryDirectory folder;
  settings.access_log = folder.file("access.log");
  settings.access_log_level = "info";
  start();
  {
    WireClient client(port());
    step(client, 1, "QUESTION", "marker-one");
    step(client, 2, "QUESTION", kSecret);
    step(client, 3, "QUESTION", "marker-two");
    step(client, 4, "QUESTION", "marker-three");
    step(client, 5, "NO\nBODY", "marker-four");
    client.send(test::bind(6, kRoot, "wrong"));
    client.receive();
    std::string old = test::bind(7, kRoot, "marker-five");
    old.replace(old.find("\x02\x01\x03"), 3, "\x02\x01\x02");
    client.send(old);
    EXPECT_EQ(client.receive()->code, 2);
  }
  stop();
  const std::string text = folder.read("access.log");
  EXPECT_NE(text.find("sasl mechanism=\"QUESTION\" name=\"asker\" result=14"), std::string::npos)
      << text;
  EXPECT_NE(text.find("sasl mechanism=\"QUESTION\" name=\"asker\" as=\"CN=ROOT\" result=0"),
            std::string::npos);
  EXPECT_NE(text.find("sasl mechanism=\"QUESTION\" name=\"asker\" result=49"), std::string::npos);
  EXPECT_NE(text.find("mechanism=\"NO\\0ABODY\" result=7"), std::string::npos);
  EXPECT_NE(text.find("op=7 BIND malformed result=2"), std::string::npos) << text;
  std::istringstream lines(text);
  int binds = 0;
  for (std::string line; std::getline(lines, line);)
    if (line.find(" BIND ") != std::string::npos) {
      ++binds;
      EXPECT_NE(line.find(" from=127.0.0.1:"), std::string::npos) << line;
    }
  EXPECT_EQ(binds, 7);
  EXPECT_EQ(text.find("marker"), std::string::npos);
  EXPECT_EQ(text.find(kSecret), std::string::npos);
}

// ---- the security layer

class LayerTest : public SaslTest {
 protected:
  // Binds with a layer; what follows is in frames.
  void bind_with_layer(WireClient& client) {
    ASSERT_EQ(step(client, 1, "QUESTION", "layer").code, kInProgress);
    ASSERT_EQ(step(client, 2, "QUESTION", kSecret).code, 0);
  }
  // The contents of the next frame; "" when the server closed.
  static std::string frame(WireClient& client) {
    const std::string header = exactly(client, 4);
    std::size_t length = 0;
    for (const char c : header) length = length << 8 | static_cast<unsigned char>(c);
    std::string clear = exactly(client, length);
    for (char& c : clear) c = static_cast<char>(c ^ kMask);
    return clear;
  }
  static std::string exactly(WireClient& client, std::size_t length) {
    std::string bytes(length, '\0');
    std::size_t done = 0;
    while (done < length) {
      const ssize_t got = ::recv(client.descriptor(), bytes.data() + done, length - done, 0);
      if (got <= 0) return "";
      done += static_cast<std::size_t>(got);
    }
    return bytes;
  }
  int changes() const { return backend.calls(parameter::delete_function); }
};

TEST_F(LayerTest, ProtectsWhatFollowsTheBindInBothDirections) {
  start();
  WireClient client(port());
  bind_with_layer(client);
  client.send(MaskLayer::frame(test::delete_entry(3, kTop)));
  const std::string answer = frame(client);
  ASSERT_GE(answer.size(), 10U);
  EXPECT_EQ(answer[4], 3);
  EXPECT_EQ(answer[9], 53);
  // Cut anywhere, several in one, one in several.
  const std::string two = MaskLayer::frame(test::search(4, "") + test::search(5, "").substr(0, 9)) +
                          MaskLayer::frame(test::search(5, "").substr(9));
  for (const char c : two) client.send(std::string_view(&c, 1));
  std::string all;
  while (all.find("\x02\x01\x05\x65") == std::string::npos) {
    const std::string more = frame(client);
    ASSERT_FALSE(more.empty());
    all += more;
  }
  EXPECT_NE(all.find("\x02\x01\x04\x65"), std::string::npos);
}

TEST_F(LayerTest, ClearMessagesUnderALayerAreNotExecuted) {
  start();
  WireClient client(port());
  bind_with_layer(client);
  client.send(test::delete_entry(3, kTop) + test::delete_entry(4, kTop));
  EXPECT_TRUE(client.closed());
  EXPECT_EQ(changes(), 0);
}

TEST_F(LayerTest, ClearMessagesBehindTheLastStepAreNotExecuted) {
  start();
  WireClient client(port());
  ASSERT_EQ(step(client, 1, "QUESTION", "layer").code, kInProgress);
  client.send(test::sasl_bind(2, "QUESTION", kSecret) + test::delete_entry(3, kTop));
  client.receive();
  EXPECT_EQ(frame(client), "");
  stop();
  EXPECT_EQ(changes(), 0);
}

TEST_F(LayerTest, ProtectedMessagesBehindTheLastStepAreExecuted) {
  start();
  WireClient client(port());
  ASSERT_EQ(step(client, 1, "QUESTION", "layer").code, kInProgress);
  client.send(test::sasl_bind(2, "QUESTION", kSecret) +
              MaskLayer::frame(test::delete_entry(3, kTop)));
  ASSERT_EQ(client.receive()->code, 0);
}

TEST_F(LayerTest, StartTlsIsRefusedUnderALayer) {
  start();
  WireClient client(port());
  bind_with_layer(client);
  client.send(MaskLayer::frame(test::extended(3, kStartTlsOid)));
  EXPECT_EQ(frame(client).at(9), 1);
}

class PartOfAFrame : public LayerTest {
 protected:
  PartOfAFrame() {
    settings.message_timeout = 1;
    settings.idle_timeout = 10;
  }
  static void expect_notice(WireClient& client, std::string_view why) {
    const std::string notice = frame(client);
    ASSERT_GE(notice.size(), 10U);
    EXPECT_EQ(notice[4], 0);
    EXPECT_EQ(notice[9], 52);
    EXPECT_NE(notice.find(why), std::string::npos) << notice;
  }
  static constexpr std::string_view kUnfinished = "message not finished in time";
  const std::string part{"\0\0\1\0half", 8};
};

TEST_F(PartOfAFrame, EndsTheConnectionInTime) {
  start();
  WireClient client(port());
  bind_with_layer(client);
  client.send(part);
  expect_notice(client, kUnfinished);
}

TEST_F(PartOfAFrame, EndsTheConnectionInTimeAlsoBehindAWholeOne) {
  start();
  WireClient clients[] = {WireClient(port()), WireClient(port()), WireClient(port())};
  const std::size_t cuts[] = {1, 4, part.size()};
  for (std::size_t i = 0; i < 3; ++i) {
    bind_with_layer(clients[i]);
    clients[i].send(MaskLayer::frame(test::delete_entry(3, kTop)) + part.substr(0, cuts[i]));
    EXPECT_EQ(frame(clients[i]).at(4), 3);
  }
  for (WireClient& client : clients) expect_notice(client, kUnfinished);
}

TEST_F(PartOfAFrame, EndsTheConnectionInTimeAlsoBehindTheLastStep) {
  start();
  WireClient client(port());
  ASSERT_EQ(step(client, 1, "QUESTION", "layer").code, kInProgress);
  client.send(test::sasl_bind(2, "QUESTION", kSecret) + part);
  ASSERT_EQ(client.receive()->code, 0);
  expect_notice(client, kUnfinished);
}

TEST_F(PartOfAFrame, IsWaitedForAnewAfterEachMessage) {
  settings.message_timeout = 3600;
  settings.idle_timeout = 1;
  start();
  WireClient client(port());
  bind_with_layer(client);
  const std::string whole = MaskLayer::frame(test::delete_entry(3, kTop));
  client.send(whole + whole.substr(0, 7));
  EXPECT_EQ(frame(client).at(4), 3);
  client.send(whole.substr(7));
  EXPECT_EQ(frame(client).at(4), 3);
  expect_notice(client, "idle for too long");  // nothing is in pieces any more
}

// Whether memory that is left out of core dumps, as that is into which connections read, holds it.
bool is_where_connections_read(std::string_view wanted) {
  std::ifstream maps("/proc/self/smaps");
  std::ifstream memory("/proc/self/mem", std::ios::binary);
  std::uintptr_t begin = 0;
  std::uintptr_t end = 0;
  for (std::string line; std::getline(maps, line);) {
    std::istringstream bounds(line);
    std::uintptr_t first = 0;
    std::uintptr_t last = 0;
    char dash = 0;
    if (bounds >> std::hex >> first >> dash >> last && dash == '-') {
      begin = first;
      end = last;
    }
    if (!line.starts_with("VmFlags:") || (line + " ").find(" dd ") == std::string::npos) continue;
    if (end - begin > (std::size_t{64} << 20)) continue;  // a sanitizer's own
    std::string bytes(end - begin, '\0');
    memory.clear();
    memory.seekg(static_cast<std::streamoff>(begin));
    memory.read(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    if (bytes.find(wanted) != std::string::npos) return true;
  }
  return false;
}

TEST_F(LayerTest, PartsOfMessagesThatMoveLeaveNothingBehind) {
  const std::string password = "a password";
  start();
  WireClient client(port());
  bind_with_layer(client);
  const std::string request = test::modify(4, kTop, "cn", password + " and more");
  const std::size_t part = request.size() - 3;
  client.send(
      MaskLayer::frame(test::delete_entry(3, std::string(200, 'x')) + request.substr(0, part)));
  EXPECT_EQ(frame(client).at(4), 3);
  EXPECT_TRUE(is_where_connections_read(password));
  client.send(MaskLayer::frame(request.substr(part)));
  EXPECT_EQ(frame(client).at(4), 4);
  client.send(MaskLayer::frame(test::delete_entry(5, kTop)));  // the other is done with
  EXPECT_EQ(frame(client).at(4), 5);
  EXPECT_FALSE(is_where_connections_read(password));
}

TEST_F(LayerTest, NoticeOfDisconnectionIsProtected) {
  start();
  WireClient client(port());
  bind_with_layer(client);
  client.send(MaskLayer::frame("no message"));
  const std::string notice = frame(client);
  ASSERT_GE(notice.size(), 10U);
  EXPECT_EQ(notice[9], 2);
}

// ---- passwords in clear

class ClearPasswords : public test::BareSessionTest {
 protected:
  int bind_from(const TransportFacts& facts, std::string_view name = kRoot,
                std::string_view password = kSecret) {
    session->set_transport(facts);
    session->sent.clear();
    session->handle(test::bind(1, name, password));
    EXPECT_TRUE(session->run_until([this] { return session->idle(); }));
    return result_in(session->sent).code;
  }
  static TransportFacts from(const char* how) {
    TransportFacts facts;
    facts.loopback = std::string_view(how) == "loopback";
    facts.local = std::string_view(how) == "local";
    if (std::string_view(how) == "tls") facts.tls_version = "TLSv1.3";
    return facts;
  }
};

TEST_F(ClearPasswords, AreRefusedFromOtherHostsWithoutTlsAndNobodyIsAsked) {
  EXPECT_EQ(bind_from(from("elsewhere")), 13);
  EXPECT_EQ(bind_from(from("elsewhere"), "cn=nobody,cn=configuration"), 13);
  EXPECT_EQ(bind_from(from("elsewhere"), "cn=nobody", "wrong"), 13);
  EXPECT_EQ(authenticator.asked, 0);
  EXPECT_EQ(bind_from(from("elsewhere"), "", ""), 0);
  for (const char* const how : {"loopback", "local", "tls"})
    EXPECT_EQ(bind_from(from(how)), 0) << how;
}

TEST_F(ClearPasswords, AreRefusedFromTheOwnHostWhereThatIsConfigured) {
  settings.tls_for_local_passwords = true;
  for (const char* const how : {"loopback", "local", "elsewhere"})
    EXPECT_EQ(bind_from(from(how)), 13) << how;
  EXPECT_EQ(bind_from(from("tls")), 0);
}

TEST_F(ClearPasswords, AreTakenFromEverywhereWhereThatIsConfigured) {
  settings.tls_for_passwords = false;
  EXPECT_EQ(bind_from(from("elsewhere")), 0);
  EXPECT_EQ(authenticator.asked, 1);
}

TEST_F(ClearPasswords, RefusedBindLeavesTheConnectionAnonymous) {
  EXPECT_EQ(bind_from(from("loopback")), 0);
  EXPECT_EQ(bind_from(from("elsewhere")), 13);
  session->sent.clear();
  session->handle(test::delete_entry(2, kTop));
  ASSERT_TRUE(session->run_until([this] { return session->idle(); }));
  EXPECT_EQ(result_in(session->sent).code, 50);
}

// ---- connections on which nobody is bound

class StrangersTest : public test::LoopbackServer {
 protected:
  ~StrangersTest() override { stop(); }
};

TEST_F(StrangersTest, AreLimitedWhileThoseWhoAreBoundAreNot) {
  settings.max_unauthenticated_connections = 3;
  start();
  WireClient first(port());
  WireClient second(port());
  bind_as_root(first);
  bind_as(second, kMember);
  WireClient third(port());
  WireClient fourth(port());
  WireClient fifth(port());
  for (WireClient* const client : {&third, &fourth, &fifth})
    EXPECT_EQ(code_of(*client, test::search(1, "")), 0);
  WireClient beyond(port());
  const std::optional<Reply> notice = beyond.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
  EXPECT_EQ(notice->code, 51);
  EXPECT_TRUE(beyond.closed());
  // Whoever binds makes room, whoever is anonymous again takes it.
  bind_as_root(third);
  WireClient sixth(port());
  EXPECT_EQ(code_of(sixth, test::search(1, "")), 0);
  third.send(test::bind(2, "", ""));
  ASSERT_EQ(third.receive()->code, 0);
  WireClient another(port());
  EXPECT_EQ(another.receive()->tag, kNotice);
}

TEST_F(StrangersTest, MakeRoomWhenTheyLeave) {
  settings.max_unauthenticated_connections = 1;
  start();
  for (int i = 0; i < 20; ++i) {
    {
      WireClient client(port());
      ASSERT_EQ(code_of(client, test::search(1, "")), 0) << i;
      client.send(test::unbind(2));
      ASSERT_TRUE(client.closed());
    }
    const auto end = Clock::now() + 10s;
    while (server->connections() > 0 && Clock::now() < end) std::this_thread::yield();
  }
}

}  // namespace
}  // namespace orv::server
