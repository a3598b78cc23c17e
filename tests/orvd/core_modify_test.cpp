// Modify requests on their way through the server: which list the backend gets, and what a change
// that was made means for the server before its result leaves.
#include <algorithm>
#include <mutex>
#include <sstream>

#include "cfg/ldapmod.h"
#include "cfg/session.h"
#include "core_server_fixture.h"
#include "ops/failed_changes.h"
#include "ops/guards.h"

namespace orv::server::test {
namespace {

constexpr const char* kMemberEntry = "cn=member,cn=admingroup,cn=configuration";

struct Change {
  int operation;
  std::string type;
  std::vector<std::string> values;
};

std::string modify_with(int id, std::string_view dn, const std::vector<Change>& changes) {
  std::string list;
  for (const Change& change : changes) {
    std::string values;
    for (const std::string& value : change.values) values += tlv(0x04, value);
    const std::string code(1, static_cast<char>(change.operation));
    list += tlv(0x30, tlv(0x0A, code) + tlv(0x30, tlv(0x04, change.type) + tlv(0x31, values)));
  }
  return message(id, tlv(0x66, tlv(0x04, dn) + tlv(0x30, list)));
}

std::string text_of(pblock* parameters) {
  ldapmod* first = nullptr;
  slapi_pblock_get(parameters, parameter::modifications, &first);
  std::ostringstream text;
  for (; first; first = first->mod_next) {
    constexpr const char* kNames[] = {"add", "delete", "replace"};
    text << kNames[first->operation()] << ' ' << first->mod_type;
    for (berval** value = first->mod_vals.modv_bvals; value && *value; ++value)
      text << ' ' << (*value)->bv_val;
    text << "; ";
  }
  return text.str();
}

class ModifyServer : public LoopbackServer {
 protected:
  ModifyServer() {
    settings.audit_log.clear();
    backend.on_change = [this](pblock* parameters) {
      {
        const std::lock_guard lock(mutex);
        handed_over = text_of(parameters);
      }
      if (in_handler) in_handler();
      return finish_change(parameters, code);
    };
  }
  ~ModifyServer() override { stop(); }

  std::string last_list() {
    const std::lock_guard lock(mutex);
    return handed_over;
  }

  int code = 0;  // of the handler
  std::function<void()> in_handler;

 private:
  std::mutex mutex;
  std::string handed_over;
};

// ---- lists

TEST_F(ModifyServer, HandsOverAFoldedList) {
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(code_of(client, modify_with(2, kTop,
                                        {{1, "description", {"a"}},
                                         {2, "orv-slapdport", {"1"}},
                                         {0, "2.5.4.13", {"b"}},
                                         {2, "orv-slapdPort", {"2"}}})),
            0);
  EXPECT_EQ(last_list(), "add description b; delete description a; replace orv-slapdPort 2; ");
}

TEST_F(ModifyServer, RefusesAListThatCannotBeFoldedWithoutTheBackend) {
  start();
  WireClient client(port());
  bind_as_root(client);
  client.send(modify_with(2, kTop, {{0, "description", {"a"}}, {2, "description", {"b"}}}));
  const std::vector<Reply> replies = client.receive_result();
  ASSERT_FALSE(replies.empty());
  EXPECT_EQ(replies.back().code, 53);
  EXPECT_NE(replies.back().body.find("description"), std::string::npos);
  stop();
  EXPECT_EQ(backend.calls(parameter::modify_function), 0);
}

TEST_F(ModifyServer, HandsOverTheListOfAMemberInTheGroupAsItCame) {
  start();
  WireClient member(port());
  bind_as(member, kMember);
  const std::vector<Change> two{{1, "orv-slapdAdminPW", {"old"}}, {0, "orv-slapdAdminPW", {"new"}}};
  EXPECT_EQ(code_of(member, modify_with(2, kMemberEntry, two)), 0);
  EXPECT_EQ(last_list(), "delete orv-slapdAdminPW old; add orv-slapdAdminPW new; ");
  EXPECT_EQ(code_of(member, modify_with(3, kTop, two)), 0);
  EXPECT_EQ(last_list(), "add orv-slapdAdminPW new; delete orv-slapdAdminPW old; ");
}

TEST_F(ModifyServer, FoldsTheListOfThePrimaryAdministratorInTheGroup) {
  start();
  WireClient root(port());
  bind_as_root(root);
  EXPECT_EQ(code_of(root, modify_with(2, kMemberEntry,
                                      {{1, "orv-slapdAdminRole", {"AuditAdmin"}},
                                       {0, "orv-slapdAdminRole", {"NoAdmin"}}})),
            0);
  EXPECT_EQ(last_list(), "add orv-slapdAdminRole NoAdmin; delete orv-slapdAdminRole AuditAdmin; ");
}

TEST_F(ModifyServer, RefusesStructuralClassesAndNames) {
  start();
  WireClient client(port());
  bind_as_root(client);
  const char* const entry = "cn=x,cn=configuration";
  EXPECT_EQ(code_of(client, modify_with(2, entry, {{0, "objectClass", {"orv-slapdSupplier"}}})),
            69);
  EXPECT_EQ(code_of(client, modify_with(3, entry, {{1, "cn", {"X"}}})), 67);
  stop();
  EXPECT_EQ(backend.calls(parameter::modify_function), 0);
}

TEST_F(ModifyServer, RefusesSettingsThatTheServerCouldNotStartWith) {
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(code_of(client, modify_with(2, kTop, {{2, "orv-slapdMaxConnections", {"0"}}})), 19);
  EXPECT_EQ(code_of(client, modify_with(3, kTop, {{0, "orv-slapdPort", {"65536"}}})), 19);
  EXPECT_EQ(code_of(client, modify_with(4, "cn=default,cn=log management,cn=configuration",
                                        {{2, "orv-slapdLogLevel", {"loud"}}})),
            19);
  EXPECT_EQ(code_of(client, modify_with(5, kTop, {{1, "orv-slapdPort", {"65536"}}})), 0);
  EXPECT_EQ(code_of(client, modify_with(6, "cn=default,cn=log management,cn=configuration",
                                        {{2, "orv-slapdLogLevel", {"WARNING"}}})),
            0);
  stop();
  EXPECT_EQ(backend.calls(parameter::modify_function), 2);
}

TEST_F(ModifyServer, RefusesSettingsOfTheGroupOutOfTheirPlace) {
  start();
  WireClient client(port());
  bind_as_root(client);
  const std::vector<Change> changes{{0, "objectClass", {"ORV-slapdAdminGroupSettings"}}};
  EXPECT_EQ(code_of(client, modify_with(2, kTop, changes)), 53);
  EXPECT_EQ(code_of(client, modify_with(3, "cn=digest,cn=configuration", changes)), 53);
  EXPECT_EQ(code_of(client, modify_with(4, "cn=admingroup,cn=configuration", changes)), 0);
  stop();
  EXPECT_EQ(backend.calls(parameter::modify_function), 1);
}

int code_of_adding(const Attribute& attribute) {
  EntryPtr added;
  EXPECT_EQ(make_entry(builtin_schema(), {"cn=x,cn=configuration", {attribute}}, added).code, 0);
  return guarded(GuardedChange::add, "CN=X,CN=CONFIGURATION", 0x0C, added.get()).code;
}

TEST(ValueGuards, LookAtAddedEntriesToo) {
  EXPECT_EQ(code_of_adding({"orv-slapdLogLevel", {"loud"}}), 19);
  EXPECT_EQ(code_of_adding({"orv-slapdLogLevel", {"Debug"}}), 0);
  EXPECT_EQ(code_of_adding({"orv-slapdSizeLimit", {"-1"}}), 19);
  EXPECT_EQ(code_of_adding({"objectClass", {"orv-slapdAdminGroupSettings"}}), 53);
}

TEST_F(ModifyServer, RefusesMethodsOfStoringPasswordsThatAreNone) {
  start();
  WireClient client(port());
  bind_as_root(client);
  const auto code_of_change = [&](int id, int operation, const std::vector<std::string>& values) {
    return code_of(client, modify_with(id, "cn=admingroup,cn=configuration",
                                       {{operation, "ORV-slapdPwEncryptionAllowed", values}}));
  };
  EXPECT_EQ(code_of_change(2, 0, {"bogus"}), 21);
  EXPECT_EQ(code_of_change(3, 2, {"AES256", "{SSHA512}"}), 21);
  EXPECT_EQ(code_of_change(4, 2, {"aes256", "None", "SSHA512", "pbkdf2-sha256"}), 0);
  EXPECT_EQ(code_of_change(5, 1, {"bogus"}), 0) << "what an editor has put in can be taken out";
  stop();
  EXPECT_EQ(backend.calls(parameter::modify_function), 2);
}

TEST(ValueGuards, LookAtAddedMethodsOfStoringPasswordsToo) {
  EXPECT_EQ(code_of_adding({"orv-slapdPwEncryptionAllowed", {"AES256", "bogus"}}), 21);
  EXPECT_EQ(code_of_adding({"orv-slapdPwEncryptionAllowed", {"AES256"}}), 0);
}

constexpr const char* kNamesOfNobody[] = {
    "cn=foo,cn=configuration", "CN = Configuration", "cn=a,2.5.4.3=\\43onfiguration",
    "cn=a+cn=b,cn=digest,commonName=#040D436F6E66696775726174696F6E"};

TEST_F(ModifyServer, RefusesNamesWithWhichNobodyCouldBind) {
  start();
  WireClient client(port());
  bind_as_root(client);
  for (const char* const name : kNamesOfNobody) {
    EXPECT_EQ(code_of(client, modify_with(2, kTop, {{2, "orv-slapdAdminDN", {name}}})), 19) << name;
    EXPECT_EQ(code_of(client, modify_with(3, "cn=master server,cn=configuration",
                                          {{0, "orv-slapdMasterDN", {name}}})),
              19)
        << name;
  }
  const char* const number = "2.25.83817390626969804497818767862655265745.1.1";
  EXPECT_EQ(builtin_schema().canonical_attribute(number), "orv-slapdAdminDN");
  EXPECT_EQ(code_of(client, modify_with(4, kTop, {{2, number, {"cn=foo,cn=configuration"}}})), 19);
  EXPECT_EQ(code_of(client, modify_with(5, kTop, {{1, "orv-slapdAdminDN", {kNamesOfNobody[0]}}})),
            0)
      << "what an editor has put in can be taken out";
  for (const char* const name : {"cn=configuration,o=x", "cn=configurations", "cn=foo"})
    EXPECT_EQ(code_of(client, modify_with(6, kTop, {{2, "orv-slapdAdminDN", {name}}})), 0) << name;
}

TEST(ValueGuards, LookAtAddedNamesToo) {
  for (const char* const type : {"orv-slapdAdminDN", "orv-slapdMasterDN"}) {
    for (const char* const name : kNamesOfNobody) EXPECT_EQ(code_of_adding({type, {name}}), 19);
    EXPECT_EQ(code_of_adding({type, {"cn=foo"}}), 0);
    for (const char* const name : {"", " ", "no dn"})
      EXPECT_EQ(code_of_adding({type, {name}}), 0) << "the schema has an answer to that";
  }
}

// ---- the password policy

class PolicyServer : public ModifyServer {
 protected:
  PolicyServer() {
    read_policy = [this](AdminPolicySettings& settings) {
      const std::lock_guard lock(mutex);
      settings = in_file;
      return readable;
    };
  }
  ~PolicyServer() override { stop(); }

  int change(WireClient& client, const std::vector<Change>& changes) {
    return code_of(client,
                   modify_with(++last_id, "cn = PwdPolicy Admin, cn=configuration", changes));
  }
  void file_holds(AdminPolicySettings settings) {
    const std::lock_guard lock(mutex);
    in_file = std::move(settings);
  }

  bool readable = true;

 private:
  std::mutex mutex;
  AdminPolicySettings in_file;
  int last_id = 1;
};

TEST_F(PolicyServer, RefusesWhatWouldNotBePutInForce) {
  file_holds({{"orv-slapdAdminPolicyEnabled", "FALSE"}, {"pwdMinLength", "12"}});
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(change(client, {{2, "pwdMinLength", {"3"}}}), 19);
  EXPECT_EQ(change(client, {{1, "pwdMinLength", {"12"}}, {0, "pwdMinLength", {"3"}}}), 19);
  EXPECT_EQ(change(client, {{1, "pwdMinLength", {}}, {2, "passwordMinDiffChars", {"13"}}}), 19);
  EXPECT_EQ(change(client, {{2, "pwdMaxFailure", {"1000001"}}}), 19);
  EXPECT_EQ(change(client, {{1, "pwdMaxFailure", {"ten"}}, {2, "pwdMinLength", {"3"}}}), 19);
  EXPECT_EQ(backend.calls(parameter::modify_function), 0);
  EXPECT_EQ(change(client, {{2, "pwdMinLength", {"3"}}, {0, "passwordMinAlphaChars", {"1"}}}), 0);
  EXPECT_EQ(change(client, {{1, "pwdMinLength", {}}}), 0);
}

TEST_F(PolicyServer, LooksAtWhatTheFileHoldsWhenTheChangeIsAdmitted) {
  file_holds({{"pwdMinLength", "3"}, {"passwordMinAlphaChars", "1"}});
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(change(client, {{1, "passwordMinAlphaChars", {}}}), 19) << "2 is the default";
  EXPECT_EQ(change(client, {{0, "orv-slapdAdminPolicyEnabled", {"TRUE"}}}), 0);
  file_holds({{"pwdMinLength", "3"}});
  EXPECT_EQ(change(client, {{0, "orv-slapdAdminPolicyEnabled", {"TRUE"}}}), 19);
  EXPECT_EQ(change(client, {{2, "description", {"x"}}}), 0) << "nothing of the policy";
}

TEST_F(PolicyServer, LeavesToTheBackendWhatItRefuses) {
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(change(client, {{2, "pwdMinLength", {"three"}}}), 0);
  WireClient member(port());
  bind_as(member, kMember);
  EXPECT_EQ(change(member, {{2, "pwdMinLength", {"3"}}}), 0);
  readable = false;
  EXPECT_EQ(change(client, {{2, "pwdMinLength", {"3"}}}), 0);
  EXPECT_EQ(backend.calls(parameter::modify_function), 3);
}

// ---- modifications that fail

class FailingModifies : public ModifyServer {
 protected:
  FailingModifies() {
    settings.max_failed_change_size = kLimit;
    code = 50;
  }
  static std::string large(int id, std::size_t bytes = kLimit / 16) {
    return modify(id, kTop, "description", std::string(bytes, 'x'));
  }
  // How many large ones get to the backend, one after the other, before one is refused.
  int until_refused(WireClient& client) {
    for (int n = 0; n < 100; ++n) {
      const int got = code_of(client, large(10 + n));
      if (got == 51) return n;
      EXPECT_EQ(got, code);
    }
    return 100;
  }
  int modifies() { return backend.calls(parameter::modify_function); }

  static constexpr std::int64_t kLimit = 65536;
};

TEST_F(FailingModifies, AreRefusedWhenAConnectionHasUsedUpItsShare) {
  start();
  WireClient client(port());
  bind_as_root(client);
  const int admitted = until_refused(client);
  EXPECT_GE(admitted, 3);
  EXPECT_LE(admitted, 5);
  EXPECT_EQ(modifies(), admitted);
  WireClient other(port());
  bind_as_root(other);
  EXPECT_EQ(code_of(other, large(2)), 50) << "another connection has a share of its own";
}

TEST_F(FailingModifies, AreRefusedOnEveryConnectionOfWhoHasUsedUpTheAllowance) {
  start();
  int admitted = 0;
  int last = -1;
  for (int i = 0; i < 10 && last != 0; ++i) {
    WireClient client(port());
    bind_as_root(client);
    admitted += last = until_refused(client);
  }
  EXPECT_EQ(last, 0);
  EXPECT_GE(admitted, 15);
  EXPECT_LE(admitted, 18);
  EXPECT_EQ(modifies(), admitted);
  WireClient member(port());
  bind_as(member, kMember);
  EXPECT_EQ(code_of(member, large(2)), 50) << "others are not concerned";
}

TEST_F(FailingModifies, LeaveOtherRequestsAsTheyWere) {
  start();
  WireClient client(port());
  bind_as_root(client);
  until_refused(client);
  EXPECT_EQ(code_of(client, delete_entry(200, kTop)), 50);
  EXPECT_EQ(code_of(client, add_entry(201, "cn=x,cn=configuration", "cn", "x")), 50);
  code = 0;
  EXPECT_EQ(code_of(client, large(202)), 51) << "nor is one that would succeed let through";
}

TEST_F(FailingModifies, CostNothingWhenTheySucceed) {
  code = 0;
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(until_refused(client), 100);
}

TEST_F(FailingModifies, CostNothingWhenTheFileCannotBeOpened) {
  _CFG handle;
  backend.on_change = [&](pblock* parameters) {
    connection_of(parameters)->config_session = &handle;
    return 1;
  };
  backend.on_search = [](pblock* parameters) {
    connection_of(parameters)->config_session = nullptr;
    return 50;
  };
  code = 1;
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(until_refused(client), 100);
}

TEST_F(FailingModifies, AreNotForgottenWhenTheirClientConnectsAgain) {
  start();
  int admitted = 0;
  // One at a time, far below what one connection may.
  while (admitted < 100) {
    WireClient client(port());
    bind_as_root(client);
    const int got = code_of(client, large(2));
    if (got == 51) break;
    EXPECT_EQ(got, 50);
    ++admitted;
    client.send(unbind(3));
    EXPECT_TRUE(client.closed());
  }
  EXPECT_GE(admitted, 15);
  EXPECT_LE(admitted, 18);
}

TEST_F(FailingModifies, CountManySmallValuesByWhatTheyTake) {
  settings.max_values = 10000;
  start();
  WireClient client(port());
  bind_as_root(client);
  Change many{0, "description", {}};
  for (int i = 0; i < 1000; ++i) many.values.push_back(std::to_string(i));
  EXPECT_EQ(code_of(client, modify_with(2, kTop, {many})), 50);
  EXPECT_EQ(code_of(client, modify_with(3, kTop, {many})), 51);
}

// Many identities do not add up, and nobody keeps the primary administrator out.
TEST_F(FailingModifies, OfAllTogetherAreRefusedExceptThoseOfThePrimaryAdministrator) {
  settings.max_failed_change_size = 64 * kLimit;
  settings.max_failed_change_total_size = kLimit;
  start();
  WireClient root(port());
  bind_as_root(root);
  for (int i = 0; i < 40; ++i) EXPECT_EQ(code_of(root, large(10 + i)), 50);
  WireClient member(port());
  bind_as(member, kMember);
  const int admitted = until_refused(member);
  EXPECT_GE(admitted, 15);
  EXPECT_LE(admitted, 18);
  EXPECT_EQ(code_of(root, large(100)), 50);
  EXPECT_EQ(modifies(), 41 + admitted);
}

TEST(FailedChanges, OfAllNamesAddUpAndComeBackWithinADay) {
  using std::chrono::hours;
  constexpr std::int64_t kLimit = 1000;
  const Clock::time_point start = Clock::now();
  FailedChangesByName owed;
  for (int i = 0; i < 100; ++i) owed.charge_all(11, kLimit, start);
  EXPECT_TRUE(owed.all_used_up(kLimit, start));
  EXPECT_FALSE(owed.used_up("cn=1", kLimit, start));
  EXPECT_TRUE(owed.all_used_up(kLimit, start + hours(1)));
  EXPECT_FALSE(owed.all_used_up(kLimit, start + hours(4)));
}

TEST(FailedChanges, ComeBackWithinADay) {
  using std::chrono::hours;
  constexpr std::int64_t kLimit = 1000;
  const Clock::time_point start = Clock::now();
  FailedChanges owed;
  owed.charge(1000, kLimit, start);
  EXPECT_FALSE(owed.used_up(kLimit, start));
  owed.charge(500, kLimit, start);
  EXPECT_TRUE(owed.used_up(kLimit, start));
  EXPECT_TRUE(owed.used_up(kLimit, start + hours(11)));
  EXPECT_FALSE(owed.used_up(kLimit, start + hours(13)));
  EXPECT_FALSE(owed.settled(kLimit, start + hours(35)));
  EXPECT_TRUE(owed.settled(kLimit, start + hours(37)));
}

TEST(FailedChanges, ShutNobodyOutForLongerThanADay) {
  constexpr std::int64_t kLimit = 1000;
  const Clock::time_point start = Clock::now();
  FailedChanges owed;
  owed.charge(1000000, kLimit, start);
  EXPECT_TRUE(owed.used_up(kLimit, start + std::chrono::hours(23)));
  EXPECT_FALSE(owed.used_up(kLimit, start + std::chrono::hours(25)));
}

TEST(FailedChanges, OfNamesThatOweNothingAreForgotten) {
  constexpr std::int64_t kLimit = 1000;
  const Clock::time_point start = Clock::now();
  FailedChangesByName owed;
  for (int i = 0; i < 5000; ++i)
    owed.charge("cn=" + std::to_string(i), 1, kLimit, start + i * std::chrono::hours(1));
  EXPECT_LE(owed.names(), 1100U);
  EXPECT_FALSE(owed.used_up("cn=4999", kLimit, start));
}

// ---- settings

TEST_F(ModifyServer, SettingsAreInForceWhenTheResultArrives) {
  std::atomic<int> reloads{0};
  reload = [&](Settings& wanted) {
    ++reloads;
    wanted = settings;
    wanted.max_attributes = 1;
    return true;
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  const std::vector<Change> two{{2, "description", {"a"}}, {2, "orv-slapdPort", {"1"}}};
  EXPECT_EQ(code_of(client, modify_with(2, kTop, two)), 0);
  EXPECT_EQ(reloads, 1);
  EXPECT_EQ(code_of(client, modify_with(3, kTop, two)), 11);
}

TEST_F(ModifyServer, SettingsAreNotReadAfterAChangeThatWasRefusedOrConcernsNone) {
  std::atomic<int> reloads{0};
  reload = [&](Settings&) {
    ++reloads;
    return false;
  };
  start();
  WireClient client(port());
  bind_as_root(client);
  code = 65;
  EXPECT_EQ(code_of(client, modify(2, kTop, "description", "a")), 65);
  code = 0;
  EXPECT_EQ(code_of(client, modify(3, "cn=schemas,cn=configuration", "description", "a")), 0);
  EXPECT_EQ(reloads, 0);
  EXPECT_EQ(
      code_of(client, modify(4, "cn=audit,cn=log management,cn=configuration", "description", "a")),
      0);
  EXPECT_EQ(reloads, 1);
}

// ---- whoever changes what they are themselves

TEST_F(ModifyServer, ResultOfAChangeOfOnesOwnIdentityComesBeforeTheEndOfTheConnection) {
  std::optional<WireClient> witness;
  std::atomic<bool> witness_ended{false};
  // The result waits for this, and the connections were looked through meanwhile.
  reload = [&](Settings&) {
    const std::optional<Reply> reply = witness->receive();
    witness_ended = reply && reply->tag == kNotice;
    return false;
  };
  in_handler = [this] { authenticator.change(false); };
  start();
  witness.emplace(port());
  bind_as(*witness, kMember);
  WireClient client(port());
  bind_as(client, kMember);
  client.send(modify(2, kTop, "description", "a"));
  const std::optional<Reply> result = client.receive();
  ASSERT_TRUE(result);
  EXPECT_NE(result->tag, kNotice);
  EXPECT_EQ(result->code, 0);
  EXPECT_TRUE(witness_ended);
  const std::optional<Reply> notice = client.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kNotice);
}

}  // namespace
}  // namespace orv::server::test
