#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <vector>

#include "platform/ManualExecutor.h"
#include "platform/Queue.h"
#include "platform/TestCountdown.h"
#include "platform/ThreadPool.h"

namespace storix {
namespace {

TEST(OperationQueue, Promise11RunsOneOperationAtATimeInOrderByDefault) {
  std::vector<int> order;
  {
    ThreadPool pool(4);
    const auto queue = OperationQueue::create(pool, "operations");
    EXPECT_EQ(queue->name(), "operations");
    for (int i = 0; i < 200; ++i) queue->addOperation([&order, i] { order.push_back(i); });
  }
  EXPECT_EQ(order.size(), 200U);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST(OperationQueue, Promise11StartsNoOtherOperationInsideOneByDefault) {
  ManualExecutor executor;
  const auto queue = OperationQueue::create(executor, "operations");
  int inside = 0;
  int ran = 0;
  for (int i = 0; i < 3; ++i) {
    queue->addOperation([&executor, &inside, &ran] {
      EXPECT_EQ(++inside, 1);
      executor.runUntilIdle();
      --inside;
      ++ran;
    });
  }
  executor.runUntilIdle();
  EXPECT_EQ(ran, 3);
}

TEST(OperationQueue, Promise11RunsAsManyAsTheMaximumSideBySideAndNoMore) {
  std::atomic<int> inside{0};
  std::atomic<int> tooMany{0};
  TestCountdown meeting(3);
  {
    ThreadPool pool(8);
    const auto queue = OperationQueue::create(pool, "operations");
    queue->setMaximumConcurrency(3);
    for (int i = 0; i < 200; ++i) {
      queue->addOperation([&inside, &tooMany, &meeting] {
        if (++inside > 3) ++tooMany;
        EXPECT_TRUE(meeting.arriveAndWait());
        --inside;
      });
    }
  }
  EXPECT_EQ(tooMany, 0);
}

TEST(OperationQueue, Promise11LargerMaximumStartsWhatWaits) {
  TestCountdown first;
  TestCountdown meeting(2);
  ThreadPool pool(4);
  const auto queue = OperationQueue::create(pool, "operations");
  for (int i = 0; i < 2; ++i) {
    queue->addOperation([&first, &meeting] {
      first.arrive();
      EXPECT_TRUE(meeting.arriveAndWait());
    });
  }
  ASSERT_TRUE(first.wait());
  queue->setMaximumConcurrency(2);
  EXPECT_TRUE(meeting.wait());
}

TEST(OperationQueue, Promise11SmallerMaximumHoldsFromTheNextStartOnAndZeroCountsAsOne) {
  ManualExecutor executor;
  const auto queue = OperationQueue::create(executor, "operations");
  queue->setMaximumConcurrency(3);
  int inside = 0;
  int most = 0;
  int ran = 0;
  // Each runs the executor from inside, so that whatever else may start does so.
  for (int i = 0; i < 6; ++i) {
    queue->addOperation([&executor, &inside, &most, &ran] {
      most = std::max(most, ++inside);
      executor.runUntilIdle();
      --inside;
      ++ran;
    });
  }
  queue->setMaximumConcurrency(0);
  executor.runUntilIdle();
  EXPECT_EQ(most, 1);
  EXPECT_EQ(ran, 6);
}

TEST(OperationQueue, RunsWhatWasAddedBeforeItsLastReferenceWent) {
  ManualExecutor executor;
  int ran = 0;
  auto queue = OperationQueue::create(executor, "operations");
  queue->addOperation([&ran] { ++ran; });
  queue->addOperation([&ran] { ++ran; });
  queue.reset();
  executor.runUntilIdle();
  EXPECT_EQ(ran, 2);
}

TEST(OperationQueue, CurrentIsTheQueueOfTheRunningOperation) {
  ManualExecutor executor;
  const auto queue = OperationQueue::create(executor, "operations");
  const auto serial = SerialQueue::create(executor, "serial");
  queue->addOperation([&queue, &serial] {
    EXPECT_EQ(OperationQueue::current(), queue.get());
    EXPECT_EQ(Queue::current(), nullptr);
    serial->sync([&queue, &serial] {
      EXPECT_EQ(OperationQueue::current(), queue.get());
      EXPECT_EQ(Queue::current(), serial.get());
    });
  });
  EXPECT_EQ(OperationQueue::current(), nullptr);
  executor.runUntilIdle();
  EXPECT_EQ(OperationQueue::current(), nullptr);
}

}  // namespace
}  // namespace storix
