#include "platform/ManualExecutor.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <memory>
#include <thread>
#include <vector>

#include "platform/Queue.h"
#include "platform/TestCountdown.h"

namespace storix {
namespace {

using std::chrono::nanoseconds;
using testing::ElementsAre;

TEST(ManualExecutor, RunsNothingUnlessTold) {
  ManualExecutor executor;
  bool ran = false;
  executor.execute([&ran] { ran = true; });
  EXPECT_FALSE(ran);
  EXPECT_EQ(executor.readyCount(), 1U);
  EXPECT_FALSE(executor.hasThreads());
}

TEST(ManualExecutor, RunOneRunsTheTaskThatHasWaitedLongest) {
  ManualExecutor executor;
  std::vector<int> order;
  executor.execute([&order] { order.push_back(1); });
  executor.execute([&order] { order.push_back(2); });
  EXPECT_TRUE(executor.runOne());
  EXPECT_THAT(order, ElementsAre(1));
  EXPECT_TRUE(executor.runOne());
  EXPECT_THAT(order, ElementsAre(1, 2));
  EXPECT_FALSE(executor.runOne());
}

TEST(ManualExecutor, RunUntilIdleRunsWhatTasksSubmitAndCountsThem) {
  ManualExecutor executor;
  std::vector<int> order;
  executor.execute([&executor, &order] {
    order.push_back(1);
    executor.execute([&order] { order.push_back(3); });
  });
  executor.execute([&order] { order.push_back(2); });
  EXPECT_EQ(executor.runUntilIdle(), 3U);
  EXPECT_THAT(order, ElementsAre(1, 2, 3));
  EXPECT_EQ(executor.runUntilIdle(), 0U);
}

TEST(ManualExecutor, DelayedTaskIsReadyWhenItsTimeHasComeAndRunsWhenTold) {
  ManualExecutor executor;
  bool ran = false;
  executor.executeAfter(nanoseconds(100), [&ran] { ran = true; });
  executor.advance(nanoseconds(99));
  EXPECT_EQ(executor.readyCount(), 0U);
  EXPECT_EQ(executor.delayedCount(), 1U);
  executor.advance(nanoseconds(1));
  EXPECT_EQ(executor.readyCount(), 1U);
  EXPECT_EQ(executor.delayedCount(), 0U);
  EXPECT_FALSE(ran);
  EXPECT_TRUE(executor.runOne());
  EXPECT_TRUE(ran);
}

TEST(ManualExecutor, DelayedTasksBecomeReadyInTheOrderOfTheirTimes) {
  ManualExecutor executor;
  std::vector<int> order;
  executor.executeAfter(nanoseconds(30), [&order] { order.push_back(3); });
  executor.executeAfter(nanoseconds(10), [&order] { order.push_back(1); });
  executor.executeAfter(nanoseconds(20), [&order] { order.push_back(2); });
  executor.executeAfter(nanoseconds(10), [&order] { order.push_back(11); });
  executor.advance(nanoseconds(25));
  EXPECT_EQ(executor.runUntilIdle(), 3U);
  EXPECT_THAT(order, ElementsAre(1, 11, 2));
  executor.advance(nanoseconds(5));
  EXPECT_EQ(executor.runUntilIdle(), 1U);
}

TEST(ManualExecutor, DelayCountsFromTheTimeOfTheCall) {
  ManualExecutor executor;
  executor.advance(nanoseconds(1000));
  executor.executeAfter(nanoseconds(10), [] {});
  executor.advance(nanoseconds(9));
  EXPECT_EQ(executor.delayedCount(), 1U);
  executor.executeAfter(nanoseconds::max(), [] {});
  executor.advance(nanoseconds(1));
  EXPECT_EQ(executor.readyCount(), 1U);
  EXPECT_EQ(executor.delayedCount(), 1U);
}

TEST(ManualExecutor, TaskWithoutDelayIsReadyAtOnce) {
  ManualExecutor executor;
  executor.executeAfter(nanoseconds(0), [] {});
  executor.executeAfter(nanoseconds(-5), [] {});
  EXPECT_EQ(executor.readyCount(), 2U);
}

TEST(ManualExecutor, SyncRunsWhatStandsBeforeItInItsQueueAndNothingElse) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "one");
  const auto other = SerialQueue::create(executor, "other");
  std::vector<int> order;
  other->async([&order] { order.push_back(100); });
  queue->async([&order] { order.push_back(1); });
  queue->async([&order] { order.push_back(2); });
  queue->sync([&order] { order.push_back(3); });
  EXPECT_THAT(order, ElementsAre(1, 2, 3));
  executor.runUntilIdle();
  EXPECT_THAT(order, ElementsAre(1, 2, 3, 100));
}

TEST(ManualExecutor, PlainSyncRunsTheTasksBeforeItOnAConcurrentQueue) {
  ManualExecutor executor;
  const auto queue = ConcurrentQueue::create(executor, "one");
  std::vector<int> order;
  queue->async([&order] { order.push_back(1); });
  queue->asyncBarrier([&order] { order.push_back(2); });
  queue->async([&order] { order.push_back(3); });
  queue->sync([&order] { order.push_back(4); });
  EXPECT_THAT(order, ElementsAre(1, 2, 3, 4));
}

TEST(ManualExecutor, SyncOnASuspendedQueueWaitsForAnotherThreadToResumeItAndThenRunsWhatStandsBeforeIt) {
  ManualExecutor executor;
  const auto queue = ConcurrentQueue::create(executor, "one");
  std::vector<int> order;
  queue->suspend();
  queue->async([&order] { order.push_back(1); });
  TestCountdown waiting;
  std::thread caller([&queue, &order, &waiting] {
    waiting.arrive();
    queue->sync([&order] { order.push_back(2); });
  });
  EXPECT_TRUE(waiting.wait());
  queue->resume();
  caller.join();
  EXPECT_THAT(order, ElementsAre(1, 2));
}

TEST(ManualExecutor, SyncRunsTheNextTaskWhenTheOneThatAnotherThreadRunsHasEnded) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "one");
  std::vector<int> order;
  TestCountdown started;
  TestCountdown mayEnd;
  queue->async([&order, &started, &mayEnd] {
    started.arrive();
    EXPECT_TRUE(mayEnd.wait());
    order.push_back(1);
  });
  std::thread runner([&executor] { executor.runOne(); });
  ASSERT_TRUE(started.wait());
  queue->async([&order] { order.push_back(2); });
  std::thread caller([&queue, &order] { queue->sync([&order] { order.push_back(3); }); });
  mayEnd.arrive();
  runner.join();
  caller.join();
  EXPECT_THAT(order, ElementsAre(1, 2, 3));
}

TEST(ManualExecutor, WhatHasNotRunIsDroppedWithIt) {
  const auto held = std::make_shared<int>(1);
  auto executor = std::make_unique<ManualExecutor>();
  bool ran = false;
  executor->execute([held, &ran] { ran = true; });
  executor->executeAfter(nanoseconds(1), [held, &ran] { ran = true; });
  auto queue = SerialQueue::create(*executor, "one");
  queue->async([held, &ran] { ran = true; });
  queue->async([held, &ran] { ran = true; });
  queue.reset();
  EXPECT_EQ(held.use_count(), 5);
  executor.reset();
  EXPECT_EQ(held.use_count(), 1);
  EXPECT_FALSE(ran);
}

TEST(ManualExecutor, DroppedTaskMayHoldTheLastReferenceToASuspendedQueue) {
  const auto held = std::make_shared<int>(1);
  auto executor = std::make_unique<ManualExecutor>();
  {
    auto queue = SerialQueue::create(*executor, "one");
    queue->suspend();
    queue->async([held] {});
    executor->executeAfter(nanoseconds(1), [queue] { queue->resume(); });
  }
  EXPECT_EQ(held.use_count(), 2);
  executor.reset();
  EXPECT_EQ(held.use_count(), 1);
}

}  // namespace
}  // namespace storix
