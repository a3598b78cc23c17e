// What the plug-in tells the server when it is loaded.
#include "backend_test.h"

namespace orv {
namespace {

class Registration : public BackendTest {
 protected:
  Registration() {
    name_handler(config_back_bind, "bind");
    name_handler(config_back_unbind, "unbind");
    name_handler(config_back_search, "search");
    name_handler(config_back_modify, "modify");
    name_handler(config_back_add, "add");
    name_handler(config_back_delete, "delete");
    name_handler(config_back_init, "init");
    name_handler(config_back_close, "close");
  }

  template <typename Function>
  void name_handler(Function* function, const char* name) {
    platform.name(reinterpret_cast<const void*>(function), name);
  }

  int load() {
    return platform.run([&] { return config_backend_init(&block); });
  }

  pblock block;
};

constexpr const char* kRegister =
    "slapi_register_supported_control(\"2.16.840.1.113730.3.4.2\", -1)";

TEST_F(Registration, StoresFourteenSlotsInOrderThenTheControl) {
  EXPECT_EQ(load(), 0);
  EXPECT_THAT(platform.calls(),
              ElementsAre("slapi_pblock_set(200, bind)", "slapi_pblock_set(201, unbind)",
                          "slapi_pblock_set(202, search)", "slapi_pblock_set(203, null)",
                          "slapi_pblock_set(204, modify)", "slapi_pblock_set(205, null)",
                          "slapi_pblock_set(206, add)", "slapi_pblock_set(207, delete)",
                          "slapi_pblock_set(-19, init)", "slapi_pblock_set(209, null)",
                          "slapi_pblock_set(210, close)", "slapi_pblock_set(208, null)",
                          "slapi_pblock_set(-15, null)", "slapi_pblock_set(-16, null)", kRegister));
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(Registration, StoresNullSlotsExplicitly) {
  for (const int slot : {203, 205, 208, 209, -15, -16}) block.put(slot, &block);
  EXPECT_EQ(load(), 0);
  for (const int slot : {203, 205, 208, 209, -15, -16}) {
    EXPECT_EQ(block.values[slot].pointer, nullptr) << slot;
  }
}

TEST_F(Registration, EndsStoringAtTheFirstFailureAndStillAnnouncesTheControl) {
  platform.fail("slapi_pblock_set", 3, 77);
  EXPECT_EQ(load(), 77);
  EXPECT_EQ(platform.count("slapi_pblock_set"), 3);
  EXPECT_EQ(platform.calls().back(), kRegister);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(error("config backend initialization error. Function number=202\n")));
}

TEST_F(Registration, TellsTheFailureBeforeItAnnouncesTheControl) {
  platform.fail("slapi_pblock_set", 14, 1);
  EXPECT_EQ(load(), 1);
  EXPECT_THAT(
      platform.story({"slapi_register_supported_control"}),
      ElementsAre("debug: config backend initialization error. Function number=-16\n", kRegister));
}

TEST_F(Registration, NamesTheSlotThatFailedForEverySlot) {
  const std::vector<int> slots = {200, 201, 202, 203, 204, 205, 206,
                                  207, -19, 209, 210, 208, -15, -16};
  for (int nth = 1; nth <= 14; ++nth) {
    platform.forget();
    platform.fail("slapi_pblock_set", nth, -1);
    EXPECT_EQ(load(), -1);
    EXPECT_EQ(platform.count("slapi_pblock_set"), nth);
    EXPECT_EQ(platform.count("slapi_register_supported_control"), 1);
    EXPECT_THAT(
        platform.debug_lines(),
        ElementsAre(error("config backend initialization error. Function number=" +
                          std::to_string(slots[static_cast<std::size_t>(nth) - 1]) + "\n")));
  }
}

TEST_F(Registration, WritesTheFailureOnlyWhenDebugging) {
  debug_off();
  platform.fail("slapi_pblock_set", 8, 1);
  EXPECT_EQ(load(), 1);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(Registration, ServerOfKindThreeGetsHandlersButNoControl) {
  g_srvType = 3;
  EXPECT_EQ(load(), 0);
  EXPECT_EQ(platform.count("slapi_pblock_set"), 14);
  EXPECT_EQ(platform.count("slapi_register_supported_control"), 0);
}

TEST_F(Registration, ServerOfKindThreeGetsNoControlAfterAFailureEither) {
  g_srvType = 3;
  platform.fail("slapi_pblock_set", 1, 5);
  EXPECT_EQ(load(), 5);
  EXPECT_EQ(platform.count("slapi_register_supported_control"), 0);
}

TEST_F(Registration, OtherServerKindsGetTheControl) {
  for (const int kind : {0, 1, 2, 4}) {
    platform.forget();
    g_srvType = kind;
    EXPECT_EQ(load(), 0);
    EXPECT_EQ(platform.count("slapi_register_supported_control"), 1) << kind;
  }
}

TEST_F(Registration, IgnoresTheResultOfAnnouncingTheControl) {
  platform.fail("slapi_register_supported_control", 1, 90);
  EXPECT_EQ(load(), 0);
}

TEST_F(Registration, TracesTheBlockOnEntryAndTheResultOnExit) {
  trcEvents = kTraceEntry;
  platform.fail("slapi_pblock_set", 9, -1);
  EXPECT_EQ(load(), -1);
  char entry[64];
  std::snprintf(entry, sizeof entry, "entry 01010100 pb=0x%p", static_cast<void*>(&block));
  EXPECT_THAT(platform.records(), ElementsAre(std::string(entry), "exit 01010100 -1"));
}

TEST_F(Registration, WritesOnlyExitRecordsWhenOnlyTheSecondExitBitIsSet) {
  trcEvents = 0x00020000;
  EXPECT_EQ(load(), 0);
  EXPECT_THAT(platform.records(), ElementsAre("exit 01010100 0"));
}

}  // namespace
}  // namespace orv
