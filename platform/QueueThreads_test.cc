// What queues promise where several threads work at a time.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/Queue.h"
#include "platform/TestCountdown.h"
#include "platform/TestThreads.h"
#include "platform/ThreadPool.h"

namespace storix {
namespace {

using testing::ElementsAre;

// 7: waiting tasks

TEST(Queue, Promise7TasksThatWaitInSyncNeverKeepOthersFromRunningHoweverMany) {
  constexpr std::size_t count = 500;
  ThreadPool pool(2);
  const auto gate = SerialQueue::create(pool, "gate");
  const auto global = ConcurrentQueue::create(pool, "global");
  gate->suspend();
  int passed = 0;
  TestCountdown done(count);
  for (std::size_t i = 0; i < count; ++i) {
    global->async([&gate, &passed, &done] {
      gate->sync([&passed] { ++passed; });
      done.arrive();
    });
  }
  global->async([&gate] { gate->resume(); });
  EXPECT_TRUE(done.wait());
  EXPECT_EQ(passed, 500);
}

TEST(Queue, Promise7TaskMayWaitForATaskThatWaitsForATask) {
  constexpr std::size_t depth = 60;
  ThreadPool pool(1);
  std::vector<std::shared_ptr<SerialQueue>> queues;
  for (std::size_t i = 0; i < depth; ++i) queues.push_back(SerialQueue::create(pool, "queue"));
  // Every queue's first task waits for the next queue's, so all must be started before one can end.
  std::vector<TestCountdown> started(depth);
  TestCountdown done(depth);
  for (std::size_t i = 0; i < depth; ++i) {
    queues[i]->async([&pool, &queues, &started, &done, i] {
      started[i].arrive();
      if (i + 1 < depth) {
        {
          const BlockingScope blocking(pool);
          EXPECT_TRUE(started[i + 1].wait());
        }
        queues[i + 1]->sync([] {});
      }
      done.arrive();
    });
  }
  EXPECT_TRUE(done.wait());
}

// 8: serial queues

TEST(Queue, Promise8SerialQueueRunsOneTaskAtATime) {
  ThreadPool pool(4);
  const auto queue = SerialQueue::create(pool, "queue");
  std::atomic<int> inside{0};
  std::atomic<int> collisions{0};
  const auto task = [&inside, &collisions] {
    if (++inside != 1) ++collisions;
    std::this_thread::yield();
    --inside;
  };
  join(startThreads(4, [&queue, &task](int) {
    for (int i = 0; i < 200; ++i) {
      queue->async(task);
      queue->sync(task);
    }
  }));
  queue->sync([] {});
  EXPECT_EQ(collisions, 0);
}

// 9: plain tasks

TEST(Queue, Promise9AsynchronousPlainTasksRunSideBySide) {
  ThreadPool pool(4);
  const auto queue = ConcurrentQueue::create(pool, "queue");
  TestCountdown meeting(4);
  TestCountdown done(4);
  for (int i = 0; i < 4; ++i) {
    queue->async([&meeting, &done] {
      EXPECT_TRUE(meeting.arriveAndWait());
      done.arrive();
    });
  }
  EXPECT_TRUE(done.wait());
}

TEST(Queue, Promise9SynchronousPlainTasksRunSideBySide) {
  ThreadPool pool;
  const auto queue = ConcurrentQueue::create(pool, "queue");
  TestCountdown meeting(4);
  join(startThreads(4, [&queue, &meeting](int) { queue->sync([&meeting] { EXPECT_TRUE(meeting.arriveAndWait()); }); }));
}

TEST(Queue, Promise9PlainTasksThatWaitedForABarrierRunSideBySide) {
  ThreadPool pool(4);
  const auto queue = ConcurrentQueue::create(pool, "queue");
  queue->suspend();
  queue->asyncBarrier([] {});
  TestCountdown meeting(4);
  TestCountdown submitted(2);
  for (int i = 0; i < 2; ++i) queue->async([&meeting] { EXPECT_TRUE(meeting.arriveAndWait()); });
  auto callers = startThreads(2, [&queue, &meeting, &submitted](int) {
    submitted.arrive();
    queue->sync([&meeting] { EXPECT_TRUE(meeting.arriveAndWait()); });
  });
  EXPECT_TRUE(submitted.wait());
  queue->resume();
  join(std::move(callers));
  queue->syncBarrier([] {});
}

// 10: barriers

TEST(Queue, Promise10BarrierWaitsForTheEndOfAllBeforeItAndHoldsBackAllAfterIt) {
  ThreadPool pool(4);
  const auto queue = ConcurrentQueue::create(pool, "queue");
  std::mutex mutex;
  std::vector<int> order;
  const auto note = [&mutex, &order](int what) {
    const std::lock_guard lock(mutex);
    order.push_back(what);
  };
  TestCountdown started(2);
  TestCountdown mayEnd;
  TestCountdown done(2);
  for (int i = 0; i < 2; ++i) {
    queue->async([&started, &mayEnd, &note] {
      started.arrive();
      EXPECT_TRUE(mayEnd.wait());
      note(1);
    });
  }
  ASSERT_TRUE(started.wait());
  queue->asyncBarrier([&note] { note(2); });
  for (int i = 0; i < 2; ++i) {
    queue->async([&note, &done] {
      note(3);
      done.arrive();
    });
  }
  mayEnd.arrive();
  EXPECT_TRUE(done.wait());
  EXPECT_THAT(order, ElementsAre(1, 1, 2, 3, 3));
}

TEST(Queue, Promise10BarriersRunAlone) {
  ThreadPool pool(4);
  const auto queue = ConcurrentQueue::create(pool, "queue");
  std::atomic<int> plain{0};
  std::atomic<int> barriers{0};
  std::atomic<int> collisions{0};
  const auto plainTask = [&plain, &barriers, &collisions] {
    ++plain;
    if (barriers != 0) ++collisions;
    std::this_thread::yield();
    --plain;
  };
  const auto barrierTask = [&plain, &barriers, &collisions] {
    if (++barriers != 1 || plain != 0) ++collisions;
    std::this_thread::yield();
    --barriers;
  };
  join(startThreads(4, [&queue, &plainTask, &barrierTask](int) {
    for (int i = 0; i < 100; ++i) {
      queue->async(plainTask);
      queue->sync(plainTask);
      queue->asyncBarrier(barrierTask);
      queue->sync(plainTask);
      queue->syncBarrier(barrierTask);
    }
  }));
  queue->syncBarrier([] {});
  EXPECT_EQ(collisions, 0);
}

}  // namespace
}  // namespace storix
