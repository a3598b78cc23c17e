// Bases, scopes, order and interruption.
#include "cfg/interrupt.h"
#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

constexpr const char* kTree =
    "dn: cn=Configuration\ncn: Configuration\n\n"
    "dn: cn=Log Management,cn=Configuration\ncn: Log Management\n\n"
    "dn: cn=Audit, cn=Log Management, cn=Configuration\ncn: Audit\n\n"
    "dn: cn=AdminGroup,cn=Configuration\ncn: AdminGroup\n\n"
    "dn: CN=Default,CN=LOG  MANAGEMENT,CN=CONFIGURATION\ncn: Default\n\n"
    "dn: cn=member+ou=x,cn=AdminGroup,cn=Configuration\ncn: member\nou: x\n\n"
    "dn: cn=deep,ou=X+cn=Member,cn=AdminGroup,cn=Configuration\ncn: deep\n";

class SearchTest : public CfgTest {
 protected:
  CfgSession tree() { return open(kTree); }
};

TEST_F(SearchTest, BaseIsFoundInEverySpelling) {
  const CfgSession session = tree();
  for (const char* base : {"CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
                           " cn = audit ,2.5.4.3=log  management,commonName=Configuration",
                           "cn=\\41udit,cn=Log\\20Management,cn=#0c0d436f6e66696775726174696f6e"}) {
    EXPECT_EQ(dns(search(session, base, 0, nullptr)),
              (Values{"cn=Audit, cn=Log Management, cn=Configuration"}))
        << base;
  }
  EXPECT_EQ(search(session, "ou=X+cn=MEMBER,cn=admingroup,cn=configuration", 0, nullptr).size(),
            1U);
}

TEST_F(SearchTest, OneLevelGivesTheChildrenInTheOrderOfTheFile) {
  const CfgSession session = tree();
  EXPECT_EQ(dns(search(session, "cn=configuration", 1, nullptr)),
            (Values{"cn=Log Management,cn=Configuration", "cn=AdminGroup,cn=Configuration"}));
  EXPECT_EQ(dns(search(session, "CN=LOG MANAGEMENT,CN=CONFIGURATION", 1, nullptr)),
            (Values{"cn=Audit, cn=Log Management, cn=Configuration",
                    "CN=Default,CN=LOG  MANAGEMENT,CN=CONFIGURATION"}));
  EXPECT_TRUE(search(session, "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION", 1, nullptr).empty());
}

TEST_F(SearchTest, SubtreeGivesTheBaseFirst) {
  const CfgSession session = tree();
  EXPECT_EQ(search(session, "cn=configuration", 2, nullptr).size(), 7U);
  EXPECT_EQ(
      dns(search(session, "CN=ADMINGROUP,CN=CONFIGURATION", 2, nullptr)),
      (Values{"cn=AdminGroup,cn=Configuration", "cn=member+ou=x,cn=AdminGroup,cn=Configuration",
              "cn=deep,ou=X+cn=Member,cn=AdminGroup,cn=Configuration"}));
}

TEST_F(SearchTest, MissingBasesAndTextsThatAreNoDnHaveTheirCodes) {
  const CfgSession session = tree();
  for (const int scope : {0, 1, 2}) {
    EXPECT_EQ(search_code(session, "cn=none,cn=configuration", scope, nullptr), 32);
    EXPECT_EQ(search_code(session, "", scope, nullptr), 32);
    EXPECT_EQ(search_code(session, nullptr, scope, nullptr), 32);
    EXPECT_EQ(search_code(session, "not a dn", scope, nullptr), 34);
  }
  EXPECT_EQ(search_code(session, "cn=configuration", 3, nullptr), 2);
  EXPECT_EQ(search_code(session, "cn=configuration", 0, "(cn"), 2);
}

TEST_F(SearchTest, ABaseThatDoesNotMatchIsASuccessWithoutEntries) {
  const CfgSession session = tree();
  _CFGMessage* chain = nullptr;
  EXPECT_EQ(cfg_search_s(session.get(), "cn=configuration", 0, "(cn=other)", nullptr, 0, &chain),
            0);
  ASSERT_NE(chain, nullptr);
  EXPECT_EQ(cfg_count_entries(session.get(), chain), 0);
  EXPECT_EQ(cfg_first_entry(session.get(), chain), nullptr);
  EXPECT_EQ(cfg_get_errno(session.get()), 0);
  cfg_msgfree(chain);
}

TEST_F(SearchTest, AnErrorNumberDoesNotStick) {
  const CfgSession session = tree();
  EXPECT_EQ(search_code(session, "cn=none", 0, nullptr), 32);
  EXPECT_EQ(search_code(session, "cn=configuration", 0, nullptr), 0);
}

TEST_F(SearchTest, AnInterruptedSearchEndsWithThree) {
  const CfgSession session = tree();
  int polls = 0;
  const auto check = [](void* context) noexcept { return ++*static_cast<int*>(context) > 3; };
  {
    const cfg::InterruptScope scope(check, &polls);
    EXPECT_EQ(search_code(session, "cn=configuration", 2, nullptr), 3);
    EXPECT_EQ(polls, 4);
    {
      const cfg::InterruptScope inner([](void*) noexcept { return false; }, nullptr);
      EXPECT_EQ(search_code(session, "cn=configuration", 2, nullptr), 0);
    }
    EXPECT_EQ(search_code(session, "cn=configuration", 1, nullptr), 3);
    EXPECT_EQ(search_code(session, "cn=configuration", 0, nullptr), 3);
  }
  EXPECT_EQ(search_code(session, "cn=configuration", 2, nullptr), 0);
}

}  // namespace
}  // namespace orv::cfg_test
