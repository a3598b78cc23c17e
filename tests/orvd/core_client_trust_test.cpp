// Clients that show a certificate, once it is not believed any more: its authority is gone, its
// time has passed, or nobody asks for certificates.
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <atomic>
#include <ctime>
#include <filesystem>
#include <fstream>

#include "../temporary_directory.h"
#include "auth/sasl_external.h"
#include "cfg/result_codes.h"
#include "core_server_fixture.h"
#include "core_tls_client.h"
#include "net/tls.h"

namespace orv::server {
namespace {

using test::Certificates;
using test::kNotice;
using test::kTop;
using test::NamePart;
using test::Pair;
using test::Reply;
using test::TlsClient;
using test::WireClient;
using test::Wording;

// Whoever shows a certificate is the primary administrator by it. The authorities stand in a file
// that tests write anew.
class ClientTrust : public test::BlockedServer, public ExternalIdentities {
 protected:
  ClientTrust() {
    own = certificates.self_signed("localhost");
    alice = certificates.of_client("alice");
    other = authority_pair("Other");
    settings.tls = {own.certificate, own.key, certificates.path("ca"), ClientCertificates::optional,
                    true};
    believe({certificates.authority()});
    settings.error_log = certificates.path("error.log");
    settings.error_log_level = "info";
    more.secure_port = 0;
    mechanisms.push_back(make_external(*this));
    reload = [this](Settings& wanted) {
      wanted = settings;
      return true;
    };
    wall_time = [this] { return std::time(nullptr) + later.load(); };
  }
  ~ClientTrust() override {
    go_on.happen();
    stop();
  }

  std::shared_ptr<const Identity> primary_administrator() override { return nullptr; }
  std::shared_ptr<const Identity> of_certificate(std::string_view subject) override {
    auto identity = std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, ""});
    identity->certificate_subject = subject;
    return identity;
  }

  static Wording named(const char* name) {
    Wording wording;
    wording.subject = {{"CN", V_ASN1_UTF8STRING, name}};
    return wording;
  }
  Pair authority_pair(const char* name, long ends = 3600) {
    Wording wording = named(name);
    wording.constraint = "critical,CA:TRUE";
    wording.ends = ends;
    return certificates.self_signed(wording);
  }
  // Writes the authorities; in force after the next reload.
  void believe(const std::vector<std::string>& authorities) {
    std::ofstream file(certificates.path("ca"), std::ios::trunc);
    for (const std::string& authority : authorities) file << orv::test::content_of(authority);
  }
  // A client that shows a certificate; and one that is bound by that of alice.
  std::unique_ptr<TlsClient> connect(const Pair& shown) {
    auto client = std::make_unique<TlsClient>(server->secure_port());
    EXPECT_TRUE(client->shake_hands({TLS1_2_VERSION, TLS1_3_VERSION, &shown}));
    return client;
  }
  std::unique_ptr<TlsClient> bound() {
    auto client = connect(alice);
    EXPECT_EQ(code_of(*client, test::sasl_bind(1, "EXTERNAL", "")), 0);
    EXPECT_EQ(code_of(*client, test::delete_entry(2, kTop)), 53);
    return client;
  }
  // The client is told, without having asked for anything, and loses the connection.
  static void expect_end(WireClient& client) {
    const std::optional<Reply> notice = client.receive();
    ASSERT_TRUE(notice);
    EXPECT_EQ(notice->id, 0);
    EXPECT_EQ(notice->tag, kNotice);
    EXPECT_EQ(notice->code, result::stronger_auth_required);
    EXPECT_TRUE(client.closed());
  }
  // Its requests are executed.
  static void expect_served(WireClient& client, int id = 3) {
    EXPECT_EQ(code_of(client, test::delete_entry(id, kTop)), 53);
  }
  std::string stop_and_read_log() {
    stop();
    return orv::test::content_of(settings.error_log);
  }
  // The clock is moved on by so many seconds.
  void let_time_pass(std::time_t seconds) { later += seconds; }

  std::atomic<std::time_t> later{0};
  Certificates certificates;
  Pair own;
  Pair alice;
  Pair other;
};

TEST_F(ClientTrust, WhoseAuthorityIsReplacedLosesTheConnectionWithANoticeAndALine) {
  start();
  const auto client = bound();
  believe({other.certificate});
  server->reload();
  expect_end(*client);
  const std::string log = stop_and_read_log();
  EXPECT_NE(log.find("the certificate of the client is no longer good (unable to get local issuer "
                     "certificate): closed 127.0.0.1:"),
            std::string::npos)
      << log;
}

TEST_F(ClientTrust, WhatIsAskedAfterTheAuthorityIsGoneIsNotDone) {
  start();
  const auto client = bound();
  const int before = backend.calls(parameter::delete_function);
  believe({other.certificate});
  server->reload();
  client->send(test::delete_entry(3, kTop));
  expect_end(*client);
  EXPECT_EQ(backend.calls(parameter::delete_function), before);
}

TEST_F(ClientTrust, WhatWaitedForItsTurnWhenTheAuthorityWentIsNotDone) {
  block();
  const auto client = connect(alice);
  EXPECT_EQ(code_of(*client, test::sasl_bind(1, "EXTERNAL", "")), 0);
  client->send(test::delete_entry(2, kTop));
  ASSERT_TRUE(wait_for_waiters(1));
  believe({other.certificate});
  server->reload();
  go_on.happen();
  const std::optional<Reply> reply = client->receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->id, 2);
  EXPECT_EQ(reply->code, result::busy);
  expect_end(*client);
  EXPECT_EQ(backend.calls(parameter::delete_function), 1);  // that of the client before
}

TEST_F(ClientTrust, WhoseAuthorityStaysBesideANewOneStays) {
  start();
  const auto client = bound();
  believe({other.certificate, certificates.authority()});
  server->reload();
  expect_served(*client);
}

TEST_F(ClientTrust, WhoHasNotBoundYetDoesNotBindByACertificateThatIsNotBelievedAnyMore) {
  start();
  const auto client = connect(alice);
  EXPECT_EQ(code_of(*client, test::search(1, "")), 0);
  believe({other.certificate});
  server->reload();
  client->send(test::sasl_bind(2, "EXTERNAL", ""));
  expect_end(*client);
}

TEST_F(ClientTrust, NobodyIsKeptWhenCertificatesAreNotAskedForAnyMore) {
  start();
  const auto client = bound();
  TlsClient without(server->secure_port());
  ASSERT_TRUE(without.shake_hands());
  bind_as_root(without);
  settings.tls.client_certificates = ClientCertificates::none;
  server->reload();
  expect_end(*client);
  expect_served(without);
}

TEST_F(ClientTrust, StaysWhenRenewalFails) {
  start();
  const auto client = bound();
  for (const char* const text : {"", "nonsense"}) {
    std::ofstream(certificates.path("ca"), std::ios::trunc) << text;
    server->reload();
    expect_served(*client);
  }
  EXPECT_NE(stop_and_read_log().find("TLS stays as it was: " + certificates.path("ca")),
            std::string::npos);
}

TEST_F(ClientTrust, StaysWhenTheServersOwnCertificateIsRenewed) {
  start();
  const auto client = bound();
  const Pair renewed = certificates.self_signed("renewed");
  settings.tls.certificate_file = renewed.certificate;
  settings.tls.key_file = renewed.key;
  settings.tls.client_certificates = ClientCertificates::required;
  server->reload();
  expect_served(*client);
}

TEST_F(ClientTrust, WhoseCertificateExpiresLosesTheConnection) {
  start();
  const auto client = bound();
  let_time_pass(3000);
  expect_served(*client);
  let_time_pass(1000);
  expect_end(*client);
  EXPECT_NE(stop_and_read_log().find("(certificate has expired): closed"), std::string::npos);
}

TEST_F(ClientTrust, WhoseAuthorityExpiresLosesTheConnection) {
  const Pair brief = authority_pair("Brief", 1800);
  alice = certificates.signed_by(brief, named("alice"));
  believe({brief.certificate});
  start();
  const auto client = bound();
  let_time_pass(2000);
  expect_end(*client);
}

// What was judged anew ends with its time, too.
TEST_F(ClientTrust, WhoseCertificateExpiresAfterARenewalLosesTheConnection) {
  start();
  const auto client = bound();
  believe({other.certificate, certificates.authority()});
  server->reload();
  expect_served(*client);
  let_time_pass(4000);
  expect_end(*client);
}

// ---- what authorities have revoked

class Revoked : public ClientTrust {
 protected:
  Revoked() {
    issuer = authority_pair("Issuer");
    alice = certificates.signed_by(issuer, named("alice"));
    bob = certificates.signed_by(issuer, named("bob"));
    believe({issuer.certificate});
    settings.tls.crl_file = certificates.path("crl");
    publish(certificates.revoked_by(issuer, {}));
  }
  // In force after the next reload.
  void publish(const std::string& lists) {
    std::ofstream(settings.tls.crl_file, std::ios::trunc) << lists;
  }
  // Whether the server talks to a client that shows it, in either version of TLS.
  bool accepted(const Pair& pair) {
    int accepted = 0;
    for (const int version : {TLS1_2_VERSION, TLS1_3_VERSION}) {
      TlsClient client(server->secure_port());
      client.shake_hands({version, version, &pair});
      accepted += code_of(client, test::search(1, "")) == 0 ? 1 : 0;
    }
    EXPECT_NE(accepted, 1);
    return accepted == 2;
  }
  // Why the server would not start.
  std::string refusal() const {
    std::string error;
    return TlsContext::load(settings.tls, error) ? "" : error;
  }

  Pair issuer;
  Pair bob;
};

// ---- files that others could change

// Whoever added an authority could sign himself a certificate with any subject.
TEST_F(Revoked, FilesThatOthersMayChangeAreRefused) {
  for (const std::string& file : {settings.tls.ca_file, settings.tls.crl_file}) {
    for (const mode_t mode : {0666U, 0664U, 0646U, 0622U}) {
      ASSERT_EQ(::chmod(file.c_str(), mode), 0);
      EXPECT_EQ(refusal(), file +
                               ": what says whom the server believes can be changed by others; "
                               "chmod go-w " +
                               file)
          << mode;
    }
    for (const mode_t mode : {0644U, 0444U, 0640U, 0600U}) {
      ASSERT_EQ(::chmod(file.c_str(), mode), 0);
      EXPECT_EQ(refusal(), "") << mode;
    }
  }
}

TEST_F(Revoked, FilesThatOthersMayReplaceAreRefused) {
  const std::string folder = certificates.path("folder");
  std::filesystem::create_directory(folder);
  const TlsSettings good = settings.tls;
  for (std::string TlsSettings::*const name : {&TlsSettings::ca_file, &TlsSettings::crl_file}) {
    settings.tls = good;
    std::string& file = settings.tls.*name;
    std::filesystem::copy_file(file, folder + "/file",
                               std::filesystem::copy_options::overwrite_existing);
    std::filesystem::remove(certificates.path("link"));
    std::filesystem::create_symlink("folder/file", certificates.path("link"));
    for (const std::string& named : {folder + "/file", certificates.path("link")}) {
      file = named;
      ASSERT_EQ(::chmod(folder.c_str(), 0777), 0);
      EXPECT_NE(refusal().find("folder: this folder can be written by others"), std::string::npos)
          << refusal();
      ASSERT_EQ(::chmod(folder.c_str(), 01777), 0);
      EXPECT_EQ(refusal(), "");
    }
  }
}

// ---- certificates on the list

TEST_F(Revoked, CertificateIsRefusedAndOthersOfItsAuthorityAreNot) {
  publish(certificates.revoked_by(issuer, {bob}));
  start();
  EXPECT_FALSE(accepted(bob));
  EXPECT_TRUE(accepted(alice));
}

TEST_F(Revoked, WhoIsThatLosesTheConnectionWhenTheListIsRead) {
  start();
  const auto client = bound();
  const auto other_one = connect(bob);
  bind_as_root(*other_one);
  publish(certificates.revoked_by(issuer, {alice}));
  server->reload();
  expect_end(*client);
  expect_served(*other_one);
  EXPECT_NE(stop_and_read_log().find("(certificate revoked): closed"), std::string::npos);
}

TEST_F(Revoked, AuthoritiesBetweenAndTheirListsCountToo) {
  Wording between = named("Between");
  between.constraint = "critical,CA:TRUE";
  const Pair middle = certificates.signed_by(issuer, between);
  const Pair carol = certificates.signed_by(middle, named("carol"));
  believe({issuer.certificate, middle.certificate});
  const std::string of_middle = certificates.revoked_by(middle, {});
  publish(certificates.revoked_by(issuer, {}) + of_middle);
  start();
  EXPECT_TRUE(accepted(carol));
  publish(certificates.revoked_by(issuer, {middle}) + of_middle);
  server->reload();
  EXPECT_FALSE(accepted(carol));
  EXPECT_TRUE(accepted(alice));
}

TEST_F(Revoked, AuthorityWithoutAListLetsNobodyIn) {
  believe({issuer.certificate, other.certificate});
  const Pair dave = certificates.signed_by(other, named("dave"));
  start();
  EXPECT_TRUE(accepted(alice));
  EXPECT_FALSE(accepted(dave));
  publish(certificates.revoked_by(issuer, {}) + certificates.revoked_by(other, {}));
  server->reload();
  EXPECT_TRUE(accepted(dave));
}

TEST_F(Revoked, ListThatIsTooOldLetsNobodyIn) {
  publish(certificates.revoked_by(issuer, {}, -3600));
  start();
  EXPECT_FALSE(accepted(alice));
}

TEST_F(Revoked, ListThatCannotBeUsedDoesNotReplaceTheOneInForce) {
  publish(certificates.revoked_by(issuer, {bob}));
  start();
  const auto client = bound();
  const std::string good = certificates.revoked_by(issuer, {});
  const std::string file = settings.tls.crl_file;
  // Of another authority with the same name.
  const std::string forged = certificates.revoked_by(authority_pair("Issuer"), {});
  for (const std::string& bad :
       {std::string(), std::string("nonsense"), good.substr(0, good.size() / 2),
        good + good.substr(0, 100), forged}) {
    publish(bad);
    EXPECT_EQ(refusal().find(file + ": "), 0U) << bad;
    server->reload();
    expect_served(*client);
    EXPECT_FALSE(accepted(bob));
  }
  std::filesystem::remove(file);
  EXPECT_EQ(refusal(), file + ": No such file or directory");
  server->reload();
  expect_served(*client);
  EXPECT_FALSE(accepted(bob));
  const std::string log = stop_and_read_log();
  EXPECT_NE(log.find("TLS stays as it was: " + file + ": no usable list"), std::string::npos);
  EXPECT_NE(log.find("is not signed by its authority"), std::string::npos) << log;
}

TEST_F(Revoked, ListsAreNotReadWhereNobodyIsAskedForACertificate) {
  settings.tls.client_certificates = ClientCertificates::none;
  std::filesystem::remove(settings.tls.crl_file);
  EXPECT_EQ(refusal(), "");
}

}  // namespace
}  // namespace orv::server
