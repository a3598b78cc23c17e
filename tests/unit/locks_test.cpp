// AutoLock and AutoFree.
#include "auto_lock.h"

#include <cerrno>
#include <type_traits>

#include "backend_test.h"

namespace orv {
namespace {

constexpr const char* kStillBusy =
    "Couldn't get access to mutex controlled resource (still busy). Will wait for 30 more "
    "seconds.\n";
constexpr const char* kExpired =
    "Couldn't get access to mutex controlled resource (wait of 60 seconds expired.)\n";

class Locks : public BackendTest {
 protected:
  Locks() { platform.name(&mutex, "mutex"); }

  void lock_and_release(pthread_mutex_t* which, bool timed) {
    platform.run([&] {
      const AutoLock lock(which, timed);
      held_inside = platform.held(which);
    });
  }

  // How many of the calls so far are sleeps of that many microseconds.
  [[nodiscard]] long sleeps(int microseconds) const {
    const std::string wanted = "usleep(" + std::to_string(microseconds) + ")";
    const std::vector<std::string> all = platform.calls({"usleep"});
    return std::count(all.begin(), all.end(), wanted);
  }

  void busy_for(int attempts) {
    for (int nth = 1; nth <= attempts; ++nth) platform.fail("pthread_mutex_trylock", nth, EBUSY);
  }

  pthread_mutex_t mutex{};
  bool held_inside = false;
};

static_assert(std::has_virtual_destructor_v<AutoLock>);
static_assert(std::has_virtual_destructor_v<AutoFree<char>>);

TEST_F(Locks, NullMutexIsANoOp) {
  lock_and_release(nullptr, false);
  lock_and_release(nullptr, true);
  EXPECT_THAT(platform.calls(), IsEmpty());
}

TEST_F(Locks, UntimedLockBlocksAndTheDestructorUnlocks) {
  lock_and_release(&mutex, false);
  EXPECT_TRUE(held_inside);
  EXPECT_FALSE(platform.held(&mutex));
  EXPECT_THAT(platform.calls(),
              ElementsAre("pthread_mutex_lock(mutex)", "pthread_mutex_unlock(mutex)"));
}

TEST_F(Locks, UntimedLockDoesNotReadThePolicy) {
  default_autolock = 7;
  lock_and_release(&mutex, false);
  EXPECT_EQ(platform.count("ldap_getenv"), 0);
  EXPECT_EQ(default_autolock, 7);
}

TEST_F(Locks, TimedLockTriesOnceWhenTheMutexIsFree) {
  lock_and_release(&mutex, true);
  EXPECT_TRUE(held_inside);
  EXPECT_THAT(platform.calls(),
              ElementsAre("ldap_getenv(\"AUTOLOCKTYPE\")", "pthread_mutex_trylock(mutex)",
                          "pthread_mutex_unlock(mutex)"));
}

TEST_F(Locks, TimedLockBlocksPlainlyUnderTheRegularPolicy) {
  platform.environment["AUTOLOCKTYPE"] = "REGULARLOCK";
  lock_and_release(&mutex, true);
  EXPECT_THAT(platform.calls(),
              ElementsAre("ldap_getenv(\"AUTOLOCKTYPE\")", "pthread_mutex_lock(mutex)",
                          "pthread_mutex_unlock(mutex)"));
  EXPECT_EQ(default_autolock, 0);
}

TEST_F(Locks, TimedLockBlocksPlainlyUnderAnyPolicyButOne) {
  al_configfile_counter = 1;
  default_autolock = 2;
  lock_and_release(&mutex, true);
  EXPECT_EQ(platform.count("pthread_mutex_lock"), 1);
  EXPECT_EQ(platform.count("pthread_mutex_trylock"), 0);
  EXPECT_EQ(default_autolock, 2);
}

TEST_F(Locks, EveryTimedLockStoresThePolicy) {
  default_autolock = 0;
  lock_and_release(&mutex, true);
  EXPECT_EQ(default_autolock, 1);
}

TEST_F(Locks, EveryErrorButBusyCountsAsAcquired) {
  platform.fail("pthread_mutex_trylock", 1, EINVAL);
  lock_and_release(&mutex, true);
  EXPECT_EQ(platform.count("pthread_mutex_trylock"), 1);
  EXPECT_EQ(platform.count("usleep"), 0);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 1);
}

TEST_F(Locks, PlainLockThatFailsCountsAsAcquired) {
  for (const bool timed : {false, true}) {
    SCOPED_TRACE(timed);
    platform.forget();
    al_configfile_counter = 0;
    platform.environment["AUTOLOCKTYPE"] = "REGULARLOCK";
    platform.fail("pthread_mutex_lock", 1, EINVAL);
    EXPECT_NO_THROW(lock_and_release(&mutex, timed));
    EXPECT_FALSE(held_inside);
    EXPECT_THAT(platform.calls({"pthread_mutex_lock", "pthread_mutex_unlock"}),
                ElementsAre("pthread_mutex_lock(mutex)", "pthread_mutex_unlock(mutex)"));
  }
}

TEST_F(Locks, EndsTryingAsSoonAsItIsAcquired) {
  busy_for(2);
  lock_and_release(&mutex, true);
  EXPECT_EQ(platform.count("pthread_mutex_trylock"), 3);
  EXPECT_EQ(sleeps(100'000), 2);
  EXPECT_TRUE(held_inside);
}

TEST_F(Locks, FirstPhaseHas300AttemptsEachFollowedByATenthOfASecond) {
  busy_for(299);
  lock_and_release(&mutex, true);
  EXPECT_EQ(platform.count("pthread_mutex_trylock"), 300);
  EXPECT_EQ(sleeps(100'000), 299);
  EXPECT_EQ(sleeps(1'000'000), 0);
}

TEST_F(Locks, SecondPhaseBeginsAfter300AttemptsWithSecondsBetween) {
  busy_for(302);
  lock_and_release(&mutex, true);
  EXPECT_EQ(platform.count("pthread_mutex_trylock"), 303);
  EXPECT_EQ(sleeps(100'000), 300);
  EXPECT_EQ(sleeps(1'000'000), 2);
}

TEST_F(Locks, LastAttemptOfTheSecondPhaseStillAcquires) {
  busy_for(869);
  lock_and_release(&mutex, true);
  EXPECT_EQ(platform.count("pthread_mutex_trylock"), 870);
  EXPECT_TRUE(held_inside);
}

TEST_F(Locks, GivesUpAfter870AttemptsThrowingTheText) {
  platform.set_held(&mutex, true);
  try {
    lock_and_release(&mutex, true);
    FAIL() << "the lock was taken";
  } catch (const char* text) {
    EXPECT_STREQ(text,
                 "Couldn't get access to mutex controlled resource (wait of 60 seconds expired.)");
  }
  EXPECT_EQ(platform.count("pthread_mutex_trylock"), 870);
  EXPECT_EQ(sleeps(100'000), 300);
  EXPECT_EQ(sleeps(1'000'000), 570);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
}

TEST_F(Locks, SaysWhatItWaitsForWhileTheServerDebugs) {
  platform.server_debug = true;
  platform.thread = static_cast<pthread_t>(0x7F0000000042);
  platform.set_held(&mutex, true);
  EXPECT_THROW(lock_and_release(&mutex, true), const char*);
  const std::vector<DebugLine> lines = platform.print_debug_lines();
  ASSERT_EQ(lines.size(), 300U + 1 + 570 + 1);
  char first[96];
  char second[96];
  std::snprintf(first, sizeof first, "66 failed to trylock1 %p, waiting 0.1s\n",
                static_cast<void*>(&mutex));
  std::snprintf(second, sizeof second, "66 failed to trylock2 %p, waiting 1s\n",
                static_cast<void*>(&mutex));
  EXPECT_EQ(lines[0], info(first));
  EXPECT_EQ(lines[299], info(first));
  EXPECT_EQ(lines[300], info(kStillBusy));
  EXPECT_EQ(lines[301], info(second));
  EXPECT_EQ(lines[870], info(second));
  EXPECT_EQ(lines[871], info(kExpired));
}

TEST_F(Locks, WaitsSilentlyWhenTheServerDoesNotDebug) {
  platform.set_held(&mutex, true);
  EXPECT_THROW(lock_and_release(&mutex, true), const char*);
  EXPECT_THAT(platform.print_debug_lines(), IsEmpty());
}

TEST_F(Locks, SaysItWaitsBeforeItSleeps) {
  platform.server_debug = true;
  busy_for(1);
  bool said = false;
  platform.at("usleep", 1, [&] { said = !platform.print_debug_lines().empty(); });
  lock_and_release(&mutex, true);
  EXPECT_TRUE(said);
}

TEST_F(Locks, TakingReadingThePolicyAndReleasingLeaveRecords) {
  trcEvents = kTraceEntry;
  lock_and_release(&mutex, true);
  EXPECT_THAT(platform.records(),
              ElementsAre("entry 01040400 ", "entry 01040600 ", "exit 01040600 1",
                          "exit 01040400 0", "entry 01040500 ", "exit 01040500 0"));
}

// ---- Policy

class LockPolicy : public BackendTest {
 protected:
  int policy(int current) {
    return platform.run([&] { return AutoLock::ReadAndSetLockType(current); });
  }
};

TEST_F(LockPolicy, StaysAsItIsUntilTheServerReadsItsConfigurationAgain) {
  al_configfile_counter = 4;
  configfile_read = 4;
  EXPECT_EQ(policy(0), 0);
  EXPECT_EQ(policy(1), 1);
  EXPECT_EQ(policy(5), 5);
  configfile_read = 3;
  EXPECT_EQ(policy(0), 0);
  EXPECT_EQ(platform.count("ldap_getenv"), 0);
  EXPECT_EQ(al_configfile_counter, 4);
}

TEST_F(LockPolicy, IsReadOnceForEachReload) {
  al_configfile_counter = 4;
  configfile_read = 6;
  EXPECT_EQ(policy(0), 1);
  EXPECT_EQ(al_configfile_counter, 6);
  EXPECT_EQ(policy(0), 0);
  EXPECT_EQ(platform.calls(), std::vector<std::string>{"ldap_getenv(\"AUTOLOCKTYPE\")"});
}

TEST_F(LockPolicy, ReloadIsNotedBeforeThePolicyIsRead) {
  al_configfile_counter = 4;
  configfile_read = 6;
  platform.at("ldap_getenv", 1, [] { EXPECT_EQ(al_configfile_counter, 6); });
  EXPECT_EQ(policy(0), 1);
  EXPECT_EQ(platform.count("ldap_getenv"), 1);
}

TEST_F(LockPolicy, ExitRecordsCarryThePolicyThatStayed) {
  trcEvents = 0x00020000;
  al_configfile_counter = 1;
  EXPECT_EQ(policy(5), 5);
  EXPECT_THAT(platform.records(), ElementsAre("exit 01040600 5"));
}

TEST_F(LockPolicy, ExactWordMeansBlocking) {
  platform.environment["AUTOLOCKTYPE"] = "REGULARLOCK";
  EXPECT_EQ(policy(1), 0);
}

TEST_F(LockPolicy, EveryOtherTextMeansTimed) {
  for (const char* text : {"regularlock", "REGULARLOCKS", "REGULARLOC", "", " REGULARLOCK", "0"}) {
    al_configfile_counter = 0;
    platform.environment["AUTOLOCKTYPE"] = text;
    EXPECT_EQ(policy(0), 1) << text;
  }
}

TEST_F(LockPolicy, UnsetMeansTimed) {
  EXPECT_EQ(policy(0), 1);
}

// ---- AutoFree

class Buffers : public BackendTest {};

TEST_F(Buffers, MakingReadingAndReleasingLeaveRecords) {
  trcEvents = 0x00020000;
  char buffer[] = "text";
  platform.run([&] {
    AutoFree<char> owner(buffer, [](void*) {});
    owner.get();
  });
  EXPECT_THAT(platform.records(),
              ElementsAre("exit 01040700 0", "exit 01040400 0", "exit 01040500 0",
                          "exit 01040800 0", "exit 01040900 0"));
}

TEST_F(Buffers, AreReleasedBeforeTheirMutexIsDestroyed) {
  static std::vector<std::string>* order;
  std::vector<std::string> seen;
  order = &seen;
  char buffer[] = "text";
  platform.at("pthread_mutex_destroy", 1, [] { order->push_back("destroy"); });
  platform.run([&] {
    AutoFree<char> owner(buffer,
                         [](void* released) { order->push_back(static_cast<char*>(released)); });
  });
  EXPECT_THAT(seen, ElementsAre("text", "destroy"));
  EXPECT_THAT(platform.calls(),
              ElementsAre("pthread_mutex_init(?, null)", "pthread_mutex_destroy(?)"));
  EXPECT_EQ(platform.mutexes_alive(), 0);
}

TEST_F(Buffers, NullBufferIsNotReleased) {
  static int releases;
  releases = 0;
  platform.run([&] { AutoFree<char> owner(nullptr, [](void*) { ++releases; }); });
  EXPECT_EQ(releases, 0);
  EXPECT_EQ(platform.mutexes_alive(), 0);
}

TEST_F(Buffers, AreReadUnderTheirOwnMutexWithoutATimer) {
  char buffer[] = "text";
  const char* read = platform.run([&] {
    AutoFree<char> owner(buffer, [](void*) {});
    return owner.get();
  });
  EXPECT_EQ(read, buffer);
  EXPECT_THAT(platform.calls(), ElementsAre("pthread_mutex_init(?, null)", "pthread_mutex_lock(?)",
                                            "pthread_mutex_unlock(?)", "pthread_mutex_destroy(?)"));
}

}  // namespace
}  // namespace orv
