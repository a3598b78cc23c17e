// DIGEST-MD5 and SCRAM-SHA-256 with the library's own client as the peer, and with clients that
// say what it would not.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <map>
#include <mutex>
#include <new>
#include <optional>
#include <set>
#include <thread>

#include "auth/sasl_cyrus.h"
#include "sasl_peer.h"

namespace orv::server {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using State = SaslOutcome::State;

const std::string kMechanisms[] = {"DIGEST-MD5", "SCRAM-SHA-256"};

// ---- who there is

class People final : public SaslIdentities {
 public:
  std::shared_ptr<const Identity> of_user(std::string_view name, std::string& password) override {
    if (out_of_memory) throw std::bad_alloc();
    {
      const std::lock_guard lock(mutex);
      asked.emplace(name);
    }
    const auto found = passwords.find(std::string(name));
    if (found == passwords.end()) return nullptr;
    password = found->second;
    auto identity = std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, ""});
    identity->user_name = name;
    return identity;
  }
  std::shared_ptr<const Identity> of_principal(std::string_view) override { return nullptr; }
  bool settle(const Identity& identity, bool proved) noexcept override {
    EXPECT_EQ(identity.bound_dn, "CN=ROOT");
    ++(proved ? right : wrong);
    return proved && !locked_out;
  }
  bool has_users() const noexcept override { return !passwords.empty(); }
  bool has_principals() const noexcept override { return true; }

  std::map<std::string, std::string> passwords{{kUser, kPassword}};
  std::mutex mutex;
  std::set<std::string> asked;
  bool locked_out = false;
  bool out_of_memory = false;
  std::atomic<int> right{0};
  std::atomic<int> wrong{0};
};

// ---- both sides

class CyrusTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { tested = std::make_unique<TestedSasl>(); }
  static void TearDownTestSuite() { tested.reset(); }

  CyrusTest()
      : sasl(tested->server(), people, [this](std::string_view line) {
          const std::lock_guard lock(people.mutex);
          reported = line;
        }) {
    sasl.add_mechanisms(mechanisms);
  }

  std::unique_ptr<SaslExchange> start(const std::string& mechanism) {
    const SaslMechanism* const found = find_mechanism(mechanisms, mechanism, transport);
    EXPECT_NE(found, nullptr) << mechanism;
    return found->start(transport);
  }

  struct Meeting {
    SaslOutcome outcome;
    int steps = 0;
    std::vector<std::optional<std::string>> sent{};
    std::vector<std::string> challenges{};
  };

  // Lets the peer go on until the server says how it ends.
  Meeting meet(const std::string& mechanism, SaslPeer& peer) {
    const auto exchange = start(mechanism);
    Meeting meeting;
    meeting.sent.push_back(peer.begin());
    for (;;) {
      const std::optional<std::string>& sent = meeting.sent.back();
      meeting.outcome =
          sent ? exchange->step(std::string_view(*sent)) : exchange->step(std::nullopt);
      ++meeting.steps;
      if (meeting.outcome.state != State::go_on) break;
      meeting.challenges.push_back(meeting.outcome.reply.value_or(""));
      meeting.sent.push_back(peer.answer(meeting.challenges.back()));
    }
    if (meeting.outcome.reply) peer.answer(*meeting.outcome.reply);
    return meeting;
  }
  Meeting meet(const std::string& mechanism, const SaslLogin& login) {
    SaslPeer peer(mechanism, login);
    return meet(mechanism, peer);
  }

  static void expect_plain_refusal(const Meeting& meeting) {
    EXPECT_EQ(meeting.outcome.state, State::failed);
    EXPECT_EQ(meeting.outcome.code, result::invalid_credentials);
    EXPECT_EQ(meeting.outcome.text, "");
    EXPECT_EQ(meeting.outcome.reply, std::nullopt);
    EXPECT_EQ(meeting.outcome.identity, nullptr);
    EXPECT_EQ(meeting.outcome.layer, nullptr);
  }

  static inline std::unique_ptr<TestedSasl> tested;
  People people;
  std::string reported;
  TransportFacts transport;
  CyrusSasl sasl;
  SaslMechanisms mechanisms;
};

class ByPassword : public CyrusTest, public ::testing::WithParamInterface<std::string> {};
INSTANTIATE_TEST_SUITE_P(Mechanisms, ByPassword, ::testing::ValuesIn(kMechanisms),
                         [](const auto& info) {
                           return info.param == "DIGEST-MD5" ? "Digest" : "Scram";
                         });

std::vector<std::string> pieces_of(const std::string& answer) {
  std::vector<std::string> pieces(1);
  bool quoted = false;
  for (const char c : answer) {
    quoted ^= c == '"';
    if (c == ',' && !quoted)
      pieces.emplace_back();
    else
      pieces.back() += c;
  }
  return pieces;
}

std::string joined(const std::vector<std::string>& pieces) {
  std::string answer;
  for (const std::string& piece : pieces) answer += piece + ",";
  answer.pop_back();
  return answer;
}

// ---- who gets in

TEST_P(ByPassword, PasswordProvesAUserNameAndTheServerProvesItselfToo) {
  SaslPeer peer(GetParam(), {});
  const Meeting meeting = meet(GetParam(), peer);
  ASSERT_EQ(meeting.outcome.state, State::done) << reported;
  EXPECT_EQ(meeting.outcome.identity->bound_dn, "CN=ROOT");
  EXPECT_EQ(meeting.outcome.name, kUser);
  EXPECT_TRUE(peer.done());
  EXPECT_EQ(people.right, 1);
  EXPECT_EQ(people.wrong, 0);
}

TEST_P(ByPassword, WrongPasswordIsRefusedAndCounted) {
  for (const std::string wrong : {"wrong", "", "Vx7#kq9!Zp3", "Vx7#kq9!Zp3$ ", "vx7#kq9!zp3$"}) {
    expect_plain_refusal(meet(GetParam(), {.password = wrong}));
  }
  EXPECT_EQ(people.right, 0);
  EXPECT_EQ(people.wrong, 5);
}

TEST_P(ByPassword, NamesAreComparedByteForByte) {
  for (const std::string name : {"Boss", "bos", "bosss", "boss@localhost"})
    expect_plain_refusal(meet(GetParam(), {.user = name}));
  EXPECT_EQ(people.right, 0);
  EXPECT_EQ(people.wrong, 0);
}

TEST_F(CyrusTest, BlanksOfNamesCount) {
  for (const std::string name : {" boss", "boss ", "boss\t"}) {
    const auto exchange = start("SCRAM-SHA-256");
    const std::string first = "n,,n=" + name + ",r=abcdefgh";
    EXPECT_EQ(exchange->step(std::string_view(first)).name, name);
    EXPECT_THAT(people.asked, ::testing::Contains(name));
  }
}

TEST_P(ByPassword, NamesAndPasswordsAreAnyText) {
  const std::pair<std::string, std::string> any[] = {
      {"a,b=c", "p,w=\"x\\y"},
      {"j\u00f6rg@work", "gr\u00fc\u00dfe \u20ac"},
      {"x\"y\\z", "{not}a scheme"},
      {std::string(255, 'n'), std::string(500, 'p')}};
  for (const auto& [name, password] : any) {
    people.passwords[name] = password;
    const Meeting meeting = meet(GetParam(), {.user = name, .password = password});
    EXPECT_EQ(meeting.outcome.state, State::done) << name << ": " << reported;
    EXPECT_EQ(meeting.outcome.name, name);
  }
}

TEST_P(ByPassword, NobodysNameIsAnsweredAsAnybodysIs) {
  const Meeting known = meet(GetParam(), {.password = "wrong"});
  const Meeting unknown = meet(GetParam(), {.user = "none"});
  expect_plain_refusal(unknown);
  EXPECT_EQ(known.steps, unknown.steps);
  ASSERT_EQ(known.challenges.size(), unknown.challenges.size());
  for (std::size_t i = 0; i < known.challenges.size(); ++i)
    EXPECT_EQ(known.challenges[i].size(), unknown.challenges[i].size());
}

TEST_P(ByPassword, IdentityThatIsLockedOutIsRefusedAlikeWhateverItProves) {
  people.locked_out = true;
  expect_plain_refusal(meet(GetParam(), {}));
  expect_plain_refusal(meet(GetParam(), {.password = "wrong"}));
  EXPECT_EQ(people.right, 1);
  EXPECT_EQ(people.wrong, 1);
}

TEST_P(ByPassword, NobodyActsAsAnybodyElse) {
  for (const std::string self : {"u:boss", "dn:cn=root", "dn: CN = Root "})
    EXPECT_EQ(meet(GetParam(), {.authorization_id = self}).outcome.state, State::done) << self;
  for (const std::string other :
       {"u:alice", "u:", "u:Boss", "dn:cn=alice", "dn:", "alice", "x:boss", "dn:cn=root,cn=root"}) {
    const Meeting meeting = meet(GetParam(), {.authorization_id = other});
    EXPECT_EQ(meeting.outcome.state, State::failed) << other;
    EXPECT_EQ(meeting.outcome.code, result::invalid_credentials);
    EXPECT_EQ(meeting.outcome.reply, std::nullopt);
  }
  EXPECT_EQ(people.wrong, 0);
}

TEST_P(ByPassword, WantOfMemoryIsNoWrongPassword) {
  people.out_of_memory = true;
  SaslPeer peer(GetParam(), {});
  EXPECT_THROW(meet(GetParam(), peer), std::bad_alloc);
  EXPECT_EQ(people.wrong, 0);
}

// ---- what is recorded is of no use

TEST_P(ByPassword, RecordedBindIsNotBelievedAgain) {
  const Meeting recorded = meet(GetParam(), {});
  ASSERT_EQ(recorded.outcome.state, State::done);
  const auto exchange = start(GetParam());
  SaslOutcome outcome;
  for (const auto& sent : recorded.sent)
    outcome = sent ? exchange->step(std::string_view(*sent)) : exchange->step(std::nullopt);
  EXPECT_EQ(outcome.state, State::failed);
}

TEST_P(ByPassword, AnswerToAnotherConnectionsChallengeIsNotBelieved) {
  SaslPeer peer(GetParam(), {});
  const auto first = start(GetParam());
  const auto second = start(GetParam());
  const std::optional<std::string> begun = peer.begin();
  const auto view = [&] { return begun ? std::optional<std::string_view>(*begun) : std::nullopt; };
  const SaslOutcome asked = first->step(view());
  ASSERT_EQ(second->step(view()).state, State::go_on);
  ASSERT_EQ(asked.state, State::go_on);
  const std::string answer = peer.answer(asked.reply.value_or(""));
  EXPECT_EQ(second->step(std::string_view(answer)).state, State::failed);
  EXPECT_EQ(first->step(std::string_view(answer)).state, State::done);
}

TEST_F(CyrusTest, ChallengesAreNeverTheSame) {
  std::set<std::string> seen;
  for (int i = 0; i < 100; ++i)
    EXPECT_TRUE(seen.insert(start("DIGEST-MD5")->step(std::nullopt).reply.value_or("")).second);
}

// ---- credentials that are none

TEST_P(ByPassword, EveryPartOfAProofIsRefused) {
  const int steps = meet(GetParam(), {}).steps;
  ASSERT_EQ(steps, 2);
  std::size_t length = 1;
  // The other one takes a while to compute.
  const std::size_t stride = GetParam() == "DIGEST-MD5" ? 1 : 7;
  for (std::size_t cut = 0; cut < length; cut += stride) {
    SaslPeer peer(GetParam(), {});
    const auto exchange = start(GetParam());
    const std::optional<std::string> begun = peer.begin();
    const SaslOutcome asked =
        begun ? exchange->step(std::string_view(*begun)) : exchange->step(std::nullopt);
    const std::string answer = peer.answer(asked.reply.value_or(""));
    length = answer.size();
    const SaslOutcome outcome = exchange->step(std::string_view(answer).substr(0, cut));
    // DIGEST-MD5 has optional parts, of which the last may be missing.
    if (outcome.state == State::done)
      EXPECT_THAT(answer.substr(0, cut), HasSubstr("response="));
    else
      EXPECT_EQ(outcome.state, State::failed) << answer.substr(0, cut);
  }
  EXPECT_GT(length, 80U);
}

TEST_F(CyrusTest, OctetsOfTheProofOfScramCount) {
  std::size_t length = 3;
  for (std::size_t at = 0; at + 2 < length; at += 5) {
    SaslPeer peer("SCRAM-SHA-256", {});
    const auto exchange = start("SCRAM-SHA-256");
    std::string answer = peer.answer(*exchange->step(std::string_view(*peer.begin())).reply);
    length = answer.size();
    answer[at] = static_cast<char>(answer[at] ^ 1);
    EXPECT_EQ(exchange->step(std::string_view(answer)).state, State::failed) << answer;
  }
}

TEST_P(ByPassword, RubbishIsRefusedAtEveryStep) {
  using namespace std::string_literals;
  const std::optional<std::string> rubbish[] = {std::nullopt,
                                                ""s,
                                                "\0"s,
                                                "\0boss\0password"s,
                                                ","s,
                                                "n,,"s,
                                                "n,,n="s,
                                                "n,,n=boss"s,
                                                "n,,n=boss,r="s,
                                                "n,,n=bo=ss,r=x"s,
                                                "n,,n=boss,r=x,m=ext"s,
                                                "y,,n=\xff\xfe,r=abc"s,
                                                "c=biws"s,
                                                "c=biws,r=,p="s,
                                                "username=\"boss"s,
                                                "username=\"boss\",username=\"boss\""s,
                                                "username=\"boss\",maxbuf=99999999999"s,
                                                "=,=,=,="s,
                                                std::string(4095, 'a'),
                                                std::string(65536, '"'),
                                                std::string(65537, 'n'),
                                                std::string(1 << 20, '\0')};
  const auto view = [](const std::optional<std::string>& text) {
    return text ? std::optional<std::string_view>(*text) : std::nullopt;
  };
  for (const auto& first : rubbish)
    for (const auto& second : rubbish) {
      const auto exchange = start(GetParam());
      if (exchange->step(view(first)).state != State::go_on) continue;
      EXPECT_NE(exchange->step(view(second)).state, State::done);
    }
  EXPECT_EQ(people.right, 0);
}

// The parts of an answer, where each is replaced by something else or left out; the other parts are
// as the client made them.
TEST_P(ByPassword, AnswersWithOtherPartsAreNoProof) {
  const std::string instead[] = {"",
                                 "=",
                                 "\"\"",
                                 "x",
                                 "-1",
                                 "99999999999999999999",
                                 "\"\\\"",
                                 "auth-conf",
                                 "3des",
                                 "%s%n",
                                 std::string(3000, 'z')};
  std::size_t parts = 1;
  for (std::size_t part = 0; part < parts; ++part)
    for (const std::string& value : instead) {
      SaslPeer peer(GetParam(), {});
      const auto exchange = start(GetParam());
      const std::optional<std::string> begun = peer.begin();
      const SaslOutcome asked =
          begun ? exchange->step(std::string_view(*begun)) : exchange->step(std::nullopt);
      std::vector<std::string> pieces = pieces_of(peer.answer(asked.reply.value_or("")));
      parts = pieces.size();
      const std::string name = pieces[part].substr(0, pieces[part].find('=') + 1);
      pieces[part] = value.empty() ? "" : name + value;
      const SaslOutcome outcome = exchange->step(std::string_view(joined(pieces)));
      const bool may_differ = name == "maxbuf=" || name == "cipher=" || name == "charset=" ||
                              name == "authzid=" || name == "qop=" || name == "nc=";
      EXPECT_TRUE(may_differ || outcome.state == State::failed) << name << value;
    }
  EXPECT_GE(parts, 3U);
}

TEST_P(ByPassword, EmptyAnswersDoNotGoOnForEver) {
  const auto exchange = start(GetParam());
  State state = State::go_on;
  for (int i = 0; i < 20 && state == State::go_on; ++i)
    state = exchange->step(std::string_view("")).state;
  EXPECT_EQ(state, State::failed);
}

// ---- SCRAM: channel bindings

TEST_F(CyrusTest, ClientThatInsistsOnAChannelBindingIsRefused) {
  for (const std::string first : {"p=tls-unique,,n=boss,r=abcdefgh", "p=tls-exporter,,n=boss,r=abc",
                                  "p=tls-server-end-point,,n=boss,r=abc", "p=,,n=boss,r=abc"})
    EXPECT_EQ(start("SCRAM-SHA-256")->step(std::string_view(first)).state, State::failed) << first;
}

TEST_F(CyrusTest, ClientThatCouldBindTheChannelGoesOnWithoutIt) {
  const SaslOutcome outcome =
      start("SCRAM-SHA-256")->step(std::string_view("y,,n=boss,r=abcdefgh"));
  EXPECT_EQ(outcome.state, State::go_on);
  EXPECT_THAT(outcome.reply.value_or(""), HasSubstr("r=abcdefgh"));
  EXPECT_THAT(outcome.reply.value_or(""), HasSubstr(",i=15000"));
}

// ---- DIGEST-MD5: realm

TEST_F(CyrusTest, RealmIsThatOfTheSettings) {
  sasl.configure({.digest_realm = "The Realm"});
  const std::string challenge = *start("DIGEST-MD5")->step(std::nullopt).reply;
  EXPECT_THAT(challenge, HasSubstr("realm=\"The Realm\""));
  EXPECT_EQ(meet("DIGEST-MD5", {}).outcome.state, State::done) << reported;
}

// ---- security layers

TEST_F(CyrusTest, DigestHasNoCiphers) {
  const std::string challenge = *start("DIGEST-MD5")->step(std::nullopt).reply;
  EXPECT_THAT(challenge, HasSubstr("auth-int"));
  EXPECT_THAT(challenge, Not(HasSubstr("auth-conf")));
  EXPECT_THAT(challenge, Not(HasSubstr("cipher")));
}

class LayerOfDigest : public CyrusTest {
 protected:
  LayerOfDigest() : peer("DIGEST-MD5", {.min_strength = 1, .max_strength = 1}) {
    SaslOutcome outcome = meet("DIGEST-MD5", peer).outcome;
    EXPECT_EQ(outcome.state, State::done) << reported;
    layer = std::move(outcome.layer);
  }
  void SetUp() override { ASSERT_NE(layer, nullptr); }

  SaslPeer peer;
  std::unique_ptr<SecurityLayer> layer;
};

std::string long_text() {
  std::string text;
  while (text.size() < 1000000) text += std::to_string(text.size()) + " ";
  return text;
}

TEST_F(LayerOfDigest, CarriesTextsOfAnyLengthToTheClient) {
  for (const std::string& text : {std::string("x"), long_text(), std::string(65536, 'y')}) {
    std::string wire = "before";
    ASSERT_TRUE(layer->wrap(text, wire));
    EXPECT_EQ(peer.decode(wire.substr(6)), text);
  }
}

TEST_F(LayerOfDigest, TakesFramesFromTheClientHoweverTheyAreCut) {
  const std::string text = long_text();
  const std::string wire = peer.encode(text).value();
  std::string clear;
  std::size_t size = 1;
  for (std::size_t at = 0; at < wire.size(); at += size, size = size % 70000 * 3 + 1)
    ASSERT_TRUE(layer->unwrap(std::string_view(wire).substr(at, size), clear));
  EXPECT_EQ(clear, text);
}

TEST_F(LayerOfDigest, TellsWhetherTheClientOwesTheRestOfAFrame) {
  const std::string one = peer.encode("some text").value();
  const std::string two = one + peer.encode("some other text").value();
  std::string clear;
  for (std::size_t i = 0; i < two.size(); ++i) {
    EXPECT_EQ(layer->has_part(), i != 0 && i != one.size()) << i;
    ASSERT_TRUE(layer->unwrap(two.substr(i, 1), clear));
  }
  EXPECT_FALSE(layer->has_part());
  EXPECT_EQ(clear, "some textsome other text");
  const std::string third = peer.encode("the last text").value();
  ASSERT_TRUE(layer->unwrap(third + third.substr(0, 2), clear));
  EXPECT_TRUE(layer->has_part());
}

TEST_F(LayerOfDigest, RefusesWhatIsDamaged) {
  std::string wire = peer.encode("some text").value();
  wire[wire.size() / 2] = static_cast<char>(wire[wire.size() / 2] ^ 1);
  std::string clear;
  EXPECT_FALSE(layer->unwrap(wire, clear));
}

TEST_F(LayerOfDigest, RefusesWhatIsPlayedAgain) {
  const std::string wire = peer.encode("some text").value();
  std::string clear;
  EXPECT_TRUE(layer->unwrap(wire, clear));
  EXPECT_FALSE(layer->unwrap(wire, clear));
  EXPECT_EQ(clear, "some text");
}

TEST_F(LayerOfDigest, RefusesFramesOfALengthThatIsNone) {
  using namespace std::string_literals;
  for (const std::string& head : {"\xff\xff\xff\xff"s, "\x7f\xff\xff\xff"s, "\x80\0\0\0"s,
                                  "\0\x02\0\0"s, "\0\x01\0\x01"s, "\0\0\0\x0f"s, "\0\0\0\x01"s}) {
    SaslPeer other("DIGEST-MD5", {.min_strength = 1, .max_strength = 1});
    SaslOutcome outcome = meet("DIGEST-MD5", other).outcome;
    ASSERT_NE(outcome.layer, nullptr);
    std::string clear;
    const bool taken = outcome.layer->unwrap(head + std::string(100, 'x'), clear);
    EXPECT_FALSE(taken);
    EXPECT_EQ(clear, "");
  }
}

TEST_F(LayerOfDigest, FramesWithoutContentsAreNoEndlessLoop) {
  std::string clear;
  layer->unwrap(std::string(4000, '\0'), clear);
  EXPECT_EQ(clear, "");
}

TEST_F(CyrusTest, ClientThatWantsTinyFramesIsRefused) {
  const Meeting meeting =
      meet("DIGEST-MD5", {.min_strength = 1, .max_strength = 1, .longest_frame = 100});
  EXPECT_EQ(meeting.outcome.state, State::failed);
  EXPECT_EQ(meeting.outcome.code, result::unwilling_to_perform);
}

TEST_F(CyrusTest, NoLayerIsOfferedWhereTheTransportProtectsAlready) {
  TransportFacts secure;
  secure.tls_version = "TLSv1.3";
  secure.tls_strength = 256;
  TransportFacts local;
  local.local = true;
  for (const TransportFacts& facts : {secure, local}) {
    transport = facts;
    const std::string challenge = *start("DIGEST-MD5")->step(std::nullopt).reply;
    EXPECT_THAT(challenge, Not(HasSubstr("auth-int")));
    EXPECT_THAT(challenge, Not(HasSubstr("auth-conf")));
    EXPECT_EQ(meet("DIGEST-MD5", {.max_strength = 256}).outcome.layer, nullptr);
  }
}

TEST_F(CyrusTest, LayerOutlivesTheExchange) {
  SaslPeer peer("DIGEST-MD5", {.min_strength = 1, .max_strength = 1});
  std::unique_ptr<SecurityLayer> layer = meet("DIGEST-MD5", peer).outcome.layer;
  std::string wire;
  ASSERT_TRUE(layer->wrap("after all", wire));
  EXPECT_EQ(peer.decode(wire), "after all");
}

// ---- what is offered

TEST_F(CyrusTest, MechanismsAreOfferedWhileSomebodyCouldUseThem) {
  EXPECT_THAT(offered_mechanisms(mechanisms, transport),
              ElementsAre("SCRAM-SHA-256", "DIGEST-MD5"));
  people.passwords.clear();
  EXPECT_THAT(offered_mechanisms(mechanisms, transport), IsEmpty());
}

TEST_F(CyrusTest, SettingsSayWhichMayBeOffered) {
  sasl.configure({.mechanisms = {"DIGEST-MD5", "EXTERNAL"}});
  EXPECT_THAT(offered_mechanisms(mechanisms, transport), ElementsAre("DIGEST-MD5"));
  EXPECT_TRUE(sasl.allows("EXTERNAL"));
  sasl.configure({.mechanisms = {"NONE"}});
  EXPECT_THAT(offered_mechanisms(mechanisms, transport), IsEmpty());
  EXPECT_FALSE(sasl.allows("EXTERNAL"));
  sasl.configure({});
  EXPECT_TRUE(sasl.allows("EXTERNAL"));
}

TEST_F(CyrusTest, KerberosNeedsAKeytab) {
  EXPECT_THAT(sasl.configure({.keytab = "/nowhere/keytab"}), ElementsAre(HasSubstr("/nowhere")));
  EXPECT_THAT(offered_mechanisms(mechanisms, transport), Not(::testing::Contains("GSSAPI")));
  EXPECT_THAT(sasl.configure({.mechanisms = {"DIGEST-MD5"}, .keytab = "/nowhere"}), IsEmpty());
}

TEST_F(CyrusTest, PluginsThatTheServerDoesNotKnowAreNotLoaded) {
  for (const char* const name : {"PLAIN", "LOGIN", "CRAM-MD5", "NTLM", "ANONYMOUS"}) {
    EXPECT_EQ(find_mechanism(mechanisms, name, transport), nullptr) << name;
    EXPECT_FALSE(tested->server().has(name)) << name;
  }
  EXPECT_EQ(find_mechanism(mechanisms, "SCRAM-SHA-1", transport), nullptr);
}

// ---- threads

TEST_F(CyrusTest, ExchangesOfManyThreadsDoNotMeet) {
  std::atomic<int> done{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&, t] {
      for (int i = 0; i < 5; ++i) {
        const std::string& mechanism = kMechanisms[static_cast<std::size_t>(t + i) % 2];
        SaslPeer peer(mechanism, {.password = i == 3 ? "wrong" : kPassword});
        const auto exchange = find_mechanism(mechanisms, mechanism, transport)->start(transport);
        const std::optional<std::string> begun = peer.begin();
        const SaslOutcome asked =
            begun ? exchange->step(std::string_view(*begun)) : exchange->step(std::nullopt);
        const std::string answer = peer.answer(asked.reply.value_or(""));
        if (exchange->step(std::string_view(answer)).state == State::done) ++done;
        sasl.configure({});
      }
    });
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(done, 16);
  EXPECT_EQ(people.wrong, 4);
}

}  // namespace
}  // namespace orv::server
