// Limits on what clients may send, hold and leave unread: each before a bind and for the primary
// administrator, with the line that the error log gets.
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <vector>

#include "../temporary_directory.h"
#include "core_server_fixture.h"
#include "cut_off_log.h"
#include "descriptor.h"
#include "net/limits.h"
#include "net/pace.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using orv::test::TemporaryDirectory;
using test::kNotice;
using test::kTop;
using test::Reply;
using test::WireClient;

int count(const std::string& text, const std::string& part) {
  int found = 0;
  for (auto at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) ++found;
  return found;
}

class LimitedServer : public test::LoopbackServer {
 protected:
  LimitedServer() {
    settings.error_log = folder.file("error.log");
    settings.error_log_level = "info";
  }
  ~LimitedServer() override { stop(); }

  // What the error log holds once the server has stopped.
  std::string log() {
    stop();
    return folder.read("error.log");
  }

  const TemporaryDirectory folder{"/tmp"};  // the path of a socket is short
};

// ---- what is in force whoever the client is

enum class Who { stranger, administrator };

class Limits : public LimitedServer, public testing::WithParamInterface<Who> {
 protected:
  std::unique_ptr<WireClient> connect() {
    auto client = std::make_unique<WireClient>(port());
    if (GetParam() == Who::administrator) bind_as_root(*client);
    return client;
  }
  // The client is told so, loses its connection, the log has a line, and others are served.
  void expect_cut_off(WireClient& client, const std::string& why) {
    const std::optional<Reply> notice = client.receive();
    ASSERT_TRUE(notice);
    EXPECT_EQ(notice->id, 0);
    EXPECT_EQ(notice->tag, kNotice);
    EXPECT_NE(notice->body.find(why), std::string::npos) << notice->body;
    EXPECT_TRUE(client.closed());
    WireClient other(port());
    EXPECT_EQ(code_of(other, test::search(1, "")), 0);
    EXPECT_EQ(count(log(), why + ": closed 127.0.0.1:"), 1);
  }
};

INSTANTIATE_TEST_SUITE_P(Of, Limits, testing::Values(Who::stranger, Who::administrator),
                         [](const auto& info) {
                           return info.param == Who::stranger ? "Strangers" : "Administrators";
                         });

TEST_P(Limits, MessageThatIsTooBigEndsTheConnection) {
  settings.max_message_size = 1024;
  start();
  const auto client = connect();
  client->send(test::search(2, std::string(2000, 'x')).substr(0, 20));
  expect_cut_off(*client, "message too big: more than 1024 bytes (orv-slapdMaxMessageSize)");
}

TEST_P(Limits, MessageThatIsNotFinishedInTimeEndsTheConnection) {
  settings.message_timeout = 1;
  start();
  const auto client = connect();
  client->send(test::search(2, "").substr(0, 10));
  expect_cut_off(*client, "message not finished in time");
}

// A byte now and then is no progress: the deadline is that of the whole message.
TEST_P(Limits, MessageThatTricklesInEndsTheConnectionInTime) {
  settings.message_timeout = 1;
  start();
  const auto client = connect();
  const std::string request = test::search(2, std::string(200, 'x'));
  const auto begun = Clock::now();
  std::size_t sent = 0;
  while (sent + 1 < request.size() && Clock::now() - begun < 5s) {
    if (::send(client->descriptor(), &request[sent], 1, MSG_NOSIGNAL) != 1) break;
    ++sent;
    char byte = 0;
    timeval pause{0, 50000};
    ::setsockopt(client->descriptor(), SOL_SOCKET, SO_RCVTIMEO, &pause, sizeof pause);
    if (::recv(client->descriptor(), &byte, 1, MSG_PEEK) >= 0) break;  // told or closed
  }
  EXPECT_LT(sent, request.size() / 2);
  timeval patience{10, 0};
  ::setsockopt(client->descriptor(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  expect_cut_off(*client, "message not finished in time");
}

TEST_P(Limits, IdleConnectionIsEndedWithANotice) {
  settings.idle_timeout = 1;
  start();
  const auto client = connect();
  const std::optional<Reply> notice = client->receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
  EXPECT_TRUE(client->closed());
}

TEST_P(Limits, WhatAMessageHoldsTooMuchOfIsRefusedAndTheConnectionGoesOn) {
  settings.max_filter_depth = 3;
  settings.max_filter_items = 4;
  settings.max_controls = 2;
  settings.max_attributes = 2;
  settings.max_values = 2;
  controls = {"1.2.3"};
  start();
  const auto client = connect();
  const auto filtered = [](int id, const std::string& filter) {
    using test::integer;
    using test::tlv;
    return test::message(id,
                         tlv(0x63, tlv(0x04, "") + tlv(0x0A, std::string(1, '\0')) +
                                       tlv(0x0A, std::string(1, '\0')) + integer(0) + integer(0) +
                                       tlv(0x01, std::string(1, '\0')) + filter + tlv(0x30, "")));
  };
  const std::string present = test::tlv(0x87, "objectClass");
  const auto negated = [](std::string inner, int times) {
    for (int i = 0; i < times; ++i) inner = test::tlv(0xA2, inner);
    return inner;
  };
  const auto any_of = [&](int parts) {
    std::string all;
    for (int i = 0; i < parts; ++i) all += present;
    return test::tlv(0xA1, all);
  };
  const auto entry = [](int id, int attributes, int values) {
    using test::tlv;
    std::string set;
    for (int i = 0; i < values; ++i) set += tlv(0x04, "v" + std::to_string(i));
    std::string list;
    for (int i = 0; i < attributes; ++i)
      list += tlv(0x30, tlv(0x04, "cn;x-" + std::to_string(i)) + tlv(0x31, set));
    return test::message(id, tlv(0x68, tlv(0x04, "cn=nobody") + tlv(0x30, list)));
  };
  const std::string search = test::search(9, "");
  const auto controlled = [&](int how_many) {
    std::string list;
    for (int i = 0; i < how_many; ++i) list += test::control("1.2.3", false);
    // The operation of `search`, which has a short header and a short id.
    return test::message(9, search.substr(5), list);
  };
  EXPECT_EQ(code_of(*client, filtered(2, negated(present, 2))), 0);
  EXPECT_EQ(code_of(*client, filtered(3, negated(present, 3))), 11);
  EXPECT_EQ(code_of(*client, filtered(4, any_of(3))), 0);
  EXPECT_EQ(code_of(*client, filtered(5, any_of(4))), 11);
  EXPECT_EQ(code_of(*client, entry(6, 2, 1)), 32);
  EXPECT_EQ(code_of(*client, entry(7, 3, 1)), 11);
  EXPECT_EQ(code_of(*client, entry(8, 1, 3)), 11);
  EXPECT_EQ(code_of(*client, controlled(2)), 0);
  EXPECT_EQ(code_of(*client, controlled(3)), 11);
  EXPECT_EQ(code_of(*client, test::search(10, "")), 0);
}

TEST_P(Limits, ReaderThatDoesNotReadIsCutOffAndNobodyElseWaits) {
  settings.write_timeout = 1;
  start();
  const auto client = connect();
  const int small = 4096;
  ::setsockopt(client->descriptor(), SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
  // Asks for the schema again and again.
  std::string requests;
  for (int i = 0; i < 64; ++i) requests += test::search(100 + i, "cn=subschema");
  WireClient other(port());
  ASSERT_EQ(code_of(other, test::search(1, "")), 0);
  std::size_t at = 0;
  const auto end = Clock::now() + 300s;  // a sanitizer takes long to make what fills all buffers
  while (server->connections() > 1 && Clock::now() < end) {
    ASSERT_EQ(code_of(other, test::search(1, "")), 0);
    const ssize_t sent = ::send(client->descriptor(), requests.data() + at, requests.size() - at,
                                MSG_DONTWAIT | MSG_NOSIGNAL);
    if (sent > 0) at = (at + static_cast<std::size_t>(sent)) % requests.size();
  }
  EXPECT_EQ(server->connections(), 1);
  EXPECT_EQ(count(log(), "does not read its answers: closed 127.0.0.1:"), 1);
}

// ---- while nobody is bound

TEST_F(LimitedServer, StrangersMessagesAreSmallerAndABindLiftsThat) {
  settings.max_unauthenticated_message_size = 1024;
  start();
  const std::string large = test::search(2, "cn=" + std::string(2000, 'x'));
  WireClient administrator(port());
  bind_as_root(administrator);
  EXPECT_EQ(code_of(administrator, large), 32);
  WireClient stranger(port());
  stranger.send(large);
  const std::optional<Reply> notice = stranger.receive();
  ASSERT_TRUE(notice);
  EXPECT_NE(notice->body.find("orv-slapdMaxUnauthenticatedMessageSize"), std::string::npos);
  EXPECT_TRUE(stranger.closed());
  // Who is anonymous again is held to it again.
  administrator.send(test::bind(3, "", ""));
  ASSERT_EQ(administrator.receive()->code, 0);
  administrator.send(large);
  EXPECT_EQ(administrator.receive()->tag, kNotice);
}

TEST_F(LimitedServer, ConnectionOnWhichNobodyBindsInTimeIsEnded) {
  settings.unauthenticated_timeout = 1;
  start();
  WireClient administrator(port());
  bind_as_root(administrator);
  WireClient stranger(port());
  // However busy it is.
  std::optional<Reply> reply;
  const auto end = Clock::now() + 10s;
  do {
    stranger.send(test::search(1, ""));
    reply = stranger.receive_result().back();
  } while (reply->tag != kNotice && Clock::now() < end);
  EXPECT_EQ(reply->tag, kNotice);
  EXPECT_NE(reply->body.find("nobody bound for too long"), std::string::npos);
  EXPECT_EQ(code_of(administrator, test::search(2, "")), 0);
  // Who is anonymous again has as long again.
  administrator.send(test::bind(3, "", ""));
  ASSERT_EQ(administrator.receive()->code, 0);
  EXPECT_EQ(code_of(administrator, test::search(4, "")), 0);
  EXPECT_EQ(administrator.receive()->tag, kNotice);
}

TEST_F(LimitedServer, ConnectionOnWhichOneBindFailsAfterTheOtherIsEnded) {
  settings.unauthenticated_timeout = 1;
  settings.bind_timeout = 1;
  // Slower than the client, so that its next bind is always here already.
  authenticator.meanwhile = [](std::string_view) {
    const auto end = Clock::now() + 20ms;
    while (Clock::now() < end) std::this_thread::yield();
  };
  start();
  WireClient stranger(port());
  int id = 0;
  const auto send_one = [&] {
    id = id % 100 + 1;
    stranger.send(test::bind(id, test::kRoot, "wrong"));
  };
  send_one();
  std::optional<Reply> reply;
  const auto begun = Clock::now();
  do {
    send_one();
    reply = stranger.receive();
  } while (reply && reply->tag != kNotice && Clock::now() - begun < 8s);
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->tag, kNotice);
  EXPECT_NE(reply->body.find("nobody bound for too long"), std::string::npos);
  EXPECT_GE(Clock::now() - begun, 1500ms);  // a bind that is under way is waited for
}

// ---- readers

TEST(Pace, ReaderWithoutProgressIsTooSlow) {
  const Clock::time_point start{};
  Pace pace;
  pace.begin(start);
  EXPECT_FALSE(pace.too_slow(start + 29s, 30, 0));
  EXPECT_TRUE(pace.too_slow(start + 30s, 30, 0));
  pace.took(1, start + 29s);
  EXPECT_FALSE(pace.too_slow(start + 58s, 30, 0));
  EXPECT_TRUE(pace.too_slow(start + 59s, 30, 0));
}

TEST(Pace, ReaderThatTakesALittleNowAndThenIsTooSlow) {
  const Clock::time_point start{};
  Pace pace;
  pace.begin(start);
  for (int second = 10; second < 30; second += 10) pace.took(100, start + 1s * second);
  EXPECT_FALSE(pace.too_slow(start + 29s, 30, 100));
  EXPECT_TRUE(pace.too_slow(start + 30s, 30, 100));
}

TEST(Pace, ReaderThatKeepsTheRateIsNotHoweverLongItTakes) {
  const Clock::time_point start{};
  Pace pace;
  pace.begin(start);
  for (int second = 1; second <= 3600; ++second) {
    pace.took(100, start + 1s * second);
    ASSERT_FALSE(pace.too_slow(start + 1s * second, 30, 100)) << second;
  }
  // What it took beyond the rate before does not count for later.
  EXPECT_TRUE(pace.too_slow(start + 3630s, 30, 100));
}

TEST_F(LimitedServer, ReaderThatTakesALittleNowAndThenIsCutOff) {
  settings.write_timeout = 1;
  settings.min_read_rate = 64 << 20;
  backend.on_search = [](pblock* parameters) {
    const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION", 1 << 20);
    int code = 0;
    int sent = 0;
    for (; code == 0 && sent < 48; ++sent) code = test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, code, sent);
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  client.send(test::search(2, kTop));
  // It goes on reading, a megabyte within a tenth of a second at most.
  std::vector<char> into(100000);
  const timeval patience{10, 0};
  ::setsockopt(client.descriptor(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  const auto end = Clock::now() + 10s;
  auto next = Clock::now();
  ssize_t got = 1;
  std::size_t all = 0;
  while (got > 0 && Clock::now() < end) {
    if (Clock::now() < next) continue;
    next = Clock::now() + 10ms;
    got = ::recv(client.descriptor(), into.data(), into.size(), 0);
    if (got > 0) all += static_cast<std::size_t>(got);
  }
  EXPECT_LE(got, 0);
  EXPECT_LT(all, std::size_t{48} << 20);
  EXPECT_EQ(count(log(), "does not read its answers: closed"), 1);
}

// ---- connections

TEST(CountedAs, OneIpv4AddressAndOneIpv6NetworkOf64Bits) {
  const auto counted = [](const char* address) {
    return counted_as(asio::ip::make_address(address));
  };
  EXPECT_EQ(counted("192.0.2.1"), "192.0.2.1");
  EXPECT_NE(counted("192.0.2.1"), counted("192.0.2.2"));
  EXPECT_EQ(counted("2001:db8:1:2::1"), counted("2001:db8:1:2:ffff:ffff:ffff:ffff"));
  EXPECT_NE(counted("2001:db8:1:2::1"), counted("2001:db8:1:3::1"));
  EXPECT_NE(counted("::1"), counted("2001:db8::1"));
  // Every host on the link has an address of this one.
  EXPECT_NE(counted("fe80::1"), counted("fe80::2"));
}

// Lowers the limit of open files for a while.
class FewerFiles {
 public:
  explicit FewerFiles(rlim_t most) {
    ::getrlimit(RLIMIT_NOFILE, &before_);
    rlimit lower = before_;
    lower.rlim_cur = std::min(most, before_.rlim_max);
    ::setrlimit(RLIMIT_NOFILE, &lower);
  }
  ~FewerFiles() { ::setrlimit(RLIMIT_NOFILE, &before_); }

 private:
  rlimit before_{};
};

TEST(ConnectionsThatFit, LeaveDescriptorsForOtherFiles) {
  {
    const FewerFiles limit(1024);
    EXPECT_GT(connections_that_fit(), 512);
    EXPECT_LT(connections_that_fit(), 1024 - 64);
  }
  const FewerFiles limit(64);
  EXPECT_EQ(connections_that_fit(), 0);
}

TEST_F(LimitedServer, ConnectionsThatDoNotFitAreRefusedBeforeDescriptorsRunOut) {
  start();
  WireClient kept(port());
  bind_as_root(kept);
  {
    const FewerFiles limit(64);
    WireClient beyond(port());
    const std::optional<Reply> notice = beyond.receive();
    ASSERT_TRUE(notice);
    EXPECT_EQ(notice->code, 51);
    EXPECT_TRUE(beyond.closed());
    EXPECT_EQ(code_of(kept, test::search(2, kTop)), 0);
  }
  WireClient again(port());
  EXPECT_EQ(code_of(again, test::search(1, "")), 0);
}

// A socket that has a descriptor already and connects later.
class LateClient {
 public:
  LateClient() : socket_(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    timeval patience{10, 0};
    ::setsockopt(socket_.number(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  }
  bool connect(std::uint16_t port) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    return ::connect(socket_.number(), reinterpret_cast<const sockaddr*>(&address),
                     sizeof address) == 0;
  }
  // All that comes until the server closes the connection.
  std::string rest() {
    std::string all;
    char bytes[512];
    ssize_t got = 0;
    while ((got = ::recv(socket_.number(), bytes, sizeof bytes, 0)) > 0)
      all.append(bytes, static_cast<std::size_t>(got));
    return got == 0 ? all : "not closed";
  }

 private:
  Descriptor socket_;
};

double processor_seconds() {
  timespec now{};
  ::clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

// Every descriptor that the process may open, up to a limit that is soon reached.
class AllDescriptors {
 public:
  AllDescriptors() : limit_(400) {
    for (Descriptor next(::dup(0)); next; next = Descriptor(::dup(0)))
      taken_.push_back(std::move(next));
  }

 private:
  const FewerFiles limit_;
  std::vector<Descriptor> taken_;
};

TEST_F(LimitedServer, ClientsForWhomNoDescriptorIsLeftAreToldAndOthersAreServedLater) {
  start();
  WireClient kept(port());
  bind_as_root(kept);
  std::vector<LateClient> clients(50);
  {
    const AllDescriptors all;
    const double before = processor_seconds();
    const auto begun = Clock::now();
    for (LateClient& client : clients) ASSERT_TRUE(client.connect(port()));
    for (LateClient& client : clients)
      EXPECT_NE(client.rest().find("no descriptor is left"), std::string::npos);
    EXPECT_EQ(code_of(kept, test::search(2, kTop)), 0);
    // One more keeps the listener busy; it rests between its attempts.
    EXPECT_EQ(code_of(kept, test::search(3, kTop)), 0);
    const double elapsed = std::chrono::duration<double>(Clock::now() - begun).count();
    EXPECT_LT(processor_seconds() - before, 0.5 + elapsed / 2);
  }
  // The server may still be looking for another client to turn away.
  const auto end = Clock::now() + 10s;
  int code = 51;
  while (code == 51 && Clock::now() < end) {
    WireClient after(port());
    code = code_of(after, test::search(1, ""));
  }
  EXPECT_EQ(code, 0);
  const std::string lines = log();
  EXPECT_GE(count(lines, "cannot accept a connection"), 1);
  EXPECT_LE(count(lines, "cannot accept a connection"), CutOffLog::kLines);
}

// Those who open files at that moment may get the descriptor by which clients are told.
TEST_F(LimitedServer, ClientsAreToldThatNoDescriptorIsLeftWhateverElseIsOpened) {
  start();
  WireClient first(port());
  ASSERT_EQ(code_of(first, test::search(1, "")), 0);  // it accepts
  std::vector<LateClient> clients(20);
  const AllDescriptors all;
  std::atomic<bool> enough{false};
  std::thread opener([&] {
    while (!enough) Descriptor(::dup(0)).close();
  });
  for (LateClient& client : clients) {
    EXPECT_TRUE(client.connect(port()));
    const std::string rest = client.rest();
    EXPECT_NE(rest.find("no descriptor is left"), std::string::npos) << rest;
    if (HasFailure()) break;
  }
  enough = true;
  opener.join();
}

// Clients of the Unix socket wait for the next descriptor instead: among them is who administers
// the server.
class LocalLateClient final : public WireClient {
 public:
  LocalLateClient() { socket_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0); }
  bool connect(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    return ::connect(socket_, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
  }
};

TEST_F(LimitedServer, ClientOfTheUnixSocketWaitsForADescriptor) {
  more.local_socket = folder.file("ldapi");
  start();
  WireClient first(port());
  ASSERT_EQ(code_of(first, test::search(1, "")), 0);  // it accepts
  LocalLateClient local;
  LateClient turned_away;
  {
    const AllDescriptors all;
    ASSERT_TRUE(local.connect(more.local_socket));
    local.send(test::search(1, ""));
    ASSERT_TRUE(turned_away.connect(port()));
    EXPECT_NE(turned_away.rest().find("no descriptor is left"), std::string::npos);
  }
  EXPECT_EQ(local.receive_result().back().code, 0);
}

// ---- the log

class CutOffLines : public testing::Test {
 protected:
  CutOffLines() {
    Settings settings;
    settings.error_log = folder.file("error.log");
    logs.open(settings);
  }
  std::string text() {
    logs.finish();
    return folder.read("error.log");
  }

  const TemporaryDirectory folder;
  Logs logs;
  CutOffLog lines{logs};
  const Clock::time_point start = Clock::time_point{} + 1h;
};

TEST_F(CutOffLines, AreBoundedForEachKindAndTheRestIsCounted) {
  for (int i = 0; i < 1000; ++i) lines.tell(CutOff::connections, "not let in", start);
  lines.tell(CutOff::message, "too big", start);
  lines.tick(start + 59s);
  lines.tick(start + 60s);
  lines.tick(start + 61s);
  const std::string all = text();
  EXPECT_EQ(count(all, "not let in\n"), CutOffLog::kLines);
  EXPECT_EQ(count(all, "too big"), 1);
  EXPECT_EQ(count(all, "also 990 connections that were refused"), 1);
  EXPECT_EQ(count(all, "\n"), CutOffLog::kLines + 2);
}

TEST_F(CutOffLines, AreWrittenAgainInTheNextInterval) {
  for (int i = 0; i < 100; ++i) lines.tell(CutOff::output, "first", start);
  lines.tell(CutOff::output, "second", start + 60s);
  const std::string all = text();
  EXPECT_EQ(count(all, "first"), CutOffLog::kLines);
  EXPECT_EQ(count(all, "also 90 clients that did not read"), 1);
  EXPECT_EQ(count(all, "second"), 1);
}

TEST_F(LimitedServer, FloodOfRefusedConnectionsDoesNotFloodTheLog) {
  settings.max_connections = 1;
  start();
  WireClient kept(port());
  EXPECT_EQ(code_of(kept, test::search(1, "")), 0);
  for (int i = 0; i < 300; ++i) EXPECT_EQ(WireClient(port()).receive()->code, 51);
  EXPECT_EQ(code_of(kept, test::search(2, "")), 0);
  EXPECT_EQ(count(log(), "too many connections: refused"), CutOffLog::kLines);
}

}  // namespace
}  // namespace orv::server
