#include "platform/Queue.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <thread>
#include <vector>

#include "platform/ManualExecutor.h"
#include "platform/OnceToken.h"
#include "platform/TestAllocations.h"
#include "platform/TestCountdown.h"
#include "platform/TestThreads.h"
#include "platform/ThreadPool.h"

namespace storix {
namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using testing::ElementsAre;

class QueueDeathTest : public testing::Test {
 protected:
  QueueDeathTest() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

// 1: order

TEST(Queue, Promise1TasksOfASerialQueueStartInSubmissionOrder) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "queue");
  std::vector<int> order;
  queue->async([&order] { order.push_back(1); });
  queue->async([&order] { order.push_back(2); });
  queue->sync([&order] { order.push_back(3); });
  queue->async([&order] { order.push_back(4); });
  executor.runUntilIdle();
  EXPECT_THAT(order, ElementsAre(1, 2, 3, 4));
}

TEST(Queue, Promise1TasksOfAConcurrentQueueStartInSubmissionOrder) {
  ManualExecutor executor;
  const auto queue = ConcurrentQueue::create(executor, "queue");
  std::vector<int> order;
  queue->async([&order] { order.push_back(1); });
  queue->asyncBarrier([&order] { order.push_back(2); });
  queue->async([&order] { order.push_back(3); });
  queue->async([&order] { order.push_back(4); });
  queue->syncBarrier([&order] { order.push_back(5); });
  queue->async([&order] { order.push_back(6); });
  queue->sync([&order] { order.push_back(7); });
  EXPECT_THAT(order, ElementsAre(1, 2, 3, 4, 5, 6, 7));
}

TEST(Queue, Promise1WhatOneThreadSubmitsFirstIsFirstOnThePoolToo) {
  ThreadPool pool(4);
  const auto queue = SerialQueue::create(pool, "queue");
  for (int round = 0; round < 200; ++round) {
    std::vector<int> order;
    queue->async([&order] { order.push_back(1); });
    queue->async([&order] { order.push_back(2); });
    queue->sync([&order] { order.push_back(3); });
    queue->sync([&order] { order.push_back(4); });
    ASSERT_THAT(order, ElementsAre(1, 2, 3, 4));
  }
}

TEST(Queue, Promise1AsynchronousPlainTasksStartInSubmissionOrder) {
  std::vector<int> order;
  {
    ThreadPool pool(1);
    const auto queue = ConcurrentQueue::create(pool, "queue");
    for (int i = 0; i < 100; ++i) queue->async([&order, i] { order.push_back(i); });
  }
  EXPECT_EQ(order.size(), 100U);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

// 2: asynchronous

TEST(Queue, Promise2AsyncNeverRunsTheTaskInsideTheCall) {
  ManualExecutor executor;
  const auto serial = SerialQueue::create(executor, "serial");
  const auto concurrent = ConcurrentQueue::create(executor, "concurrent");
  int ran = 0;
  serial->async([&serial, &ran] {
    serial->async([&ran] { ++ran; });
    EXPECT_EQ(ran, 0);
  });
  concurrent->async([&ran] { ++ran; });
  concurrent->asyncBarrier([&ran] { ++ran; });
  EXPECT_EQ(ran, 0);
  executor.runUntilIdle();
  EXPECT_EQ(ran, 3);
}

// 3: synchronous

TEST(Queue, Promise3SyncReturnsAfterTheTaskHasRunOnTheCallersThread) {
  ThreadPool pool;
  const auto serial = SerialQueue::create(pool, "serial");
  const auto concurrent = ConcurrentQueue::create(pool, "concurrent");
  std::vector<std::thread::id> ids;
  const auto record = [&ids] { ids.push_back(std::this_thread::get_id()); };
  serial->sync(record);
  concurrent->sync(record);
  concurrent->syncBarrier(record);
  EXPECT_THAT(ids, testing::Each(std::this_thread::get_id()));
  EXPECT_EQ(ids.size(), 3U);
}

TEST(Queue, Promise3SyncBehindARunningTaskStillRunsOnTheCallersThread) {
  ThreadPool pool;
  const auto concurrent = ConcurrentQueue::create(pool, "concurrent");
  for (int round = 0; round < 50; ++round) {
    TestCountdown started;
    concurrent->asyncBarrier([&started] { started.arrive(); });
    ASSERT_TRUE(started.wait());
    std::thread::id id;
    concurrent->sync([&id] { id = std::this_thread::get_id(); });
    ASSERT_EQ(id, std::this_thread::get_id());
  }
}

TEST(Queue, Promise3SyncWithNothingBeforeItAllocatesNothingAndAsksNoExecutor) {
  ManualExecutor executor;
  const auto serial = SerialQueue::create(executor, "serial");
  const auto concurrent = ConcurrentQueue::create(executor, "concurrent");
  int ran = 0;
  const std::size_t before = allocationsOfThisThread();
  serial->sync([&ran] { ++ran; });
  concurrent->sync([&ran, &concurrent] { concurrent->sync([&ran] { ++ran; }); });
  concurrent->syncBarrier([&ran] { ++ran; });
  EXPECT_EQ(allocationsOfThisThread(), before);
  EXPECT_EQ(ran, 3);
  EXPECT_EQ(executor.readyCount(), 0U);
}

TEST(Queue, Promise3SyncTaskMayChangeWhatTheCallerGives) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "serial");
  int calls = 0;
  auto counting = [&calls, own = 0]() mutable { calls = ++own; };
  queue->sync(counting);
  queue->sync(counting);
  EXPECT_EQ(calls, 2);
}

TEST(Queue, Promise3PlainSyncInsideAPlainTaskOfTheSameQueueRuns) {
  ThreadPool pool;
  const auto queue = ConcurrentQueue::create(pool, "queue");
  bool ran = false;
  queue->sync([&queue, &ran] { queue->sync([&ran] { ran = true; }); });
  EXPECT_TRUE(ran);
  TestCountdown done;
  queue->async([&queue, &done] { queue->sync([&done] { done.arrive(); }); });
  EXPECT_TRUE(done.wait());
}

TEST_F(QueueDeathTest, Promise3SyncFromATaskOfTheSameSerialQueueEndsTheProcess) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "the queue");
  EXPECT_DEATH(queue->sync([&queue] { queue->sync([] {}); }), "the queue");
  EXPECT_DEATH(
      {
        queue->async([&queue] { queue->sync([] {}); });
        executor.runUntilIdle();
      },
      "the queue");
}

TEST_F(QueueDeathTest, Promise3SyncOnTheQueueOfAnOuterTaskEndsTheProcess) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "the queue");
  const auto other = ConcurrentQueue::create(executor, "other");
  EXPECT_DEATH(queue->sync([&queue, &other] { other->sync([&queue] { queue->sync([] {}); }); }), "the queue");
}

TEST_F(QueueDeathTest, Promise3SyncThatWouldWaitForItsOwnTaskOnAConcurrentQueueEndsTheProcess) {
  ManualExecutor executor;
  const auto queue = ConcurrentQueue::create(executor, "the queue");
  EXPECT_DEATH(queue->sync([&queue] { queue->syncBarrier([] {}); }), "the queue");
  EXPECT_DEATH(queue->syncBarrier([&queue] { queue->syncBarrier([] {}); }), "the queue");
  EXPECT_DEATH(queue->syncBarrier([&queue] { queue->sync([] {}); }), "the queue");
  EXPECT_DEATH(queue->sync([&queue] {
    queue->asyncBarrier([] {});
    queue->sync([] {});
  }),
               "the queue");
}

// 4: visibility (what ThreadSanitizer sees, too)

TEST(Queue, Promise4SerialTasksSeeWhatEarlierOnesWrote) {
  ThreadPool pool(4);
  const auto queue = SerialQueue::create(pool, "queue");
  int count = 0;
  join(startThreads(4, [&queue, &count](int) {
    for (int i = 0; i < 500; ++i) {
      int before = -1;
      queue->sync([&count, &before] { before = count++; });
      EXPECT_GE(before, 0);
      queue->async([&count] { ++count; });
    }
  }));
  int total = 0;
  queue->sync([&count, &total] { total = count; });
  EXPECT_EQ(total, 4000);
}

TEST(Queue, Promise4PlainTasksAndBarriersSeeEachOthersWrites) {
  ThreadPool pool(4);
  const auto queue = ConcurrentQueue::create(pool, "queue");
  std::vector<int> slots(5, 0);
  join(startThreads(4, [&queue, &slots](int number) {
    const auto slot = static_cast<std::size_t>(number);
    for (int i = 0; i < 200; ++i) {
      queue->sync([&slots, slot] { ++slots[slot]; });
      queue->asyncBarrier([&slots] { slots[4] = slots[0] + slots[1] + slots[2] + slots[3]; });
      queue->sync([&slots] { EXPECT_GE(slots[4], 0); });
    }
  }));
  int total = 0;
  queue->syncBarrier([&slots, &total] { total = slots[4]; });
  EXPECT_EQ(total, 800);
}

TEST(Queue, Promise4TaskSeesWhatItsSubmitterWroteBefore) {
  ThreadPool pool(4);
  const auto queue = ConcurrentQueue::create(pool, "queue");
  for (int i = 0; i < 200; ++i) {
    int value = i;
    TestCountdown done;
    queue->async([&value, &done, i] {
      EXPECT_EQ(value, i);
      done.arrive();
    });
    ASSERT_TRUE(done.wait());
  }
}

// 5: suspension

TEST(Queue, Promise5NoTaskStartsWhileSuspendedAndSuspensionsAreCounted) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "queue");
  bool ran = false;
  queue->suspend();
  queue->suspend();
  queue->async([&ran] { ran = true; });
  executor.runUntilIdle();
  EXPECT_FALSE(ran);
  queue->resume();
  executor.runUntilIdle();
  EXPECT_FALSE(ran);
  queue->resume();
  executor.runUntilIdle();
  EXPECT_TRUE(ran);
}

TEST(Queue, Promise5TaskThatIsOnItsWayDoesNotStartOnceSuspended) {
  ManualExecutor executor;
  const auto queue = ConcurrentQueue::create(executor, "queue");
  int ran = 0;
  queue->async([&ran] { ++ran; });
  queue->async([&ran] { ++ran; });
  ASSERT_GT(executor.readyCount(), 0U);
  queue->suspend();
  executor.runUntilIdle();
  EXPECT_EQ(ran, 0);
  queue->resume();
  executor.runUntilIdle();
  EXPECT_EQ(ran, 2);
}

TEST(Queue, Promise5SynchronousTaskWaitsWhileSuspended) {
  ThreadPool pool;
  const auto serial = SerialQueue::create(pool, "serial");
  const auto concurrent = ConcurrentQueue::create(pool, "concurrent");
  std::atomic<bool> resumed{false};
  serial->suspend();
  concurrent->suspend();
  TestCountdown waiting(3);
  const auto check = [&resumed] { EXPECT_TRUE(resumed); };
  auto callers = startThreads(3, [&serial, &concurrent, &waiting, &check](int i) {
    waiting.arrive();
    if (i == 0) serial->sync(check);
    if (i == 1) concurrent->sync(check);
    if (i == 2) concurrent->syncBarrier(check);
  });
  EXPECT_TRUE(waiting.wait());
  resumed = true;
  serial->resume();
  concurrent->resume();
  join(std::move(callers));
}

TEST(Queue, Promise5TaskMaySuspendItsOwnQueueAndRunsToItsEnd) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "queue");
  std::vector<int> order;
  queue->async([&queue, &order] {
    queue->suspend();
    order.push_back(1);
  });
  queue->async([&order] { order.push_back(2); });
  executor.runUntilIdle();
  EXPECT_THAT(order, ElementsAre(1));
  queue->resume();
  executor.runUntilIdle();
  EXPECT_THAT(order, ElementsAre(1, 2));
}

TEST(Queue, Promise5SynchronousTaskMaySuspendItsOwnQueue) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "queue");
  bool ran = false;
  queue->sync([&queue] { queue->suspend(); });
  queue->async([&ran] { ran = true; });
  executor.runUntilIdle();
  EXPECT_FALSE(ran);
  queue->resume();
  queue->sync([&ran] { EXPECT_TRUE(ran); });
}

TEST_F(QueueDeathTest, Promise5MoreResumesThanSuspensionsEndTheProcess) {
  ManualExecutor executor;
  const auto queue = ConcurrentQueue::create(executor, "the queue");
  queue->suspend();
  queue->resume();
  EXPECT_DEATH(queue->resume(), "the queue");
}

// 6: the end of a queue

TEST(Queue, Promise6QueueRunsWhatWasSubmittedBeforeItsLastReferenceWent) {
  ManualExecutor executor;
  int ran = 0;
  SerialQueue::create(executor, "serial")->async([&ran] { ++ran; });
  auto concurrent = ConcurrentQueue::create(executor, "concurrent");
  concurrent->async([&ran] { ++ran; });
  concurrent->asyncBarrier([&ran] {
    ++ran;
    EXPECT_EQ(Queue::current()->label(), "concurrent");
  });
  concurrent.reset();
  EXPECT_EQ(ran, 0);
  executor.runUntilIdle();
  EXPECT_EQ(ran, 3);
}

TEST(Queue, Promise6SuspensionEndsWithTheLastReference) {
  ManualExecutor executor;
  bool ran = false;
  auto queue = SerialQueue::create(executor, "queue");
  queue->suspend();
  queue->async([&ran] { ran = true; });
  queue.reset();
  executor.runUntilIdle();
  EXPECT_TRUE(ran);
}

TEST(Queue, Promise6TaskOfAQueueWithoutReferencesCannotSuspendIt) {
  ManualExecutor executor;
  int ran = 0;
  auto queue = SerialQueue::create(executor, "queue");
  Queue &reference = *queue;
  queue->async([&reference, &ran] {
    reference.suspend();
    ++ran;
  });
  queue->async([&reference, &ran] {
    reference.resume();
    reference.suspend();
    ++ran;
  });
  queue.reset();
  executor.runUntilIdle();
  EXPECT_EQ(ran, 2);
}

TEST(Queue, Promise6TaskMayHoldTheLastReferenceToItsOwnQueue) {
  ThreadPool pool;
  for (int i = 0; i < 100; ++i) {
    TestCountdown done;
    auto queue = SerialQueue::create(pool, "queue");
    Queue &reference = *queue;
    reference.async([queue = std::move(queue), &done]() mutable {
      queue.reset();
      done.arrive();
    });
    ASSERT_TRUE(done.wait());
  }
}

TEST(Queue, Promise6SynchronousTaskMayDropTheLastReferenceToItsOwnQueue) {
  ManualExecutor executor;
  bool later = false;
  auto serial = SerialQueue::create(executor, "serial");
  serial->sync([&serial, &later] {
    serial->async([&later] { later = true; });
    serial.reset();
    EXPECT_EQ(Queue::current()->label(), "serial");
  });
  auto concurrent = ConcurrentQueue::create(executor, "concurrent");
  concurrent->sync([&concurrent] { concurrent.reset(); });
  executor.runUntilIdle();
  EXPECT_TRUE(later);
}

TEST(Queue, Promise6WhatATaskHoldsIsGoneWhenTheTaskIsOver) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "queue");
  const Queue *whereGone = nullptr;
  std::shared_ptr<int> held(new int(1), [&whereGone](const int *value) {
    whereGone = Queue::current();
    delete value;
  });
  queue->async([held = std::move(held)] {});
  queue->sync([&whereGone, &queue] { EXPECT_EQ(whereGone, queue.get()); });
}

// 12: delayed tasks

TEST(Queue, Promise12DelayedTaskIsSubmittedWhenTheDelayHasPassedAndNotBefore) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "queue");
  std::vector<int> order;
  runAfterDelay(executor, 100, queue, [&order] { order.push_back(1); });
  executor.advance(nanoseconds(99));
  executor.runUntilIdle();
  EXPECT_THAT(order, ElementsAre());
  executor.advance(nanoseconds(1));
  executor.runUntilIdle();
  EXPECT_THAT(order, ElementsAre(1));
}

TEST(Queue, Promise12DelayedTaskIsATaskOfItsQueue) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "queue");
  const Queue *current = nullptr;
  runAfterDelay(executor, 1, queue, [&current] { current = Queue::current(); });
  queue->suspend();
  executor.advance(nanoseconds(1));
  executor.runUntilIdle();
  EXPECT_EQ(current, nullptr);
  queue->resume();
  executor.runUntilIdle();
  EXPECT_EQ(current, queue.get());
}

TEST(Queue, Promise12LongestDelayDoesNotPassAtOnce) {
  ManualExecutor executor;
  const auto queue = SerialQueue::create(executor, "queue");
  runAfterDelay(executor, UINT64_MAX, queue, [] {});
  executor.advance(std::chrono::hours(24 * 365));
  EXPECT_EQ(executor.delayedCount(), 1U);
  EXPECT_EQ(executor.readyCount(), 0U);
}

TEST(Queue, Promise12DelayedTaskRunsOnThePool) {
  ThreadPool pool;
  const auto queue = SerialQueue::create(pool, "queue");
  TestCountdown ran;
  const auto due = std::chrono::steady_clock::now() + milliseconds(2);
  runAfterDelay(pool, 2000000, queue, [&ran, due] {
    EXPECT_GE(std::chrono::steady_clock::now(), due);
    ran.arrive();
  });
  EXPECT_TRUE(ran.wait());
}

// 13: run once

TEST(OnceToken, Promise13TaskRunsTheFirstTimeOnlyAndConcurrentFirstCallersWaitForIt) {
  for (int round = 0; round < 50; ++round) {
    OnceToken token;
    int runs = 0;
    TestCountdown meeting(4);
    join(startThreads(4, [&token, &runs, &meeting](int) {
      EXPECT_TRUE(meeting.arriveAndWait());
      token.runOnce([&runs] {
        std::this_thread::yield();
        ++runs;
      });
      EXPECT_EQ(runs, 1);
    }));
    token.runOnce([&runs] { ++runs; });
    ASSERT_EQ(runs, 1);
  }
}

// The current queue

TEST(Queue, CurrentIsTheQueueOfTheInnermostTask) {
  ManualExecutor executor;
  const auto outer = SerialQueue::create(executor, "outer");
  const auto inner = ConcurrentQueue::create(executor, "inner");
  EXPECT_EQ(Queue::current(), nullptr);
  outer->sync([&outer, &inner] {
    EXPECT_EQ(Queue::current(), outer.get());
    inner->syncBarrier([&inner] { EXPECT_EQ(Queue::current(), inner.get()); });
    EXPECT_EQ(Queue::current(), outer.get());
    outer->async([&outer] { EXPECT_EQ(Queue::current(), outer.get()); });
    inner->async([&inner] { EXPECT_EQ(Queue::current(), inner.get()); });
    inner->sync([&inner] { EXPECT_EQ(Queue::current(), inner.get()); });
    EXPECT_EQ(Queue::current(), outer.get());
  });
  EXPECT_EQ(Queue::current(), nullptr);
  EXPECT_EQ(executor.runUntilIdle(), 2U);
  EXPECT_EQ(Queue::current(), nullptr);
}

TEST(Queue, LabelIsAsGiven) {
  ManualExecutor executor;
  EXPECT_EQ(SerialQueue::create(executor, "one label")->label(), "one label");
  EXPECT_EQ(ConcurrentQueue::create(executor, "another")->label(), "another");
}

}  // namespace
}  // namespace storix
