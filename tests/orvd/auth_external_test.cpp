// Who is somebody without a password: by the socket or by a certificate.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "auth/certificate_map.h"
#include "auth/sasl_external.h"
#include "auth_identities_fixture.h"
#include "slapi/connection.h"

namespace orv::server {
namespace {

using ::testing::Contains;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

class ExternalIdentitiesOfAFile : public IdentitiesOfAFile {};

// ---- Without a password: the Unix socket, and certificates

std::string group_with_map(const std::string& values) {
  return "\ndn: cn=AdminGroup,cn=configuration\nobjectClass: container\n"
         "objectClass: orv-slapdAdminGroupSettings\ncn: AdminGroup\n" +
         values;
}

std::string mapped(const std::string& value) {
  return "orv-slapdCertificateMap: " + value + "\n";
}

TEST(CertificateMapping, ReadsTwoNames) {
  CertificateMapping mapping;
  ASSERT_TRUE(parse_certificate_mapping(" CN = Alice , O=Example=>cn=alice", mapping));
  EXPECT_EQ(mapping.subject, "CN=ALICE,O=EXAMPLE");
  EXPECT_EQ(mapping.bound_dn, "CN=ALICE");
}

TEST(CertificateMapping, IsNotLedAstrayByEscapedArrows) {
  CertificateMapping mapping;
  ASSERT_TRUE(parse_certificate_mapping("cn=a=\\>cn=evil => cn=b", mapping));
  EXPECT_EQ(mapping.bound_dn, "CN=B");
  ASSERT_TRUE(parse_certificate_mapping("cn=a\\  => cn=b", mapping));
  EXPECT_EQ(mapping.subject, "CN=A\\20");
}

TEST(CertificateMapping, RefusesWhatIsNone) {
  CertificateMapping mapping;
  for (const char* const value :
       {"", "=>", "cn=a", "cn=a =>", "=> cn=b", "cn=a > cn=b", "a => cn=b", "cn=a => b",
        "cn=a => cn=b => cn=c", "cn=a\\=> cn=b", ">", "cn=a,=>cn=b"})
    EXPECT_FALSE(parse_certificate_mapping(value, mapping)) << value;
}

TEST_F(ExternalIdentitiesOfAFile, CertificateProvesWhomItIsMappedTo) {
  const auto identities = read(kTop + group_with_map(mapped("cn=Alice,o=Example => cn=alice")) +
                               member("alice", "cn=alice", "alicepw"));
  ASSERT_TRUE(identities) << error_;
  const auto alice = identities->of_certificate("CN=ALICE,O=EXAMPLE");
  ASSERT_TRUE(alice);
  EXPECT_EQ(alice->bound_dn, "CN=ALICE");
  EXPECT_EQ(alice->authority, authority::admin_group_member);
  EXPECT_TRUE(identities->still_valid(*alice));
  EXPECT_EQ(identities->of_certificate("CN=ALICE"), nullptr);
  EXPECT_EQ(identities->of_certificate(""), nullptr);
  EXPECT_THAT(warnings_, IsEmpty());
}

TEST_F(ExternalIdentitiesOfAFile, CertificatesStandForSomebodyWhoCanBind) {
  const std::string alice = member("alice", "cn=alice", "alicepw");
  EXPECT_FALSE(read(kTop + kGroup + alice)->maps_certificates());
  for (const char* const useless : {"cn=a => cn=nobody", "nonsense"})
    EXPECT_FALSE(read(kTop + group_with_map(mapped(useless)) + alice)->maps_certificates());
  EXPECT_FALSE(
      read(kTop + group_with_map(mapped("cn=a => cn=alice") + mapped("CN=A => cn=root")) + alice)
          ->maps_certificates());
  EXPECT_TRUE(read(kTop + group_with_map(mapped("cn=a => cn=alice")) + alice)->maps_certificates());
}

TEST_F(ExternalIdentitiesOfAFile, CertificateNeedsNoPassword) {
  const auto identities = read(kTopWithoutPassword + group_with_map(mapped("cn=r => cn=root")));
  ASSERT_TRUE(identities) << error_;
  const auto root = identities->of_certificate("CN=R");
  ASSERT_TRUE(root);
  EXPECT_EQ(root->authority, authority::primary_administrator);
  EXPECT_TRUE(identities->still_valid(*root));
  EXPECT_EQ(identities->authenticate("cn=root", "x"), nullptr);
  ASSERT_NE(identities->primary_administrator(), nullptr);
  EXPECT_TRUE(identities->still_valid(*identities->primary_administrator()));
}

TEST_F(ExternalIdentitiesOfAFile, CertificateOfSomebodyWhoMayNotBindProvesNothing) {
  const std::string off = kTop + "orv-slapdAdminGroupEnabled: FALSE\n";
  const std::string rest = group_with_map(mapped("cn=a => cn=alice") + mapped("cn=n => cn=nobody") +
                                          mapped("cn=c => cn=alice,cn=configuration")) +
                           member("alice", "cn=alice", "alicepw");
  const auto identities = read(off + rest);
  ASSERT_TRUE(identities) << error_;
  for (const char* const subject : {"CN=A", "CN=N", "CN=C"})
    EXPECT_EQ(identities->of_certificate(subject), nullptr) << subject;
  EXPECT_THAT(warnings_, Contains(HasSubstr("nobody can bind as CN=NOBODY")));
}

TEST_F(ExternalIdentitiesOfAFile, SubjectThatIsMappedTwiceProvesNothing) {
  const auto identities =
      read(kTop + group_with_map(mapped("cn=A => cn=root") + mapped("cn=a => cn=alice")) +
           member("alice", "cn=alice", "alicepw"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->of_certificate("CN=A"), nullptr);
  EXPECT_THAT(warnings_, Contains(HasSubstr("CN=A is mapped twice")));
}

TEST_F(ExternalIdentitiesOfAFile, MapAnywhereElseMapsNobody) {
  const auto identities =
      read(kTop + mapped("cn=t => cn=root") + kGroup +
           member("alice", "cn=alice", "alicepw", kAuditRole + mapped("cn=m => cn=root")));
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->of_certificate("CN=T"), nullptr);
  EXPECT_EQ(identities->of_certificate("CN=M"), nullptr);
}

TEST_F(ExternalIdentitiesOfAFile, WhoWasProvedByACertificateIsNoLongerWhenTheMapIsGone) {
  const std::string rest = member("alice", "cn=alice", "alicepw");
  const auto before = read(kTop + group_with_map(mapped("cn=a => cn=alice")) + rest);
  ASSERT_TRUE(before);
  const auto alice = before->of_certificate("CN=A");
  ASSERT_TRUE(alice);
  const auto without = read(kTop + kGroup + rest);
  EXPECT_FALSE(without->still_valid(*alice));
  const auto elsewhere = read(kTop + group_with_map(mapped("cn=a => cn=root")) + rest);
  EXPECT_FALSE(elsewhere->still_valid(*alice));
  const auto same = read(kTop + group_with_map(mapped("CN = a=>CN=Alice")) + rest);
  EXPECT_TRUE(same->still_valid(*alice));
  // By the password alice is as before.
  const Identity* const by_password = without->authenticate("cn=alice", "alicepw");
  ASSERT_NE(by_password, nullptr);
  EXPECT_TRUE(without->still_valid(*by_password));
}

TEST_F(ExternalIdentitiesOfAFile, MapThatIsNoneIsReportedWithoutHarm) {
  const auto identities =
      read(kTop + group_with_map(mapped("nonsense") + mapped("cn=r => cn=root")));
  ASSERT_TRUE(identities) << error_;
  EXPECT_TRUE(identities->of_certificate("CN=R"));
  EXPECT_THAT(warnings_, Contains(HasSubstr("is not SUBJECT => NAME")));
}

TEST_F(ExternalIdentitiesOfAFile, PrimaryAdministratorWhoseNameIsClaimedTwiceIsNobody) {
  const auto identities = read(kTop + kGroup + member("alice", "CN=Root", "alicepw"));
  ASSERT_TRUE(identities) << error_;
  EXPECT_EQ(identities->primary_administrator(), nullptr);
}

// ---- EXTERNAL

class ScriptedExternal final : public ExternalIdentities {
 public:
  std::shared_ptr<const Identity> primary_administrator() override {
    return std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, ""});
  }
  std::shared_ptr<const Identity> of_certificate(std::string_view subject) override {
    if (subject != "CN=A") return nullptr;
    return std::make_shared<Identity>(Identity{"CN=ALICE", 0x14, 0, ""});
  }
  bool maps_certificates() const noexcept override { return maps; }
  bool maps = true;
};

class External : public ::testing::Test {
 protected:
  // The bound DN that a bind leads to; "none" when it fails, "not offered".
  std::string bound(const TransportFacts& facts, std::string_view as = "") {
    const auto mechanism = make_external(identities_);
    if (!mechanism->offered(facts)) return "not offered";
    const SaslOutcome outcome = mechanism->start(facts)->step(as);
    return outcome.state == SaslOutcome::State::done ? outcome.identity->bound_dn : "none";
  }
  ScriptedExternal identities_;
};

TEST_F(External, OnAUnixSocketRootAndTheServersUserAreTheAdministrator) {
  TransportFacts facts;
  facts.local = true;
  EXPECT_EQ(bound(facts), "not offered");
  facts.peer_uid = 0;
  EXPECT_EQ(bound(facts), "CN=ROOT");
  facts.peer_uid = ::geteuid();
  EXPECT_EQ(bound(facts), "CN=ROOT");
  facts.peer_uid = ::geteuid() + 1;
  EXPECT_EQ(bound(facts), "not offered");
}

TEST_F(External, UnderTlsItIsWhomTheCertificateIsMappedTo) {
  TransportFacts facts;
  facts.tls_version = "TLSv1.3";
  EXPECT_EQ(bound(facts), "not offered");
  facts.certificate_subject = "CN=A";
  EXPECT_EQ(bound(facts), "CN=ALICE");
  EXPECT_EQ(bound(facts, "dn:cn=alice"), "CN=ALICE");
  EXPECT_EQ(bound(facts, "dn:cn=root"), "none");
  EXPECT_EQ(bound(facts, "u:alice"), "none");
  facts.certificate_subject = "CN=B";
  EXPECT_EQ(bound(facts), "none");
}

TEST_F(External, IsNotOfferedToCertificatesWhereNoneStandsForAnybody) {
  identities_.maps = false;
  TransportFacts facts;
  facts.tls_version = "TLSv1.3";
  facts.certificate_subject = "CN=A";
  EXPECT_EQ(bound(facts), "not offered");
  facts.peer_uid = 0;
  EXPECT_EQ(bound(facts), "CN=ROOT");
}

TEST(ActingAs, IsForOneselfAlone) {
  const Identity alice{"CN=ALICE", 0x14, 0, ""};
  for (const char* const own : {"", "dn:cn=alice", "dn: CN = Alice", "u:al"})
    EXPECT_TRUE(may_act_as(alice, "al", own)) << own;
  for (const char* const other : {"dn:", "dn:cn=bob", "u:", "u:AL", "u:bob", "alice", "cn=alice",
                                  "DN:cn=alice", "dn:cn=alice,", " "})
    EXPECT_FALSE(may_act_as(alice, "al", other)) << other;
  EXPECT_FALSE(may_act_as(alice, "", "u:"));
}

}  // namespace
}  // namespace orv::server
