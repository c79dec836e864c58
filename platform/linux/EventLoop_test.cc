#include "platform/linux/EventLoop.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <functional>
#include <thread>
#include <vector>

namespace storix::linuxhost {
namespace {

TEST(EventLoopTest, PostedTasksRunInOrderOnTheThreadThatRuns) {
  auto loop = EventLoop::create();
  ASSERT_TRUE(loop.ok());
  std::vector<int> order;
  std::vector<std::thread::id> threads;
  std::thread poster([&loop, &order, &threads] {
    for (int i = 0; i < 100; ++i) {
      loop.value()->post([&order, &threads, i] {
        order.push_back(i);
        threads.push_back(std::this_thread::get_id());
      });
    }
    loop.value()->post([] { ::kill(::getpid(), SIGTERM); });
  });
  loop.value()->run();
  poster.join();
  ASSERT_EQ(order.size(), 100U);
  for (int i = 0; i < 100; ++i) {
    EXPECT_EQ(order[static_cast<std::size_t>(i)], i);
    EXPECT_EQ(threads[static_cast<std::size_t>(i)], std::this_thread::get_id());
  }
}

TEST(EventLoopTest, TermAndInterruptEndIt) {
  for (const int signal : {SIGTERM, SIGINT}) {
    auto loop = EventLoop::create();
    ASSERT_TRUE(loop.ok());
    ::kill(::getpid(), signal);
    loop.value()->run();
  }
}

TEST(EventLoopTest, TasksThatPostTasksDoNotKeepASignalWaiting) {
  auto loop = EventLoop::create();
  ASSERT_TRUE(loop.ok());
  std::function<void()> again = [&loop, &again] { loop.value()->post(again); };
  loop.value()->post(again);
  ::kill(::getpid(), SIGTERM);
  loop.value()->run();
}

TEST(EventLoopTest, TasksThatHaveNotRunAreDropped) {
  const auto held = std::make_shared<int>(0);
  {
    auto loop = EventLoop::create();
    ASSERT_TRUE(loop.ok());
    loop.value()->post([held] { FAIL(); });
    EXPECT_EQ(held.use_count(), 2);
  }
  EXPECT_EQ(held.use_count(), 1);
}

TEST(EventLoopTest, WritingToAClosedPipeIsAnError) {
  auto loop = EventLoop::create();
  ASSERT_TRUE(loop.ok());
  int ends[2];
  ASSERT_EQ(::pipe(ends), 0);
  ::close(ends[0]);
  EXPECT_EQ(::write(ends[1], "x", 1), -1);
  EXPECT_EQ(errno, EPIPE);
  ::close(ends[1]);
}

}  // namespace
}  // namespace storix::linuxhost
