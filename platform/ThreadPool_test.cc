#include "platform/ThreadPool.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <thread>
#include <vector>

#include "platform/Queue.h"
#include "platform/TestCountdown.h"

namespace storix {
namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::steady_clock;
using testing::ElementsAre;

/// How many are inside at a time, at most.
class Occupancy {
 public:
  void enter() {
    const int now = ++inside_;
    int most = most_.load();
    while (most < now && !most_.compare_exchange_weak(most, now)) {
    }
  }
  void leave() { --inside_; }
  [[nodiscard]] int most() const { return most_; }

 private:
  std::atomic<int> inside_{0};
  std::atomic<int> most_{0};
};

TEST(ThreadPool, ExecuteRunsTheTaskOnAThreadOfThePool) {
  ThreadPool pool;
  TestCountdown ran;
  std::thread::id thread;
  pool.execute([&ran, &thread] {
    thread = std::this_thread::get_id();
    ran.arrive();
  });
  ASSERT_TRUE(ran.wait());
  EXPECT_NE(thread, std::this_thread::get_id());
  EXPECT_TRUE(pool.hasThreads());
}

TEST(ThreadPool, OneThreadRunsTasksInOrder) {
  std::vector<int> order;
  {
    ThreadPool pool(1);
    for (int i = 0; i < 100; ++i) pool.execute([&order, i] { order.push_back(i); });
  }
  EXPECT_EQ(order.size(), 100U);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST(ThreadPool, AsManyTasksAsItsConcurrencyRunSideBySideAndNoMore) {
  Occupancy occupancy;
  TestCountdown meeting(3);
  {
    ThreadPool pool(3);
    for (int i = 0; i < 3; ++i) pool.execute([&meeting] { EXPECT_TRUE(meeting.arriveAndWait()); });
    for (int i = 0; i < 300; ++i) {
      pool.execute([&occupancy] {
        occupancy.enter();
        std::this_thread::yield();
        occupancy.leave();
      });
    }
  }
  EXPECT_LE(occupancy.most(), 3);
}

TEST(ThreadPool, TwoTasksAtLeastRunSideBySideByDefault) {
  ThreadPool pool;
  TestCountdown meeting(2);
  TestCountdown done(2);
  for (int i = 0; i < 2; ++i) {
    pool.execute([&meeting, &done] {
      EXPECT_TRUE(meeting.arriveAndWait());
      done.arrive();
    });
  }
  EXPECT_TRUE(done.wait());
}

TEST(ThreadPool, TasksThatSayTheyWaitKeepNoOtherFromRunningHoweverManyTheyAre) {
  constexpr std::size_t count = 200;
  ThreadPool pool(1);
  TestCountdown all(count + 1);
  TestCountdown ended(count);
  for (std::size_t i = 0; i < count; ++i) {
    pool.execute([&pool, &all, &ended] {
      {
        const BlockingScope blocking(pool);
        EXPECT_TRUE(all.arriveAndWait());
      }
      ended.arrive();
    });
  }
  pool.execute([&all] { all.arrive(); });
  EXPECT_TRUE(ended.wait());
}

TEST(ThreadPool, WaitInsideAWaitCountsOnce) {
  Occupancy occupancy;
  TestCountdown others(50);
  {
    ThreadPool pool(1);
    pool.execute([&pool, &others] {
      const BlockingScope outer(pool);
      const BlockingScope inner(pool);
      EXPECT_TRUE(others.wait());
    });
    for (int i = 0; i < 50; ++i) {
      pool.execute([&occupancy, &others] {
        occupancy.enter();
        std::this_thread::yield();
        occupancy.leave();
        others.arrive();
      });
    }
  }
  EXPECT_EQ(occupancy.most(), 1);
}

TEST(ThreadPool, AfterWaitsAreOverNoMoreTasksRunSideBySideThanBefore) {
  Occupancy occupancy;
  TestCountdown waiting(5);
  TestCountdown release;
  TestCountdown done(300);
  ThreadPool pool(1);
  for (int i = 0; i < 5; ++i) {
    pool.execute([&pool, &waiting, &release] {
      const BlockingScope blocking(pool);
      waiting.arrive();
      EXPECT_TRUE(release.wait());
    });
  }
  ASSERT_TRUE(waiting.wait());
  pool.execute([&pool, &occupancy, &release, &done] {
    for (int i = 0; i < 300; ++i) {
      pool.execute([&occupancy, &done] {
        occupancy.enter();
        std::this_thread::yield();
        occupancy.leave();
        done.arrive();
      });
    }
    release.arrive();
  });
  EXPECT_TRUE(done.wait());
  EXPECT_EQ(occupancy.most(), 1);
}

TEST(ThreadPool, WaitForAnotherPoolFreesAPlaceInTheThreadsOwnPool) {
  ThreadPool pool(1);
  ThreadPool other(1);
  TestCountdown released;
  TestCountdown ended;
  pool.execute([&other, &released, &ended] {
    {
      const BlockingScope blocking(other);
      EXPECT_TRUE(released.wait());
    }
    ended.arrive();
  });
  pool.execute([&released] { released.arrive(); });
  EXPECT_TRUE(ended.wait());
}

TEST(ThreadPool, WaitOnAThreadThatIsNotThePoolsChangesNothing) {
  Occupancy occupancy;
  {
    ThreadPool pool(1);
    const BlockingScope blocking(pool);
    TestCountdown done(50);
    for (int i = 0; i < 50; ++i) {
      pool.execute([&occupancy, &done] {
        occupancy.enter();
        std::this_thread::yield();
        occupancy.leave();
        done.arrive();
      });
    }
    EXPECT_TRUE(done.wait());
  }
  EXPECT_EQ(occupancy.most(), 1);
}

/// Tells of the end of the thread that made it.
struct EndOfThread {
  explicit EndOfThread(TestCountdown &whenEnding) : ended(whenEnding) {}
  ~EndOfThread() { ended.arrive(); }
  TestCountdown &ended;
};

TEST(ThreadPool, ThreadsWithoutWorkEndAndNewOnesComeWithNewWork) {
  ThreadPool pool(2, milliseconds(1));
  for (int round = 0; round < 5; ++round) {
    TestCountdown ended(2);
    TestCountdown meeting(2);
    for (int i = 0; i < 2; ++i) {
      pool.execute([&ended, &meeting] {
        thread_local std::unique_ptr<EndOfThread> end;
        end = std::make_unique<EndOfThread>(ended);
        EXPECT_TRUE(meeting.arriveAndWait());
      });
    }
    ASSERT_TRUE(ended.wait());
  }
}

TEST(ThreadPool, DestructorRunsWhatWasGivenAndWhatThatGives) {
  std::atomic<int> ran{0};
  {
    ThreadPool pool(1);
    for (int i = 0; i < 20; ++i) {
      pool.execute([&pool, &ran] {
        ++ran;
        pool.execute([&pool, &ran] {
          ++ran;
          pool.execute([&ran] { ++ran; });
        });
      });
    }
  }
  EXPECT_EQ(ran, 60);
}

TEST(ThreadPool, DestructorStillGivesAPlaceToTheTaskThatAnotherWaitsFor) {
  bool ended = false;
  {
    ThreadPool pool(1);
    TestCountdown started;
    pool.execute([&pool, &started, &ended] {
      started.arrive();
      TestCountdown released;
      pool.execute([&released] { released.arrive(); });
      const BlockingScope blocking(pool);
      EXPECT_TRUE(released.wait());
      ended = true;
    });
    ASSERT_TRUE(started.wait());
  }
  EXPECT_TRUE(ended);
}

TEST(ThreadPool, DestructorDropsWhatWaitsForItsDelay) {
  const auto held = std::make_shared<int>(1);
  std::atomic<bool> ran{false};
  {
    ThreadPool pool(1);
    pool.executeAfter(std::chrono::hours(1), [held, &ran] { ran = true; });
    pool.executeAfter(nanoseconds::max(), [held, &ran] { ran = true; });
    EXPECT_EQ(held.use_count(), 3);
    pool.execute([&pool, held, &ran] { pool.executeAfter(std::chrono::hours(1), [held, &ran] { ran = true; }); });
  }
  EXPECT_FALSE(ran);
  EXPECT_EQ(held.use_count(), 1);
}

TEST(ThreadPool, EndRunsWhatWasGivenAndDropsWhatComesLater) {
  ThreadPool pool(2);
  const auto held = std::make_shared<int>(1);
  std::atomic<int> ran{0};
  auto queue = SerialQueue::create(pool, "queue");
  for (int i = 0; i < 20; ++i) pool.execute([&queue, &ran] { queue->async([&ran] { ++ran; }); });
  pool.end();
  EXPECT_EQ(ran, 20);
  pool.execute([held, &ran] { ++ran; });
  pool.executeAfter(nanoseconds(0), [held, &ran] { ++ran; });
  pool.executeAfter(nanoseconds(1), [held, &ran] { ++ran; });
  queue->async([held, &ran] { ++ran; });
  EXPECT_EQ(held.use_count(), 1);
  pool.end();
  EXPECT_EQ(ran, 20);
  // What has nothing before it needs no thread.
  queue->sync([&ran] { ++ran; });
  EXPECT_EQ(ran, 21);
}

TEST(ThreadPool, DelayedTaskNeverRunsBeforeItsTime) {
  ThreadPool pool(2);
  constexpr int count = 50;
  TestCountdown ran(count);
  std::atomic<int> early{0};
  for (int i = 0; i < count; ++i) {
    const auto due = steady_clock::now() + milliseconds(i % 7);
    pool.executeAfter(milliseconds(i % 7), [&ran, &early, due] {
      if (steady_clock::now() < due) ++early;
      ran.arrive();
    });
  }
  EXPECT_TRUE(ran.wait());
  EXPECT_EQ(early, 0);
}

TEST(ThreadPool, LaterDelayedTaskWithAnEarlierTimeDoesNotWaitForTheOthers) {
  ThreadPool pool;
  pool.executeAfter(std::chrono::hours(1), [] {});
  // All but the first find the timer waiting.
  for (int i = 0; i < 10; ++i) {
    TestCountdown ran;
    pool.executeAfter(milliseconds(1), [&ran] { ran.arrive(); });
    ASSERT_TRUE(ran.wait());
  }
}

TEST(ThreadPool, TasksWithEqualDelaysRunInTheOrderOfTheirCalls) {
  ThreadPool pool(1);
  std::vector<int> order;
  TestCountdown ran(100);
  for (int i = 0; i < 100; ++i) {
    pool.executeAfter(milliseconds(1), [&order, &ran, i] {
      order.push_back(i);
      ran.arrive();
    });
  }
  ASSERT_TRUE(ran.wait());
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST(ThreadPool, TaskWithoutDelayRunsAtOnce) {
  ThreadPool pool;
  TestCountdown ran(2);
  pool.executeAfter(nanoseconds(0), [&ran] { ran.arrive(); });
  pool.executeAfter(nanoseconds(-1), [&ran] { ran.arrive(); });
  EXPECT_TRUE(ran.wait());
}

TEST(LocalTasks, RunAtTheEndOfTheScopeOnItsThreadInOrder) {
  ThreadPool pool;
  std::vector<int> order;
  {
    const ThreadPool::LocalTasks local(pool);
    pool.execute([&pool, &order] {
      order.push_back(1);
      pool.execute([&order] { order.push_back(3); });
    });
    pool.execute([&order] { order.push_back(2); });
    EXPECT_THAT(order, ElementsAre());
  }
  EXPECT_THAT(order, ElementsAre(1, 2, 3));
}

TEST(LocalTasks, TaskOfAQueueRunsThereToo) {
  ThreadPool pool;
  const auto queue = ConcurrentQueue::create(pool, "queue");
  std::thread::id thread;
  {
    const ThreadPool::LocalTasks local(pool);
    queue->async([&thread] { thread = std::this_thread::get_id(); });
    EXPECT_EQ(thread, std::thread::id());
  }
  EXPECT_EQ(thread, std::this_thread::get_id());
}

TEST(LocalTasks, GoToThePoolWhenTheThreadBlocks) {
  ThreadPool pool;
  TestCountdown ran(2);
  const ThreadPool::LocalTasks local(pool);
  pool.execute([&ran] { ran.arrive(); });
  const BlockingScope blocking(pool);
  pool.execute([&ran] { ran.arrive(); });
  EXPECT_TRUE(ran.wait());
}

TEST(LocalTasks, TellsThatTheThreadBlocksOncePerWait) {
  ThreadPool pool;
  int told = 0;
  const std::function<void()> tell = [&told] { ++told; };
  const ThreadPool::LocalTasks local(pool, &tell);
  {
    const BlockingScope wait(pool);
    EXPECT_EQ(told, 1);
    const BlockingScope waitInside(pool);
    EXPECT_EQ(told, 1);
  }
  const BlockingScope nextWait(pool);
  EXPECT_EQ(told, 2);
}

TEST(LocalTasks, AreHeldAgainWhenTheWaitIsOver) {
  ThreadPool pool;
  std::thread::id thread;
  {
    const ThreadPool::LocalTasks local(pool);
    { const BlockingScope blocking(pool); }
    pool.execute([&thread] { thread = std::this_thread::get_id(); });
  }
  EXPECT_EQ(thread, std::this_thread::get_id());
}

TEST(LocalTasks, SyncThatWaitsLetsThemGo) {
  ThreadPool pool;
  const auto queue = ConcurrentQueue::create(pool, "queue");
  const auto other = SerialQueue::create(pool, "other");
  other->suspend();
  bool ran = false;
  const ThreadPool::LocalTasks local(pool);
  queue->async([&other] { other->resume(); });
  other->sync([&ran] { ran = true; });
  EXPECT_TRUE(ran);
}

TEST(LocalTasks, TaskAtTheEndThatBlocksLetsTheRestGo) {
  ThreadPool pool;
  TestCountdown second;
  const ThreadPool::LocalTasks local(pool);
  pool.execute([&pool, &second] {
    const BlockingScope blocking(pool);
    EXPECT_TRUE(second.wait());
  });
  pool.execute([&second] { second.arrive(); });
}

TEST(LocalTasks, InnerScopeRunsItsOwn) {
  ThreadPool pool;
  std::vector<int> order;
  {
    const ThreadPool::LocalTasks outer(pool);
    pool.execute([&order] { order.push_back(3); });
    {
      const ThreadPool::LocalTasks inner(pool);
      pool.execute([&order] { order.push_back(1); });
    }
    order.push_back(2);
  }
  EXPECT_THAT(order, ElementsAre(1, 2, 3));
}

TEST(LocalTasks, LeaveOtherThreadsAndOtherPoolsAlone) {
  ThreadPool pool;
  ThreadPool other;
  TestCountdown ran(2);
  const ThreadPool::LocalTasks local(pool);
  other.execute([&pool, &ran] {
    pool.execute([&ran] { ran.arrive(); });
    ran.arrive();
  });
  EXPECT_TRUE(ran.wait());
}

TEST(LocalTasks, DoNotHoldUpAnotherThreadsSyncBehindThem) {
  ThreadPool pool;
  const auto queue = SerialQueue::create(pool, "queue");
  int value = 0;
  std::thread other;
  {
    const ThreadPool::LocalTasks local(pool);
    queue->async([&value] { value = 1; });
    // The other thread's task stands behind one that this thread holds back.
    other = std::thread([&queue, &value] { queue->sync([&value] { EXPECT_EQ(value++, 1); }); });
    other.join();
  }
  EXPECT_EQ(value, 2);
}

TEST(ThreadPoolEnd, RunsWhatWasGivenAndWhatThatGives) {
  ThreadPool pool;
  std::atomic<int> ran = 0;
  for (int i = 0; i < 100; ++i) {
    pool.execute([&pool, &ran] {
      ++ran;
      pool.execute([&ran] { ++ran; });
    });
  }
  pool.end();
  EXPECT_EQ(ran, 200);
}

TEST(ThreadPoolEnd, DropsWhatWaitsForItsDelayAndWhatComesLater) {
  ThreadPool pool;
  const auto held = std::make_shared<int>(0);
  pool.executeAfter(std::chrono::hours(1), [held] { ADD_FAILURE(); });
  pool.end();
  pool.execute([held] { ADD_FAILURE(); });
  pool.executeAfter(std::chrono::nanoseconds(1), [held] { ADD_FAILURE(); });
  EXPECT_EQ(held.use_count(), 1);
  pool.end();
}

TEST(ThreadPoolEnd, QueuesDropTheirTasksAndCanStillBeUsedAndLetGo) {
  ThreadPool pool;
  auto queue = SerialQueue::create(pool, "queue");
  const auto held = std::make_shared<int>(0);
  queue->suspend();
  queue->async([held] { ADD_FAILURE(); });
  pool.end();
  queue.reset();
  EXPECT_EQ(held.use_count(), 1);
  int value = 0;
  SerialQueue::create(pool, "another")->sync([&value] { value = 1; });
  EXPECT_EQ(value, 1);
}

}  // namespace
}  // namespace storix
