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

}  // namespace
}  // namespace orv::server
