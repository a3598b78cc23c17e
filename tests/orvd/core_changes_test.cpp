// What the server does about changes before and after the backend: guards, consequences, and rights
// that shrank while an operation waited.
#include <algorithm>
#include <fstream>
#include <iterator>

#include "core_server_fixture.h"
#include "file_report.h"
#include "ops/canonical.h"
#include "ops/consequences.h"
#include "ops/guards.h"

namespace orv::server {
namespace {

constexpr unsigned kPrimary = 0x0C;
constexpr unsigned kGroupMember = 0x14;
constexpr const char* kPolicy = "CN=PWDPOLICY ADMIN,CN=CONFIGURATION";
constexpr const char* kContainer = "CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";

EntryPtr entry_of_class(const std::string& dn, const std::string& name) {
  EntryPtr made;
  EXPECT_EQ(make_entry(builtin_schema(), {dn, {{"objectClass", {"top", name}}}}, made).code, 0);
  return made;
}

// ---- guards

TEST(Guards, PolicyIsAddedAndDeletedByThePrimaryAdministratorAlone) {
  const EntryPtr policy = entry_of_class(kPolicy, "orv-slapdAdminPolicy");
  EXPECT_EQ(guarded(GuardedChange::add, kPolicy, kPrimary, policy.get()).code, 0);
  EXPECT_EQ(guarded(GuardedChange::add, kPolicy, kGroupMember, policy.get()).code, 50);
  EXPECT_EQ(guarded(GuardedChange::remove, kPolicy, kPrimary, nullptr).code, 0);
  EXPECT_EQ(guarded(GuardedChange::remove, kPolicy, kGroupMember, nullptr).code, 50);
}

TEST(Guards, ContainerOfPassThroughEntriesIsDeletedByNobody) {
  EXPECT_EQ(guarded(GuardedChange::remove, kContainer, kPrimary, nullptr).code, 53);
  EXPECT_EQ(guarded(GuardedChange::remove, kContainer, kGroupMember, nullptr).code, 53);
  EXPECT_EQ(
      guarded(GuardedChange::remove, std::string("CN=X,") + kContainer, kPrimary, nullptr).code, 0);
}

TEST(Guards, SupplierOfTheWholeServerStandsInOnePlace) {
  for (const char* const name : {"orv-slapdReplication", "ORV-SLAPDREPLICATION"}) {
    const EntryPtr supplier = entry_of_class("cn=x,cn=configuration", name);
    EXPECT_EQ(guarded(GuardedChange::add, "CN=X,CN=CONFIGURATION", kPrimary, supplier.get()).code,
              53);
    EXPECT_EQ(
        guarded(GuardedChange::add, "CN=MASTER SERVER,CN=CONFIGURATION", kPrimary, supplier.get())
            .code,
        0);
  }
}

TEST(Guards, NoOtherEntryIsGuarded) {
  const EntryPtr other = entry_of_class("cn=x,cn=configuration", "orv-slapdSupplier");
  EXPECT_EQ(guarded(GuardedChange::add, "CN=X,CN=CONFIGURATION", kGroupMember, other.get()).code,
            0);
  EXPECT_EQ(
      guarded(GuardedChange::remove, "CN=DIGEST,CN=CONFIGURATION", kGroupMember, nullptr).code, 0);
}

TEST(Guards, EveryGuardIsInTheDocumentation) {
  std::ifstream file(ORV_SOURCE_DIR "/docs/guards.md");
  const std::string text{std::istreambuf_iterator<char>(file), {}};
  for (const Guard& guard : entry_guards()) {
    const std::string row =
        std::string("| ") + (guard.change == GuardedChange::add ? "add" : "delete") + " | `" +
        std::string(guard.dn) + "` | " + (guard.primary_may ? "primary administrator" : "nobody") +
        " | " + std::to_string(guard.code) + " |";
    EXPECT_NE(text.find(row), std::string::npos) << row;
  }
}

// ---- consequences

class OneIdentity final : public Authenticator {
 public:
  std::shared_ptr<const Identity> authenticate(std::string_view, std::string_view) override {
    return nullptr;
  }
  bool may_define(std::string_view entry_dn) const noexcept override {
    return entry_dn == "CN=MEMBER,CN=ADMINGROUP,CN=CONFIGURATION";
  }
};

TEST(Consequences, OfAddingEntriesThatDefineSomebody) {
  for (const char* const name :
       {"orv-slapdAdminGroupMember", "orv-slapdSupplier", "orv-slapdReplication"}) {
    const EntryPtr added = entry_of_class("cn=x,cn=configuration", name);
    EXPECT_TRUE(consequences_of_add("CN=X,CN=CONFIGURATION", *added).identities) << name;
  }
  const EntryPtr other = entry_of_class("cn=x,cn=configuration", "container");
  EXPECT_FALSE(consequences_of_add("CN=X,CN=CONFIGURATION", *other).any());
}

TEST(Consequences, OfDeletingEntriesThatDefineSomebody) {
  const OneIdentity identities;
  EXPECT_TRUE(
      consequences_of_change("CN=MEMBER,CN=ADMINGROUP,CN=CONFIGURATION", identities).identities);
  EXPECT_TRUE(consequences_of_change("CN=CONFIGURATION", identities).identities);
  EXPECT_FALSE(consequences_of_change("CN=X,CN=CONFIGURATION", identities).any());
}

TEST(Consequences, OfEntriesThatSayHowPasswordsAreStored) {
  const OneIdentity identities;
  EXPECT_TRUE(consequences_of_change("CN=CONFIGURATION", identities).methods);
  EXPECT_TRUE(consequences_of_change("CN=ADMINGROUP,CN=CONFIGURATION", identities).methods);
  EXPECT_FALSE(consequences_of_change("CN=X,CN=ADMINGROUP,CN=CONFIGURATION", identities).methods);
}

TEST(Consequences, OfEntriesThatHoldSettings) {
  const OneIdentity identities;
  EXPECT_TRUE(consequences_of_change(kPolicy, identities).policy);
  EXPECT_FALSE(consequences_of_change(kPolicy, identities).settings);
  EXPECT_TRUE(consequences_of_change("CN=CONFIGURATION", identities).settings);
  EXPECT_TRUE(
      consequences_of_change("CN=ACCESS,CN=LOG MANAGEMENT,CN=CONFIGURATION", identities).settings);
  EXPECT_FALSE(
      consequences_of_change("CN=X,CN=XLOG MANAGEMENT,CN=CONFIGURATION", identities).settings);
}

// ---- the file as somebody left it

TEST(FileReport, FindsTypesUnderTheirNumbers) {
  EXPECT_EQ(
      numbered_types("version: 1\n# 2.5.4.3: no\ndn: cn=x\n2.5.4.3: x\n 2.5.4.4: folded\n"
                     "2.5.4.0:: dG9w\n2.5.4.3;x: y\ncn: 2.5.4.3: z\n2.5.4"),
      (std::vector<std::string>{"line 4: the attribute type 2.5.4.3 stands under its number",
                                "line 6: the attribute type 2.5.4.0 stands under its number",
                                "line 7: the attribute type 2.5.4.3 stands under its number"}));
  EXPECT_TRUE(numbered_types("").empty());
}

TEST(FileReport, KnowsAddressesOfThisHost) {
  EXPECT_FALSE(is_foreign_address("127.0.0.1"));
  EXPECT_FALSE(is_foreign_address("0.0.0.0"));
  EXPECT_FALSE(is_foreign_address("::"));
  EXPECT_FALSE(is_foreign_address("localhost"));
  EXPECT_TRUE(is_foreign_address("192.0.2.1"));
  EXPECT_TRUE(is_foreign_address("2001:db8::1"));
}

}  // namespace

namespace test {
namespace {

// ---- rights that shrink

TEST_F(BlockedServer, OperationThatWaitedWhileItsIdentityWentIsRefusedWithoutTheBackend) {
  block();
  WireClient waiting(port());
  bind_as(waiting, kMember);
  waiting.send(delete_entry(2, kTop));
  ASSERT_TRUE(wait_for_waiters(1));
  authenticator.change(false);
  go_on.happen();
  const std::vector<Reply> replies = waiting.receive_result();
  ASSERT_FALSE(replies.empty());
  // Refused, or ended by the notice that the identity is gone.
  if (replies.back().tag != kNotice) {
    EXPECT_EQ(replies.back().code, 50);
  }
  stop();
  EXPECT_EQ(backend.calls(parameter::delete_function), 1);
}

TEST_F(BlockedServer, OperationThatWaitedIsServedWhenItsIdentityIsStillTheSame) {
  block();
  WireClient waiting(port());
  bind_as(waiting, kMember);
  waiting.send(delete_entry(2, kTop));
  ASSERT_TRUE(wait_for_waiters(1));
  authenticator.change(true);
  go_on.happen();
  const std::vector<Reply> replies = waiting.receive_result();
  ASSERT_FALSE(replies.empty());
  EXPECT_EQ(replies.back().code, 53);
  stop();
  EXPECT_EQ(backend.calls(parameter::delete_function), 2);
}

}  // namespace
}  // namespace test
}  // namespace orv::server
