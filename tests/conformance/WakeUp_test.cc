#include "service/ServicerTest.h"

namespace storix {
namespace {

using ::testing::ElementsAre;

using WakeUpTest = ServicerTest;

TEST_F(WakeUpTest, IsServedAndAnsweredOnTheGlobalQueue) {
  connect({});
  call(SXDaemon::wakeUpName);
  EXPECT_THAT(trace(),
              ElementsAre("request peer 100 wakeUpCompletion: ()",
                          "log debug [DEBUG] Serving: wakeUpCompletion:", reply(SXDaemon::wakeUpName, "()", global)));
}

TEST_F(WakeUpTest, WithoutReplyDoesNothingMore) {
  connect({});
  client_->callWithoutReply(SXDaemon::wakeUpName);
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAre("request without reply peer 100 wakeUpCompletion: ()",
                                   "log debug [DEBUG] Serving: wakeUpCompletion:"));
}

}  // namespace
}  // namespace storix
