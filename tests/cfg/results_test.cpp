// Chains, records, cursors and values: who owns what, and what the error number says.
#include <algorithm>
#include <set>

#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

constexpr const char* kTree =
    "dn: cn=top\ncn: top\nobjectClass: a\ndescription: one\nobjectClass: b\n2.5.4.13: two\n\n"
    "dn: cn=a,cn=top\ncn: a\n\ndn: cn=b,cn=top\ncn: b\n\ndn: cn=c,cn=top\ncn: c\n";

class ResultsTest : public CfgTest {
 protected:
  _CFGMessage* chain_of(const CfgSession& session, const char* base = "cn=top", int scope = 2) {
    _CFGMessage* chain = nullptr;
    EXPECT_EQ(cfg_search_s(session.get(), base, scope, nullptr, nullptr, 0, &chain), 0);
    return chain;
  }
  static std::string dn(const CfgSession& session, _CFGMessage* record) {
    return CfgText(cfg_get_dn(session.get(), record)).get();
  }
};

TEST_F(ResultsTest, ATypeAtSeveralPlacesIsOneAttributeAtItsFirstPlace) {
  const CfgSession session = open(kTree);
  const std::vector<FoundEntry> found = search(session, "cn=top", 0, nullptr);
  const FoundEntry expected = {
      "cn=top", {{"cn", {"top"}}, {"objectClass", {"a", "b"}}, {"description", {"one", "two"}}}};
  EXPECT_EQ(found[0], expected);
}

TEST_F(ResultsTest, HeadAndRecordsAreDistinctAndCountable) {
  const CfgSession session = open(kTree);
  const CfgResult chain(chain_of(session));
  EXPECT_EQ(cfg_count_entries(session.get(), chain.get()), 4);
  std::set<void*> seen{chain.get()};
  for (_CFGMessage* record = cfg_first_entry(session.get(), chain.get()); record != nullptr;
       record = cfg_next_entry(session.get(), record)) {
    EXPECT_TRUE(seen.insert(record).second);
  }
  EXPECT_EQ(seen.size(), 5U);
  EXPECT_EQ(cfg_get_errno(session.get()), 0);
}

TEST_F(ResultsTest, AnUnlinkedRecordIsFreedByItsHolderAndTheChainStaysGood) {
  for (int victim = 0; victim < 4; ++victim) {
    const CfgSession session = open(kTree);
    const CfgResult chain(chain_of(session));
    _CFGMessage* record = cfg_first_entry(session.get(), chain.get());
    for (int i = 0; i < victim; ++i) record = cfg_next_entry(session.get(), record);
    cfg_msg_unlink(session.get(), record);
    EXPECT_EQ(cfg_next_entry(session.get(), record), nullptr);
    EXPECT_EQ(cfg_get_dn(session.get(), record), nullptr);
    cfg_msg_unlink(session.get(), record);
    std::free(record);
    EXPECT_EQ(cfg_count_entries(session.get(), chain.get()), 3);
    EXPECT_EQ(read_chain(session.get(), chain.get()).size(), 3U);
  }
}

TEST_F(ResultsTest, RecordsAreUnlinkedInAnyOrder) {
  std::vector<std::size_t> order = {0, 1, 2, 3};
  do {
    const CfgSession session = open(kTree);
    const CfgResult chain(chain_of(session));
    std::vector<_CFGMessage*> records;
    for (_CFGMessage* record = cfg_first_entry(session.get(), chain.get()); record != nullptr;
         record = cfg_next_entry(session.get(), record)) {
      records.push_back(record);
    }
    ASSERT_EQ(records.size(), 4U);
    std::size_t left = records.size();
    for (const std::size_t victim : order) {
      cfg_msg_unlink(session.get(), records[victim]);
      std::free(std::exchange(records[victim], nullptr));
      std::vector<_CFGMessage*> linked;
      for (_CFGMessage* record = cfg_first_entry(session.get(), chain.get()); record != nullptr;
           record = cfg_next_entry(session.get(), record)) {
        linked.push_back(record);
      }
      ASSERT_EQ(linked.size(), --left);
      ASSERT_TRUE(std::all_of(linked.begin(), linked.end(), [&](_CFGMessage* record) {
        return std::count(records.begin(), records.end(), record) == 1;
      }));
    }
  } while (std::next_permutation(order.begin(), order.end()));
}

TEST_F(ResultsTest, ARecordIsNoChainAndAChainNoRecord) {
  const CfgSession session = open(kTree);
  const CfgResult chain(chain_of(session));
  _CFGMessage* const record = cfg_first_entry(session.get(), chain.get());
  EXPECT_EQ(cfg_msgfree(record), 0);
  EXPECT_EQ(cfg_count_entries(session.get(), record), 0);
  EXPECT_EQ(cfg_get_dn(session.get(), chain.get()), nullptr);
  EXPECT_EQ(dn(session, record), "cn=top");
}

TEST_F(ResultsTest, SeveralChainsLiveAtOnceAndAreReleasedInAnyOrder) {
  const CfgSession session = open(kTree);
  _CFGMessage* first = chain_of(session);
  _CFGMessage* second = chain_of(session, "cn=a,cn=top", 0);
  _CFGMessage* third = chain_of(session, "cn=b,cn=top", 0);
  cfg_msgfree(second);
  EXPECT_EQ(dn(session, cfg_first_entry(session.get(), third)), "cn=b,cn=top");
  cfg_msgfree(first);
  EXPECT_EQ(dn(session, cfg_first_entry(session.get(), third)), "cn=b,cn=top");
  cfg_msgfree(third);
}

TEST_F(ResultsTest, UnbindReclaimsChainsThatWereNeverReleased) {
  const CfgSession session = open(kTree);
  chain_of(session);
  chain_of(session);
}

TEST_F(ResultsTest, AnAbsentAttributeIsNullWithSixteen) {
  const CfgSession session = open(kTree);
  const CfgResult chain(chain_of(session));
  _CFGMessage* const record = cfg_first_entry(session.get(), chain.get());
  for (const char* name : {"ou", "unknown", "", "1.1", "description;x"}) {
    EXPECT_EQ(cfg_get_values(session.get(), record, name), nullptr) << name;
    EXPECT_EQ(cfg_get_errno(session.get()), 16) << name;
  }
  EXPECT_EQ(values_of(session.get(), record, "DESCRIPTION"), (Values{"one", "two"}));
  EXPECT_EQ(cfg_get_errno(session.get()), 0);
  EXPECT_EQ(values_of(session.get(), record, "2.5.4.13"), (Values{"one", "two"}));
}

TEST_F(ResultsTest, ValuesOutliveTheChain) {
  const CfgSession session = open(kTree);
  _CFGMessage* const chain = chain_of(session);
  char** values = cfg_get_values(session.get(), cfg_first_entry(session.get(), chain), "cn");
  cfg_msgfree(chain);
  ASSERT_NE(values, nullptr);
  EXPECT_STREQ(values[0], "top");
  EXPECT_EQ(values[1], nullptr);
  std::free(values[0]);  // each text, then the array, is the same as cfg_value_free
  std::free(values);
}

TEST_F(ResultsTest, ASelectionShowsOnlyWhatWasAskedFor) {
  const CfgSession session = open(kTree);
  const auto names = [&](std::vector<const char*> asked) {
    Values result;
    const std::vector<FoundEntry> found = search(session, "cn=top", 0, nullptr, std::move(asked));
    for (const auto& [name, values] : found.at(0).attributes) {
      result.push_back(name);
    }
    return result;
  };
  EXPECT_EQ(names({"DESCRIPTION"}), (Values{"description"}));
  EXPECT_EQ(names({"2.5.4.13", "commonName"}), (Values{"cn", "description"}));
  EXPECT_EQ(names({"1.1"}), Values());
  EXPECT_EQ(names({"1.1", "cn"}), (Values{"cn"}));
  EXPECT_EQ(names({"ou"}), Values());
  EXPECT_EQ(names({"*"}), (Values{"cn", "objectClass", "description"}));
  EXPECT_EQ(names({"ou", "*"}), (Values{"cn", "objectClass", "description"}));
  EXPECT_EQ(names({"cn;lang-en"}), Values());
}

TEST_F(ResultsTest, AnUnselectedAttributeIsAbsent) {
  const CfgSession session = open(kTree);
  const char* names[] = {"cn", nullptr};
  _CFGMessage* chain = nullptr;
  ASSERT_EQ(cfg_search_s(session.get(), "cn=top", 0, nullptr, const_cast<char**>(names), 0, &chain),
            0);
  const CfgResult owned(chain);
  EXPECT_EQ(cfg_get_values(session.get(), cfg_first_entry(session.get(), chain), "description"),
            nullptr);
  EXPECT_EQ(cfg_get_errno(session.get()), 16);
}

TEST_F(ResultsTest, AnEmptySelectionListMeansAll) {
  const CfgSession session = open(kTree);
  char* names[] = {nullptr};
  _CFGMessage* chain = nullptr;
  ASSERT_EQ(cfg_search_s(session.get(), "cn=top", 0, nullptr, names, 0, &chain), 0);
  const CfgResult owned(chain);
  EXPECT_EQ(read_chain(session.get(), chain)[0].attributes.size(), 3U);
}

TEST_F(ResultsTest, TypesOnlyGivesEmptyArraysThatAreNotNull) {
  const CfgSession session = open(kTree);
  _CFGMessage* chain = nullptr;
  ASSERT_EQ(cfg_search_s(session.get(), "cn=top", 0, nullptr, nullptr, 1, &chain), 0);
  const CfgResult owned(chain);
  _CFGMessage* const record = cfg_first_entry(session.get(), chain);
  const CfgValues values(cfg_get_values(session.get(), record, "objectClass"));
  ASSERT_NE(values, nullptr);
  EXPECT_EQ(values.get()[0], nullptr);
  EXPECT_EQ(cfg_get_errno(session.get()), 0);
  EXPECT_EQ(cfg_get_values(session.get(), record, "ou"), nullptr);
  EXPECT_EQ(cfg_get_errno(session.get()), 16);
  EXPECT_EQ(read_entry(session.get(), record).attributes.size(), 3U);
}

TEST_F(ResultsTest, AnEntryWithThousandsOfTypesListsEachOnce) {
  std::string content = "dn: cn=top\n";
  for (int round = 0; round < 2; ++round) {
    for (int i = 0; i < 3000; ++i) content += "Type-" + std::to_string(i) + ": v\nTYPE-1: w\n";
  }
  const CfgSession session = open(content);
  const std::vector<FoundEntry> found = search(session, "cn=top", 0, nullptr);
  ASSERT_EQ(found[0].attributes.size(), 3000U);
  EXPECT_EQ(found[0].attributes[0].first, "Type-0");
  EXPECT_EQ(found[0].attributes[1].first, "TYPE-1");
  EXPECT_EQ(found[0].attributes[1].second.size(), 6002U);
}

TEST_F(ResultsTest, NamesFoldedWithinThemAreListed) {
  const CfgSession session = open("dn: cn=top\nFir\n stName: a\nSeco\n ndName:: Yg==\n");
  const FoundEntry expected = {"cn=top", {{"FirstName", {"a"}}, {"SecondName", {"b"}}}};
  EXPECT_EQ(search(session, "cn=top", 0, nullptr)[0], expected);
}

}  // namespace
}  // namespace orv::cfg_test
