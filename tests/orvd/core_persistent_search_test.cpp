// Persistent searches: their controls, their bounds, and what becomes of them when something fails.
#include "ops/persistent_search.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "cfg/attribute_table.h"
#include "core_fake_backend.h"
#include "core_server_fixture.h"
#include "core_wire.h"
#include "slapi/codepage.h"
#include "slapi/schema.h"

namespace orv::server {
namespace {

using test::LoopbackServer;
using test::Reply;
using test::WireClient;

constexpr const char* kMember = "cn=x,cn=admingroup,cn=configuration";
constexpr const char* kNormalMember = "CN=X,CN=ADMINGROUP,CN=CONFIGURATION";
constexpr int kEntryTag = 0x64;
constexpr int kDoneTag = 0x65;

std::string control_value(int types, bool changes_only, bool notifications) {
  return test::tlv(0x30, test::integer(types) + test::tlv(0x01, std::string(1, changes_only)) +
                             test::tlv(0x01, std::string(1, notifications)));
}

// ---- the control

TEST(PersistentSearchControl, IsReadWhole) {
  struct PersistentSearchControl control {};
  ASSERT_TRUE(read_persistent_search(control_value(5, true, false), control));
  EXPECT_EQ(control.change_types, 5U);
  EXPECT_TRUE(control.changes_only);
  EXPECT_FALSE(control.return_notifications);
}

TEST(PersistentSearchControl, IsRefusedWhenMalformed) {
  struct PersistentSearchControl control {};
  const std::string good = control_value(1, true, true);
  for (std::size_t length = 0; length < good.size(); ++length)
    EXPECT_FALSE(read_persistent_search(std::string_view(good).substr(0, length), control));
  EXPECT_FALSE(read_persistent_search(good + '\0', control));
  EXPECT_FALSE(read_persistent_search(control_value(0, true, true), control));
  EXPECT_FALSE(read_persistent_search(control_value(16, true, true), control));
  EXPECT_FALSE(read_persistent_search(
      test::tlv(0x30, test::integer(1) + test::tlv(0x01, "") + test::tlv(0x01, "")), control));
}

TEST(EntryChangeControl, TellsTheTypeOfTheChange) {
  EntryChangeControl control(ChangeType::remove);
  EXPECT_EQ(std::string(control.get()->oid), "2.16.840.1.113730.3.4.7");
  EXPECT_EQ(std::string(control.get()->value.bv_val, control.get()->value.bv_len),
            std::string("\x30\x03\x0A\x01\x02"));
}

// ---- one search

class Counting final : public ChangeListener {
 public:
  void has_news(PersistentSearchPtr) noexcept override { ++news; }
  int news = 0;
};

class OneSearch : public testing::Test {
 protected:
  PersistentSearchPtr make(int types = 15, int scope = 2) {
    SearchRequest request;
    request.scope = scope;
    return std::make_shared<PersistentSearch>(
        home, 1, PersistentSearchControl{static_cast<unsigned>(types), true, true}, request,
        "CN=ADMINGROUP,CN=CONFIGURATION", "(objectClass=*)");
  }
  static ChangePtr change(std::size_t bytes = 10) {
    return std::make_shared<const Change>(Change{ChangeType::add, kNormalMember, nullptr, bytes});
  }
  std::shared_ptr<Counting> home = std::make_shared<Counting>();
};

TEST_F(OneSearch, CoversWhatItAskedFor) {
  EXPECT_TRUE(make()->covers(ChangeType::add, kNormalMember));
  EXPECT_TRUE(make()->covers(ChangeType::add, "CN=ADMINGROUP,CN=CONFIGURATION"));
  EXPECT_FALSE(make()->covers(ChangeType::add, "CN=CONFIGURATION"));
  EXPECT_FALSE(make(2)->covers(ChangeType::add, kNormalMember));
  EXPECT_TRUE(make(2)->covers(ChangeType::remove, kNormalMember));
  EXPECT_TRUE(make(15, 1)->covers(ChangeType::add, kNormalMember));
  EXPECT_FALSE(make(15, 1)->covers(ChangeType::add, "CN=ADMINGROUP,CN=CONFIGURATION"));
  EXPECT_FALSE(make(15, 1)->covers(ChangeType::add, std::string("CN=Y,") + kNormalMember));
  EXPECT_TRUE(make(15, 0)->covers(ChangeType::add, "CN=ADMINGROUP,CN=CONFIGURATION"));
  EXPECT_FALSE(make(15, 0)->covers(ChangeType::add, kNormalMember));
}

TEST_F(OneSearch, FailsWhenItFallsTooFarBehind) {
  const PersistentSearchPtr search = make();
  for (std::size_t i = 0; i < PersistentSearch::kMostWaiting; ++i) search->tell(change());
  EXPECT_EQ(search->failure(), 0);
  search->tell(change());
  EXPECT_EQ(search->failure(), 11);
  const int told = home->news;
  search->tell(change());
  EXPECT_EQ(home->news, told);
}

TEST_F(OneSearch, FailsWhenTooMuchWaits) {
  const PersistentSearchPtr search = make();
  search->tell(change(2 * PersistentSearch::kMostBytes));  // alone, however large
  EXPECT_EQ(search->failure(), 0);
  search->tell(change());
  EXPECT_EQ(search->failure(), 11);
}

TEST_F(OneSearch, KeepsUpWhenItsChangesAreTaken) {
  const PersistentSearchPtr search = make();
  for (std::size_t i = 0; i < 2 * PersistentSearch::kMostWaiting; ++i) {
    search->tell(change(PersistentSearch::kMostBytes));
    ASSERT_TRUE(search->take());
  }
  EXPECT_EQ(search->failure(), 0);
  EXPECT_FALSE(search->take());
}

TEST_F(OneSearch, HearsNothingAfterItsEnd) {
  const PersistentSearchPtr search = make();
  search->tell(change());
  search->end();
  search->tell(change());
  EXPECT_FALSE(search->take());
}

TEST_F(OneSearch, CountsUntilItIsGone) {
  PersistentSearches all;
  {
    const PersistentSearchPtr forgotten = make();
    ASSERT_TRUE(all.count(*forgotten, 1));
    EXPECT_FALSE(all.count(*make(), 1));
  }
  const PersistentSearchPtr next = make();
  ASSERT_TRUE(all.count(*next, 1));
  ASSERT_TRUE(all.join(next));
  all.leave(*next);
  all.leave(*next);
  EXPECT_TRUE(all.count(*make(), 1));
}

TEST_F(OneSearch, TheBackendIsToldWhileThereMayBeSome) {
  const auto switched = [] {
    int on = -1;
    slapi_pblock_get(getGlobalPBlock(), parameter::persistent_search_switch, &on);
    return on;
  };
  const auto monitor = [] {
    PSearchMonitor* found = nullptr;
    slapi_pblock_get(getGlobalPBlock(), parameter::persistent_search_monitor, &found);
    return found;
  };
  {
    PersistentSearches all;
    EXPECT_EQ(switched(), 1);
    EXPECT_TRUE(monitor());
  }
  EXPECT_EQ(switched(), 0);
  EXPECT_FALSE(monitor());
}

// ---- what a deleted entry shows

class DeletedEntry : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }
  static EntryPtr make(const char* normal_dn) {
    EntryPtr made = test::make_test_entry(normal_dn);
    for (const char* type : {"orv-slapdAdminPW", "orv-slapdMasterPW", "orv-slapdAdminDN",
                             "orv-slapdAdminGroupEnabled"}) {
      std::string text = "cn=x";
      berval value{text.size(), text.data()};
      berval* values[] = {&value, nullptr};
      attr_merge(made.get(), type, values, 1, 1, nullptr);
    }
    return made;
  }
  static bool shows(const char* normal_dn, const Identity* identity, const char* type) {
    const EntryPtr deleted = make(normal_dn);
    const EntryPtr visible = visible_part(builtin_schema(), *deleted, identity);
    return attr_find(visible.get(), type, 0, 0) != nullptr;
  }
  const Identity root{"CN=ROOT", 0x0C, 0, "CN=CONFIGURATION"};
  const Identity member{"CN=M", 0x14, 0x3E, "CN=M,CN=ADMINGROUP,CN=CONFIGURATION"};
};

TEST_F(DeletedEntry, ShowsItsSecretsToThePrimaryAdministratorAndItsOwner) {
  EXPECT_TRUE(shows(kNormalMember, &root, "orv-slapdAdminPW"));
  EXPECT_TRUE(shows("CN=M,CN=ADMINGROUP,CN=CONFIGURATION", &member, "orv-slapdAdminPW"));
}

TEST_F(DeletedEntry, HidesItsSecretsFromEverybodyElse) {
  for (const char* type : {"orv-slapdAdminPW", "orv-slapdMasterPW"}) {
    EXPECT_FALSE(shows(kNormalMember, &member, type));
    EXPECT_FALSE(shows(kNormalMember, nullptr, type));
  }
  EXPECT_TRUE(shows(kNormalMember, &member, "orv-slapdAdminDN"));
}

TEST_F(DeletedEntry, HidesTheAdministratorOfTheTopEntry) {
  EXPECT_FALSE(shows("CN=CONFIGURATION", &member, "orv-slapdAdminDN"));
  EXPECT_FALSE(shows("CN=CONFIGURATION", &member, "orv-slapdAdminGroupEnabled"));
  EXPECT_TRUE(shows("CN=CONFIGURATION", &root, "orv-slapdAdminDN"));
}

// ---- which searches are told of a deleted entry

class DeletionIn : public OneSearch {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }
  static void speak(const char* code_page) {
    set_local_code_page(code_page);
    ASSERT_EQ(initIconvHandle(), 0);
  }
  void TearDown() override {
    for (const PersistentSearchPtr& search : joined) all.leave(*search);
    speak("UTF-8");
  }

  // As the backend keeps it: values are given in UTF-8 and come into the entry's code page.
  static EntryPtr deleted(const char* dn, const std::string& description) {
    EntryPtr made = test::make_test_entry(dn);
    made->local_code_page = true;
    std::string text = description;
    berval value{text.size(), text.data()};
    berval* values[] = {&value, nullptr};
    attr_merge(made.get(), "description", values, 1, 1, nullptr);
    return made;
  }
  PersistentSearchPtr listen(const char* filter) {
    SearchRequest request;
    request.scope = 2;
    auto search =
        std::make_shared<PersistentSearch>(home, 1, PersistentSearchControl{15, true, true},
                                           request, "CN=ADMINGROUP,CN=CONFIGURATION", filter);
    EXPECT_TRUE(all.count(*search, 10));
    EXPECT_TRUE(all.join(search));
    joined.push_back(search);
    return search;
  }
  void announce(EntryPtr before) {
    all.announce(all.audience(ChangeType::remove, kNormalMember, std::move(before)));
  }

  PersistentSearches all;
  std::vector<PersistentSearchPtr> joined;
};

TEST_F(DeletionIn, AnotherCodePageMatchesByCharactersAndIsToldInUtf8) {
  speak("ISO-8859-1");
  const PersistentSearchPtr asked = listen("(description=caf\xC3\xA9)");
  const PersistentSearchPtr another = listen("(description=caf\xC3\x83\xC2\xA9)");
  announce(deleted(kMember, "Caf\xC3\xA9"));
  const ChangePtr change = asked->take();
  ASSERT_TRUE(change);
  const attr* const told = attr_find(change->before.get(), "description", 0, 0);
  ASSERT_TRUE(told);
  EXPECT_STREQ(told->values[0]->bv_val, "Caf\xC3\xA9");
  EXPECT_FALSE(another->take()) << "what it asked for has other characters";
  EXPECT_EQ(asked->failure(), 0);
  EXPECT_EQ(another->failure(), 0);
}

TEST_F(DeletionIn, AnotherCodePageIsMatchedBeforeItIsConverted) {
  speak("ISO-8859-1");
  const PersistentSearchPtr asked = listen("(description=\xC3\x83\xC2\xA9)");
  // Two characters, whose bytes in the file are one character of UTF-8.
  announce(deleted(kMember, "\xC3\x83\xC2\xA9"));
  EXPECT_TRUE(asked->take());
}

TEST_F(DeletionIn, ACodePageWithoutTheNameEndsTheSearchesThatShouldHearOfIt) {
  speak("EUC-JP");
  const PersistentSearchPtr asked = listen("(description=text)");
  const PersistentSearchPtr another = listen("(description=something else)");
  EntryPtr before = deleted(kMember, "text");
  std::free(before->dn);
  before->dn = strdup("cn=\xFF\xFF,cn=admingroup,cn=configuration");
  announce(std::move(before));
  EXPECT_FALSE(asked->take());
  EXPECT_NE(asked->failure(), 0);
  EXPECT_GT(home->news, 0);
}

TEST_F(DeletionIn, TheBackendsKeepingThatFailedEndsTheSearches) {
  const PersistentSearchPtr asked = listen("(objectClass=*)");
  announce(nullptr);
  EXPECT_FALSE(asked->take());
  EXPECT_EQ(asked->failure(), 80);
}

TEST_F(DeletionIn, AFilterThatCannotBeReadEndsItsSearchAlone) {
  const PersistentSearchPtr broken = listen("(description=");
  const PersistentSearchPtr asked = listen("(description=text)");
  announce(deleted(kMember, "text"));
  EXPECT_EQ(broken->failure(), 2);
  EXPECT_FALSE(broken->take());
  EXPECT_TRUE(asked->take());
}

// ---- over the wire

class PersistentWire : public LoopbackServer {
 protected:
  PersistentWire() {
    controls = {kPersistentSearchOid, kEntryChangeOid};
    // Each search finds the entry it names, of the size that the test wants.
    backend.on_search = [this](pblock* parameters) {
      const std::string dn = test::target_of(parameters);
      if (search_code != 0) return test::finish_search(parameters, search_code, 0);
      const EntryPtr found = test::make_test_entry(dn, value_bytes);
      const int code = test::send_test_entry(parameters, *found);
      return test::finish_search(parameters, code, 1);
    };
    backend.on_change = [](pblock* parameters) { return test::finish_change(parameters, 0); };
  }
  ~PersistentWire() override { stop(); }

  static std::string persistent_search(int id, bool changes_only = true,
                                       std::string_view base = test::kTop) {
    const std::string control =
        test::tlv(0x30, test::tlv(0x04, kPersistentSearchOid) + test::tlv(0x01, "\xFF") +
                            test::tlv(0x04, control_value(15, changes_only, true)));
    const std::string request =
        test::tlv(0x63, test::tlv(0x04, base) + test::tlv(0x0A, "\x02") +
                            test::tlv(0x0A, std::string(1, '\0')) + test::integer(0) +
                            test::integer(0) + test::tlv(0x01, std::string(1, '\0')) +
                            test::tlv(0x87, "objectClass") + test::tlv(0x30, ""));
    return test::message(id, request, control);
  }
  // Whether the server has taken everything that was sent so far.
  static bool taken(WireClient& client, int id) {
    client.send(test::extended(id, "1.2.3"));
    const auto reply = client.receive();
    return reply && reply->id == id;
  }
  // Binds, and asks for all changes under the message id 7; the next one is 9.
  void listen(WireClient& client) {
    bind_as_root(client);
    client.send(persistent_search(7));
    EXPECT_TRUE(taken(client, 8));
  }
  int add(WireClient& client, int id, const std::string& dn = kMember) {
    return code_of(client, test::add_entry(id, dn, "cn", "x"));
  }
  int remove(WireClient& client, int id, const std::string& dn = kMember) {
    return code_of(client, test::delete_entry(id, dn));
  }

  std::atomic<int> search_code{0};
  std::atomic<std::size_t> value_bytes{8};
};

TEST_F(PersistentWire, TellsChangesOfAllKindsUnderItsMessageId) {
  loops = 2;
  start();
  WireClient listener(port());
  WireClient changer(port());
  listen(listener);
  bind_as_root(changer);
  ASSERT_EQ(add(changer, 2), 0);
  ASSERT_EQ(code_of(changer, test::modify(3, kMember, "description", "y")), 0);
  for (int i = 0; i < 2; ++i) {
    const auto notice = listener.receive();
    ASSERT_TRUE(notice);
    EXPECT_EQ(notice->id, 7);
    EXPECT_EQ(notice->tag, kEntryTag);
  }
  listener.send(test::abandon(9, 7));
  ASSERT_TRUE(taken(listener, 10));
  ASSERT_EQ(add(changer, 4), 0);
  EXPECT_TRUE(taken(listener, 11)) << "a notice came after the search was abandoned";
}

TEST_F(PersistentWire, SendsNoResultBeforeItEnds) {
  start();
  WireClient listener(port());
  bind_as_root(listener);
  listener.send(persistent_search(7, false));
  const auto first = listener.receive();
  ASSERT_TRUE(first);
  EXPECT_EQ(first->tag, kEntryTag);
  EXPECT_TRUE(taken(listener, 8));
}

TEST_F(PersistentWire, AFailedFirstPartIsItsResult) {
  start();
  search_code = 32;
  WireClient listener(port());
  bind_as_root(listener);
  EXPECT_EQ(code_of(listener, persistent_search(7)), 32);
  EXPECT_EQ(code_of(listener, persistent_search(7)), 32) << "its message id is free again";
}

TEST_F(PersistentWire, AMessageIdOfARunningSearchIsInUse) {
  start();
  WireClient listener(port());
  listen(listener);
  listener.send(test::search(7, test::kTop));
  const auto notice = listener.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->id, 0);
}

TEST_F(PersistentWire, EndsWithTheCodeOfASearchThatFails) {
  start();
  WireClient listener(port());
  WireClient changer(port());
  listen(listener);
  bind_as_root(changer);
  search_code = 1;
  ASSERT_EQ(add(changer, 2), 0);
  const auto end = listener.receive();
  ASSERT_TRUE(end);
  EXPECT_EQ(end->id, 7);
  EXPECT_EQ(end->tag, kDoneTag);
  EXPECT_EQ(end->code, 1);
}

TEST_F(PersistentWire, AnEntryThatIsGoneAgainIsNotTold) {
  start();
  WireClient listener(port());
  WireClient changer(port());
  listen(listener);
  bind_as_root(changer);
  search_code = 32;
  ASSERT_EQ(add(changer, 2), 0);
  while (backend.calls(parameter::search_function) < 2) std::this_thread::yield();
  search_code = 0;
  ASSERT_EQ(add(changer, 3), 0);
  const auto notice = listener.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kEntryTag);
}

TEST_F(PersistentWire, ARefusedChangeIsNotTold) {
  start();
  WireClient listener(port());
  WireClient changer(port());
  listen(listener);
  bind_as_root(changer);
  backend.on_change = [](pblock* parameters) { return test::finish_change(parameters, 68); };
  ASSERT_EQ(add(changer, 2), 68);
  EXPECT_TRUE(taken(listener, 9));
  EXPECT_EQ(backend.calls(parameter::search_function), 1);
}

TEST_F(PersistentWire, ADeletedEntryIsToldWithoutASearch) {
  start();
  WireClient listener(port());
  WireClient changer(port());
  listen(listener);
  bind_as_root(changer);
  backend.on_change = [](pblock* parameters) {
    EntryPtr before = test::make_test_entry(test::target_of(parameters));
    std::string text = "container";
    berval value{text.size(), text.data()};
    berval* values[] = {&value, nullptr};
    attr_merge(before.get(), "objectClass", values, 1, 1, nullptr);
    slapi_pblock_set(parameters, parameter::entry_before_delete,
                     static_cast<void*>(before.release()));
    return test::finish_change(parameters, 0);
  };
  ASSERT_EQ(remove(changer, 2), 0);
  const auto notice = listener.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->tag, kEntryTag);
  EXPECT_EQ(backend.calls(parameter::search_function), 1) << "that of the first part";
}

TEST_F(PersistentWire, WhoIsNobodyAnyMoreHearsNothingMore) {
  start();
  WireClient listener(port());
  listen(listener);
  authenticator.change(false);
  const auto notice = listener.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->id, 0);
}

TEST_F(PersistentWire, ABindEndsItAndIsAnswered) {
  start();
  WireClient listener(port());
  listen(listener);
  EXPECT_EQ(code_of(listener, test::bind(9, test::kRoot, test::kSecret)), 0);
  listener.send(test::search(7, test::kTop));
  EXPECT_EQ(listener.receive_result().back().code, 0) << "its message id is free again";
}

// A bind that is answered at once, when the end of the last search leaves nothing outstanding.
TEST_F(PersistentWire, ABindEndsItAlsoWhileANoticeWaitsForItsTurn) {
  test::Event first_goes_on;
  test::Event second_goes_on;
  std::atomic<int> changes{0};
  backend.on_change = [&](pblock* parameters) {
    (changes.fetch_add(1) == 0 ? first_goes_on : second_goes_on).wait();
    return test::finish_change(parameters, 0);
  };
  start();
  WireClient listener(port());
  WireClient one(port());
  WireClient two(port());
  for (WireClient* const client : {&listener, &one, &two}) bind_as_root(*client);
  listener.send(persistent_search(7));
  ASSERT_TRUE(taken(listener, 8));

  one.send(test::add_entry(2, kMember, "cn", "x"));
  while (changes.load() == 0) std::this_thread::yield();
  two.send(test::add_entry(2, kMember, "cn", "x"));
  ASSERT_TRUE(wait_for_waiters(1)) << "the second add waits";
  first_goes_on.happen();
  while (changes.load() == 1) std::this_thread::yield();
  ASSERT_TRUE(wait_for_waiters(1)) << "the notice waits behind the second add";
  EXPECT_EQ(code_of(listener, test::bind(9, "", "")), 0);
  second_goes_on.happen();
  EXPECT_TRUE(taken(listener, 10));
  stop();  // what the handler refers to goes out of scope here
}

// The limits of the request were for its first part.
TEST_F(PersistentWire, ANoticeThatWaitsLongerThanTheTimeLimitIsStillTold) {
  settings.time_limit = 1;
  test::Event goes_on;
  std::atomic<int> changes{0};
  backend.on_change = [&](pblock* parameters) {
    if (changes.fetch_add(1) == 1) goes_on.wait();
    return test::finish_change(parameters, 0);
  };
  start();
  WireClient listener(port());
  WireClient changer(port());
  for (WireClient* const client : {&listener, &changer}) bind_as_root(*client);
  listener.send(persistent_search(7));
  ASSERT_TRUE(taken(listener, 8));
  changer.send(test::add_entry(2, kMember, "cn", "x") + test::add_entry(3, kMember, "cn", "x"));
  ASSERT_TRUE(wait_for_waiters(1)) << "the notice of the first waits behind the second";
  const auto later = Clock::now() + std::chrono::milliseconds(1200);
  while (Clock::now() < later) std::this_thread::yield();
  goes_on.happen();
  for (int i = 0; i < 2; ++i) {
    const auto notice = listener.receive();
    ASSERT_TRUE(notice);
    EXPECT_EQ(notice->tag, kEntryTag);
  }
  stop();  // what the handler refers to goes out of scope here
}

TEST_F(PersistentWire, TheBoundsHold) {
  settings.max_persistent_searches = 2;
  settings.max_persistent_searches_per_connection = 1;
  start();
  WireClient one(port());
  WireClient two(port());
  WireClient three(port());
  for (WireClient* const client : {&one, &two, &three}) bind_as_root(*client);
  one.send(persistent_search(7));
  two.send(persistent_search(7));
  ASSERT_TRUE(taken(one, 8));
  ASSERT_TRUE(taken(two, 8));
  EXPECT_EQ(code_of(one, persistent_search(9)), 11);
  EXPECT_EQ(code_of(three, persistent_search(9)), 51);
  one.send(test::abandon(10, 7));
  ASSERT_TRUE(taken(one, 11));
  three.send(persistent_search(10));
  EXPECT_TRUE(taken(three, 11));
}

TEST_F(PersistentWire, AreNotOfferedWhenTheyAreSwitchedOff) {
  settings.max_persistent_searches = 0;
  start();
  WireClient client(port());
  bind_as_root(client);
  EXPECT_EQ(code_of(client, persistent_search(7)), 12);
}

// The listener reads nothing until the end: what waits for it is bounded, and it is told so. The
// notices are large enough to fill what the system buffers for it.
TEST_F(PersistentWire, WhoDoesNotReadIsEndedWithAResult) {
  settings.write_timeout = 3600;
  loops = 2;
  start();
  value_bytes = 300000;
  WireClient listener(port());
  WireClient changer(port());
  listen(listener);
  bind_as_root(changer);
  const int most = static_cast<int>(PersistentSearch::kMostWaiting) + 200;
  for (int i = 0; i < most; ++i) ASSERT_EQ(add(changer, i + 2), 0);
  const std::vector<Reply> replies = listener.receive_result();
  ASSERT_FALSE(replies.empty());
  EXPECT_EQ(replies.back().tag, kDoneTag);
  EXPECT_EQ(replies.back().code, 11);
  EXPECT_LT(replies.size(), 200U);
}

TEST_F(PersistentWire, TheServerStopsWhileSomebodyListens) {
  start();
  WireClient listener(port());
  listen(listener);
  stop();
  EXPECT_EQ(status, 0);
  const auto notice = listener.receive();
  ASSERT_TRUE(notice);
  EXPECT_EQ(notice->id, 0);
}

}  // namespace
}  // namespace orv::server
