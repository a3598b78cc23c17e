// The server over loopback sockets, with a backend that does what the test says.
#include "server.h"

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/un.h>

#include <atomic>
#include <csignal>
#include <cstddef>
#include <cstring>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>

#include "core_searched_file.h"
#include "core_server_fixture.h"
#include "descriptor.h"
#include "process/service_manager.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using test::Event;
using test::kMember;
using test::kNotice;
using test::kRoot;
using test::kSecret;
using test::kTop;
using test::Reply;
using test::WireClient;

class ServerTest : public test::LoopbackServer {
 protected:
  ServerTest() { loops = 2; }
};

// ---- who gets in

TEST_F(ServerTest, CallersWithoutAccessAreRefusedBeforeTheBackendIsEntered) {
  start();
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::search(1, kTop)), 50);
  EXPECT_EQ(code_of(client, test::delete_entry(2, kTop)), 50);
  EXPECT_EQ(code_of(client, test::add_entry(3, "cn=x,cn=configuration", "cn", "x")), 50);
  EXPECT_EQ(code_of(client, test::modify(4, kTop, "cn", "x")), 50);
  for (const int handler : {parameter::search_function, parameter::add_function,
                            parameter::delete_function, parameter::modify_function})
    EXPECT_EQ(backend.calls(handler), 0) << handler;
}

TEST_F(ServerTest, HandlersGetTheNormalisedTargetAndTheCallersAuthority) {
  std::string target;
  unsigned flags = 0;
  unsigned roles = 0;
  std::string bound;
  unsigned connection_flags = 0;
  backend.on_search = [&](pblock* parameters) {
    target = test::target_of(parameters);
    const Operation* const operation = test::operation_of(parameters);
    flags = operation->authority;
    roles = operation->roles;
    bound = operation->bound_dn;
    connection_flags = test::connection_of(parameters)->authority;
    return test::finish_search(parameters, 0, 0);
  };
  start();
  WireClient client(port());
  bind_as(client, kMember);
  EXPECT_EQ(code_of(client, test::search(2, "CN = a\\20b , 2.5.4.3=Configuration")), 0);
  EXPECT_EQ(target, "CN=A B,CN=CONFIGURATION");
  EXPECT_EQ(flags, 0x14U);
  EXPECT_EQ(connection_flags, 0x14U);
  EXPECT_EQ(roles, 0x20U);
  EXPECT_EQ(bound, "CN=MEMBER");
}

TEST_F(ServerTest, BindAnswersByWhatItProves) {
  backend.on_bind = [](pblock*) { return 49; };
  start();
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::bind(1, "", "")), 0);
  EXPECT_EQ(code_of(client, test::bind(2, kRoot, kSecret)), 0);
  EXPECT_EQ(code_of(client, test::bind(3, kRoot, "wrong")), 49);
  EXPECT_EQ(code_of(client, test::bind(4, kRoot, "")), 53);
  EXPECT_EQ(code_of(client, test::bind(5, "no dn", "x")), 34);
  EXPECT_EQ(code_of(client, test::sasl_bind(6, "PLAIN")), 7);
  EXPECT_EQ(backend.calls(parameter::bind_function), 0);
  EXPECT_EQ(code_of(client, test::bind(7, "cn=x,cn=configuration", kSecret)), 49);
  EXPECT_EQ(backend.calls(parameter::bind_function), 1);
}

TEST_F(ServerTest, FailedBindLeavesTheConnectionAnonymous) {
  start();
  for (const std::string& failing :
       {test::bind(3, kRoot, "wrong"), test::bind(3, kRoot, ""), test::sasl_bind(3, "PLAIN"),
        test::message(3, test::tlv(0x60, test::integer(2) + test::tlv(0x04, kRoot) +
                                             test::tlv(0x80, kSecret)))}) {
    WireClient client(port());
    bind_as(client, kRoot);
    EXPECT_EQ(code_of(client, test::search(2, kTop)), 0);
    EXPECT_NE(code_of(client, failing), 0);
    EXPECT_EQ(code_of(client, test::search(4, kTop)), 50);
  }
}

// ---- what is not offered

TEST_F(ServerTest, WhatIsNotOfferedIsRefusedAsTheProtocolSays) {
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  EXPECT_EQ(code_of(client, test::compare(2, kTop)), 53);
  EXPECT_EQ(code_of(client, test::extended(3, "1.2.3")), 2);
  EXPECT_EQ(code_of(client, test::search(4, "o=elsewhere")), 32);
  EXPECT_EQ(code_of(client, test::delete_entry(5, "o=elsewhere")), 32);
  EXPECT_EQ(code_of(client, test::delete_entry(6, "")), 53);
  EXPECT_EQ(code_of(client, test::search(7, "no dn")), 34);
  EXPECT_EQ(code_of(client, test::modify(8, kTop, "noSuchType", "x")), 17);
  EXPECT_EQ(code_of(client, test::modify(9, kTop, "cn", "\xC3(")), 21);
}

TEST_F(ServerTest, CriticalControlsMustBeKnown) {
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  const std::string request = test::tlv(0x4A, kTop);
  const std::string manage = test::control("2.16.840.1.113730.3.4.2", true);
  EXPECT_EQ(code_of(client, test::message(2, request, test::control("1.2.3", true))), 12);
  EXPECT_EQ(code_of(client, test::message(3, request, test::control("1.2.3", false))), 53);
  EXPECT_EQ(code_of(client, test::message(4, request, manage)), 53);
}

TEST_F(ServerTest, RootDseAndSubschemaAreReadableByEverybody) {
  start();
  WireClient client(port());
  for (const char* base : {"", "cn=subschema"}) {
    client.send(test::search(1, base));
    const std::vector<Reply> replies = client.receive_result();
    ASSERT_EQ(replies.size(), 2U) << base;
    EXPECT_EQ(replies[0].tag, 0x64);
    EXPECT_EQ(replies[1].code, 0);
  }
  EXPECT_EQ(code_of(client, test::search(2, "", 2)), 32);
}

// ---- results

TEST_F(ServerTest, HandlerThatSentNothingIsAnsweredWithItsCode) {
  backend.on_change = [](pblock*) { return 32; };
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  EXPECT_EQ(code_of(client, test::delete_entry(2, kTop)), 32);
  backend.on_search = [](pblock*) { return 0; };
  EXPECT_EQ(code_of(client, test::search(3, kTop)), 80);
}

TEST_F(ServerTest, SizeLimitIsTheStricterOfTheClientsAndTheServers) {
  backend.on_search = [](pblock* parameters) {
    const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION");
    int code = 0;
    int sent = 0;
    for (; code == 0 && sent < 100; ++sent) code = test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, code, sent);
  };
  settings.size_limit = 5;
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  for (const auto& [asked, sent] : {std::pair{0, 5}, {3, 3}, {50, 5}}) {
    client.send(test::search(2, kTop, 2, asked));
    const std::vector<Reply> replies = client.receive_result();
    EXPECT_EQ(static_cast<int>(replies.size()) - 1, sent);
    EXPECT_EQ(replies.back().code, 4);
  }
}

TEST_F(ServerTest, ChangesRunOneAtATimeWithSearches) {
  start();
  std::vector<std::thread> threads;
  std::atomic<int> answered{0};
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&, t] {
      WireClient client(port());
      bind_as(client, kRoot);
      for (int i = 2; i < 102; ++i) {
        const int code =
            code_of(client, (i + t) % 2 ? test::search(i, kTop) : test::delete_entry(i, kTop));
        if (code == ((i + t) % 2 ? 0 : 53)) ++answered;
      }
    });
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(answered.load(), 400);
  EXPECT_EQ(backend.most_inside(), 1);
}

TEST_F(ServerTest, PipelinedRequestsAreAllAnsweredInOrder) {
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  std::string all;
  for (int i = 2; i < 502; ++i) all += test::search(i, kTop);
  client.send(all);
  for (int i = 2; i < 502; ++i) {
    const std::optional<Reply> reply = client.receive();
    ASSERT_TRUE(reply);
    ASSERT_EQ(reply->id, i);
  }
}

// ---- waiting, abandoning, leaving

class BlockedServerTest : public test::BlockedServer {
 protected:
  BlockedServerTest() { loops = 2; }
};

TEST_F(BlockedServerTest, BindWaitsUntilNothingIsOutstandingAndLaterRequestsWaitForIt) {
  block();
  WireClient& client = *holder;
  const int asked = authenticator.asked;
  client.send(test::bind(3, kRoot, "wrong") + test::search(4, kTop));
  WireClient other(port());  // the loop goes round while the delete runs
  EXPECT_EQ(code_of(other, test::search(1, "")), 0);
  EXPECT_EQ(authenticator.asked, asked);
  go_on.happen();
  EXPECT_EQ(client.receive()->id, 2);
  EXPECT_EQ(client.receive()->code, 49);
  EXPECT_EQ(client.receive()->code, 50);
}

TEST_F(BlockedServerTest, WaitingOperationIsToldBusyAtItsDeadline) {
  settings.operation_wait = 1;
  block();
  WireClient client(port());
  bind_as(client, kRoot);
  EXPECT_EQ(code_of(client, test::search(2, kTop)), 51);
  EXPECT_EQ(backend.calls(parameter::search_function), 0);
}

TEST_F(BlockedServerTest, OthersAreServedWhileOneIsInsideTheBackend) {
  block();
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  EXPECT_EQ(code_of(client, test::search(2, kTop)), 50);
}

TEST_F(BlockedServerTest, AbandonedOperationThatWaitsIsDroppedUnserved) {
  block();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop));
  ASSERT_TRUE(wait_for_waiters(1));
  client.send(test::abandon(3, 2) + test::search(4, ""));
  const std::vector<Reply> replies = client.receive_result();
  EXPECT_EQ(replies.back().id, 4);
  EXPECT_EQ(server->backend().gate().waiting(), 0U);
  go_on.happen();
  EXPECT_EQ(holder->receive()->code, 53);
  EXPECT_EQ(backend.calls(parameter::search_function), 0);
}

TEST_F(BlockedServerTest, WaitingOperationOfAClientThatLeftIsDroppedUnserved) {
  block();
  {
    WireClient client(port());
    bind_as(client, kRoot);
    client.send(test::search(2, kTop));
    ASSERT_TRUE(wait_for_waiters(1));
  }
  EXPECT_TRUE(wait_for_waiters(0));
  go_on.happen();
  EXPECT_EQ(holder->receive()->code, 53);
  EXPECT_EQ(backend.calls(parameter::search_function), 0);
}

TEST_F(BlockedServerTest, ClientThatLeavesInMidOperationHarmsNobody) {
  backend.on_unbind = [&](pblock* parameters) {
    state_at_unbind = test::connection_of(parameters)->state.load();
    unbound.happen();
    return 0;
  };
  block();
  holder->close();
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  EXPECT_EQ(backend.calls(parameter::unbind_function), 0);  // not before the operation has ended
  go_on.happen();
  EXPECT_TRUE(unbound.wait());
  EXPECT_EQ(state_at_unbind.load(), 0);
}

TEST_F(BlockedServerTest, TooManyOutstandingOperationsWaitWithoutBeingRead) {
  settings.max_pending_operations = 2;
  block();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop) + test::search(3, kTop) + test::search(4, kTop));
  ASSERT_TRUE(wait_for_waiters(2));
  WireClient other(port());
  EXPECT_EQ(code_of(other, test::search(1, "")), 0);
  EXPECT_EQ(server->backend().gate().waiting(), 2U);
  go_on.happen();
  for (int id = 2; id <= 4; ++id) EXPECT_EQ(client.receive()->id, id);
}

TEST_F(BlockedServerTest, MessageIdStillInUseEndsTheConnectionWithANotice) {
  block();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop));
  ASSERT_TRUE(wait_for_waiters(1));
  client.send(test::search(2, ""));
  const std::optional<Reply> notice = client.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->id, 0);
  EXPECT_EQ(notice->tag, kNotice);
  EXPECT_EQ(notice->code, 2);
  EXPECT_TRUE(client.closed());
  EXPECT_TRUE(wait_for_waiters(0));
}

TEST_F(BlockedServerTest, MessageIdOfAnAbandonedOperationMayBeUsedAgain) {
  block();
  holder->send(test::abandon(3, 2) + test::search(2, ""));
  const std::vector<Reply> replies = holder->receive_result();
  ASSERT_FALSE(replies.empty());
  EXPECT_EQ(replies.back().id, 2);
  EXPECT_EQ(replies.back().code, 0);
}

TEST_F(ServerTest, UnbindHandlerIsCalledOnceForEachConnection) {
  backend.on_unbind = [&](pblock*) {
    unbound.happen();
    return 0;
  };
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop) + test::unbind(3));
  EXPECT_EQ(client.receive()->id, 2);
  EXPECT_TRUE(client.closed());
  EXPECT_TRUE(unbound.wait());
  stop();
  EXPECT_EQ(backend.calls(parameter::unbind_function), 1);
}

// A search in the library that goes on until it is interrupted. With scope 0 it runs on the loop.
class LongSearchTest : public ServerTest {
 protected:
  LongSearchTest() {
    backend.on_search = [this](pblock* parameters) {
      entered.happen();
      ended_with = file.search_until_interrupted();
      return test::finish_search(parameters, ended_with, 0);
    };
  }
  ~LongSearchTest() override { stop(); }

  test::SearchedFile file{200};
  Event entered;
  std::atomic<int> ended_with{-1};
};

TEST_F(LongSearchTest, EndsWhenItIsAbandonedThoughItsThreadIsBusy) {
  loops = 1;
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop));
  ASSERT_TRUE(entered.wait());
  client.send(test::abandon(3, 2) + test::search(4, ""));
  EXPECT_EQ(client.receive_result().back().id, 4);
  EXPECT_EQ(ended_with.load(), 3);
}

TEST_F(LongSearchTest, EndsWhenItsClientLeft) {
  backend.on_unbind = [&](pblock*) {
    unbound.happen();
    return 0;
  };
  loops = 1;
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop));
  ASSERT_TRUE(entered.wait());
  client.close();
  ASSERT_TRUE(unbound.wait());
  EXPECT_EQ(ended_with.load(), 3);
}

TEST_F(LongSearchTest, EndsAtItsTimeLimit) {
  loops = 1;
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  EXPECT_EQ(code_of(client, test::search(2, kTop, 2, 0, 1)), 3);
  EXPECT_EQ(ended_with.load(), 3);
}

TEST_F(LongSearchTest, EndsWhenTheServerStops) {
  loops = 1;
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop, 2));
  ASSERT_TRUE(entered.wait());
  stop();
  EXPECT_EQ(ended_with.load(), 3);
  EXPECT_EQ(status, 0);
}

// ---- bad input

TEST_F(ServerTest, MessageSentAByteAtATimeIsAnswered) {
  start();
  WireClient client(port());
  const std::string request = test::search(1, "");
  for (const char byte : request) client.send({&byte, 1});
  EXPECT_EQ(client.receive_result().size(), 2U);
}

TEST_F(ServerTest, MessageBeyondTheLimitEndsTheConnectionWithANotice) {
  settings.max_message_size = 2048;
  start();
  WireClient client(port());
  client.send(test::search(1, std::string(4096, 'x')));
  const std::optional<Reply> notice = client.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->id, 0);
  EXPECT_EQ(notice->tag, kNotice);
  EXPECT_EQ(notice->code, 2);
  EXPECT_TRUE(client.closed());
}

TEST_F(ServerTest, AnnouncedLengthAloneTakesNoMemoryAndIsRefused) {
  start();
  WireClient client(port());
  client.send("\x30\x84\x7F\xFF\xFF\xFF");
  EXPECT_EQ(client.receive()->tag, kNotice);
  EXPECT_TRUE(client.closed());
}

TEST_F(ServerTest, WhatIsNoLdapMessageEndsTheConnectionWithANotice) {
  start();
  for (const std::string& junk :
       {std::string("GET / HTTP/1.0\r\n\r\n"), std::string("\x30\x80", 2), std::string(64, '\xFF'),
        test::tlv(0x30, "\x04\x01x"), test::message(1, test::tlv(0x7F, ""))}) {
    WireClient client(port());
    client.send(junk);
    const std::optional<Reply> notice = client.receive();
    ASSERT_TRUE(notice);
    EXPECT_EQ(notice->tag, kNotice);
    EXPECT_EQ(notice->id, 0);
    EXPECT_TRUE(client.closed());
  }
}

TEST_F(ServerTest, TruncatedMessageAndAClientThatLeavesHarmNobody) {
  start();
  const std::string request = test::bind(1, kRoot, kSecret);
  for (std::size_t length = 1; length < request.size(); ++length) {
    WireClient client(port());
    client.send(request.substr(0, length));
  }
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
}

TEST_F(ServerTest, SlowSenderIsDisconnectedAndNobodyWaitsForHim) {
  settings.message_timeout = 1;
  loops = 1;
  start();
  WireClient slow(port());
  slow.send("\x30");
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  EXPECT_EQ(slow.receive()->tag, kNotice);
  EXPECT_TRUE(slow.closed());
}

TEST_F(ServerTest, IdleConnectionIsEndedWithANotice) {
  settings.idle_timeout = 1;
  start();
  WireClient client(port());
  EXPECT_EQ(client.receive()->tag, kNotice);
  EXPECT_TRUE(client.closed());
}

TEST_F(ServerTest, SlowReaderIsCutOffAndNobodyWaitsForHim) {
  settings.write_timeout = 1;
  backend.on_search = [](pblock* parameters) {
    const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION", 1 << 20);
    int code = 0;
    int sent = 0;
    for (; code == 0 && sent < 32; ++sent) code = test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, code, sent);
  };
  backend.on_unbind = [&](pblock*) {
    unbound.happen();
    return 0;
  };
  loops = 1;
  start();
  WireClient slow(port());
  bind_as(slow, kRoot);
  slow.send(test::search(2, kTop));
  WireClient client(port());
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  EXPECT_TRUE(unbound.wait());
}

TEST_F(ServerTest, ReaderWithAPauseGetsEverything) {
  backend.on_search = [](pblock* parameters) {
    const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION", 1 << 20);
    int sent = 0;
    for (; sent < 32; ++sent) test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, 0, sent);
  };
  loops = 1;
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop) + test::search(3, ""));
  WireClient other(port());
  EXPECT_EQ(code_of(other, test::search(1, "")), 0);
  EXPECT_EQ(client.receive_result().size(), 33U);
  EXPECT_EQ(client.receive_result().back().id, 3);
}

TEST_F(ServerTest, AnswerBeyondTheBudgetEndsWithAdminLimitExceeded) {
  settings.max_result_size = 4096;
  backend.on_search = [](pblock* parameters) {
    const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION", 1000);
    int code = 0;
    int sent = 0;
    for (; code == 0 && sent < 100; ++sent) code = test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, code, sent);
  };
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop));
  const std::vector<Reply> replies = client.receive_result();
  EXPECT_EQ(replies.size(), 4U);
  EXPECT_EQ(replies.back().code, 11);
}

TEST_F(ServerTest, ConnectionsBeyondTheLimitAreRefusedWithANotice) {
  settings.max_connections = 2;
  start();
  WireClient first(port());
  WireClient second(port());
  EXPECT_EQ(code_of(first, test::search(1, "")), 0);
  EXPECT_EQ(code_of(second, test::search(1, "")), 0);
  WireClient third(port());
  const std::optional<Reply> notice = third.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->code, 51);
  EXPECT_TRUE(third.closed());
  EXPECT_EQ(code_of(first, test::search(2, "")), 0);
}

TEST_F(ServerTest, ConnectionsOfOneAddressBeyondItsLimitAreRefusedAndOthersAreNot) {
  settings.max_connections_per_address = 1;
  start();
  std::optional<WireClient> first(std::in_place, "127.0.0.1", port(), "127.0.0.2");
  EXPECT_EQ(code_of(*first, test::search(1, "")), 0);
  WireClient second("127.0.0.1", port(), "127.0.0.2");
  const std::optional<Reply> notice = second.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
  EXPECT_EQ(notice->code, 51);
  EXPECT_TRUE(second.closed());
  WireClient elsewhere("127.0.0.1", port(), "127.0.0.3");
  EXPECT_EQ(code_of(elsewhere, test::search(1, "")), 0);
  // The place is free again once the first has left.
  first.reset();
  const auto end = Clock::now() + 10s;
  while (server->connections() != 1 && Clock::now() < end) std::this_thread::yield();
  WireClient third("127.0.0.1", port(), "127.0.0.2");
  EXPECT_EQ(code_of(third, test::search(1, "")), 0);
}

#ifdef ORV_HOST_HAS_IPV6
TEST_F(ServerTest, ListensOnAnIpv6AddressBesideAnIpv4One) {
  addresses = {"::1", "127.0.0.1"};
  start();
  EXPECT_EQ(server->url(), "ldap://[::1]:" + std::to_string(port()));
  for (const std::string& address : addresses) {
    WireClient client(address, port());
    EXPECT_EQ(code_of(client, test::search(1, "")), 0) << address;
  }
}

TEST_F(ServerTest, WithoutAddressesItListensOnAllOfTheHostIpv6Included) {
  addresses.clear();
  start();
  for (const char* const address : {"127.0.0.1", "127.0.0.2", "::1"}) {
    WireClient client(address, port());
    EXPECT_EQ(code_of(client, test::search(1, "")), 0) << address;
  }
}
#else
TEST_F(ServerTest, WithoutAddressesItListensOnAllOfAHostThatHasIpv4Alone) {
  addresses.clear();
  start();
  for (const char* const address : {"127.0.0.1", "127.0.0.2"}) {
    WireClient client(address, port());
    EXPECT_EQ(code_of(client, test::search(1, "")), 0) << address;
  }
}
#endif

TEST_F(ServerTest, AddressThatIsNotOfThisHostIsAnErrorThatNamesIt) {
  addresses = {"127.0.0.1"};
  start();
  std::string error;
  EXPECT_FALSE(server->listen({"192.0.2.1"}, 0, error));
  EXPECT_EQ(error,
            "cannot listen on 192.0.2.1 port 0: Cannot assign requested address; this host does "
            "not have the address, or not yet: see orv-slapdIpAddress");
}

TEST(ConnectionCounter, CountsInAllAndByAddressAndTakesTicketsBack) {
  ConnectionCounter counter;
  auto a1 = counter.admit("a", 3, 2);
  auto a2 = counter.admit("a", 3, 2);
  EXPECT_TRUE(a1);
  EXPECT_TRUE(a2);
  EXPECT_FALSE(counter.admit("a", 3, 2));
  auto b1 = counter.admit("b", 3, 2);
  EXPECT_TRUE(b1);
  EXPECT_FALSE(counter.admit("c", 3, 2));
  a1 = {};
  EXPECT_EQ(counter.count(), 2);
  EXPECT_TRUE(counter.admit("a", 3, 2));
  EXPECT_EQ(counter.count(), 2);
}

// ---- reload and stop

TEST_F(ServerTest, ReloadTakesNewLimitsOverForOpenConnections) {
  backend.on_search = [](pblock* parameters) {
    const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION");
    int code = 0;
    int sent = 0;
    for (; code == 0 && sent < 100; ++sent) code = test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, code, sent);
  };
  reload = [&](Settings& wanted) {
    wanted = settings;
    wanted.size_limit = 1;
    wanted.port = 1;  // needs a restart
    return true;
  };
  loops = 1;
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  EXPECT_EQ(code_of(client, test::search(2, kTop)), 0);
  std::raise(SIGHUP);
  const auto end = Clock::now() + 10s;
  int code = 0;
  while (code == 0 && Clock::now() < end) code = code_of(client, test::search(3, kTop));
  EXPECT_EQ(code, 4);
}

// What a service manager is sent.
class Notices {
 public:
  Notices() : socket_(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    const std::string name = "orv-notices-" + std::to_string(::getpid());
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path + 1, name.data(), name.size());
    const auto size = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + name.size());
    const timeval patience{10, 0};
    ::setsockopt(socket_.number(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    ::bind(socket_.number(), reinterpret_cast<const sockaddr*>(&address), size);
    ::setenv("NOTIFY_SOCKET", ("@" + name).c_str(), 1);
  }
  std::string next() {
    char text[512];
    const ssize_t size = ::recv(socket_.number(), text, sizeof text, 0);
    return size < 0 ? "nothing" : std::string(text, text + size);
  }

 private:
  Descriptor socket_;
};

TEST_F(ServerTest, ManagerHearsTheEndOfAReloadThatFails) {
  Notices notices;
  ServiceManager connected;
  std::string error;
  ASSERT_TRUE(connected.connect(error)) << error;
  manager = &connected;
  reload = [](Settings&) -> bool { throw std::runtime_error("no memory"); };
  start();
  EXPECT_TRUE(notices.next().starts_with("READY=1\n"));
  std::raise(SIGHUP);
  EXPECT_TRUE(notices.next().starts_with("RELOADING=1\n"));
  EXPECT_TRUE(notices.next().starts_with("READY=1\n"));
  stop();  // before the manager goes
}

TEST_F(BlockedServerTest, StopFinishesTheOperationInHandAndClosesTheBackend) {
  block();
  server->stop();
  WireClient* const client = &*holder;
  go_on.happen();
  control.join();
  EXPECT_EQ(status, 0);
  EXPECT_EQ(backend.closed(), 1);
  const std::optional<Reply> reply = client->receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 53);
  EXPECT_EQ(client->receive()->tag, kNotice);
}

TEST_F(ServerTest, StopTellsIdleClientsAndDoesNotWaitForThemToLeave) {
  start();
  WireClient idle(port());
  EXPECT_EQ(code_of(idle, test::search(1, "")), 0);
  // One that was told to leave before, and has not.
  WireClient parting(port());
  parting.send("not LDAP at all");
  EXPECT_EQ(parting.receive()->tag, kNotice);
  const auto begin = Clock::now();
  stop();
  EXPECT_LT(Clock::now() - begin, 1500ms);
  const std::optional<Reply> notice = idle.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
  EXPECT_EQ(notice->code, 52);
  EXPECT_TRUE(idle.closed());
  EXPECT_TRUE(parting.closed());
}

TEST_F(ServerTest, HandlerThatThrowsEndsTheServerWithAFailure) {
  backend.on_search = [](pblock*) -> int { throw 1; };
  start();
  WireClient client(port());
  bind_as(client, kRoot);
  client.send(test::search(2, kTop));
  control.join();
  EXPECT_EQ(status, 1);
  EXPECT_EQ(backend.closed(), 0);
}

}  // namespace
}  // namespace orv::server
