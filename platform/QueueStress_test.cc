#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <memory>
#include <random>
#include <thread>
#include <vector>

#include "platform/ManualExecutor.h"
#include "platform/Queue.h"
#include "platform/TestCountdown.h"
#include "platform/ThreadPool.h"

// Many threads at once, bounded by counts. What they check is plain memory, so that ThreadSanitizer
// finds two tasks that run together and must not.

namespace storix {
namespace {

constexpr int threadCount = 6;
constexpr int rounds = 300;

template <class Body>
void onThreads(const Body &body, int times = rounds) {
  std::vector<std::thread> threads;
  threads.reserve(threadCount);
  for (int i = 0; i < threadCount; ++i) {
    threads.emplace_back([&body, i, times] {
      std::minstd_rand random(static_cast<unsigned>(i + 1));
      for (int round = 0; round < times; ++round) body(i, random);
    });
  }
  for (std::thread &thread : threads) thread.join();
}

TEST(QueueStress, SerialQueueUnderEverythingAtOnce) {
  ThreadPool pool(3);
  const auto queue = SerialQueue::create(pool, "queue");
  long sum = 0;
  std::atomic<long> submitted{0};
  onThreads([&queue, &sum, &submitted](int, std::minstd_rand &random) {
    switch (random() % 5) {
      case 0:
        queue->suspend();
        queue->async([&sum] { ++sum; });
        queue->resume();
        ++submitted;
        break;
      case 1:
        queue->async([&queue, &sum] {
          ++sum;
          queue->async([&sum] { ++sum; });
        });
        submitted += 2;
        break;
      default:
        queue->sync([&sum] { ++sum; });
        ++submitted;
    }
  });
  // The tasks that tasks submit stand before the second one of these.
  queue->sync([] {});
  queue->sync([&sum, &submitted] { EXPECT_EQ(sum, submitted); });
}

TEST(QueueStress, ConcurrentQueueUnderEverythingAtOnce) {
  ThreadPool pool(3);
  const auto queue = ConcurrentQueue::create(pool, "queue");
  long written = 0;  // by barriers
  std::atomic<long> read{0};
  std::atomic<long> barriers{0};
  std::atomic<long> plain{0};
  onThreads([&queue, &written, &read, &barriers, &plain](int, std::minstd_rand &random) {
    const auto look = [&written, &read] {
      if (written >= 0) ++read;
    };
    switch (random() % 8) {
      case 0:
        queue->suspend();
        queue->asyncBarrier([&written] { ++written; });
        queue->resume();
        ++barriers;
        break;
      case 1:
        queue->syncBarrier([&written] { ++written; });
        ++barriers;
        break;
      case 2:
        queue->asyncBarrier([&queue, &written] {
          ++written;
          queue->asyncBarrier([&written] { ++written; });
        });
        barriers += 2;
        break;
      case 3:
      case 4:
        queue->async(look);
        ++plain;
        break;
      default:
        queue->sync(look);
        ++plain;
    }
  });
  queue->syncBarrier([] {});
  queue->syncBarrier([&written, &read, &barriers, &plain] {
    EXPECT_EQ(written, barriers);
    EXPECT_EQ(read, plain);
  });
}

TEST(QueueStress, TasksThatWaitForOtherQueuesTasks) {
  constexpr int times = rounds / 3;  // each costs a thread
  ThreadPool pool(2);
  const auto global = ConcurrentQueue::create(pool, "global");
  // Waits go to queues further on alone, so that nobody waits in a ring.
  std::array<std::shared_ptr<SerialQueue>, 4> queues;
  for (auto &queue : queues) queue = SerialQueue::create(pool, "queue");
  std::array<long, 4> counts{};
  TestCountdown done(static_cast<std::size_t>(threadCount) * times);
  onThreads(
      [&global, &queues, &counts, &done](int, std::minstd_rand &random) {
        const std::size_t first = random() % 3;
        const std::size_t second = first + 1 + random() % (3 - first);
        global->async([&queues, &counts, &done, first, second] {
          queues[first]->sync([&queues, &counts, first, second] {
            ++counts[first];
            queues[second]->sync([&counts, second] { ++counts[second]; });
          });
          done.arrive();
        });
        if (random() % 16 == 0) {
          queues[second]->suspend();
          global->async([&queues, second] { queues[second]->resume(); });
        }
      },
      times);
  EXPECT_TRUE(done.wait());
  long total = 0;
  for (std::size_t i = 0; i < queues.size(); ++i) queues[i]->sync([&total, &counts, i] { total += counts[i]; });
  EXPECT_EQ(total, 2L * threadCount * times);
}

TEST(QueueStress, QueuesThatEndWhileTheirTasksWait) {
  std::atomic<long> ran{0};
  std::atomic<long> submitted{0};
  {
    ThreadPool pool(3);
    onThreads([&pool, &ran, &submitted](int, std::minstd_rand &random) {
      const auto count = [&ran] { ++ran; };
      auto serial = SerialQueue::create(pool, "serial");
      auto concurrent = ConcurrentQueue::create(pool, "concurrent");
      auto operations = OperationQueue::create(pool, "operations");
      serial->suspend();
      concurrent->suspend();
      serial->async(count);
      serial->async([&own = *serial, count] { own.async(count); });
      if (random() % 2) serial->resume();
      concurrent->async(count);
      concurrent->asyncBarrier([&own = *concurrent, count] { own.async(count); });
      if (random() % 2) concurrent->resume();
      operations->addOperation([operations, count] { operations->addOperation(count); });
      submitted += 5;
      if (random() % 2) operations.reset();
    });
  }
  EXPECT_EQ(ran, submitted);
}

TEST(QueueStress, QueueSharedByThreadsOfWhichAnyIsTheLast) {
  ThreadPool pool(3);
  for (int round = 0; round < 100; ++round) {
    auto queue = ConcurrentQueue::create(pool, "queue");
    TestCountdown meeting(4);
    std::vector<std::thread> threads;
    threads.reserve(4);
    for (int i = 0; i < 4; ++i) {
      threads.emplace_back([own = queue, &meeting, i]() mutable {
        EXPECT_TRUE(meeting.arriveAndWait());
        own->sync([] {});
        if (i == 0) own->asyncBarrier([] {});
        own->sync([&own] { own.reset(); });
      });
    }
    queue.reset();
    for (std::thread &thread : threads) thread.join();
  }
}

TEST(QueueStress, OperationsWhileTheMaximumChanges) {
  std::atomic<long> ran{0};
  {
    ThreadPool pool(4);
    const auto queue = OperationQueue::create(pool, "operations");
    onThreads([&queue, &ran](int, std::minstd_rand &random) {
      queue->addOperation([&ran] { ++ran; });
      queue->setMaximumConcurrency(random() % 5);
    });
  }
  EXPECT_EQ(ran, threadCount * rounds);
}

TEST(QueueStress, LocalTasksOnManyThreads) {
  ThreadPool pool(2);
  const auto global = ConcurrentQueue::create(pool, "global");
  const auto guard = SerialQueue::create(pool, "guard");
  long replies = 0;
  TestCountdown done(static_cast<std::size_t>(threadCount) * rounds);
  onThreads([&pool, &global, &guard, &replies, &done](int, std::minstd_rand &random) {
    const ThreadPool::LocalTasks local(pool);
    if (random() % 4 == 0) guard->async([] {});
    guard->sync([] {});
    global->async([&guard, &replies, &done] {
      guard->sync([&replies] { ++replies; });
      done.arrive();
    });
    if (random() % 4 == 0) {
      const BlockingScope blocking(pool);
      std::this_thread::yield();
    }
  });
  EXPECT_TRUE(done.wait());
  guard->sync([&replies] { EXPECT_EQ(replies, threadCount * rounds); });
}

TEST(QueueStress, ThreadsThatComeAndGo) {
  std::atomic<int> ran{0};
  {
    ThreadPool pool(2, std::chrono::nanoseconds(1));
    onThreads([&pool, &ran](int, std::minstd_rand &random) {
      pool.execute([&pool, &ran] {
        const BlockingScope blocking(pool);
        ++ran;
      });
      if (random() % 8 == 0) pool.executeAfter(std::chrono::microseconds(random() % 100), [] {});
      std::this_thread::yield();
    });
  }
  EXPECT_EQ(ran, threadCount * rounds);
}

TEST(QueueStress, ManualExecutorRunByManyThreads) {
  ManualExecutor executor;
  const auto serial = SerialQueue::create(executor, "serial");
  const auto concurrent = ConcurrentQueue::create(executor, "concurrent");
  long sum = 0;
  long submitted = 0;
  onThreads([&executor, &serial, &concurrent, &sum, &submitted](int, std::minstd_rand &random) {
    switch (random() % 4) {
      case 0:
        executor.runOne();
        break;
      case 1:
        concurrent->sync([&serial, &sum, &submitted] {
          serial->sync([&sum, &submitted] {
            ++sum;
            ++submitted;
          });
        });
        break;
      case 2:
        concurrent->asyncBarrier([] {});
        break;
      default:
        serial->sync([&submitted] { ++submitted; });
        serial->async([&sum] { ++sum; });
    }
  });
  executor.runUntilIdle();
  serial->sync([&sum, &submitted] { EXPECT_EQ(sum, submitted); });
}

}  // namespace
}  // namespace storix
