#include "platform/linux/sockets/IoLoop.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>

#include <atomic>
#include <future>
#include <latch>
#include <semaphore>
#include <thread>
#include <vector>

#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

constexpr auto generous = std::chrono::seconds(60);

UniqueFd makeEvent() { return UniqueFd(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)); }
void raise(const UniqueFd &event) { eventfd_write(event.get(), 1); }
void lower(const UniqueFd &event) {
  eventfd_t value = 0;
  eventfd_read(event.get(), &value);
}

class IoLoopTest : public testing::Test {
 protected:
  ThreadPool pool_;
};

TEST_F(IoLoopTest, ReadyDescriptorIsServedAgainAndAgain) {
  IoLoop loop(pool_);
  const UniqueFd event = makeEvent();
  std::promise<void> third;
  int count = 0;
  const auto watch = loop.watch(event.get(), EPOLLIN, [&count, &third](std::uint32_t events) {
    EXPECT_TRUE(events & EPOLLIN);
    if (++count == 3) third.set_value();
    if (count > 3) return;
  });
  raise(event);
  ASSERT_EQ(third.get_future().wait_for(generous), std::future_status::ready);
  watch->setEvents(0);
}

TEST_F(IoLoopTest, SlowHandlersDelayNobodyElse) {
  IoLoop loop(pool_);
  constexpr int slow = 8;
  std::latch allRun(slow);
  std::vector<UniqueFd> events;
  events.reserve(slow);
  std::vector<std::unique_ptr<IoLoop::Watch>> watches;
  for (int i = 0; i < slow; ++i) {
    events.push_back(makeEvent());
    const int fd = events.back().get();
    watches.push_back(loop.watch(fd, EPOLLIN, [&allRun, &event = events[static_cast<std::size_t>(i)]](std::uint32_t) {
      lower(event);
      allRun.arrive_and_wait();
    }));
    ASSERT_TRUE(watches.back());
  }
  for (const UniqueFd &event : events) raise(event);
  allRun.wait();
}

TEST_F(IoLoopTest, OneHandlerNeverRunsTwiceAtOnce) {
  IoLoop loop(pool_);
  const UniqueFd event = makeEvent();
  std::atomic<int> inside = 0;
  std::atomic<int> left = 500;
  std::promise<void> done;
  const auto watch = loop.watch(event.get(), EPOLLIN, [&inside, &left, &done](std::uint32_t) {
    EXPECT_EQ(++inside, 1);
    if (--left == 0) done.set_value();
    --inside;
  });
  std::atomic<bool> stop = false;
  std::thread other([&watch, &stop] {
    while (!stop) {
      watch->setEvents(EPOLLIN | EPOLLOUT);
      watch->setEvents(EPOLLIN);
    }
  });
  raise(event);
  EXPECT_EQ(done.get_future().wait_for(generous), std::future_status::ready);
  stop = true;
  other.join();
  watch->setEvents(0);
}

TEST_F(IoLoopTest, DestroyingAWatchWaitsForItsHandler) {
  IoLoop loop(pool_);
  const UniqueFd event = makeEvent();
  std::promise<void> entered;
  std::promise<void> leave;
  std::atomic<bool> over = false;
  auto watch = loop.watch(event.get(), EPOLLIN, [&](std::uint32_t) {
    lower(event);
    entered.set_value();
    leave.get_future().wait();
    over = true;
  });
  raise(event);
  ASSERT_EQ(entered.get_future().wait_for(generous), std::future_status::ready);
  std::thread destroyer([&watch] { watch.reset(); });
  leave.set_value();
  destroyer.join();
  EXPECT_TRUE(over);
}

TEST_F(IoLoopTest, AHandlerMayDestroyItsOwnWatch) {
  IoLoop loop(pool_);
  const UniqueFd event = makeEvent();
  std::promise<void> gone;
  std::unique_ptr<IoLoop::Watch> watch;
  const UniqueFd start = makeEvent();
  watch = loop.watch(start.get(), 0, [&watch, &gone](std::uint32_t) {
    watch.reset();
    gone.set_value();
  });
  watch->setEvents(EPOLLIN);
  raise(start);
  EXPECT_EQ(gone.get_future().wait_for(generous), std::future_status::ready);
}

TEST_F(IoLoopTest, PausedWatchIsNotServedUntilItGoesOn) {
  IoLoop loop(pool_);
  const UniqueFd paused = makeEvent();
  const UniqueFd other = makeEvent();
  std::atomic<bool> allowed = false;
  std::promise<void> ran;
  std::promise<void> otherRan;
  const auto watch = loop.watch(paused.get(), 0, [&](std::uint32_t) {
    EXPECT_TRUE(allowed);
    lower(paused);
    ran.set_value();
  });
  const auto otherWatch = loop.watch(other.get(), EPOLLIN, [&](std::uint32_t) {
    lower(other);
    otherRan.set_value();
  });
  raise(paused);
  raise(other);
  ASSERT_EQ(otherRan.get_future().wait_for(generous), std::future_status::ready);
  allowed = true;
  watch->setEvents(EPOLLIN);
  EXPECT_EQ(ran.get_future().wait_for(generous), std::future_status::ready);
}

TEST_F(IoLoopTest, AThreadThatStaysSeesAtOnceWhatIsWantedOfItsDescriptor) {
  IoLoop loop(pool_);
  const UniqueFd event = makeEvent();
  // Far more than could be seen in time by a thread that looks when it has waited long enough.
  std::atomic<int> left = 5'000;
  std::promise<void> allSeen;
  std::unique_ptr<IoLoop::Watch> watch;
  watch = loop.watch(event.get(), 0, [&](std::uint32_t) {
    watch->setEvents(EPOLLIN);
    if (--left == 0) allSeen.set_value();
  });
  std::atomic<bool> over = false;
  std::thread changing([&] {
    while (!over) {
      watch->setEvents(EPOLLOUT);
      std::this_thread::yield();
    }
  });
  EXPECT_EQ(allSeen.get_future().wait_for(generous), std::future_status::ready);
  over = true;
  changing.join();
  loop.end();
}

/// A peer that asks, and one that answers as soon as it is asked.
class AskingAndAnswering {
 public:
  /// What the handlers do besides.
  std::function<void()> asked;
  std::function<void()> answered;

  explicit AskingAndAnswering(IoLoop &loop)
      : askingWatch_(loop.watch(asking_.get(), EPOLLIN,
                                [this](std::uint32_t) {
                                  lower(asking_);
                                  asked();
                                })),
        answeringWatch_(loop.watch(
            answering_.get(), EPOLLIN,
            [this](std::uint32_t) {
              lower(answering_);
              answered();
            },
            IoLoop::Expected::answers)) {}

  void ask() { raise(asking_); }
  void answer() { raise(answering_); }

 private:
  const UniqueFd asking_ = makeEvent();
  const UniqueFd answering_ = makeEvent();
  const std::unique_ptr<IoLoop::Watch> askingWatch_;
  const std::unique_ptr<IoLoop::Watch> answeringWatch_;
};

TEST_F(IoLoopTest, AnswersAreServedByTheThreadThatStaysWithWhoAsks) {
  IoLoop loop(pool_);
  std::promise<void> together;
  std::thread::id asker;
  bool over = false;
  AskingAndAnswering peers(loop);
  peers.asked = [&] {
    asker = std::this_thread::get_id();
    peers.answer();
  };
  // The first times another thread may serve it, or the one that stays has waited too long.
  peers.answered = [&] {
    if (over) return;
    over = asker == std::this_thread::get_id();
    if (over) return together.set_value();
    peers.ask();
  };
  peers.ask();
  EXPECT_EQ(together.get_future().wait_for(generous), std::future_status::ready);
}

TEST_F(IoLoopTest, AHandlerThatBlocksHoldsUpNobodyWhomItsThreadStaysWith) {
  IoLoop loop(pool_);
  // In turn one that blocks and one that does not, after which a thread may stay with both again.
  constexpr int lastRound = 201;
  std::atomic<int> round = 0;
  std::binary_semaphore answer(0);
  std::promise<void> done;
  AskingAndAnswering peers(loop);
  peers.asked = [&] {
    const int current = ++round;
    peers.answer();
    if (current % 2 == 0) return;
    const BlockingScope blocking(pool_);
    EXPECT_TRUE(answer.try_acquire_for(generous));
    if (current < lastRound) return peers.ask();
    done.set_value();
  };
  peers.answered = [&] {
    if (round % 2 == 0) return peers.ask();
    answer.release();
  };
  peers.ask();
  EXPECT_EQ(done.get_future().wait_for(generous), std::future_status::ready);
}

TEST_F(IoLoopTest, TasksOfAHandlerRunAfterItOnTheSameThread) {
  IoLoop loop(pool_);
  const UniqueFd event = makeEvent();
  std::promise<std::pair<std::thread::id, std::thread::id>> ran;
  bool over = false;
  const auto watch = loop.watch(event.get(), EPOLLIN, [&](std::uint32_t) {
    lower(event);
    pool_.execute([&ran, &over, handlerThread = std::this_thread::get_id()] {
      EXPECT_TRUE(over);
      ran.set_value({handlerThread, std::this_thread::get_id()});
    });
    over = true;
  });
  raise(event);
  auto threads = ran.get_future();
  ASSERT_EQ(threads.wait_for(generous), std::future_status::ready);
  const auto [handlerThread, taskThread] = threads.get();
  EXPECT_EQ(handlerThread, taskThread);
}

TEST_F(IoLoopTest, WatchOutlivesItsLoop) {
  const UniqueFd event = makeEvent();
  std::unique_ptr<IoLoop::Watch> watch;
  {
    IoLoop loop(pool_);
    watch = loop.watch(event.get(), EPOLLIN, [](std::uint32_t) {});
  }
  watch.reset();
}

TEST_F(IoLoopTest, AFileThatCannotBeWaitedForIsRefused) {
  IoLoop loop(pool_);
  EXPECT_EQ(loop.watch(-1, EPOLLIN, [](std::uint32_t) {}), nullptr);
}

TEST_F(IoLoopTest, EndWaitsForTheHandlerThatRunsAndLetsNoneStart) {
  IoLoop loop(pool_);
  const UniqueFd event = makeEvent();
  const UniqueFd late = makeEvent();
  std::promise<void> started;
  std::promise<void> mayFinish;
  std::atomic<bool> finished = false;
  const auto watch = loop.watch(event.get(), EPOLLIN, [&](std::uint32_t) {
    lower(event);
    started.set_value();
    mayFinish.get_future().wait();
    finished = true;
  });
  raise(event);
  started.get_future().wait();
  std::thread finisher([&mayFinish] { mayFinish.set_value(); });
  loop.end();
  finisher.join();
  EXPECT_TRUE(finished);
  const auto lateWatch = loop.watch(late.get(), 0, [](std::uint32_t) { ADD_FAILURE(); });
  ASSERT_NE(lateWatch, nullptr);
  lateWatch->setEvents(EPOLLIN);
  raise(late);
  loop.end();
}

}  // namespace
}  // namespace storix::linuxhost
