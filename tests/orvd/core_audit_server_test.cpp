// What the server records of changes whose client does not wait for them.
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <atomic>
#include <cstdlib>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "../temporary_directory.h"
#include "audit/log.h"
#include "core_bare_session.h"
#include "core_fake_backend.h"
#include "core_hung_disk.h"
#include "core_server_fixture.h"
#include "core_wire.h"

namespace orv::server {
namespace {

using test::Event;
using test::WireClient;

class AuditedServer : public test::LoopbackServer {
 protected:
  AuditedServer() {
    EXPECT_EQ(log.open(folder.file("audit.log"), {}), "");
    audit = &log;
  }
  ~AuditedServer() override {
    stop();
    server.reset();  // before the log that it writes to
  }

  // Everything that was recorded, once the server has stopped.
  std::string records() {
    stop();
    EXPECT_TRUE(log.finish());
    return folder.read("audit.log");
  }

  // Each change waits inside the backend until `let_go` happens.
  void hold_changes(int code) {
    backend.on_change = [this, code](pblock*) {
      entered.happen();
      let_go.wait();
      return code;
    };
  }

  Event entered;
  Event let_go;
  const orv::test::TemporaryDirectory folder;
  AuditLog log{[](std::string_view) {}};
};

TEST_F(AuditedServer, RecordsTheResultOfAChangeThatWasGivenUpMeanwhile) {
  hold_changes(68);
  start();
  WireClient client(port());
  bind_as_root(client);
  client.send(test::add_entry(2, "cn=x,cn=configuration", "cn", "x"));
  ASSERT_TRUE(entered.wait());
  client.send(test::abandon(3, 2));
  EXPECT_EQ(code_of(client, test::extended(4, "1.2.3")), 2);
  let_go.happen();
  const std::string text = records();
  EXPECT_NE(text.find("# result: 68\ndn: cn=x,cn=configuration\n"), std::string::npos) << text;
}

TEST_F(AuditedServer, RecordsWhatWasGivenUpBeforeItsTurn) {
  hold_changes(0);
  start();
  WireClient first(port());
  bind_as_root(first);
  first.send(test::add_entry(2, "cn=x,cn=configuration", "cn", "x"));
  ASSERT_TRUE(entered.wait());
  WireClient second(port());
  bind_as_root(second);
  second.send(test::delete_entry(2, "cn=y,cn=configuration"));
  ASSERT_TRUE(wait_for_waiters(1));
  second.send(test::abandon(3, 2));
  ASSERT_TRUE(wait_for_waiters(0));
  let_go.happen();
  EXPECT_EQ(first.receive_result().back().tag, 0x69);
  const std::string text = records();
  EXPECT_NE(text.find("# result: none, not performed\ndn: cn=y,cn=configuration\n"),
            std::string::npos)
      << text;
  EXPECT_NE(text.find("dn: cn=x,cn=configuration\n"), std::string::npos);
}

TEST_F(AuditedServer, RecordsNothingThatChangesNothing) {
  start();
  WireClient client(port());
  bind_as_root(client);
  code_of(client, test::search(2, test::kTop));
  code_of(client, test::compare(3, test::kTop));
  EXPECT_EQ(records().find("dn:"), std::string::npos);
}

// A modify of one attribute: a delete of "old", then an add of "new".
std::string delete_and_add(int id) {
  using test::tlv;
  const auto change = [](std::string_view code, std::string_view value) {
    return tlv(0x30,
               tlv(0x0A, code) + tlv(0x30, tlv(0x04, "description") + tlv(0x31, tlv(0x04, value))));
  };
  const std::string list = change("\x01", "old") + change(std::string_view("\0", 1), "new");
  return test::message(id, tlv(0x66, tlv(0x04, test::kTop) + tlv(0x30, list)));
}

std::string rename_entry(int id, std::string_view dn, std::string_view new_rdn,
                         std::string_view new_superior = "") {
  using test::tlv;
  std::string request = tlv(0x04, dn) + tlv(0x04, new_rdn) + tlv(0x01, "\xFF");
  if (!new_superior.empty()) request += tlv(0x80, new_superior);
  return test::message(id, tlv(0x6C, request));
}

TEST_F(AuditedServer, RecordsAnAttemptToRename) {
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(code_of(client, rename_entry(2, "cn=x,cn=configuration", "cn=y", "cn=z")), 53);
  const std::string text = records();
  EXPECT_NE(text.find("# operation: rename\n# result: 53\n"
                      "dn: cn=x,cn=configuration\nchangetype: modrdn\nnewrdn: cn=y\n"
                      "deleteoldrdn: 1\nnewsuperior: cn=z\n\n"),
            std::string::npos)
      << text;
}

// A session that nobody but the test looks after: a server might find out before the request comes.
class AuditedSession : public test::BareSessionTest {
 protected:
  AuditedSession() {
    EXPECT_EQ(log.open(folder.file("audit.log"), {}), "");
    services.audit = &log;
  }

  const orv::test::TemporaryDirectory folder;
  AuditLog log{[](std::string_view) {}};
};

TEST_F(AuditedSession, RecordsAChangeOnAConnectionWhoseIdentityWasRevokedMeanwhile) {
  for (const std::string& request : {test::add_entry(2, "cn=x,cn=configuration", "cn", "x"),
                                     test::delete_entry(2, "cn=x,cn=configuration"),
                                     test::modify(2, "cn=x,cn=configuration", "cn", "x"),
                                     rename_entry(2, "cn=x,cn=configuration", "cn=y")}) {
    session = std::make_shared<test::BareSession>(services, lane, settings);
    bind_as_root();
    authenticator.change(false);
    session->handle(request);
    EXPECT_TRUE(session->ended);
    authenticator.change(true);
  }
  ASSERT_TRUE(log.finish());
  const std::string text = folder.read("audit.log");
  for (const char* operation : {"add", "delete", "modify", "rename"})
    EXPECT_NE(text.find(std::string("# message-id: 2\n# operation: ") + operation +
                        "\n# result: 8\ndn: cn=x,cn=configuration\n"),
              std::string::npos)
        << text;
}

TEST_F(AuditedServer, RecordsAChangeWithAMessageIdThatIsInUse) {
  hold_changes(0);
  start();
  WireClient client(port());
  bind_as_root(client);
  client.send(test::add_entry(2, "cn=x,cn=configuration", "cn", "x"));
  ASSERT_TRUE(entered.wait());
  client.send(test::delete_entry(2, "cn=y,cn=configuration"));
  while (client.receive()) {
  }
  let_go.happen();
  const std::string text = records();
  EXPECT_NE(text.find("# message-id: 2\n# operation: delete\n# result: 2\n"
                      "dn: cn=y,cn=configuration\n"),
            std::string::npos)
      << text;
  EXPECT_NE(text.find("# message-id: 2\n# operation: add\n# result: 0\n"), std::string::npos);
}

// The next change has the gate, and the thread, while the record of the one before it waits.
TEST_F(AuditedServer, RecordThatADiskHoldsUpHoldsUpItsOwnClientOnly) {
  Event first_entered;
  Event second_entered;
  std::atomic<int> entered{0};
  backend.on_change = [&](pblock* parameters) {
    (++entered == 1 ? first_entered : second_entered).happen();
    return test::finish_change(parameters, 0);
  };
  start();
  WireClient first(port());
  bind_as_root(first);
  WireClient second(port());
  bind_as_root(second);
  test::HungDisk hung(folder.file("audit.log"));
  first.send(delete_and_add(2));
  ASSERT_TRUE(first_entered.wait());
  second.send(delete_and_add(2));
  ASSERT_TRUE(second_entered.wait());
  char byte = 0;
  EXPECT_EQ(recv(first.descriptor(), &byte, 1, MSG_PEEK | MSG_DONTWAIT), -1);
  EXPECT_EQ(first.receive_result().back().code, 0);
  EXPECT_EQ(second.receive_result().back().code, 0);
  hung.release();
  records();
  const std::string text = test::HungDisk::written(folder.file("audit.log"));
  EXPECT_NE(text.find("# connection: 2\n# message-id: 2\n# operation: modify\n# result: 0\n"),
            std::string::npos);
}

TEST_F(AuditedServer, StopDoesNotLoseTheAnswerThatWaitsForItsRecord) {
  Event entered;
  backend.on_change = [&](pblock*) {
    entered.happen();
    return 32;
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  test::HungDisk hung(folder.file("audit.log"));
  client.send(delete_and_add(2));
  ASSERT_TRUE(entered.wait());
  stop();
  const std::optional<test::Reply> reply = client.receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->id, 2);
  EXPECT_EQ(reply->code, 32);
}

TEST_F(AuditedServer, RecordsModificationsAsTheClientSentThem) {
  backend.on_change = [](pblock*) { return 0; };
  start();
  WireClient client(port());
  bind_as_root(client);
  client.send(delete_and_add(2));
  ASSERT_FALSE(client.receive_result().empty());
  EXPECT_NE(records().find("delete: description\ndescription: old\n-\n"
                           "add: description\ndescription: new\n-\n"),
            std::string::npos);
}

TEST_F(AuditedServer, ChangeThatEndsTheLogIsStillRecordedInIt) {
  backend.on_change = [](pblock* parameters) { return test::finish_change(parameters, 0); };
  reload = [this](Settings&) {
    log.open("", {});
    return false;
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  ASSERT_EQ(code_of(client, delete_and_add(2)), 0);
  EXPECT_NE(records().find("# operation: modify\n# result: 0\n"), std::string::npos);
}

}  // namespace
}  // namespace orv::server
