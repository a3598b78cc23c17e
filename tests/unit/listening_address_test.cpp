// Addresses on which the server listens: the host must have them.
#include <sys/mman.h>
#include <unistd.h>

#include "backend_test.h"
#include "config_modify.h"
#include "slapi/owners.h"

namespace orv {
namespace {

using Attributes = std::vector<scripted::ScriptedAttribute>;

class ListeningAddress : public BackendTest {
 protected:
  ListeningAddress() { platform.addresses = {"127.0.0.1", "::1"}; }

  void TearDown() override {
    e.reset();
    if (text != nullptr) std::free(text);
    BackendTest::TearDown();
  }

  void make(const Attributes& attributes) {
    e.reset(scripted::make_entry({"CN=CONFIGURATION", attributes}));
  }
  void top_entry(const std::vector<std::string>& addresses) {
    make({{"objectClass", {"top", "orv-slapdTop"}}, {"orv-slapdIpAddress", addresses}});
  }
  int check() {
    return traced(0x01030200, [&] { return checkIPaddrs(e.get(), &text); });
  }
  char* message(int kind, const berval& value) {
    return platform.run([&] { return gen_checkIPaddrs_err(kind, &value); });
  }
  // What stays behind of the address that was told.
  void expect_only_the_copy_left() {
    e.reset();
    std::free(text);
    text = nullptr;
    EXPECT_THAT(platform.leaks(), ElementsAre("memory"));
    platform.release_leaks();
  }

  EntryPtr e;
  char* text = nullptr;
};

TEST_F(ListeningAddress, EntryWithoutObjectClassesIsNotExamined) {
  for (const bool null_list : {false, true}) {
    platform.empty_lists_are_null = null_list;
    for (const Attributes& attributes :
         {Attributes{{"orv-slapdIpAddress", {"10.0.0.1"}}},
          Attributes{{"objectClass", {}}, {"orv-slapdIpAddress", {"10.0.0.1"}}}}) {
      platform.forget();
      make(attributes);
      EXPECT_EQ(check(), 0);
      EXPECT_THAT(platform.debug_lines(), ElementsAre(detail("checkIPaddrs: entry has no ocs.\n")));
      EXPECT_EQ(platform.count("value_find") + platform.count("attr_find"), 0);
    }
  }
}

TEST_F(ListeningAddress, EntryOfAnotherClassPassesWithoutALine) {
  make({{"objectClass", {"top", "orv-slapdTopX", "orv-slapdTo"}},
        {"orv-slapdIpAddress", {"10.0.0.1"}}});
  e->object_classes->syntax = 7;
  EXPECT_EQ(check(), 0);
  EXPECT_EQ(text, nullptr);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  EXPECT_THAT(platform.calls(), ElementsAre("value_find(\"objectClass\", \"orv-slapdTop\", 7, 1)"));
}

TEST_F(ListeningAddress, OnlyTheAnswer0MeansThatTheClassIsThere) {
  make({{"objectClass", {"other"}}, {"orv-slapdIpAddress", {"10.0.0.1"}}});
  platform.fail("value_find", 1, 0);
  EXPECT_EQ(check(), 19);
  expect_only_the_copy_left();
  platform.forget();
  top_entry({"10.0.0.1"});
  platform.fail("value_find", 1, -1);
  EXPECT_EQ(check(), 0);
}

TEST_F(ListeningAddress, TopEntryWithoutAddressesListensOnAllOfThem) {
  for (const bool null_list : {false, true}) {
    platform.empty_lists_are_null = null_list;
    for (const Attributes& attributes :
         {Attributes{{"objectClass", {"orv-slapdTop"}}},
          Attributes{{"objectClass", {"orv-slapdTop"}}, {"orv-slapdIpAddress", {}}}}) {
      platform.forget();
      make(attributes);
      EXPECT_EQ(check(), 0);
      EXPECT_THAT(platform.debug_lines(),
                  ElementsAre(detail("checkIPaddrs: entry is orv-slapdTop.\n"),
                              detail("checkIPaddrs: server is configured to use all addrs.\n")));
      EXPECT_EQ(platform.count("isValidIPAddressOnSystem"), 0);
    }
  }
}

TEST_F(ListeningAddress, AddressesOfTheHostPassOneAfterTheOther) {
  top_entry({"::1", "127.0.0.1"});
  char mine[] = "left alone";
  text = mine;
  EXPECT_EQ(check(), 0);
  EXPECT_EQ(text, mine);
  text = nullptr;
  EXPECT_THAT(
      platform.story({"attr_find", "isValidIPAddressOnSystem"}),
      ElementsAre("debug: checkIPaddrs: entry is orv-slapdTop.\n",
                  "attr_find(\"orv-slapdIpAddress\", 0, 0)", "isValidIPAddressOnSystem(\"::1\")",
                  "isValidIPAddressOnSystem(\"127.0.0.1\")"));
}

TEST_F(ListeningAddress, FirstAddressThatTheHostLacksGives19AndIsNamed) {
  top_entry({"127.0.0.1", "10.0.0.1", "10.0.0.2"});
  EXPECT_EQ(check(), 19);
  EXPECT_STREQ(text, "IP address 10.0.0.1 is not defined for this system.");
  EXPECT_THAT(
      platform.story({"isValidIPAddressOnSystem", "kel_asprintf"}),
      ElementsAre("debug: checkIPaddrs: entry is orv-slapdTop.\n",
                  "isValidIPAddressOnSystem(\"127.0.0.1\")",
                  "isValidIPAddressOnSystem(\"10.0.0.1\")",
                  "debug: checkIPaddrs: says the following IP address is not valid 10.0.0.1\n",
                  "kel_asprintf(\"IP address %s is not defined for this system.\")"));
  EXPECT_EQ(platform.debug_lines().back().category, 0xC8110000U);
  expect_only_the_copy_left();
}

TEST_F(ListeningAddress, TextThatCannotBeMadeLeavesTheRefusalWithoutOne) {
  top_entry({"10.0.0.1"});
  platform.fail("kel_asprintf", 1, -1);
  char mine[] = "replaced";
  text = mine;
  EXPECT_EQ(check(), 19);
  EXPECT_EQ(text, nullptr);
  EXPECT_EQ(platform.debug_lines().back().category, 0xC8110000U);
  EXPECT_THAT(platform.debug_lines().back().text,
              testing::MatchesRegex("kel_asprintf failedin gen_checkIPaddrs_err in file "
                                    "back-config/config_modify.cpp at line [0-9]+"));
  e.reset();
  EXPECT_THAT(platform.leaks(), IsEmpty());  // here the copy goes
}

TEST_F(ListeningAddress, CopyIsReleasedAfterItWasSaidThatTheTextCannotBeMade) {
  top_entry({"10.0.0.1"});
  platform.fail("kel_asprintf", 1, -1);
  platform.name_allocation(1, "copy");
  EXPECT_EQ(check(), 19);
  const auto story = platform.story({"free"});
  ASSERT_GT(story.size(), 1U);
  EXPECT_THAT(story[story.size() - 2], testing::StartsWith("debug: kel_asprintf failedin"));
  EXPECT_EQ(story.back(), "free(copy)");
}

TEST_F(ListeningAddress, NoMemoryForTheCopyLeavesTheRefusalWithoutAText) {
  top_entry({"10.0.0.1"});
  platform.fail_allocation(1);
  EXPECT_EQ(check(), 19);
  EXPECT_EQ(text, nullptr);
  EXPECT_EQ(platform.count("kel_asprintf"), 0);
}

TEST_F(ListeningAddress, OnlyTwoKindsHaveATextAndTheOthersTakeNoMemory) {
  char address[] = "10.0.0.1";
  const berval value{8, address};
  text = message(21, value);
  EXPECT_STREQ(text, "10.0.0.1 is not a valid IP address.");
  expect_only_the_copy_left();
  for (const int kind : {0, 1, 18, 20, 22, 80}) {
    platform.forget();
    EXPECT_EQ(message(kind, value), nullptr);
    EXPECT_EQ(platform.allocations(), 0);
    EXPECT_THAT(platform.calls(), IsEmpty());
  }
}

// Text at the end of memory: whoever reads on, crashes.
class LastBytes {
 public:
  explicit LastBytes(const std::string& text)
      : size_(static_cast<std::size_t>(sysconf(_SC_PAGESIZE))),
        pages_(static_cast<char*>(
            mmap(nullptr, 2 * size_, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0))),
        begin_(pages_ + size_ - text.size()) {
    mprotect(pages_ + size_, size_, PROT_NONE);
    text.copy(begin_, text.size());
  }
  ~LastBytes() { munmap(pages_, 2 * size_); }
  LastBytes(const LastBytes&) = delete;
  LastBytes& operator=(const LastBytes&) = delete;

  [[nodiscard]] char* begin() const { return begin_; }

 private:
  std::size_t size_;
  char* pages_;
  char* begin_;
};

TEST_F(ListeningAddress, ValueIsReadUpToItsLengthOnly) {
  const LastBytes bytes("10.1");
  text = message(19, {4, bytes.begin()});
  EXPECT_STREQ(text, "IP address 10.1 is not defined for this system.");
  EXPECT_THAT(platform.sizes, ElementsAre(4U + 2));  // the copy
  expect_only_the_copy_left();
}

TEST_F(ListeningAddress, LinesNeedTheDebugBit) {
  debug_off();
  top_entry({"10.0.0.1"});
  platform.fail("kel_asprintf", 1, -1);
  EXPECT_EQ(check(), 19);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(ListeningAddress, ClientIsToldTheAddressWithOrWithoutTheDebugBit) {
  debug_off();
  top_entry({"10.0.0.1"});
  EXPECT_EQ(check(), 19);
  EXPECT_STREQ(text, "IP address 10.0.0.1 is not defined for this system.");
  expect_only_the_copy_left();
}

TEST_F(ListeningAddress, ExitRecordsCarryTheCodes) {
  trcEvents = kTraceExit & ~kTraceEntry;
  top_entry({"127.0.0.1"});
  check();
  top_entry({"10.0.0.1"});
  check();
  EXPECT_THAT(platform.records(),
              ElementsAre("exit 01030200 0", "exit 01030300 0", "exit 01030200 19"));
  expect_only_the_copy_left();
}

}  // namespace
}  // namespace orv
