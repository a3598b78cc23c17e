// Every allocation on the path of every function fails once, until the call needs no more of them:
// the result says so, the lock is back, nothing is left but what is kept on purpose.
#include <cerrno>

#include "backend_test.h"
#include "config_add.h"
#include "config_xlate.h"

namespace orv {
namespace {

constexpr int kEnough = 200;  // more allocations than any call here makes

class FailingAllocations : public BackendTest {
 protected:
  // Calls `attempt` with the first, second, ... allocation failing, and `check` after each, until
  // one attempt made no failing allocation. Returns the number of allocations that failed.
  template <typename Attempt, typename Check>
  int each(Attempt attempt, Check check) {
    for (int nth = 1; nth < kEnough; ++nth) {
      SCOPED_TRACE("allocation " + std::to_string(nth));
      platform.forget();
      platform.fail_allocation(nth);
      attempt();
      if (platform.allocations() < nth) return nth - 1;
      check();
      if (HasFatalFailure()) break;
    }
    ADD_FAILURE() << "still allocating";
    return 0;
  }

  // What may stay where a record is given up: the library's values and the cursor.
  void expect_only_given_up_values_left(std::vector<std::string> besides) {
    std::vector<std::string> left = platform.leaks();
    const auto kept = [](const std::string& word) {
      return word == "cfg_value" || word == "cfg_values" || word == "cursor";
    };
    const bool gave_up = platform.count("cfg_msg_unlink") == 1;
    if (gave_up) left.erase(std::remove_if(left.begin(), left.end(), kept), left.end());
    EXPECT_EQ(left, besides);
    EXPECT_THAT(platform.violations(), IsEmpty());
  }
};

TEST_F(FailingAllocations, SearchAnswersOnceAndComesToRest) {
  char cn[] = "cn";
  char* attributes[] = {cn, nullptr};
  as(0x14, "CN=ME");
  aux.attach_response_control = 1;
  pb.put(parameter::target_dn, static_cast<const void*>("CN=CONFIGURATION"));
  pb.put(parameter::search_filter_text, static_cast<const void*>("(objectClass=*)"));
  pb.put(parameter::search_scope, 2);
  pb.put(parameter::search_attributes, static_cast<const void*>(attributes));
  pb.put(parameter::search_response_control, static_cast<const void*>(&control));
  const char* member = "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION";
  platform.file[member] = {{{member, {{"orv-slapdAdminDN", {"cn=other"}}}}}};
  platform.file["CN=CONFIGURATION"] = {
      {{"cn=configuration", {{"cn", {"a", "b"}}, {"orv-slapdAdminPW", {"secret"}}}},
       {"cn=two,cn=admingroup,cn=configuration",
        {{"orv-slapdAdminDN", {"cn=me"}}, {"orv-slapdAdminPW", {"mine"}}}},
       {"cn=one,cn=admingroup,cn=configuration", {{"orv-slapdAdminPW", {"theirs"}}}}}};
  int rc = -1;
  const int failed = each(
      [&] { rc = platform.run([&] { return config_back_search(&pb); }); },
      [&] {
        EXPECT_EQ(platform.count("send_ldap_result") + platform.count("send_search_result"), 1);
        EXPECT_TRUE(rc == 0 || rc == 1 || rc == 80 || rc == 90) << rc;
        EXPECT_FALSE(locked());
        EXPECT_EQ(connection.config_session, nullptr);
        EXPECT_EQ(platform.mutexes_alive(), 0);
        EXPECT_EQ(platform.unlocks_of_free_mutexes(), 0);
        for (const std::string& sent : platform.sent) {
          EXPECT_THAT(sent, Not(testing::HasSubstr("secret")));
          EXPECT_THAT(sent, Not(testing::HasSubstr("theirs")));
        }
        expect_only_given_up_values_left({});
        platform.release_leaks();
      });
  EXPECT_EQ(rc, 0);
  EXPECT_GT(failed, 40);
  EXPECT_EQ(platform.sent.size(), 2U);
}

TEST_F(FailingAllocations, RefusedSearchAllocatesNothing) {
  as(0x24);
  EXPECT_EQ(each([&] { platform.run([&] { return config_back_search(&pb); }); }, [] {}), 0);
}

TEST_F(FailingAllocations, OtherHandlersAllocateNothing) {
  for (const Handler handler : {config_back_bind, config_back_unbind, config_back_add,
                                config_back_delete, config_back_modify, config_back_close}) {
    EXPECT_EQ(each([&] { platform.run([&] { return handler(&pb); }); }, [] {}), 0);
  }
}

TEST_F(FailingAllocations, RegistrationAllocatesNothing) {
  pblock block;
  EXPECT_EQ(each([&] { platform.run([&] { return config_backend_init(&block); }); }, [] {}), 0);
}

TEST_F(FailingAllocations, StartGives90AndLeavesAtMostTheStartupRecord) {
  platform.link_errno = EINVAL;
  int rc = -1;
  const auto start = [&] {
    auto* startup =
        static_cast<BackendStartup*>(platform.give(scripted::Owned::text, sizeof(BackendStartup)));
    *startup = {"/etc/config", nullptr};
    backend.private_data = startup;
    rc = platform.run([&] { return config_back_init(&backend); });
  };
  const int failed = each(start, [&] {
    EXPECT_EQ(rc, 90);
    const bool first = platform.allocations() == 1;
    EXPECT_EQ(platform.leaks().size(), first ? 0U : 1U);
    if (!first) std::free(backend.private_data);
  });
  EXPECT_EQ(failed, 3);
  EXPECT_EQ(rc, 0);
  platform.release_leaks();
}

TEST_F(FailingAllocations, IdentityLookupsGiveNull) {
  open_session();
  const char* member = "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION";
  const std::vector<scripted::ScriptedAttribute> attributes = {{"cn", {"a", "b"}},
                                                               {"orv-slapdAdminDN", {"cn=x"}},
                                                               {"orv-slapdKrbAdminDN", {"cn=x"}},
                                                               {"orv-slapdDigestAdminUser", {"x"}}};
  for (const char* dn :
       {"CN=CONFIGURATION", "CN=KERBEROS,CN=CONFIGURATION", "CN=DIGEST,CN=CONFIGURATION", member}) {
    platform.file[dn] = {{{dn, attributes}}};
  }
  const std::vector<std::function<char*()>> lookups = {
      [&] { return getAdminDN(connection.config_session); },
      [&] { return getAdminKerberosID(connection.config_session); },
      [&] { return getAdminDigestUserName(connection.config_session); },
      [&] { return getAdminGroupMemberDn(&connection, member); }};
  for (const std::function<char*()>& lookup : lookups) {
    char* found = nullptr;
    const int failed = each([&] { found = platform.run(lookup); },
                            [&] {
                              EXPECT_EQ(found, nullptr);
                              EXPECT_THAT(platform.leaks(), ElementsAre("session"));
                            });
    EXPECT_NE(found, nullptr);
    EXPECT_GT(failed, 9);
    std::free(found);
  }
  close_session();
}

TEST_F(FailingAllocations, EntryConversionGivesAnEntryOrGivesUpTheRecord) {
  open_session();
  platform.file["CN=X"] = {{{"cn=x", {{"cn", {"a", "b"}}, {"sn", {"c"}}}}}};
  entry* made = nullptr;
  _CFGMessage* chain = nullptr;
  const auto convert = [&] {
    platform.run(
        [&] { cfg_search_s(connection.config_session, "CN=X", 0, "f", nullptr, 0, &chain); });
    if (chain == nullptr) return;
    made = platform.run([&] {
      return CFGMessage2EntryTrans(connection.config_session,
                                   cfg_first_entry(connection.config_session, chain));
    });
  };
  const auto release = [&] {
    entry_free(made);
    made = nullptr;
    cfg_msgfree(chain);
  };
  const int failed = each(convert, [&] {
    const bool gave_up = platform.count("cfg_msg_unlink") == 1;
    EXPECT_FALSE(gave_up && made != nullptr);
    release();
    expect_only_given_up_values_left({"session"});
    // What was given up stays with the platform; a session of its own follows.
    close_session();
    platform.release_leaks();
    connection.config_session = cfg_init(nullptr, 0);
  });
  EXPECT_GT(failed, 14);
  EXPECT_EQ(scripted::text_of(*made), "cn=x|cn=a,b|sn=c");
  release();
  close_session();
}

TEST_F(FailingAllocations, OneAttributeReaderAndRetrievalGiveACode) {
  open_session();
  platform.file["CN=X"] = {{{"cn=x", {}}}};
  int rc = 0;
  _CFGMessage* chain = nullptr;
  EXPECT_EQ(each(
                [&] {
                  rc = platform.run([&] {
                    return cfg_read_cfg_entry(connection.config_session, "CN=X", "cn", 0, &chain);
                  });
                },
                [&] {
                  EXPECT_TRUE(rc == 90 || rc == 80) << rc;  // 80 when the search itself failed
                  EXPECT_THAT(platform.leaks(), ElementsAre("session"));
                }),
            3);
  EXPECT_EQ(rc, 0);
  cfg_msgfree(chain);

  entry* found = nullptr;
  EXPECT_EQ(each(
                [&] {
                  rc = platform.run(
                      [&] { return retrieve_entry(connection.config_session, "CN=X", &found); });
                },
                [&] {
                  EXPECT_NE(rc, 0);
                  EXPECT_EQ(found, nullptr);
                  EXPECT_THAT(platform.leaks(), ElementsAre("session"));
                }),
            3);
  EXPECT_EQ(rc, 0);
  entry_free(found);
  close_session();
}

}  // namespace
}  // namespace orv
