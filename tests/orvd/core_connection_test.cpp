// Rules of one connection: message ids, texts, the access log, identities that change, and what
// happens when the backend fails or memory runs out.
#include <gtest/gtest.h>

#include <unistd.h>
#include <asio/thread_pool.hpp>

#include <cstdlib>
#include <deque>
#include <mutex>
#include <new>
#include <semaphore>

#include "../temporary_directory.h"
#include "cfg/owners.h"
#include "core_bare_session.h"
#include "core_server_fixture.h"
#include "ops/log_text.h"
#include "ops/session.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using test::BareSessionTest;
using test::Event;
using test::kNotice;
using test::kRoot;
using test::kSecret;
using test::kTop;
using test::Reply;
using test::tlv;
using test::WireClient;

class ConnectionTest : public test::BlockedServer {};

// ---- message ids

TEST_F(ConnectionTest, MessageIdThatIsStillOutstandingEndsTheConnection) {
  block();
  // A search, and one that is refused for its form.
  for (const std::string& again : {test::search(2, kTop), test::search(2, kTop, 9)}) {
    WireClient client(port());
    bind_as_root(client);
    client.send(test::search(2, kTop) + again);
    const std::optional<Reply> notice = client.receive();
    ASSERT_TRUE(notice);
    EXPECT_EQ(notice->id, 0);
    EXPECT_EQ(notice->tag, kNotice);
    EXPECT_EQ(notice->code, 2);
    EXPECT_TRUE(client.closed());
    EXPECT_TRUE(wait_for_waiters(0));
  }
}

TEST_F(ConnectionTest, MessageIdMayBeUsedAgainAfterTheAnswerAndAfterAnAbandon) {
  block();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(code_of(client, test::search(2, "")), 0);
  EXPECT_EQ(code_of(client, test::search(2, "")), 0);
  client.send(test::search(3, kTop) + test::abandon(4, 3) + test::search(3, ""));
  EXPECT_EQ(client.receive_result().back().id, 3);
  // The one in hand is given up, too, and nothing will come for it.
  holder->send(test::abandon(3, 2) + test::search(2, ""));
  EXPECT_EQ(holder->receive_result().back().code, 0);
}

// ---- published entries

TEST_F(ConnectionTest, SubschemaHasNoChildrenAndTheRootDseIsFoundByABaseSearchOnly) {
  start();
  WireClient client(port());
  client.send(test::search(1, "cn=subschema", 1));
  const std::vector<Reply> replies = client.receive_result();
  ASSERT_EQ(replies.size(), 1U);
  EXPECT_EQ(replies[0].code, 0);
  client.send(test::search(2, "cn=subschema", 2));
  EXPECT_EQ(client.receive_result().size(), 2U);
  EXPECT_EQ(code_of(client, test::search(3, "", 1)), 32);
  EXPECT_EQ(code_of(client, test::search(4, "", 2)), 32);
}

// ---- texts

TEST_F(ConnectionTest, RefusalsSayWhichNameIsNoDn) {
  start();
  WireClient client(port());
  bind_as_root(client);
  const auto text_of = [&](const std::string& request) {
    client.send(request);
    const std::optional<Reply> reply = client.receive();
    EXPECT_TRUE(reply);
    EXPECT_EQ(reply->code, 34);
    return reply->body;
  };
  EXPECT_NE(text_of(test::search(2, "no dn")).find("the base object is not a DN"),
            std::string::npos);
  EXPECT_NE(text_of(test::delete_entry(3, "no dn")).find("the target is not a DN"),
            std::string::npos);
  EXPECT_NE(text_of(test::bind(4, "no dn", "x")).find("the bind name is not a DN"),
            std::string::npos);
}

TEST_F(ConnectionTest, MessageBeyondTheLimitIsToldTheLimitAndItsSetting) {
  settings.max_message_size = 2048;
  start();
  WireClient client(port());
  client.send(test::search(1, std::string(4096, 'x')));
  const std::optional<Reply> notice = client.receive();
  ASSERT_TRUE(notice);
  EXPECT_NE(notice->body.find("2048"), std::string::npos);
  EXPECT_NE(notice->body.find("orv-slapdMaxMessageSize"), std::string::npos);
}

// ---- access log

std::string logged(std::string_view text) {
  std::string line;
  append_client_text(line, text);
  return line;
}

TEST(ClientText, IsQuotedAndEscaped) {
  EXPECT_EQ(logged("cn=a"), R"("cn=a")");
  EXPECT_EQ(logged("a\"b\\c\nd\x7F"), R"("a\22b\5Cc\0Ad\7F")");
  EXPECT_EQ(logged("gr\xC3\xBC\xC3\x9F"), "\"gr\xC3\xBC\xC3\x9F\"");
}

TEST(ClientText, ControlCharactersBeyondAsciiAndBytesThatAreNoUtf8AreEscaped) {
  EXPECT_EQ(logged("\xC2\x9B"
                   "31m"),
            R"("\C2\9B31m")");
  EXPECT_EQ(logged("\x9B"
                   "31m"),
            R"("\9B31m")");
  EXPECT_EQ(logged("\xC3"), R"("\C3")");
  EXPECT_EQ(logged("\xC2\xA0"), "\"\xC2\xA0\"");
}

TEST(ClientText, IsCutWithAMarkBetweenCharacters) {
  EXPECT_EQ(logged(std::string(kLoggedBytes, 'x')).size(), kLoggedBytes + 2);
  const std::string cut = logged(std::string(100000, 'x'));
  EXPECT_LT(cut.size(), kLoggedBytes + 40);
  EXPECT_NE(cut.find("...(100000 bytes)"), std::string::npos);
  const std::string wide =
      logged(std::string(kLoggedBytes - 1, 'x') + "\xE2\x82\xAC" + std::string(50, 'y'));
  EXPECT_EQ(wide.find('\\'), std::string::npos);
  EXPECT_EQ(wide.find('\xE2'), std::string::npos);
}

class AccessLogTest : public ConnectionTest {
 protected:
  AccessLogTest() {
    settings.access_log = folder.file("access.log");
    settings.access_log_level = "info";
  }
  ~AccessLogTest() override {
    go_on.happen();
    stop();
  }
  std::string written() {
    go_on.happen();
    stop();
    return folder.read("access.log");
  }
  // The rest of the first line with this part, from there on.
  std::string line_of(const std::string& part) {
    const std::string log = written();
    const std::size_t at = log.find(part);
    EXPECT_NE(at, std::string::npos) << log;
    return at == std::string::npos ? "" : log.substr(at, log.find('\n', at) - at);
  }

  const orv::test::TemporaryDirectory folder;
};

TEST_F(AccessLogTest, LongTextsOfStrangersMakeShortLines) {
  settings.max_unauthenticated_message_size = settings.max_message_size;
  start();
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::search(1, "cn=" + std::string(500000, 'x'))), 34);
  EXPECT_EQ(code_of(client, test::bind(2, "cn=" + std::string(500000, 'x'), "no")), 34);
  EXPECT_EQ(code_of(client, test::compare(3, "cn=" + std::string(500000, 'x'))), 53);
  EXPECT_EQ(code_of(client, test::extended(4, "1." + std::string(500000, '1'))), 2);
  EXPECT_LT(written().size(), 8192U);
}

TEST_F(AccessLogTest, RequestsThatAreAnsweredOnTheSpotAreLoggedWithTheirTarget) {
  start();
  WireClient client(port());
  const std::string unknown = test::control("1.2.3.4", true);
  const std::string target = test::tlv(0x04, "cn=there");
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  EXPECT_EQ(code_of(client, test::compare(2, "cn=there")), 53);
  EXPECT_EQ(code_of(client, test::message(3, test::tlv(0x6C, target + target + "\x01\x01\xFF"))),
            53);
  EXPECT_EQ(code_of(client, test::extended(4, "1.2.3.4")), 2);
  EXPECT_EQ(code_of(client, test::message(5, test::tlv(0x4A, "cn=there"), unknown)), 12);
  const std::string log = written();
  for (const char* const line :
       {"op=1 SEARCH dn=\"\" scope=0 filter=\"(objectClass=*)\" result=0",
        "op=2 COMPARE dn=\"cn=there\" result=53", "op=3 MODIFYDN dn=\"cn=there\" result=53",
        "op=4 EXTENDED oid=\"1.2.3.4\" result=2", "op=5 DELETE dn=\"cn=there\" result=12"})
    EXPECT_NE(log.find(line), std::string::npos) << line << "\nis not in\n" << log;
}

TEST_F(AccessLogTest, AbandonedOperationsAreLoggedAsAbandoned) {
  block();
  WireClient client(port());
  bind_as_root(client);
  client.send(test::search(7, kTop));
  ASSERT_TRUE(wait_for_waiters(1));
  client.send(test::abandon(8, 7) + test::search(9, ""));
  EXPECT_EQ(client.receive_result().back().id, 9);
  const std::string line = line_of("op=7 ");
  EXPECT_NE(line.find(" abandoned "), std::string::npos) << line;
  EXPECT_EQ(line.find("result="), std::string::npos) << line;
}

TEST_F(AccessLogTest, OperationsOfAClientThatLeftAreLoggedAsAbandoned) {
  block();
  {
    WireClient client(port());
    bind_as_root(client);
    client.send(test::search(7, kTop));
    ASSERT_TRUE(wait_for_waiters(1));
  }
  ASSERT_TRUE(wait_for_waiters(0));
  EXPECT_NE(line_of("op=7 ").find(" abandoned "), std::string::npos);
}

// ---- identities

TEST_F(ConnectionTest, ConnectionWhoseIdentityChangedIsEndedWithANotice) {
  start();
  WireClient bound(port());
  WireClient stranger(port());
  bind_as_root(bound);
  EXPECT_EQ(code_of(stranger, test::search(1, "")), 0);
  authenticator.change(false);
  const std::optional<Reply> notice = bound.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
  EXPECT_EQ(notice->code, 8);
  EXPECT_TRUE(bound.closed());
  EXPECT_EQ(code_of(stranger, test::search(2, "")), 0);
}

TEST_F(ConnectionTest, NoOperationRunsWithAnIdentityThatChanged) {
  start();
  WireClient bound(port());
  bind_as_root(bound);
  authenticator.change(false);
  bound.send(test::search(2, kTop));
  EXPECT_EQ(bound.receive()->tag, kNotice);
  EXPECT_EQ(backend.calls(parameter::search_function), 0);
}

TEST_F(ConnectionTest, ConnectionWhoseIdentityIsTheSameInTheNewSnapshotStays) {
  start();
  WireClient bound(port());
  bind_as_root(bound);
  authenticator.change(true);
  EXPECT_EQ(code_of(bound, test::search(2, kTop)), 0);
  authenticator.valid = false;  // asked only once for each snapshot
  EXPECT_EQ(code_of(bound, test::search(3, kTop)), 0);
}

// ---- failures

TEST_F(ConnectionTest, ReloadThatThrowsDoesNotEndTheServer) {
  std::atomic<int> reloads{0};
  Event twice;
  reload = [&](Settings&) -> bool {
    if (++reloads == 2) twice.happen();
    throw std::bad_alloc();
  };
  start();
  std::raise(SIGHUP);
  const auto end = Clock::now() + 10s;
  while (reloads == 0 && Clock::now() < end) std::this_thread::yield();
  std::raise(SIGHUP);
  EXPECT_TRUE(twice.wait());
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  stop();
  EXPECT_EQ(status, 0);
}

TEST_F(ConnectionTest, BackendThatFailedWithItsLockHeldIsNotAskedToUnbind) {
  std::binary_semaphore lock(1);
  backend.on_search = [&](pblock*) -> int {
    lock.acquire();
    throw 1;
  };
  backend.on_unbind = [&](pblock*) {
    if (lock.try_acquire_for(8s)) lock.release();
    return 0;
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  client.send(test::search(2, kTop));
  const auto begun = Clock::now();
  control.join();
  EXPECT_EQ(status, 1);
  EXPECT_LT(Clock::now() - begun, 5s);
  EXPECT_EQ(backend.calls(parameter::unbind_function), 0);
}

// ---- changes of a session by itself

// Of the names of the targets, in the order in which they are changed.
auto noting_first_letters(std::string& order) {
  return [&order](pblock* parameters) {
    order += test::target_of(parameters).substr(3, 1);
    return test::finish_change(parameters, 0);
  };
}

// Those of whoever is bound, as the change is made.
auto taking_the_rights_away(test::ScriptedAuthenticator& authenticator) {
  return [&authenticator](pblock* parameters) {
    const int code = test::finish_change(parameters, 0);
    authenticator.change(false);
    return code;
  };
}

// What is behind an operation that waits for the client to read is not done before it, though the
// client has read by then.
TEST_F(BareSessionTest, ChangesAreMadeInTheirOrderThoughTheFirstWasTurnedBack) {
  std::string order;
  backend.on_change = noting_first_letters(order);
  bind_as_root();
  for (int i = 0; i < 20; ++i) {
    order.clear();
    ASSERT_EQ(test::enter_at_once(host.gate()), Gate::Entry::inside);
    session->handle(test::delete_entry(2, "cn=a,cn=configuration"));
    session->handle(test::delete_entry(3, "cn=b,cn=configuration"));
    session->output().answered(OutputShare::kMark);
    host.leave_gate();
    const auto end = Clock::now() + 10s;
    while (session->posts() < 2 && Clock::now() < end) std::this_thread::yield();
    session->output().settled(OutputShare::kMark);
    session->handle(test::delete_entry(4, "cn=c,cn=configuration"));
    ASSERT_TRUE(session->run_until([this] { return session->idle(); }));
    EXPECT_EQ(order, "ABC");
    session->sent.clear();
    session->output_is(0);
  }
}

TEST_F(BareSessionTest, ChangesBehindOneThatIsHeldAreHeld) {
  std::string order;
  backend.on_change = noting_first_letters(order);
  bind_as_root();
  session->output().answered(OutputShare::kMark);
  session->handle(test::delete_entry(2, "cn=a,cn=configuration"));
  session->output_is(0);  // what waited is started later, when others had their turn
  session->output().settled(OutputShare::kMark);
  session->handle(test::delete_entry(3, "cn=b,cn=configuration"));
  ASSERT_TRUE(session->run_until([this] { return session->idle(); }));
  EXPECT_EQ(order, "AB");
}

TEST_F(BareSessionTest, RequestsBehindABindThatWaitedForWhatWasHeldAreHandled) {
  bind_as_root();
  session->output().answered(OutputShare::kMark);
  session->handle(test::search(2, kTop, 0));
  session->handle(test::bind(3, "", ""));
  EXPECT_FALSE(session->idle());
  session->resumed = 0;
  session->output().settled(OutputShare::kMark);
  session->output_is(0);
  session->run_posted();
  EXPECT_TRUE(session->idle());
  EXPECT_GT(session->resumed, 0);
}

TEST_F(BareSessionTest, BindWhoseOutcomeCannotBePostedIsPickedUpLater) {
  session->fail_to_post(1);
  session->handle(test::bind(1, kRoot, kSecret));
  ASSERT_TRUE(session->run_until([this] { return session->idle(); }));
  EXPECT_EQ(session->failed_posts(), 1);
  EXPECT_EQ(result_in(session->sent).code, 0);
}

TEST_F(BareSessionTest, OperationWhoseEndCannotBePostedIsPickedUpLater) {
  bind_as_root();
  session->fail_to_post(1);
  session->handle(test::delete_entry(2, kTop));
  ASSERT_TRUE(session->run_until([this] { return session->idle(); }));
  EXPECT_EQ(session->failed_posts(), 1);
  EXPECT_EQ(result_in(session->sent).code, 53);
}

TEST_F(BareSessionTest, AdmissionThatCannotBePostedKeepsTheGateAndIsPickedUpLater) {
  bind_as_root();
  ASSERT_EQ(test::enter_at_once(host.gate()), Gate::Entry::inside);
  session->handle(test::search(2, kTop));
  EXPECT_FALSE(session->idle());
  session->fail_to_post(1);
  host.gate().leave();
  ASSERT_TRUE(session->run_until([this] { return session->idle(); }));
  EXPECT_EQ(session->failed_posts(), 1);
  EXPECT_EQ(result_in(session->sent).code, 0);
  EXPECT_TRUE(host.gate().close_and_wait_until_empty(1s));
}

// Some clients throw away what they have not read when they find the connection ended.
TEST_F(BareSessionTest, WhoChangedTheirOwnRightsHaveTimeToReadTheAnswerAndNothingElse) {
  bind_as_root();
  backend.on_change = taking_the_rights_away(authenticator);
  session->handle(test::modify(2, kTop, "description", "x"));
  ASSERT_TRUE(session->run_until([this] { return session->idle(); }));
  EXPECT_EQ(result_in(session->sent).code, 0);
  session->tick();
  EXPECT_FALSE(session->ended);
  const auto calls = backend.calls(parameter::search_function);
  session->handle(test::search(3, kTop));
  EXPECT_TRUE(session->ended);
  EXPECT_EQ(backend.calls(parameter::search_function), calls);
}

TEST_F(BareSessionTest, WhoChangedTheirOwnRightsAreDisconnectedAMomentLater) {
  bind_as_root();
  backend.on_change = taking_the_rights_away(authenticator);
  session->handle(test::modify(2, kTop, "description", "x"));
  EXPECT_TRUE(session->run_until([this] { return session->ended; }));
}

class FullServerTest : public BareSessionTest {
 protected:
  FullServerTest() : BareSessionTest(4096) {
    backend.on_search = [](pblock* parameters) {
      const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION", 3000);
      const int code = test::send_test_entry(parameters, *entry);
      return test::finish_search(parameters, code, 1);
    };
  }
  int code_of(int id) { return code_of_request(test::search(id, kTop)); }
  int code_of_request(const std::string& request) {
    session->sent.clear();
    session->handle(request);
    EXPECT_TRUE(session->run_until([this] { return session->idle(); }));
    return session->sent.size() > 1000 ? 0 : result_in(session->sent).code;
  }
};

TEST_F(FullServerTest, SearchGetsWhatIsLeftOfTheCeilingAndIsRefusedWhenNothingIs) {
  bind_as_root();
  EXPECT_EQ(code_of(2), 0);
  EXPECT_EQ(code_of(3), 11);  // the client has not read the first
  OutputShare other(services.output);
  other.answered(4096);
  EXPECT_EQ(code_of(4), 51);
  other.settled(4096);
  session->sent.clear();
  session->output_is(0);
  EXPECT_EQ(code_of(5), 0);
}

TEST_F(FullServerTest, CopiesOfAnEntryGetHalfOfWhatIsLeftEach) {
  services.supported_controls = {kPreReadOid};
  bind_as_root();
  const std::string wish =
      tlv(0x30, tlv(0x04, kPreReadOid) + tlv(0x01, "\xFF") + tlv(0x04, tlv(0x30, "")));
  const std::string plain = test::delete_entry(2, kTop);
  const std::string reading = test::message(2, operation_in(plain), wish);
  EXPECT_EQ(code_of_request(reading), 11);
  EXPECT_EQ(backend.calls(parameter::delete_function), 0);
  OutputShare other(services.output);
  other.answered(4096);
  EXPECT_EQ(code_of_request(reading), 51);
  EXPECT_EQ(code_of_request(plain), 53);  // as the backend answers
}

}  // namespace
}  // namespace orv::server
