// The session on the configuration file, its lock, and the bind and unbind handlers.
#include "config_session.h"

#include <stdexcept>

#include "backend_test.h"

namespace orv {
namespace {

class Session : public BackendTest {
 protected:
  int open() {
    return traced(0x01010400, [&] { return init_cfg_ld(&connection, &state); });
  }
  void end() {
    platform.run([&] { config_end(&state); });
  }
  // Opens, with a bind that fails with 81, and looks at everything that is done from the bind on.
  void expect_failed_bind_told_in_its_order() {
    platform.fail("cfg_bind_s", 1, 81);
    EXPECT_EQ(open(), 1);
    const auto told =
        platform.story({"cfg_bind_s", "cfg_set_option", "cfg_get_option", "cfg_dump_exception"});
    ASSERT_GT(told.size(), 10U);
    EXPECT_THAT(
        std::vector<std::string>(std::next(told.begin(), 10), told.end()),
        ElementsAre("cfg_bind_s(session, null, null, 128)",
                    "stderr: Binding to config failed! rc = 81 \n",
                    "stderr: Turn on ldtrc for detail errors\n", "debug: unable to bind! \n",
                    "cfg_set_option(session, 1001, 1)", "cfg_set_option(session, 1002, 1)",
                    "cfg_get_option(session, 1005)", "cfg_dump_exception(session)",
                    "debug: line 7, column 3: not an attribute\n",
                    "debug: Error using filename : /file/in/use\n"));
    for (const DebugLine& line : platform.debug_lines()) EXPECT_EQ(line.category, 0xC80D0000U);
    rest();
  }
  // Gives back what a test's session left.
  void rest() {
    if (connection.config_session != nullptr) close_session();
    platform.set_held(&state.configMutex, false);
  }
};

TEST_F(Session, OpensByLockingMakingAHandleNamingFilesAndBinding) {
  EXPECT_EQ(open(), 0);
  EXPECT_THAT(
      platform.story({"pthread_mutex_lock", "pthread_mutex_unlock", "cfg_init", "cfg_set_option",
                      "cfg_get_option", "cfg_bind_s", "cfg_dump_exception"}),
      ElementsAre("pthread_mutex_lock(configMutex)", "debug: Initing config32 handle \n",
                  "cfg_init(null, 0)", "debug: Setting cfg file name to /etc/orv/config.ldif\n",
                  "cfg_set_option(session, 1005, \"/etc/orv/config.ldif\")",
                  "debug: Setting cfg file name to /etc/orv/config.ldif.save\n",
                  "cfg_set_option(session, 1006, \"/etc/orv/config.ldif.save\")",
                  "debug: Setting cfg file name to /etc/orv/config.ldif.save\n",
                  "cfg_set_option(session, 1006, \"/etc/orv/config.ldif.save\")",
                  "debug: Setting in-memory config key stash file\n",
                  "cfg_set_option(session, 1007, \"/etc/orv/key.stash\")",
                  "debug: Binding to cfg32 \n", "cfg_bind_s(session, null, null, 128)"));
  EXPECT_TRUE(locked());
  EXPECT_NE(connection.config_session, nullptr);
  for (const DebugLine& line : platform.debug_lines()) EXPECT_EQ(line.category, 0xC80D0000U);
  EXPECT_EQ(platform.standard_error(), "");
  rest();
}

TEST_F(Session, SaveFileIsNamedTwice) {
  EXPECT_EQ(open(), 0);
  EXPECT_THAT(platform.calls({"cfg_set_option"}),
              ElementsAre("cfg_set_option(session, 1005, \"/etc/orv/config.ldif\")",
                          "cfg_set_option(session, 1006, \"/etc/orv/config.ldif.save\")",
                          "cfg_set_option(session, 1006, \"/etc/orv/config.ldif.save\")",
                          "cfg_set_option(session, 1007, \"/etc/orv/key.stash\")"));
  rest();
}

TEST_F(Session, UnsetFilesAreNotNamed) {
  state = {nullptr, nullptr, nullptr, {}};
  EXPECT_EQ(open(), 0);
  EXPECT_EQ(platform.count("cfg_set_option"), 0);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Initing config32 handle \n"), detail("Binding to cfg32 \n")));
  rest();
}

TEST_F(Session, EachFileIsNamedWhetherTheOthersAreSetOrNot) {
  state.key_stash_file = nullptr;
  EXPECT_EQ(open(), 0);
  EXPECT_THAT(platform.story({"cfg_set_option"}),
              ElementsAre("debug: Initing config32 handle \n",
                          "debug: Setting cfg file name to /etc/orv/config.ldif\n",
                          "cfg_set_option(session, 1005, \"/etc/orv/config.ldif\")",
                          "debug: Setting cfg file name to /etc/orv/config.ldif.save\n",
                          "cfg_set_option(session, 1006, \"/etc/orv/config.ldif.save\")",
                          "debug: Setting cfg file name to /etc/orv/config.ldif.save\n",
                          "cfg_set_option(session, 1006, \"/etc/orv/config.ldif.save\")",
                          "debug: Binding to cfg32 \n"));
  rest();

  platform.forget();
  state = {nullptr, nullptr, "/etc/orv/key.stash", {}};
  EXPECT_EQ(open(), 0);
  EXPECT_THAT(platform.story({"cfg_set_option"}),
              ElementsAre("debug: Initing config32 handle \n",
                          "debug: Setting in-memory config key stash file\n",
                          "cfg_set_option(session, 1007, \"/etc/orv/key.stash\")",
                          "debug: Binding to cfg32 \n"));
  rest();

  platform.forget();
  state = {"/etc/orv/config.ldif", nullptr, nullptr, {}};
  EXPECT_EQ(open(), 0);
  EXPECT_THAT(platform.story({"cfg_set_option"}),
              ElementsAre("debug: Initing config32 handle \n",
                          "debug: Setting cfg file name to /etc/orv/config.ldif\n",
                          "cfg_set_option(session, 1005, \"/etc/orv/config.ldif\")",
                          "debug: Binding to cfg32 \n"));
  rest();

  platform.forget();
  state = {nullptr, "/etc/orv/config.ldif.save", nullptr, {}};
  EXPECT_EQ(open(), 0);
  EXPECT_THAT(platform.calls({"cfg_set_option"}),
              ElementsAre("cfg_set_option(session, 1006, \"/etc/orv/config.ldif.save\")",
                          "cfg_set_option(session, 1006, \"/etc/orv/config.ldif.save\")"));
  rest();
}

TEST_F(Session, NameOfTheKeyStashIsNotTraced) {
  EXPECT_EQ(open(), 0);
  for (const DebugLine& line : platform.debug_lines()) {
    EXPECT_THAT(line.text, Not(testing::HasSubstr("key.stash")));
  }
  rest();
}

TEST_F(Session, LockFailureGives80AndHoldsNothing) {
  platform.fail("pthread_mutex_lock", 1, 22);
  EXPECT_EQ(open(), 80);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(info("Could not lock configMutex\n")));
  EXPECT_THAT(platform.calls(), ElementsAre("pthread_mutex_lock(configMutex)"));
  EXPECT_EQ(connection.config_session, nullptr);
}

TEST_F(Session, HandleInTheSlotIsUsedAgainWithoutABind) {
  _CFG* left = open_session();
  EXPECT_EQ(open(), 0);
  EXPECT_TRUE(locked());
  EXPECT_EQ(connection.config_session, left);
  EXPECT_THAT(platform.calls(), ElementsAre("pthread_mutex_lock(configMutex)"));
  rest();
}

TEST_F(Session, AnyExceptionOfTheLibraryUnlocksAndGives1) {
  for (const int kind : {0, 1}) {
    platform.forget();
    platform.at("cfg_init", 1, [kind] {
      if (kind == 0) throw 42;
      throw std::runtime_error("out of something");
    });
    EXPECT_EQ(open(), 1);
    EXPECT_FALSE(locked());
    EXPECT_EQ(connection.config_session, nullptr);
    EXPECT_THAT(platform.debug_lines(),
                ElementsAre(detail("Initing config32 handle \n"),
                            error("CFG32 Threw an exception binding to the config file!\n")));
    EXPECT_EQ(platform.calls().back(), "pthread_mutex_unlock(configMutex)");
  }
}

TEST_F(Session, ExceptionIsToldBeforeTheLockIsReleased) {
  platform.at("cfg_init", 1, [] { throw 42; });
  EXPECT_EQ(open(), 1);
  EXPECT_THAT(platform.story({"pthread_mutex_lock", "cfg_init", "pthread_mutex_unlock"}),
              ElementsAre("pthread_mutex_lock(configMutex)", "debug: Initing config32 handle \n",
                          "cfg_init(null, 0)",
                          "debug: CFG32 Threw an exception binding to the config file!\n",
                          "pthread_mutex_unlock(configMutex)"));
}

TEST_F(Session, UnlockThatFailsAfterAnExceptionIsNotTold) {
  platform.at("cfg_init", 1, [] { throw 42; });
  platform.fail("pthread_mutex_unlock", 1, 1);
  EXPECT_EQ(open(), 1);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Initing config32 handle \n"),
                          error("CFG32 Threw an exception binding to the config file!\n")));
  rest();
}

TEST_F(Session, NullHandleIsStoredAndGives90WithTheLockHeld) {
  platform.fail("cfg_init", 1, 0);
  EXPECT_EQ(open(), 90);
  EXPECT_TRUE(locked());
  EXPECT_EQ(connection.config_session, nullptr);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Initing config32 handle \n"), detail("unable to init ! \n")));
  EXPECT_EQ(platform.count("cfg_bind_s"), 0);
  rest();
}

TEST_F(Session, FailedBindGives1AndKeepsHandleAndLock) {
  for (const int code : {90, -1}) {
    platform.forget();
    platform.fail("cfg_bind_s", 1, code);
    EXPECT_EQ(open(), 1);
    EXPECT_TRUE(locked());
    EXPECT_NE(connection.config_session, nullptr);
    EXPECT_EQ(platform.standard_error(), "Binding to config failed! rc = " + std::to_string(code) +
                                             " \nTurn on ldtrc for detail errors\n");
    rest();
  }
}

TEST_F(Session, FailedBindIsToldInItsOrder) {
  expect_failed_bind_told_in_its_order();
}

TEST_F(Session, FailedBindIsToldInItsOrderAlsoWhereNoOptionIsTaken) {
  platform.fail("cfg_set_option", 0, 1);
  expect_failed_bind_told_in_its_order();
}

TEST_F(Session, FailedBindIsToldOnStandardErrorWithoutTraceButNotDumped) {
  debug_off();
  platform.fail("cfg_bind_s", 1, 1);
  EXPECT_EQ(open(), 1);
  EXPECT_EQ(platform.standard_error(),
            "Binding to config failed! rc = 1 \nTurn on ldtrc for detail errors\n");
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  EXPECT_EQ(platform.count("cfg_dump_exception"), 0);
  EXPECT_THAT(platform.calls({"cfg_set_option"}), Contains("cfg_set_option(session, 1001, 1)"));
  EXPECT_THAT(platform.calls({"cfg_set_option"}), Contains("cfg_set_option(session, 1002, 1)"));
  EXPECT_EQ(platform.count("cfg_get_option"), 1);
  rest();
}

TEST_F(Session, FileNameThatCannotBeReadBackIsNoCrash) {
  platform.fail("cfg_bind_s", 1, 1);
  platform.fail("cfg_get_option", 1, 1);
  EXPECT_EQ(open(), 1);
  EXPECT_EQ(platform.debug_lines().back(), detail("Error using filename : (null)\n"));
  rest();
}

TEST_F(Session, HandleOfAFailedBindIsUsedAgainByTheNextOpening) {
  platform.fail("cfg_bind_s", 1, 1);
  EXPECT_EQ(open(), 1);
  end();
  EXPECT_EQ(open(), 0);
  EXPECT_EQ(platform.count("cfg_bind_s"), 1);
  rest();
}

TEST_F(Session, EndUnlocksAndNothingElse) {
  platform.set_held(&state.configMutex, true);
  end();
  EXPECT_FALSE(locked());
  EXPECT_THAT(platform.calls(), ElementsAre("pthread_mutex_unlock(configMutex)"));
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(Session, EndLeavesAnExitRecord) {
  trcEvents = kTraceEntry;
  platform.set_held(&state.configMutex, true);
  end();
  EXPECT_THAT(platform.records(), ElementsAre("entry 01010500 ", "exit 01010500 0"));
}

TEST_F(Session, EndThatCannotUnlockSaysSo) {
  platform.fail("pthread_mutex_unlock", 1, 1);
  end();
  EXPECT_THAT(platform.debug_lines(), ElementsAre(info("Could not unlock config mutex\n")));
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 1) << "it is not tried again";
}

TEST_F(Session, DebugLinesNeedTheirTraceBit) {
  trcEvents = ~kTraceDebug;
  EXPECT_EQ(open(), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  EXPECT_THAT(platform.records(), ElementsAre("entry 01010400 ", "exit 01010400 0"));
  rest();
}

TEST_F(Session, ExitRecordsCarryTheCodeOfEachFailure) {
  trcEvents = kTraceExit;
  platform.fail("cfg_bind_s", 1, 1);
  platform.fail("pthread_mutex_lock", 2, 1);
  EXPECT_EQ(open(), 1);
  EXPECT_EQ(open(), 80);
  EXPECT_THAT(platform.records(), ElementsAre("entry 01010400 ", "exit 01010400 1",
                                              "entry 01010400 ", "exit 01010400 80"));
  rest();
}

// ---- Handlers

class BindAndUnbind : public BackendTest {
 protected:
  int bind() {
    return traced(0x01010600, [&] { return config_back_bind(&pb); });
  }
  int unbind() {
    return traced(0x01010700, [&] { return config_back_unbind(&pb); });
  }
};

TEST_F(BindAndUnbind, BindIsRefusedWith49WithoutASession) {
  EXPECT_EQ(bind(), 49);
  EXPECT_THAT(platform.calls(),
              ElementsAre("slapi_pblock_get(130)", "slapi_pblock_get(131)", "slapi_pblock_get(132)",
                          "send_ldap_result(connection, operation, 49, null, null)"));
  EXPECT_THAT(platform.debug_lines(), ElementsAre(info("entering config_back_bind...\n")));
}

TEST_F(BindAndUnbind, BindIsToldBeforeItIsAnswered) {
  EXPECT_EQ(bind(), 49);
  EXPECT_THAT(platform.story({"slapi_pblock_get", "send_ldap_result"}),
              ElementsAre("slapi_pblock_get(130)", "slapi_pblock_get(131)", "slapi_pblock_get(132)",
                          "debug: entering config_back_bind...\n",
                          "send_ldap_result(connection, operation, 49, null, null)"));
}

TEST_F(BindAndUnbind, BindIsRefusedWith49WhateverCannotBeRead) {
  const char* const answers[] = {"send_ldap_result(connection, operation, 49, null, null)",
                                 "send_ldap_result(null, operation, 49, null, null)",
                                 "send_ldap_result(connection, null, 49, null, null)"};
  int nth = 0;
  for (const char* answer : answers) {
    SCOPED_TRACE(++nth);
    platform.forget();
    platform.fail("slapi_pblock_get", nth, -1);
    EXPECT_EQ(bind(), 49);
    EXPECT_THAT(platform.calls(), ElementsAre("slapi_pblock_get(130)", "slapi_pblock_get(131)",
                                              "slapi_pblock_get(132)", answer));
    EXPECT_THAT(platform.debug_lines(), ElementsAre(info("entering config_back_bind...\n")));
  }
}

TEST_F(BindAndUnbind, ConnectionThatNeverUsedTheBackendTakesNoLock) {
  EXPECT_EQ(unbind(), 0);
  EXPECT_THAT(platform.calls(), ElementsAre("slapi_pblock_get(130)", "slapi_pblock_get(131)"));
}

TEST_F(BindAndUnbind, UnbindDropsTheHandleUnderTheLockAndKeepsTheSlot) {
  _CFG* left = open_session();
  EXPECT_EQ(unbind(), 0);
  EXPECT_THAT(platform.calls({"pthread_mutex_lock", "cfg_unbind", "pthread_mutex_unlock"}),
              ElementsAre("pthread_mutex_lock(configMutex)", "cfg_unbind(session)",
                          "pthread_mutex_unlock(configMutex)"));
  EXPECT_EQ(connection.config_session, left);
  EXPECT_FALSE(locked());
}

TEST_F(BindAndUnbind, UnbindReturnsTheLibrarysResult) {
  open_session();
  platform.fail("cfg_unbind", 1, 81);
  EXPECT_EQ(unbind(), 81);
  EXPECT_FALSE(locked());
}

TEST_F(BindAndUnbind, UnbindThatCannotLockGives80AndKeepsTheHandle) {
  open_session();
  platform.fail("pthread_mutex_lock", 1, 22);
  EXPECT_EQ(unbind(), 80);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(info("Could not lock configMutex\n")));
  EXPECT_EQ(platform.count("cfg_unbind"), 0);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
  close_session();
}

TEST_F(BindAndUnbind, UnbindThatCannotUnlockSaysSo) {
  open_session();
  platform.fail("pthread_mutex_unlock", 1, 1);
  EXPECT_EQ(unbind(), 0);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(info("Could not unlock config mutex\n")));
}

TEST_F(BindAndUnbind, ExitRecordsCarryTheirCodes) {
  trcEvents = kTraceExit;
  bind();
  unbind();
  EXPECT_THAT(platform.records(), ElementsAre("entry 01010600 ", "exit 01010600 49",
                                              "entry 01010700 ", "exit 01010700 0"));
}

}  // namespace
}  // namespace orv
