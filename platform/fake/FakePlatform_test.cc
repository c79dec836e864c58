#include "platform/fake/FakePlatform.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <thread>

#include "platform/fake/FakeHostTest.h"

namespace storix::fake {
namespace {

using std::chrono::seconds;
using testing::ElementsAre;
using testing::IsEmpty;

class FakePlatformTest : public FakeHostTest {
 protected:
  std::vector<std::string> ran_;
};

TEST_F(FakePlatformTest, NothingRunsBeforeTheTestSaysSo) {
  platform().globalQueue()->async([this] { ran_.push_back(currentContext()); });
  platform().executor().runOnPlatformThread([this] { ran_.push_back(currentContext()); });
  EXPECT_THAT(ran_, IsEmpty());
  EXPECT_TRUE(platform().runOne());
  EXPECT_EQ(ran_.size(), 1U);
  runUntilIdle();
  EXPECT_THAT(ran_, ElementsAre("queue global queue", "platform thread"));
  EXPECT_EQ(currentContext(), "caller");
}

TEST_F(FakePlatformTest, ContextNamesTheInnermostQueue) {
  const auto serial = platform().createSerialQueue("inner");
  platform().executor().runOnPlatformThread(
      [this, serial] { serial->sync([this] { ran_.push_back(currentContext()); }); });
  platform().createOperationQueue("operations")->addOperation([this] { ran_.push_back(currentContext()); });
  runUntilIdle();
  EXPECT_THAT(ran_, ElementsAre("queue inner", "operation queue operations"));
}

TEST_F(FakePlatformTest, DelayedTaskIsSubmittedWhenTheClockSaysSo) {
  platform().runAfterDelay(2'000'000'000, platform().globalQueue(), [this] { ran_.push_back(currentContext()); });
  ASSERT_EQ(platform().delayedTasks().size(), 1U);
  EXPECT_EQ(platform().delayedTasks().front().nanoseconds, 2'000'000'000U);
  EXPECT_EQ(platform().delayedTasks().front().queueLabel, "global queue");
  platform().advance(seconds(1));
  runUntilIdle();
  EXPECT_THAT(ran_, IsEmpty());
  platform().advance(seconds(1));
  runUntilIdle();
  EXPECT_THAT(ran_, ElementsAre("queue global queue"));
  EXPECT_THAT(platform().delayedTasks(), IsEmpty());
}

TEST_F(FakePlatformTest, NotificationReachesEveryObserverOnTheEventLoop) {
  const auto observe = [this] { ran_.push_back(currentContext()); };
  platform().addSystemNotificationObserver("unlocked", observe);
  platform().addSystemNotificationObserver("unlocked", observe);
  platform().addSystemNotificationObserver("other", observe);
  platform().postNotification("unlocked");
  EXPECT_THAT(ran_, IsEmpty());
  runUntilIdle();
  EXPECT_THAT(ran_, ElementsAre("main event loop", "main event loop"));
}

TEST_F(FakePlatformTest, EventLoopOfManualQueuesReturnsWhenAllIsIdle) {
  platform().globalQueue()->async([this] { ran_.push_back("ran"); });
  platform().runEventLoop();
  EXPECT_THAT(ran_, ElementsAre("ran"));
}

TEST_F(FakePlatformTest, LockStateIsWhatTheTestSays) {
  EXPECT_EQ(platform().deviceLockState(), deviceLockStateNoPasscode);
  platform().setDeviceLockState(1);
  platform().setDeviceUnlockedSinceBoot(false);
  EXPECT_EQ(platform().deviceLockState(), 1);
  EXPECT_FALSE(platform().deviceUnlockedSinceBoot());
}

TEST_F(FakePlatformTest, SandboxAnswersWhatTheTestSays) {
  const AuditToken token = auditTokenForProcess(7);
  const auto check = [this](const AuditToken &who, const std::string &path) {
    return platform().checkSandboxAccess(who, "file-write-data", SandboxFilter::pathNoReport, path);
  };
  platform().sandbox().allowAccess(token, "/a");
  EXPECT_EQ(check(token, "/a"), 0);
  EXPECT_NE(check(token, "/b"), 0);
  EXPECT_NE(check(AuditToken{}, "/a"), 0);
  EXPECT_EQ(platform().issueSandboxExtension(SandboxExtensionClass::readWrite, "/a", 0), FakeSandbox::tokenFor("/a"));
  platform().sandbox().failExtension("/a");
  EXPECT_FALSE(platform().issueSandboxExtension(SandboxExtensionClass::readWrite, "/a", 0));
  EXPECT_THAT(platform().trace().take(),
              ElementsAre("checkSandboxAccess peer 7 file-write-data pathNoReport /a",
                          "checkSandboxAccess peer 7 file-write-data pathNoReport /b",
                          "checkSandboxAccess no peer file-write-data pathNoReport /a",
                          "issueSandboxExtension readWrite /a flags=0", "issueSandboxExtension readWrite /a flags=0"));
}

TEST_F(FakePlatformTest, LogLinesStandInTheTraceBetweenTheCalls) {
  (void)platform().deviceLockState();
  sx_default_log().info("[INFO] between");
  (void)platform().deviceUnlockedSinceBoot();
  EXPECT_THAT(platform().trace().take(),
              ElementsAre("deviceLockState", "log info [INFO] between", "deviceUnlockedSinceBoot"));
  EXPECT_TRUE(platform().log().contains(LogSeverity::info, "[INFO] between"));
  EXPECT_FALSE(platform().log().contains(LogSeverity::fault, "[INFO] between"));
  EXPECT_THAT(platform().log().texts(), ElementsAre("[INFO] between"));
}

TEST_F(FakePlatformTest, DataStandsInTracesAsItsBytes) {
  EXPECT_EQ(traced(Arguments{Value(Data{"token\n"}), std::nullopt, "text"}), "(<token\\n>, (null), text)");
}

TEST_F(FakePlatformTest, ShutDownLetsGoOfEverythingOfTheLogic) {
  const auto held = std::make_shared<int>(1);
  platform().addSystemNotificationObserver("n", [held] {});
  platform().runAfterDelay(1, platform().globalQueue(), [held] {});
  platform().globalQueue()->async([held] {});
  EXPECT_GT(held.use_count(), 1);
  platform().shutDown();
  EXPECT_EQ(held.use_count(), 1);
}

class ThreadedFakePlatformTest : public FakeHostTest {
 protected:
  ThreadedFakePlatformTest() : FakeHostTest({.queues = FakeExecutor::Kind::threads}) {}
};

TEST_F(ThreadedFakePlatformTest, RunUntilIdleWaitsForTasksAndForThoseTheySubmit) {
  std::atomic<int> ran{0};
  for (int i = 0; i < 50; ++i) {
    platform().globalQueue()->async([this, &ran] {
      platform().executor().runOnPlatformThread([&ran] { ++ran; });
      ++ran;
    });
  }
  runUntilIdle();
  EXPECT_EQ(ran, 100);
}

TEST_F(ThreadedFakePlatformTest, NotificationsAreDeliveredWhileTheEventLoopRuns) {
  std::string context;
  platform().addSystemNotificationObserver("n", [this, &context] {
    context = currentContext();
    platform().endEventLoop();
  });
  platform().postNotification("n");
  std::thread main([this] { platform().runEventLoop(); });
  main.join();
  EXPECT_EQ(context, "main event loop");
}

TEST_F(ThreadedFakePlatformTest, LaneRunsItsTasksOneAtATimeInOrder) {
  PlatformLane lane(platform().executor());
  std::vector<int> order;
  for (int i = 0; i < 100; ++i) {
    lane.submit([&order, i] { order.push_back(i); });
  }
  runUntilIdle();
  ASSERT_EQ(order.size(), 100U);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

}  // namespace
}  // namespace storix::fake
