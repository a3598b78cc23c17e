#include "slapi/psearch.h"

#include <gtest/gtest.h>

#include "slapi/pblock.h"

namespace orv {
namespace {

// How many more searches the monitor lets begin when `most` may run.
int room(PSearchMonitor& monitor, int most) {
  int begun = 0;
  while (monitor.begin(most)) ++begun;
  for (int i = 0; i < begun; ++i) monitor.end();
  return begun;
}

TEST(PersistentSearches, AreCountedAndBounded) {
  PSearchMonitor monitor;
  EXPECT_EQ(room(monitor, 0), 0);
  EXPECT_EQ(room(monitor, 3), 3);
  ASSERT_TRUE(monitor.begin(3));
  EXPECT_EQ(room(monitor, 3), 2);
  monitor.end();
  EXPECT_EQ(room(monitor, 3), 3);
}

TEST(PersistentSearches, AreAnnouncedInTheGlobalBlock) {
  PSearchMonitor monitor;
  pblock* const global = getGlobalPBlock();
  int on = -1;
  void* found = &monitor;
  EXPECT_EQ(slapi_pblock_get(global, -141, &on), 0);
  EXPECT_EQ(slapi_pblock_get(global, -146, &found), 0);
  EXPECT_EQ(on, 0);
  EXPECT_EQ(found, nullptr);
  ASSERT_EQ(slapi_pblock_set(global, -141, 1), 0);
  ASSERT_EQ(slapi_pblock_set(global, -146, static_cast<void*>(&monitor)), 0);
  EXPECT_EQ(slapi_pblock_get(global, -141, &on), 0);
  EXPECT_EQ(slapi_pblock_get(global, -146, &found), 0);
  EXPECT_EQ(on, 1);
  EXPECT_EQ(found, &monitor);
  ASSERT_EQ(slapi_pblock_set(global, -141, 0), 0);
  ASSERT_EQ(slapi_pblock_set(global, -146, nullptr), 0);
}

}  // namespace
}  // namespace orv
