#include <algorithm>
#include <atomic>

#include "tests/contract/ContractTest.h"

namespace storix::contract {
namespace {

// What queues promise in full is tested beside them; here stands what the platform adds: that it makes
// such queues, labels them and has them run.
class QueuesContract : public ContractTest {};

TEST_P(QueuesContract, SerialQueueRunsItsTasksInOrder) {
  const auto queue = platform().createSerialQueue("a serial queue");
  EXPECT_EQ(queue->label(), "a serial queue");
  std::vector<int> order;
  for (int i = 0; i < 100; ++i) queue->async([&order, i] { order.push_back(i); });
  bool ranInside = false;
  queue->sync([&] { ranInside = Queue::current() == queue.get(); });
  EXPECT_TRUE(ranInside);
  EXPECT_EQ(order.size(), 100U);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST_P(QueuesContract, ConcurrentQueueRunsPlainTasksSideBySideAndBarriersAlone) {
  const auto queue = platform().createConcurrentQueue("a concurrent queue");
  EXPECT_EQ(queue->label(), "a concurrent queue");
  Awaited<int> arrived;
  for (int i = 0; i < 2; ++i) {
    queue->async([&arrived] {
      arrived.change([](int &count) { ++count; });
      EXPECT_TRUE(arrived.wait([](int count) { return count == 2; }));
    });
  }
  int seenByBarrier = 0;
  queue->syncBarrier([&] { seenByBarrier = arrived.value(); });
  EXPECT_EQ(seenByBarrier, 2);
}

TEST_P(QueuesContract, OperationQueueRunsOneOperationAtATimeInOrder) {
  const auto queue = platform().createOperationQueue("an operation queue");
  EXPECT_EQ(queue->name(), "an operation queue");
  Awaited<std::vector<int>> order;
  std::atomic<int> running{0};
  for (int i = 0; i < 50; ++i) {
    queue->addOperation([&order, &running, expected = queue.get(), i] {
      EXPECT_EQ(++running, 1);
      EXPECT_EQ(OperationQueue::current(), expected);
      --running;
      order.change([i](std::vector<int> &list) { list.push_back(i); });
    });
  }
  ASSERT_TRUE(order.wait([](const std::vector<int> &list) { return list.size() == 50; }));
  const std::vector<int> list = order.value();
  EXPECT_TRUE(std::is_sorted(list.begin(), list.end()));
}

TEST_P(QueuesContract, GlobalQueueIsOneAndRunsTasksSideBySide) {
  EXPECT_EQ(platform().globalQueue(), platform().globalQueue());
  Awaited<int> arrived;
  Awaited<int> left;
  const Queue *global = platform().globalQueue().get();
  for (int i = 0; i < 2; ++i) {
    platform().globalQueue()->async([&arrived, &left, global] {
      EXPECT_EQ(Queue::current(), global);
      arrived.change([](int &count) { ++count; });
      EXPECT_TRUE(arrived.wait([](int count) { return count == 2; }));
      left.change([](int &count) { ++count; });
    });
  }
  EXPECT_TRUE(left.wait([](int count) { return count == 2; }));
}

TEST_P(QueuesContract, DelayedTaskRunsOnItsQueueAndNotBeforeItsTime) {
  const auto queue = platform().createSerialQueue("delayed");
  constexpr std::chrono::milliseconds delay(20);
  const auto start = std::chrono::steady_clock::now();
  struct Run {
    bool onQueue = false;
    std::optional<std::chrono::steady_clock::duration> after;
  };
  Awaited<Run> run;
  platform().runAfterDelay(static_cast<std::uint64_t>(std::chrono::nanoseconds(delay).count()), queue,
                           [&run, start, expected = queue.get()] {
                             run.change([start, expected](Run &r) {
                               r.onQueue = Queue::current() == expected;
                               r.after = std::chrono::steady_clock::now() - start;
                             });
                           });
  ASSERT_TRUE(run.wait([](const Run &r) { return r.after.has_value(); }));
  EXPECT_TRUE(run.value().onQueue);
  EXPECT_GE(run.value().after, delay);
}

TEST_P(QueuesContract, DelayedTaskHoldsItsQueue) {
  Awaited<bool> ran;
  platform().runAfterDelay(1, platform().createSerialQueue("dropped"),
                           [&ran] { ran.change([](bool &value) { value = true; }); });
  EXPECT_TRUE(ran.wait([](bool value) { return value; }));
}

TEST_P(QueuesContract, TasksThatWaitForOtherQueuesNeverStarveThem) {
  const auto last = platform().createSerialQueue("last");
  Awaited<int> done;
  constexpr int count = 64;
  Awaited<bool> open;
  for (int i = 0; i < count; ++i) {
    platform().globalQueue()->async([this, &done, &open, last, i] {
      const auto own = platform().createSerialQueue("own " + std::to_string(i));
      own->async([&open] { EXPECT_TRUE(open.wait([](bool value) { return value; })); });
      own->sync([&last] { last->sync([] {}); });
      done.change([](int &value) { ++value; });
    });
  }
  open.change([](bool &value) { value = true; });
  EXPECT_TRUE(done.wait([](int value) { return value == count; }));
}

STORIX_CONTRACT(QueuesContract);

}  // namespace
}  // namespace storix::contract
