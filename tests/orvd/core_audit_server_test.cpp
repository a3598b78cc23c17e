// What the server records of changes whose client does not wait for them.
#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "audit/log.h"
#include "core_fake_backend.h"
#include "core_server_fixture.h"
#include "core_wire.h"

namespace orv::server {
namespace {

using test::Event;
using test::WireClient;

class AuditedServer : public test::LoopbackServer {
 protected:
  AuditedServer() {
    char name[] = "/tmp/orv-audited-XXXXXX";
    folder = mkdtemp(name);
    EXPECT_EQ(log.open(folder + "/audit.log", {}), "");
    audit = &log;
  }
  ~AuditedServer() override {
    stop();
    std::filesystem::remove_all(folder);
  }

  // Everything that was recorded, once the server has stopped.
  std::string records() {
    stop();
    EXPECT_TRUE(log.finish());
    std::ifstream in(folder + "/audit.log");
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
  }

  std::string folder;
  AuditLog log{[](std::string_view) {}};
};

TEST_F(AuditedServer, RecordsTheResultOfAChangeThatWasGivenUpMeanwhile) {
  Event entered;
  Event let_go;
  backend.on_change = [&](pblock*) {
    entered.happen();
    let_go.wait();
    return 68;
  };
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
  Event entered;
  Event let_go;
  backend.on_change = [&](pblock*) {
    entered.happen();
    let_go.wait();
    return 0;
  };
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
  backend.on_change = [](pblock* parameters) {
    send_ldap_result(test::connection_of(parameters), test::operation_of(parameters), 0, nullptr,
                     "");
    return 0;
  };
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
