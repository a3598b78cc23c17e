// Operations that are registered and refused.
#include "backend_test.h"

namespace orv {
namespace {

class Unoffered : public BackendTest, public testing::WithParamInterface<Handler> {};

TEST_P(Unoffered, IsAnsweredWith53AndAnEmptyTextAndTouchesNoLock) {
  EXPECT_EQ(platform.run([&] { return GetParam()(&pb); }), 53);
  EXPECT_THAT(platform.calls({"send_ldap_result"}),
              ElementsAre("send_ldap_result(connection, operation, 53, null, \"\")"));
  EXPECT_EQ(platform.count("pthread_mutex_lock"), 0);
  EXPECT_EQ(platform.count("pthread_mutex_unlock"), 0);
}

INSTANTIATE_TEST_SUITE_P(Modify, Unoffered, testing::Values(config_back_modify));

}  // namespace
}  // namespace orv
