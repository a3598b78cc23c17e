// TLS on the port for it and by StartTLS: who is let in, what is never executed, and that nobody
// waits for those who are slow.
#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/stat.h>

#include <fstream>
#include <sstream>

#include "auth/certificate_map.h"
#include "core_searched_file.h"
#include "core_server_fixture.h"
#include "core_tls_client.h"
#include "net/tls.h"
#include "slapi/pblock.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using test::Certificates;
using test::kNotice;
using test::kRoot;
using test::kSecret;
using test::kTop;
using test::NamePart;
using test::Pair;
using test::Reply;
using test::TlsClient;
using test::TlsWish;
using test::WireClient;
using test::Wording;

constexpr const char* kStartTls = kStartTlsOid;
constexpr int kExtended = 0x78;

class TlsTest : public test::BlockedServer {
 protected:
  TlsTest() {
    own = certificates.self_signed("localhost");
    settings.tls.certificate_file = own.certificate;
    settings.tls.key_file = own.key;
    more.secure_port = 0;
  }
  // So that nobody is served while handlers of this class are gone.
  ~TlsTest() override {
    go_on.happen();
    stop();
  }

  std::uint16_t secure_port() const { return server->secure_port(); }

  static int start_tls(WireClient& client, int id = 1) {
    client.send(test::extended(id, kStartTls));
    const std::optional<Reply> reply = client.receive();
    return reply && reply->tag == kExtended ? reply->code : -1;
  }
  // Who is bound may delete; everybody else gets 50 from the server itself.
  static int try_delete(WireClient& client, int id) {
    return code_of(client, test::delete_entry(id, kTop));
  }
  void count_changes() {
    backend.on_change = [](pblock* parameters) { return test::finish_change(parameters, 53); };
  }
  int changes() const { return backend.calls(parameter::delete_function); }

  // The access log so far, when the server has stopped.
  std::string stop_and_read_log() {
    stop();
    std::ifstream file(log);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  void write_access_log() {
    log = certificates.path("access.log");
    settings.access_log = log;
    settings.access_log_level = "info";
  }

  Certificates certificates;
  Pair own;
  std::string log;
};

// ---- what works

TEST_F(TlsTest, PortForTlsServesClientsThatBeginWithIt) {
  count_changes();
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  bind_as_root(client);
  EXPECT_EQ(try_delete(client, 2), 53);
  EXPECT_EQ(changes(), 1);
}

TEST_F(TlsTest, StartTlsIsAnsweredInClearWithItsNameAndFollowedByTls) {
  count_changes();
  start();
  TlsClient client(port());
  client.send(test::extended(1, kStartTls));
  const std::optional<Reply> reply = client.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 0);
  EXPECT_NE(reply->body.find(kStartTls), std::string::npos);
  ASSERT_TRUE(client.shake_hands());
  bind_as_root(client);
  EXPECT_EQ(try_delete(client, 2), 53);
}

TEST_F(TlsTest, BothVersionsAndTheirCipherAreInTheAccessLog) {
  write_access_log();
  start();
  for (const int version : {TLS1_2_VERSION, TLS1_3_VERSION}) {
    TlsClient client(secure_port());
    ASSERT_TRUE(client.shake_hands({version, version}));
    EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  }
  const std::string text = stop_and_read_log();
  EXPECT_NE(text.find("TLS version=TLSv1.2 cipher=ECDHE-"), std::string::npos) << text;
  EXPECT_NE(text.find("TLS version=TLSv1.3 cipher=TLS_AES_256_GCM_SHA384 bits=256"),
            std::string::npos)
      << text;
}

TEST_F(TlsTest, LargeAnswerArrivesWholeThroughTls) {
  backend.on_search = [](pblock* parameters) {
    const EntryPtr entry = test::make_test_entry(kTop, 30000);
    for (int i = 0; i < 200; ++i) test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, 0, 200);
  };
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  bind_as_root(client);
  client.send(test::search(2, kTop));
  const std::vector<Reply> replies = client.receive_result();
  EXPECT_EQ(replies.size(), 201U);
  EXPECT_EQ(replies.back().code, 0);
}

TEST_F(TlsTest, ManyRequestsInOneRecordAreAllAnswered) {
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  std::string together;
  for (int id = 1; id <= 200; ++id) together += test::search(id, "");
  client.send(together);
  for (int id = 1; id <= 200; ++id) {
    const std::vector<Reply> replies = client.receive_result();
    ASSERT_FALSE(replies.empty()) << id;
    EXPECT_EQ(replies.back().id, id);
    EXPECT_EQ(replies.back().code, 0);
  }
}

// ---- StartTLS: what must not be (RFC 4511, 4.14; RFC 4513, 3.1)

TEST_F(TlsTest, StartTlsForgetsWhoWasBoundInClear) {
  count_changes();
  start();
  TlsClient client(port());
  bind_as_root(client);
  EXPECT_EQ(try_delete(client, 2), 53);
  EXPECT_EQ(start_tls(client, 3), 0);
  ASSERT_TRUE(client.shake_hands());
  EXPECT_EQ(try_delete(client, 4), 50);
  EXPECT_EQ(changes(), 1);
}

TEST_F(TlsTest, WhatFollowsAStartTlsRequestInClearIsNeverExecuted) {
  count_changes();
  start();
  const std::string requests[] = {test::delete_entry(3, kTop), test::bind(3, kRoot, kSecret),
                                  test::search(3, ""), test::unbind(3), std::string(1, '\x30')};
  for (const std::string& behind : requests) {
    TlsClient client(port());
    bind_as_root(client);
    client.send(test::extended(2, kStartTls) + behind);
    const std::optional<Reply> notice = client.receive();
    ASSERT_TRUE(notice);
    EXPECT_EQ(notice->id, 0);
    EXPECT_EQ(notice->tag, kNotice);
    EXPECT_EQ(notice->code, 2);
    EXPECT_TRUE(client.closed());
  }
  EXPECT_EQ(changes(), 0);
}

TEST_F(TlsTest, WhatComesInClearBehindTheAnswerEndsTheConnection) {
  count_changes();
  start();
  TlsClient client(port());
  bind_as_root(client);
  ASSERT_EQ(start_tls(client, 2), 0);
  client.send_raw(test::delete_entry(3, kTop));
  // An alert of TLS may come, and nothing else.
  char bytes[64];
  const ssize_t length = ::recv(client.descriptor(), bytes, sizeof bytes, 0);
  EXPECT_TRUE(length <= 0 || bytes[0] == 21);
  EXPECT_EQ(changes(), 0);
  stop();
  EXPECT_EQ(changes(), 0);
}

TEST_F(TlsTest, StartTlsIsRefusedWhileAnOperationIsOutstanding) {
  block();
  TlsClient client(port());
  bind_as_root(client);
  client.send(test::delete_entry(2, kTop));
  ASSERT_TRUE(wait_for_waiters(1));
  EXPECT_EQ(start_tls(client, 3), 1);
  go_on.happen();
  const std::optional<Reply> reply = client.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 53);
  EXPECT_EQ(start_tls(client, 4), 0);
  EXPECT_TRUE(client.shake_hands());
}

TEST_F(TlsTest, StartTlsIsRefusedUnderTls) {
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  EXPECT_EQ(start_tls(client), 1);
  EXPECT_EQ(code_of(client, test::search(2, "")), 0);
}

TEST_F(TlsTest, StartTlsWithAValueIsRefused) {
  start();
  WireClient client(port());
  client.send(test::message(1, test::tlv(0x77, test::tlv(0x80, kStartTls) + test::tlv(0x81, "x"))));
  const std::optional<Reply> reply = client.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 2);
  EXPECT_EQ(code_of(client, test::search(2, "")), 0);
}

TEST_F(TlsTest, WithoutACertificateThereIsNoTls) {
  settings.tls = {};
  start();
  EXPECT_EQ(secure_port(), 0);
  WireClient client(port());
  EXPECT_EQ(start_tls(client), 2);
  EXPECT_EQ(code_of(client, test::search(2, "")), 0);
}

// ---- versions, suites, sessions

TEST_F(TlsTest, PortThatIsNotOpenForWantOfACertificateIsToldOf) {
  settings.tls = {};
  settings.secure_port = 3636;
  settings.error_log = certificates.path("error.log");
  settings.error_log_level = "info";
  start();
  stop();
  std::ifstream file(settings.error_log);
  const std::string text{std::istreambuf_iterator<char>(file), {}};
  EXPECT_NE(text.find("nobody listens at orv-slapdSecurePort"), std::string::npos) << text;
  EXPECT_NE(text.find("orv-slapdTlsCertificateFile"), std::string::npos);
}

TEST_F(TlsTest, OldVersionsAreRefused) {
  start();
  for (const int version : {TLS1_VERSION, TLS1_1_VERSION}) {
    TlsClient client(secure_port());
    EXPECT_FALSE(client.shake_hands({version, version}));
  }
}

TEST_F(TlsTest, OldestVersionIsConfigured) {
  settings.tls.tls_1_2 = false;
  start();
  TlsClient older(secure_port());
  EXPECT_FALSE(older.shake_hands({TLS1_2_VERSION, TLS1_2_VERSION}));
  TlsClient newer(secure_port());
  EXPECT_TRUE(newer.shake_hands());
}

TEST_F(TlsTest, SuitesWithoutForwardSecrecyOrAuthenticationOfDataAreRefused) {
  start();
  for (const char* const suites : {"ECDHE-ECDSA-AES128-SHA256", "ECDHE-ECDSA-AES256-SHA",
                                   "AES256-GCM-SHA384", "aNULL:eNULL"}) {
    TlsClient client(secure_port());
    EXPECT_FALSE(client.shake_hands({TLS1_2_VERSION, TLS1_2_VERSION, nullptr, suites})) << suites;
  }
}

TEST_F(TlsTest, RenegotiationIsRefused) {
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands({TLS1_2_VERSION, TLS1_2_VERSION}));
  SSL_renegotiate(client.ssl());
  EXPECT_NE(SSL_do_handshake(client.ssl()), 1);
}

TEST_F(TlsTest, SessionsAreNotResumed) {
  start();
  for (const int version : {TLS1_2_VERSION, TLS1_3_VERSION}) {
    TlsClient client(secure_port());
    ASSERT_TRUE(client.shake_hands({version, version}));
    EXPECT_EQ(code_of(client, test::search(1, "")), 0);  // tickets of TLS 1.3 come with it
    SSL_SESSION* const session = SSL_get1_session(client.ssl());
    EXPECT_EQ(SSL_SESSION_is_resumable(session) == 1 && SSL_SESSION_has_ticket(session) == 1,
              false);
    EXPECT_EQ(SSL_SESSION_get_ticket_lifetime_hint(session), 0U);
    TlsClient again(secure_port());
    TlsWish wish{version, version};
    wish.session = session;
    EXPECT_TRUE(again.shake_hands(wish));
    EXPECT_EQ(SSL_session_reused(again.ssl()), 0);
    SSL_SESSION_free(session);
  }
}

// ---- slow and false clients

TEST_F(TlsTest, HandshakeThatIsNotFinishedInTimeEndsAndNobodyElseWaits) {
  settings.handshake_timeout = 1;
  write_access_log();
  start();
  WireClient silent(secure_port());
  WireClient halfway(secure_port());
  halfway.send(std::string("\x16\x03\x01\x02\x00\x01", 6));
  WireClient after_answer(port());
  ASSERT_EQ(start_tls(after_answer), 0);
  TlsClient other(secure_port());
  ASSERT_TRUE(other.shake_hands());
  EXPECT_EQ(code_of(other, test::search(1, "")), 0);
  EXPECT_TRUE(silent.closed());
  EXPECT_TRUE(halfway.closed());
  EXPECT_TRUE(after_answer.closed());
  EXPECT_EQ(code_of(other, test::search(2, "")), 0);
  EXPECT_NE(stop_and_read_log().find("CLOSE reason=TLS handshake not finished in time"),
            std::string::npos);
}

TEST_F(TlsTest, ClearMessagesAtThePortForTlsAreNotExecuted) {
  count_changes();
  write_access_log();
  start();
  for (const std::string& bytes :
       {test::bind(1, kRoot, kSecret) + test::delete_entry(2, kTop),
        std::string("GET / HTTP/1.0\r\n\r\n"), std::string(5000, '\0'),
        std::string("\x16\x03\x01\xFF\xFF", 5) + std::string(70000, 'x')}) {
    WireClient client(secure_port());
    client.send(bytes);
    ::shutdown(client.descriptor(), SHUT_WR);
    char answer[256];
    // An alert at most.
    const ssize_t length = ::recv(client.descriptor(), answer, sizeof answer, 0);
    EXPECT_TRUE(length <= 0 || answer[0] == 21);
  }
  EXPECT_EQ(changes(), 0);
  EXPECT_NE(stop_and_read_log().find("TLS handshake failed: "), std::string::npos);
  EXPECT_EQ(authenticator.asked, 0);
}

TEST_F(TlsTest, HalfARecordEndsTheConnectionAsHalfAMessageDoes) {
  settings.message_timeout = 1;
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  client.send_raw(std::string("\x17\x03\x03\x01\x00half", 9));
  const std::optional<Reply> notice = client.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
  EXPECT_EQ(notice->code, 52);
}

TEST_F(TlsTest, HalfAMessageInWholeRecordsEndsTheConnection) {
  settings.message_timeout = 1;
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  client.send(test::search(1, "").substr(0, 10));
  const std::optional<Reply> notice = client.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->code, 52);
}

TEST_F(TlsTest, DamagedRecordEndsTheConnectionAndNothingOfItIsExecuted) {
  count_changes();
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  bind_as_root(client);
  client.send_raw(std::string("\x17\x03\x03\x00\x28", 5) + std::string(40, 'x'));
  EXPECT_FALSE(client.receive());
  EXPECT_EQ(changes(), 0);
}

// As many key updates as one likes in one piece; what is asked behind them comes last.
std::string key_updates(SSL* ssl, int count, std::string_view request) {
  BIO* const memory = BIO_new(BIO_s_mem());
  BIO* const socket = SSL_get_wbio(ssl);
  BIO_up_ref(socket);
  SSL_set0_wbio(ssl, memory);
  for (int i = 0; i < count; ++i) {
    SSL_key_update(ssl, SSL_KEY_UPDATE_NOT_REQUESTED);
    SSL_do_handshake(ssl);
  }
  SSL_write(ssl, request.data(), static_cast<int>(request.size()));
  char* data = nullptr;
  const long length = BIO_get_mem_data(memory, &data);
  std::string bytes(data, static_cast<std::size_t>(length));
  SSL_set0_wbio(ssl, socket);
  return bytes;
}

TEST_F(TlsTest, KeysMayBeRenewedNowAndThen) {
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands({TLS1_3_VERSION, TLS1_3_VERSION}));
  for (int i = 1; i < 100; ++i) {
    client.send_raw(key_updates(client.ssl(), 3, test::search(i, "")));
    const std::optional<Reply> reply = client.receive();
    ASSERT_TRUE(reply) << i;
    ASSERT_TRUE(client.receive()) << i;
  }
}

// Each costs the server more than the client, and as long as they come no other client of the same
// loop would have its turn.
TEST_F(TlsTest, FloodOfKeyUpdatesEndsTheConnection) {
  write_access_log();
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands({TLS1_3_VERSION, TLS1_3_VERSION}));
  client.send_raw(key_updates(client.ssl(), 1000, test::search(1, "")));
  EXPECT_FALSE(client.receive());
  EXPECT_NE(stop_and_read_log().find("too many records without data"), std::string::npos);
}

TEST_F(TlsTest, ClientThatFinishesTlsInOrderIsToldSo) {
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  client.say_goodbye();
  char byte;
  const int length = SSL_read(client.ssl(), &byte, 1);
  EXPECT_EQ(SSL_get_error(client.ssl(), length), SSL_ERROR_ZERO_RETURN);
}

TEST_F(TlsTest, ConnectionThatIsCutInAMessageExecutesNothing) {
  count_changes();
  start();
  const std::string request = test::delete_entry(2, kTop);
  {
    TlsClient client(secure_port());
    ASSERT_TRUE(client.shake_hands());
    bind_as_root(client);
    client.send(std::string_view(request).substr(0, request.size() - 1));
    ::shutdown(client.descriptor(), SHUT_WR);
    EXPECT_TRUE(client.closed());
  }
  stop();
  EXPECT_EQ(changes(), 0);
}

TEST_F(TlsTest, ReaderThatDoesNotReadIsCutOffAndNobodyElseWaits) {
  settings.write_timeout = 1;
  backend.on_search = [](pblock* parameters) {
    const EntryPtr entry = test::make_test_entry(kTop, 1 << 20);
    for (int i = 0; i < 32; ++i) test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, 0, 32);
  };
  start();
  TlsClient stuck(secure_port());
  ASSERT_TRUE(stuck.shake_hands());
  bind_as_root(stuck);
  stuck.send(test::search(2, kTop));
  TlsClient other(secure_port());
  ASSERT_TRUE(other.shake_hands());
  EXPECT_EQ(code_of(other, test::search(1, "")), 0);
  const auto end = Clock::now() + 20s;
  while (server->connections() > 1 && Clock::now() < end) std::this_thread::yield();
  EXPECT_EQ(server->connections(), 1);
  EXPECT_EQ(code_of(other, test::search(2, "")), 0);
}

TEST_F(TlsTest, NoticeOfDisconnectionComesThroughTls) {
  settings.idle_timeout = 1;
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  const std::optional<Reply> notice = client.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
}

// However a connection ends, it no longer counts among those on which nobody is bound.
TEST_F(TlsTest, EndsOfAllKindsMakeRoomForStrangers) {
  settings.max_unauthenticated_connections = 1;
  start();
  const auto wait_until_gone = [&] {
    const auto end = Clock::now() + 10s;
    while (server->connections() > 0 && Clock::now() < end) std::this_thread::yield();
  };
  for (int i = 0; i < 3; ++i) {
    {
      WireClient halfway(secure_port());
      halfway.send(std::string("\x16\x03\x01\x02\x00\x01", 6));
      ::shutdown(halfway.descriptor(), SHUT_WR);
      halfway.closed();
    }
    wait_until_gone();
    {
      WireClient false_one(secure_port());
      false_one.send("GET / HTTP/1.0\r\n\r\n");
      false_one.closed();
    }
    wait_until_gone();
    {
      WireClient asked(port());
      ASSERT_EQ(start_tls(asked), 0) << i;
    }
    wait_until_gone();
    {
      TlsClient bound(port());
      bind_as_root(bound);
      ASSERT_EQ(start_tls(bound, 2), 0) << i;  // anonymous again
      ASSERT_TRUE(bound.shake_hands());
      EXPECT_EQ(code_of(bound, test::bind(3, kRoot, "wrong")), 49);
      bind_as_root(bound);
    }
    wait_until_gone();
  }
  TlsClient last(secure_port());
  ASSERT_TRUE(last.shake_hands());
  EXPECT_EQ(code_of(last, test::search(1, "")), 0);
}

TEST_F(TlsTest, ServerStopsInTheMiddleOfHandshakes) {
  start();
  WireClient silent(secure_port());
  WireClient asked(port());
  ASSERT_EQ(start_tls(asked), 0);
  stop();
  EXPECT_EQ(status, 0);
  EXPECT_TRUE(silent.closed());
  EXPECT_TRUE(asked.closed());
}

// An abandon that comes while the loop itself runs the search is found inside TLS as well.
TEST_F(TlsTest, AbandonIsFoundWhileASearchRunsOnTheLoop) {
  const test::SearchedFile file;
  std::atomic<bool> stopped{false};
  backend.on_search = [&](pblock* parameters) {
    stopped = file.search_until_interrupted() == 3;
    return test::finish_search(parameters, 3, 0);
  };
  start();
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands());
  bind_as_root(client);
  client.send(test::search(2, kTop));
  client.send(test::abandon(3, 2));
  EXPECT_EQ(code_of(client, test::search(4, "")), 0);
  EXPECT_TRUE(stopped);
}

// ---- certificates of clients

TEST_F(TlsTest, CertificateOfAClientIsOptional) {
  settings.tls.client_certificates = ClientCertificates::optional;
  settings.tls.ca_file = certificates.authority();
  write_access_log();
  start();
  const Pair alice = certificates.of_client("alice");
  TlsClient with(secure_port());
  ASSERT_TRUE(with.shake_hands({TLS1_2_VERSION, TLS1_3_VERSION, &alice}));
  EXPECT_EQ(code_of(with, test::search(1, "")), 0);
  TlsClient without(secure_port());
  ASSERT_TRUE(without.shake_hands());
  EXPECT_EQ(code_of(without, test::search(1, "")), 0);
  EXPECT_NE(stop_and_read_log().find("subject=\"CN=ALICE,O=ORV TEST\""), std::string::npos);
}

TEST_F(TlsTest, CertificateOfAClientIsRequired) {
  settings.tls.client_certificates = ClientCertificates::required;
  settings.tls.ca_file = certificates.authority();
  start();
  const Pair alice = certificates.of_client("alice");
  for (const int version : {TLS1_2_VERSION, TLS1_3_VERSION}) {
    TlsClient with(secure_port());
    ASSERT_TRUE(with.shake_hands({version, version, &alice}));
    EXPECT_EQ(code_of(with, test::search(1, "")), 0);
    TlsClient without(secure_port());
    without.shake_hands({version, version});
    EXPECT_EQ(code_of(without, test::search(1, "")), -1);
  }
}

TEST_F(TlsTest, CertificateThatNobodyTrustedSignedIsRefusedEvenWhereNoneIsRequired) {
  settings.tls.client_certificates = ClientCertificates::optional;
  settings.tls.ca_file = certificates.authority();
  start();
  const Pair stranger = certificates.self_signed("alice");
  for (const int version : {TLS1_2_VERSION, TLS1_3_VERSION}) {
    TlsClient client(secure_port());
    client.shake_hands({version, version, &stranger});
    EXPECT_EQ(code_of(client, test::search(1, "")), -1);
  }
}

// ---- what is read in a certificate

class ClientCertificate : public TlsTest {
 protected:
  void SetUp() override {
    settings.tls.client_certificates = ClientCertificates::optional;
    settings.tls.ca_file = certificates.authority();
    write_access_log();
    start();
  }
  // Whether the server talks to a client that shows it.
  bool accepted(const Pair& pair) {
    TlsClient client(secure_port());
    client.shake_hands({TLS1_2_VERSION, TLS1_3_VERSION, &pair});
    return code_of(client, test::search(1, "")) == 0;
  }
  bool accepted(const Wording& wording) { return accepted(certificates.of_client(wording)); }
  // As the access log has it; "" for none.
  std::string subject_of(const std::vector<NamePart>& parts) {
    Wording wording;
    wording.subject = parts;
    EXPECT_TRUE(accepted(wording));
    std::string text = stop_and_read_log();
    const std::size_t place = text.find("subject=\"");
    if (place == std::string::npos) return "";
    text.erase(0, place + 9);
    return text.substr(0, text.find("\"\n"));
  }
};

constexpr int kUtf8 = V_ASN1_UTF8STRING;
const NamePart kOrganisation{"O", kUtf8, "Orv Test"};

TEST_F(ClientCertificate, SubjectIsTheSameHoweverItsTextIsEncoded) {
  EXPECT_EQ(subject_of({{"O", V_ASN1_PRINTABLESTRING, "orv  TEST"},
                        {"OU", V_ASN1_UNIVERSALSTRING, std::string("\0\0\0u", 4)},
                        {"CN", V_ASN1_BMPSTRING, std::string("\0A\0l", 4)}}),
            "CN=AL,OU=U,O=ORV TEST");
}

TEST_F(ClientCertificate, SubjectIsTheSameInWhateverOrderThePartsOfAnRdnAre) {
  EXPECT_EQ(subject_of({kOrganisation, {"OU", kUtf8, "x"}, {"CN", kUtf8, "alice", true}}),
            "CN=ALICE+OU=X,O=ORV TEST");
}

TEST_F(ClientCertificate, SubjectThatEndsForOthersAtANulIsNone) {
  EXPECT_EQ(subject_of({kOrganisation, {"CN", kUtf8, std::string("alice\0evil", 10)}}), "");
}

TEST_F(ClientCertificate, SubjectWithANulInWideCharactersIsNone) {
  EXPECT_EQ(subject_of({{"CN", V_ASN1_BMPSTRING, std::string("\0A\0\0\0B", 6)}}), "");
}

// What looks like further parts of a DN is within the value, also when it is copied from the log.
TEST_F(ClientCertificate, SubjectInTheLogCanBeCopiedIntoTheMap) {
  const std::string subject = subject_of({{"CN", kUtf8, "alice,o=Orv Test"}});
  EXPECT_EQ(subject, "CN=ALICE\\2CO\\3DORV TEST");
  CertificateMapping mapping;
  ASSERT_TRUE(parse_certificate_mapping(subject + " => cn=alice", mapping));
  EXPECT_EQ(mapping.subject, "CN=ALICE\\2CO\\3DORV TEST");
}

TEST_F(ClientCertificate, SubjectNamesTypesThatAreUnknownByTheirNumbers) {
  const std::string subject = subject_of({kOrganisation,
                                          {"emailAddress", V_ASN1_IA5STRING, "a@b"},
                                          {"serialNumber", V_ASN1_PRINTABLESTRING, "1"},
                                          {"1.2.3.4.5", kUtf8, "x"}});
  EXPECT_EQ(subject, "1.2.3.4.5=X,2.5.4.5=1,EMAIL=A@B,O=ORV TEST");
  CertificateMapping mapping;
  ASSERT_TRUE(parse_certificate_mapping(subject + " => cn=alice", mapping));
  EXPECT_EQ(mapping.subject, subject);
}

TEST_F(ClientCertificate, IsRefusedBeforeAndAfterItsTime) {
  Wording wording;
  wording.subject = {kOrganisation};
  wording.begins = -7200;
  wording.ends = -3600;
  EXPECT_FALSE(accepted(wording));
  wording.begins = 3600;
  wording.ends = 7200;
  EXPECT_FALSE(accepted(wording));
}

TEST_F(ClientCertificate, IsRefusedWhenItIsForServersAlone) {
  Wording wording;
  wording.subject = {kOrganisation};
  wording.purpose = "serverAuth";
  EXPECT_FALSE(accepted(wording));
  wording.purpose = "clientAuth";
  EXPECT_TRUE(accepted(wording));
}

TEST_F(ClientCertificate, MakesNobodyAnAuthority) {
  Wording wording;
  wording.subject = {kOrganisation};
  const Pair alice = certificates.of_client("alice");
  EXPECT_FALSE(accepted(certificates.signed_by(alice, wording)));
}

TEST_F(TlsTest, CertificateIsNotAskedForWhereNoneIsWanted) {
  write_access_log();
  start();
  const Pair alice = certificates.of_client("alice");
  TlsClient client(secure_port());
  ASSERT_TRUE(client.shake_hands({TLS1_2_VERSION, TLS1_3_VERSION, &alice}));
  EXPECT_EQ(code_of(client, test::search(1, "")), 0);
  EXPECT_EQ(stop_and_read_log().find("subject="), std::string::npos);
}

// ---- a new certificate

class RenewedTls : public TlsTest {
 protected:
  RenewedTls() {
    reload = [this](Settings& wanted) {
      wanted = settings;
      return true;
    };
  }
  std::string presented() {
    TlsClient client(secure_port());
    return client.shake_hands() ? client.peer_name() : "none";
  }
};

TEST_F(RenewedTls, NewConnectionsGetTheNewCertificateAndOldOnesGoOn) {
  start();
  TlsClient before(secure_port());
  ASSERT_TRUE(before.shake_hands());
  EXPECT_EQ(before.peer_name(), "localhost");
  const Pair renewed = certificates.self_signed("renewed");
  // Under the names of the old files.
  ASSERT_EQ(std::rename(renewed.certificate.c_str(), own.certificate.c_str()), 0);
  ASSERT_EQ(std::rename(renewed.key.c_str(), own.key.c_str()), 0);
  server->reload();
  EXPECT_EQ(presented(), "renewed");
  EXPECT_EQ(code_of(before, test::search(1, "")), 0);
}

TEST_F(RenewedTls, BadCertificateIsNotTakenOver) {
  start();
  const Pair other = certificates.self_signed("other");
  settings.tls.key_file = other.key;
  server->reload();
  EXPECT_EQ(presented(), "localhost");
  settings.tls.key_file = own.key;
  settings.tls.certificate_file = certificates.path("nowhere");
  server->reload();
  EXPECT_EQ(presented(), "localhost");
  settings.tls = {};
  server->reload();
  EXPECT_EQ(presented(), "localhost");
}

// ---- reading certificates

class TlsFiles : public testing::Test {
 protected:
  TlsFiles() {
    own = certificates.self_signed("localhost");
    settings.certificate_file = own.certificate;
    settings.key_file = own.key;
  }
  std::string refusal() {
    std::string error;
    return TlsContext::load(settings, error) ? "" : error;
  }
  void write(const std::string& path, std::string_view text) {
    std::ofstream(path, std::ios::trunc) << text;
  }
  Certificates certificates;
  Pair own;
  TlsSettings settings;
};

TEST_F(TlsFiles, GoodOnesAreTaken) {
  EXPECT_EQ(refusal(), "");
}

TEST_F(TlsFiles, CauseOfARefusalNamesTheFile) {
  const TlsSettings good = settings;
  const Pair other = certificates.self_signed("other");
  settings.certificate_file = certificates.path("nowhere");
  EXPECT_EQ(refusal(), settings.certificate_file + ": No such file or directory");
  settings = good;
  settings.key_file = certificates.path("nowhere");
  EXPECT_EQ(refusal(), settings.key_file + ": No such file or directory");
  settings = good;
  settings.key_file = other.key;
  EXPECT_NE(refusal().find(other.key + ": no"), std::string::npos) << refusal();
  settings = good;
  write(own.certificate, "no certificate");
  EXPECT_NE(refusal().find(own.certificate + ": no usable certificate"), std::string::npos);
}

// Nobody would ever write to it, and whoever waited would be the thread that controls the server.
TEST_F(TlsFiles, PipesAreRefusedWithoutWaiting) {
  const std::string pipe = certificates.path("pipe");
  ASSERT_EQ(::mkfifo(pipe.c_str(), 0600), 0);
  const TlsSettings good = settings;
  settings.certificate_file = pipe;
  EXPECT_EQ(refusal(), pipe + ": not a regular file");
  settings = good;
  settings.key_file = pipe;
  EXPECT_EQ(refusal(), pipe + ": not a regular file");
  settings = good;
  settings.client_certificates = ClientCertificates::optional;
  settings.ca_file = pipe;
  EXPECT_EQ(refusal(), pipe + ": not a regular file");
}

TEST_F(TlsFiles, KeyThatOthersMayReadIsRefused) {
  for (const mode_t mode : {0604U, 0644U, 0620U, 0666U}) {
    ASSERT_EQ(::chmod(own.key.c_str(), mode), 0);
    EXPECT_NE(refusal().find("others may read"), std::string::npos) << mode;
  }
  for (const mode_t mode : {0400U, 0600U, 0640U}) {
    ASSERT_EQ(::chmod(own.key.c_str(), mode), 0);
    EXPECT_EQ(refusal(), "") << mode;
  }
}

TEST_F(TlsFiles, KeyMayStandInTheFileOfTheCertificate) {
  std::stringstream both;
  both << std::ifstream(own.key).rdbuf() << std::ifstream(own.certificate).rdbuf();
  write(own.key, both.str());
  settings.certificate_file = own.key;
  settings.key_file.clear();
  EXPECT_EQ(refusal(), "");
}

TEST_F(TlsFiles, CertificatesOfClientsNeedAnAuthority) {
  settings.client_certificates = ClientCertificates::optional;
  EXPECT_NE(refusal().find("orv-slapdTlsCaFile"), std::string::npos);
  settings.ca_file = certificates.path("nowhere");
  EXPECT_NE(refusal().find("No such file"), std::string::npos);
  write(certificates.path("empty"), "");
  settings.ca_file = certificates.path("empty");
  EXPECT_NE(refusal().find("no usable certificates"), std::string::npos);
  settings.ca_file = certificates.authority();
  EXPECT_EQ(refusal(), "");
}

TEST_F(TlsFiles, ServerDoesNotListenWithABadCertificate) {
  ASSERT_EQ(::chmod(own.key.c_str(), 0644), 0);
  test::FakeBackend backend;
  test::ScriptedAuthenticator authenticator;
  Logs logs;
  Settings all;
  all.tls = settings;
  Server server({builtin_schema(), backend.record(), authenticator, {}, logs, {}, all, 1, {}});
  std::string error;
  EXPECT_FALSE(server.listen({"127.0.0.1"}, 0, error));
  EXPECT_NE(error.find(own.key), std::string::npos);
}

}  // namespace
}  // namespace orv::server
