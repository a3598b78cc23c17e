// Start and stop of the backend's instance.
#include <cerrno>
#include <cstddef>

#include "backend_test.h"

namespace orv {
namespace {

class Instance : public BackendTest {
 protected:
  // Starts with a start-up record as the server makes it.
  int start(const char* config_file, const char* key_stash = nullptr) {
    startup =
        static_cast<BackendStartup*>(platform.give(scripted::Owned::text, sizeof(BackendStartup)));
    *startup = {config_file, key_stash};
    platform.name(startup, "startup record");
    backend.private_data = startup;
    return traced(0x01010200, [&] { return config_back_init(&backend); });
  }

  // Releases what a successful start keeps for ever.
  void release_state() {
    auto* made = static_cast<ConfigBackendPrivate*>(backend.private_data);
    std::free(const_cast<char*>(made->config_file));
    std::free(const_cast<char*>(made->save_file));
    std::free(made);
  }

  ConfigBackendPrivate& made() { return *static_cast<ConfigBackendPrivate*>(backend.private_data); }

  // The start failed: nothing was left but the start-up record, untouched.
  void expect_startup_kept() {
    EXPECT_EQ(backend.private_data, startup);
    EXPECT_THAT(platform.leaks(), ElementsAre("text"));
    EXPECT_EQ(platform.count("free"), 0);
    EXPECT_EQ(platform.count("initIconvHandle"), 0);
    EXPECT_EQ(platform.count("pthread_mutex_destroy"), 0);
    std::free(startup);
  }

  BackendStartup* startup = nullptr;
};

TEST_F(Instance, LinkIsResolvedAndItsTargetNamesTheSaveFile) {
  platform.link_target = "/srv/orv/live.ldif";
  EXPECT_EQ(start("/etc/orv/config.ldif", "/etc/orv/key"), 0);
  EXPECT_STREQ(made().config_file, "/srv/orv/live.ldif");
  EXPECT_STREQ(made().save_file, "/srv/orv/live.ldif.save");
  EXPECT_STREQ(made().key_stash_file, "/etc/orv/key");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Readlink rc: 18\nPath:/srv/orv/live.ldif\n"),
                          detail("Save file name: /srv/orv/live.ldif.save\n")));
  release_state();
}

TEST_F(Instance, PlainFileKeepsItsPath) {
  platform.link_errno = EINVAL;
  EXPECT_EQ(start("/etc/orv/config.ldif"), 0);
  EXPECT_STREQ(made().config_file, "/etc/orv/config.ldif");
  EXPECT_STREQ(made().save_file, "/etc/orv/config.ldif.save");
  EXPECT_EQ(made().key_stash_file, nullptr);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Readlink rc: -1\nPath:\n"), detail("File not a link.\n"),
                          detail("Save file name: /etc/orv/config.ldif.save\n")));
  release_state();
}

TEST_F(Instance, OnlyTheLinkItselfIsResolvedAndRelativeTargetsStayRelative) {
  platform.link_target = "../other/link";
  EXPECT_EQ(start("/etc/orv/config.ldif"), 0);
  EXPECT_STREQ(made().config_file, "../other/link");
  EXPECT_EQ(platform.count("readlink"), 1);
  release_state();
}

TEST_F(Instance, StepsComeInTheirOrder) {
  platform.link_target = "/a";
  EXPECT_EQ(start("/b"), 0);
  EXPECT_THAT(platform.calls(),
              ElementsAre("pthread_mutex_init(?, null)", "readlink(\"/b\", 4086)",
                          "kel_strlcpy(\"/a\", 8)", "kel_strlcat(\"/a\", \".save\", 8)",
                          "initIconvHandle()", "free(startup record)"));
  EXPECT_EQ(platform.last_mutex_made(), &made().configMutex);
  release_state();
}

TEST_F(Instance, StateHoldsTheConfiguredPathFromItsBeginning) {
  platform.link_target = "/a";
  std::string at_first;
  platform.at("readlink", 1, [&] {
    const char* made_mutex = reinterpret_cast<const char*>(platform.last_mutex_made());
    const auto* state_made = reinterpret_cast<const ConfigBackendPrivate*>(
        made_mutex - offsetof(ConfigBackendPrivate, configMutex));
    at_first = state_made->config_file;
    EXPECT_EQ(state_made->save_file, nullptr);
    EXPECT_EQ(state_made->key_stash_file, nullptr);
  });
  EXPECT_EQ(start("/b", "/key"), 0);
  EXPECT_EQ(at_first, "/b");
  release_state();
}

TEST_F(Instance, StateIsWholeAndInItsPlaceBeforeTheCodePageIsSetUp) {
  platform.link_target = "/a";
  platform.at("initIconvHandle", 1, [&] {
    ASSERT_NE(backend.private_data, startup);
    EXPECT_STREQ(made().config_file, "/a");
    EXPECT_STREQ(made().save_file, "/a.save");
    EXPECT_STREQ(made().key_stash_file, "/key");
  });
  EXPECT_EQ(start("/b", "/key"), 0);
  EXPECT_EQ(platform.count("initIconvHandle"), 1);
  release_state();
}

TEST_F(Instance, LinesComeBetweenTheSteps) {
  platform.link_errno = EINVAL;
  EXPECT_EQ(start("/b"), 0);
  EXPECT_THAT(platform.story({"readlink", "kel_strlcpy", "kel_strlcat", "initIconvHandle"}),
              ElementsAre("readlink(\"/b\", 4086)", "debug: Readlink rc: -1\nPath:\n",
                          "debug: File not a link.\n", "kel_strlcpy(\"/b\", 4096)",
                          "kel_strlcpy(\"/b\", 8)", "kel_strlcat(\"/b\", \".save\", 8)",
                          "debug: Save file name: /b.save\n", "initIconvHandle()"));
  release_state();
}

TEST_F(Instance, AtMost4086BytesOfALinkAreRead) {
  platform.link_target = std::string(5000, 'x');
  EXPECT_EQ(start("/b"), 0);
  EXPECT_EQ(std::string(made().config_file), std::string(4086, 'x'));
  EXPECT_EQ(std::string(made().save_file), std::string(4086, 'x') + ".save");
  release_state();
}

TEST_F(Instance, MissingFileFailsWith80AndKeepsTheStartupRecord) {
  platform.link_errno = ENOENT;
  EXPECT_EQ(start("/nowhere"), 80);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Readlink rc: -1\nPath:\n"),
                          info("config_back_init: Readlink error rc= -1\n")));
  expect_startup_kept();
}

TEST_F(Instance, EmptyPathFailsWith80AfterTheNoteThatItIsNoLink) {
  platform.link_errno = EINVAL;
  EXPECT_EQ(start(""), 80);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Readlink rc: -1\nPath:\n"), detail("File not a link.\n"),
                          info("config_back_init: Readlink error rc= 0\n")));
  expect_startup_kept();
}

TEST_F(Instance, EmptyLinkIsNotCopiedFromThePath) {
  errno = 0;
  platform.link_target = "";
  EXPECT_EQ(start("/b"), 80);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Readlink rc: 0\nPath:\n"),
                          info("config_back_init: Readlink error rc= 0\n")));
  expect_startup_kept();
}

TEST_F(Instance, StaleErrorNumberDoesNotTurnALinkIntoAFile) {
  errno = EINVAL;
  platform.link_target = "/target";
  EXPECT_EQ(start("/b"), 0);
  EXPECT_STREQ(made().config_file, "/target");
  release_state();
}

TEST_F(Instance, EmptyLinkWithTheErrorNumberOfAPlainFileIsTakenForOne) {
  errno = EINVAL;
  platform.link_target = "";
  EXPECT_EQ(start("/b"), 0);
  EXPECT_STREQ(made().config_file, "/b");
  release_state();
}

TEST_F(Instance, LinkOfOneByteIsNotTakenForAPlainFile) {
  errno = EINVAL;
  platform.link_target = "a";
  EXPECT_EQ(start("/b"), 0);
  EXPECT_STREQ(made().config_file, "a");
  EXPECT_STREQ(made().save_file, "a.save");
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(detail("Readlink rc: 1\nPath:a\n"), detail("Save file name: a.save\n")));
  release_state();
}

TEST_F(Instance, PathOfOneByteStarts) {
  platform.link_errno = EINVAL;
  EXPECT_EQ(start("c"), 0);
  EXPECT_STREQ(made().config_file, "c");
  EXPECT_STREQ(made().save_file, "c.save");
  release_state();
}

TEST_F(Instance, LongestPathThatFitsStarts) {
  platform.link_errno = EINVAL;
  const std::string path(4095, 'p');
  EXPECT_EQ(start(path.c_str()), 0);
  EXPECT_EQ(made().config_file, path);
  EXPECT_EQ(made().save_file, path + ".save");
  release_state();
}

TEST_F(Instance, PathOf4096BytesIsTooLong) {
  platform.link_errno = EINVAL;
  EXPECT_EQ(start(std::string(4096, 'p').c_str()), 1);
  EXPECT_EQ(platform.debug_lines().back(),
            info("kelstr error near back-config/config_init.cpp:137\n"));
  EXPECT_THAT(platform.calls({"kel_strlcpy"}), testing::SizeIs(1));
  EXPECT_THAT(platform.calls({"kel_strlcpy"}).back(), testing::EndsWith(", 4096)"));
  expect_startup_kept();
}

TEST_F(Instance, SaveNameThatDoesNotFitFailsAtTheCopy) {
  platform.link_target = "/a";
  platform.fail("kel_strlcpy", 1, 8);
  EXPECT_EQ(start("/b"), 1);
  EXPECT_EQ(platform.debug_lines().back(),
            info("kelstr error near back-config/config_init.cpp:165\n"));
  EXPECT_EQ(platform.count("kel_strlcat"), 0);
  expect_startup_kept();
}

TEST_F(Instance, SaveNameThatJustFitsIsNoFailure) {
  platform.link_target = "/a";
  platform.fail("kel_strlcpy", 1, 7);
  platform.fail("kel_strlcat", 1, 7);
  EXPECT_EQ(start("/b"), 0);
  release_state();
}

TEST_F(Instance, SaveNameThatDoesNotFitFailsAtTheAppend) {
  platform.link_target = "/a";
  platform.fail("kel_strlcat", 1, 8);
  EXPECT_EQ(start("/b"), 1);
  EXPECT_EQ(platform.debug_lines().back(),
            info("kelstr error near back-config/config_init.cpp:175\n"));
  expect_startup_kept();
}

TEST_F(Instance, ConverterFailureIsTheResultWithTheStateInPlace) {
  platform.link_target = "/a";
  platform.fail("initIconvHandle", 1, 80);
  EXPECT_EQ(start("/b"), 80);
  EXPECT_EQ(platform.calls().back(), "free(startup record)");
  EXPECT_STREQ(made().config_file, "/a");
  release_state();
}

TEST_F(Instance, WithoutMemoryForTheStateTheStartupRecordIsReleased) {
  platform.fail_allocation(1);
  EXPECT_EQ(start("/b"), 90);
  EXPECT_THAT(platform.calls(), ElementsAre("free(startup record)"));
  EXPECT_EQ(backend.private_data, startup);  // not looked at again by anybody
  EXPECT_EQ(platform.last_mutex_made(), nullptr);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
}

TEST_F(Instance, WithoutMemoryForThePathTheStartupRecordIsKept) {
  platform.fail_allocation(2);
  EXPECT_EQ(start("/b"), 90);
  EXPECT_EQ(platform.count("readlink"), 0);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  expect_startup_kept();
}

TEST_F(Instance, WithoutMemoryForTheSaveNameTheStartupRecordIsKept) {
  platform.link_target = "/a";
  platform.fail_allocation(3);
  EXPECT_EQ(start("/b"), 90);
  EXPECT_THAT(platform.debug_lines(), ElementsAre(detail("Readlink rc: 2\nPath:/a\n")));
  expect_startup_kept();
}

// A start that fails releases what it has made, each failure in an order of its own.
class FailedStart : public Instance {
 protected:
  FailedStart() {
    platform.link_target = "/a";
    platform.name_allocation(1, "state");
    platform.name_allocation(2, "path");
    platform.name_allocation(3, "save name");
  }
  void TearDown() override {
    std::free(startup);
    Instance::TearDown();
  }
};

TEST_F(FailedStart, AtTheLinkReleasesTheStateBeforeThePath) {
  platform.link_errno = ENOENT;
  EXPECT_EQ(start("/nowhere"), 80);
  EXPECT_THAT(platform.calls({"free"}), ElementsAre("free(state)", "free(path)"));
}

TEST_F(FailedStart, AtTheCopyOfThePathReleasesThePathBeforeTheState) {
  platform.link_errno = EINVAL;
  EXPECT_EQ(start(std::string(4096, 'p').c_str()), 1);
  EXPECT_THAT(platform.calls({"free"}), ElementsAre("free(path)", "free(state)"));
}

TEST_F(FailedStart, WithoutMemoryForTheSaveNameReleasesThePathBeforeTheState) {
  platform.fail_allocation(3);
  EXPECT_EQ(start("/b"), 90);
  EXPECT_THAT(platform.calls({"free"}), ElementsAre("free(path)", "free(state)"));
}

TEST_F(FailedStart, AtTheCopyIntoTheSaveNameReleasesThatLast) {
  platform.fail("kel_strlcpy", 1, 8);
  EXPECT_EQ(start("/b"), 1);
  EXPECT_THAT(platform.calls({"free"}),
              ElementsAre("free(path)", "free(state)", "free(save name)"));
}

TEST_F(FailedStart, AtTheAppendToTheSaveNameReleasesThatLast) {
  platform.fail("kel_strlcat", 1, 8);
  EXPECT_EQ(start("/b"), 1);
  EXPECT_THAT(platform.calls({"free"}),
              ElementsAre("free(path)", "free(state)", "free(save name)"));
}

TEST_F(Instance, NothingIsTracedWhenNotDebugging) {
  debug_off();
  platform.link_errno = ENOENT;
  EXPECT_EQ(start("/nowhere"), 80);
  EXPECT_THAT(platform.debug_lines(), IsEmpty());
  expect_startup_kept();
}

TEST_F(Instance, StartAndStopLeaveExitRecordsWithTheirCodes) {
  trcEvents = kTraceExit;
  platform.link_errno = ENOENT;
  EXPECT_EQ(start("/nowhere"), 80);
  std::free(startup);
  backend.private_data = nullptr;
  platform.run([&] { return config_back_close(&pb); });
  EXPECT_THAT(platform.records(), ElementsAre("entry 01010200 ", "exit 01010200 80",
                                              "entry 01010300 ", "exit 01010300 17"));
}

class Closing : public BackendTest {
 protected:
  int close() {
    return traced(0x01010300, [&] { return config_back_close(&pb); });
  }
};

TEST_F(Closing, DestroysTheMutexAndReleasesNothing) {
  EXPECT_EQ(close(), 0);
  EXPECT_THAT(platform.calls(),
              ElementsAre("slapi_pblock_get(130)", "pthread_mutex_destroy(configMutex)"));
  EXPECT_THAT(platform.debug_lines(), ElementsAre(info("calling config_close...\n")));
  EXPECT_EQ(backend.private_data, &state);
}

TEST_F(Closing, IsToldBeforeTheBackendIsLookedAt) {
  EXPECT_EQ(close(), 0);
  EXPECT_THAT(platform.story({"slapi_pblock_get", "pthread_mutex_destroy"}),
              ElementsAre("debug: calling config_close...\n", "slapi_pblock_get(130)",
                          "pthread_mutex_destroy(configMutex)"));
}

TEST_F(Closing, IgnoresThatTheMutexIsBusy) {
  platform.fail("pthread_mutex_destroy", 1, EBUSY);
  EXPECT_EQ(close(), 0);
}

TEST_F(Closing, UnreadableBackendGivesMinusOne) {
  for (const int code : {-1, 1}) {
    platform.forget();
    platform.fail("slapi_pblock_get", 1, code);
    EXPECT_EQ(close(), -1);
    EXPECT_THAT(platform.debug_lines(), ElementsAre(info("calling config_close...\n"),
                                                    info("config_close: Could not get backend\n")));
    EXPECT_EQ(platform.count("pthread_mutex_destroy"), 0);
  }
}

TEST_F(Closing, NullBackendGives17) {
  pb.put(parameter::backend, static_cast<const void*>(nullptr));
  EXPECT_EQ(close(), 17);
  EXPECT_THAT(platform.debug_lines(),
              ElementsAre(info("calling config_close...\n"),
                          closing("config_close: An invalid Backend (NULL) is encountered\n")));
}

TEST_F(Closing, InstanceNeverStartedGives17) {
  backend.private_data = nullptr;
  EXPECT_EQ(close(), 17);
  EXPECT_THAT(
      platform.debug_lines(),
      ElementsAre(info("calling config_close...\n"),
                  closing("config_close: The Backend private pointer has not been initialized\n")));
  EXPECT_EQ(platform.count("pthread_mutex_destroy"), 0);
}

}  // namespace
}  // namespace orv
