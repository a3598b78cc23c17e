// What the server does about changes before and after the backend: guards, consequences, and rights
// that shrank while an operation waited.
#include <algorithm>
#include <atomic>
#include <iterator>
#include <mutex>
#include <utility>

#include "../temporary_directory.h"
#include "core_server_fixture.h"
#include "ops/canonical.h"
#include "ops/consequences.h"
#include "ops/guards.h"
#include "ops/persistent_search.h"

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
  const std::string text = orv::test::content_of(ORV_SOURCE_DIR "/docs/guards.md");
  for (const Guard& guard : entry_guards()) {
    const std::string row =
        std::string("| ") + (guard.change == GuardedChange::add ? "add" : "delete") + " | `" +
        std::string(guard.dn) + "` | " + (guard.primary_may ? "primary administrator" : "nobody") +
        " | " + std::to_string(guard.code) + " |";
    EXPECT_NE(text.find(row), std::string::npos) << row;
  }
}

// ---- the password policy

// The code of adding a policy entry with these attributes.
int code_of_adding_policy(std::vector<Attribute> attributes, unsigned authority = kPrimary) {
  EntryPtr made;
  EXPECT_EQ(make_entry(builtin_schema(), {kPolicy, std::move(attributes)}, made).code, 0);
  return guarded_policy(builtin_schema(), kPolicy, *made, authority).code;
}

TEST(PolicyGuard, RefusesAnAddedPolicyThatCouldNotBePutInForce) {
  const Attribute off{"orv-slapdAdminPolicyEnabled", {"FALSE"}};
  EXPECT_EQ(code_of_adding_policy({off}), 0);
  EXPECT_EQ(code_of_adding_policy({off, {"pwdMinLength", {"3"}}}), 19);
  EXPECT_EQ(code_of_adding_policy({{"PWDMINLENGTH", {"3"}}}), 19);
  EXPECT_EQ(code_of_adding_policy({{"pwdMinLength", {"3"}}, {"passwordMinAlphaChars", {"1"}}}), 0);
  EXPECT_EQ(code_of_adding_policy({{"pwdMaxFailure", {"0"}}}), 19);
  EXPECT_EQ(code_of_adding_policy({{"pwdMaxFailure", {"0"}}, {"pwdLockout", {"FALSE"}}}), 0);
  EXPECT_EQ(code_of_adding_policy({{"pwdMaxFailure", {"99999999999"}}}), 19);
}

TEST(PolicyGuard, LeavesToOthersWhatTheyRefuse) {
  EXPECT_EQ(code_of_adding_policy({{"pwdMinLength", {"3"}}}, kGroupMember), 0);
  EXPECT_EQ(code_of_adding_policy({{"pwdMinLength", {"ten"}}}), 0);
  EXPECT_EQ(code_of_adding_policy({{"pwdLockout", {"yes"}}, {"pwdMinLength", {"3"}}}), 0);
  EntryPtr elsewhere;
  ASSERT_EQ(
      make_entry(builtin_schema(), {"cn=x,cn=configuration", {{"pwdMinLength", {"3"}}}}, elsewhere)
          .code,
      0);
  EXPECT_EQ(guarded_policy(builtin_schema(), "CN=X,CN=CONFIGURATION", *elsewhere, kPrimary).code,
            0);
}

// ---- the files of TLS

// The code of adding an entry with these attributes.
int code_of_adding_files(const std::string& dn, std::vector<Attribute> attributes,
                         unsigned authority = kPrimary) {
  EntryPtr made;
  EXPECT_EQ(make_entry(builtin_schema(), {dn, std::move(attributes)}, made).code, 0);
  return guarded_tls_files(dn, *made, authority).code;
}

TEST(TlsFilesGuard, RefusesAnAddedEntryWithWhichTheServerWouldNotStart) {
  constexpr const char* kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
  const Attribute nothing{"orv-slapdTlsCertificateFile", {"/nonexistent/tls.crt"}};
  EXPECT_EQ(code_of_adding_files(kGroup, {nothing}), 53);
  EXPECT_EQ(code_of_adding_files(kGroup, {{"ORV-slapdTlsCertificateFile", nothing.values}}), 53);
  EXPECT_EQ(code_of_adding_files(kGroup, {{"orv-slapdTlsKeyFile", nothing.values}}), 0)
      << "without a certificate there is no TLS";
  EXPECT_EQ(code_of_adding_files(kGroup, {{"cn", {"AdminGroup"}}}), 0);
  EXPECT_EQ(code_of_adding_files(kGroup, {nothing}, kGroupMember), 0) << "the rules refuse those";
  EXPECT_EQ(code_of_adding_files("CN=X,CN=CONFIGURATION", {nothing}), 0);
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
  EXPECT_TRUE(consequences_of_change("CN=DIGEST,CN=CONFIGURATION", identities).identities);
  EXPECT_TRUE(consequences_of_change("CN=KERBEROS,CN=CONFIGURATION", identities).identities);
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

// ---- changes that are not what the backend says

// How many changes the library has made; only the gate's holder counts.
std::atomic<unsigned long>& library_changes() {
  static std::atomic<unsigned long> made{0};
  return made;
}

class ReportedChanges : public LoopbackServer {
 protected:
  ReportedChanges() {
    changes_made = [] { return library_changes().load(); };
    backend.on_change = [this](pblock* parameters) {
      if (writes) ++library_changes();
      const int rc = code;
      return finish_change(parameters, rc);
    };
    take_over = [this](const Consequences& consequences, bool made) {
      const std::lock_guard lock(mutex);
      taken_over.emplace_back(consequences.identities, made);
      return read_anew.load();
    };
  }
  ~ReportedChanges() override { stop(); }

  using Told = std::vector<std::pair<bool, bool>>;  // identities, made
  Told told() {
    const std::lock_guard lock(mutex);
    return std::exchange(taken_over, {});
  }

  std::atomic<bool> writes{true};
  std::atomic<int> code{0};
  std::atomic<bool> read_anew{false};

 private:
  std::mutex mutex;
  Told taken_over;
};

TEST_F(ReportedChanges, ThatWereNotMadeAreAnsweredWith90) {
  start();
  WireClient client(port());
  bind_as_root(client);
  const std::string added = "cn=x,cn=configuration";
  writes = false;
  EXPECT_EQ(code_of(client, add_entry(2, added, "objectClass", "orv-slapdSupplier")), 90);
  EXPECT_EQ(code_of(client, modify(3, kTop, "description", "x")), 90);
  EXPECT_EQ(code_of(client, delete_entry(4, added)), 90);
  EXPECT_EQ(told(), (Told{{true, false}, {true, false}, {true, false}})) << "looked for, not taken";
  writes = true;
  EXPECT_EQ(code_of(client, modify(5, kTop, "description", "x")), 0);
  EXPECT_EQ(told(), (Told{{true, true}}));
}

TEST_F(ReportedChanges, AreLookedForInTheFileWhateverTheResult) {
  start();
  WireClient client(port());
  bind_as_root(client);
  for (const int failure : {1, 50, 51, 53, 80, 90}) {
    code = failure;
    EXPECT_EQ(code_of(client, delete_entry(failure, "cn=x,cn=configuration")), failure);
    EXPECT_EQ(told().size(), 1U) << failure;
  }
}

TEST_F(ReportedChanges, ThatFailedAndStandInTheFileHaveTheirSettingsRead) {
  std::atomic<int> reloads{0};
  reload = [&](Settings&) {
    ++reloads;
    return false;
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  code = 80;
  EXPECT_EQ(code_of(client, modify(2, kTop, "description", "x")), 80);
  EXPECT_EQ(reloads, 0);
  read_anew = true;
  EXPECT_EQ(code_of(client, modify(3, kTop, "description", "x")), 80);
  EXPECT_EQ(reloads, 1);
}

TEST_F(ReportedChanges, ThatWereNotMadeAreNotTold) {
  controls = {kPersistentSearchOid, kEntryChangeOid};
  backend.on_search = [](pblock* parameters) { return finish_search(parameters, 0, 0); };
  start();
  WireClient listener(port());
  WireClient client(port());
  bind_as_root(listener);
  bind_as_root(client);
  const std::string value = tlv(0x30, integer(15) + tlv(0x01, "\xFF") + tlv(0x01, "\xFF"));
  const std::string wish =
      tlv(0x30, tlv(0x04, kPersistentSearchOid) + tlv(0x01, "\xFF") + tlv(0x04, value));
  listener.send(
      message(7,
              tlv(0x63, tlv(0x04, kTop) + tlv(0x0A, "\x02") + tlv(0x0A, std::string(1, '\0')) +
                            integer(0) + integer(0) + tlv(0x01, std::string(1, '\0')) +
                            tlv(0x87, "objectClass") + tlv(0x30, "")),
              wish));
  listener.send(extended(8, "1.2.3"));
  ASSERT_TRUE(listener.receive());
  writes = false;
  EXPECT_EQ(code_of(client, add_entry(2, "cn=x,cn=configuration", "cn", "x")), 90);
  listener.send(extended(9, "1.2.3"));
  ASSERT_TRUE(listener.receive());
  EXPECT_EQ(backend.calls(parameter::search_function), 1) << "that of the first part";
}

TEST_F(LoopbackServer, FilesAreLookedAfterAgainAndAgainWithoutARequest) {
  Event looked_twice;
  std::atomic<int> looks{0};
  look_after = [&] {
    if (++looks == 2) looked_twice.happen();
  };
  start();
  EXPECT_TRUE(looked_twice.wait());
  stop();
}

}  // namespace
}  // namespace test
}  // namespace orv::server
