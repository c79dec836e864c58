#include "platform/linux/EventLoop.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdint>

namespace storix::linuxhost {

namespace {

sigset_t endingSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGTERM);
  sigaddset(&set, SIGINT);
  return set;
}

}  // namespace

Result<std::unique_ptr<EventLoop>> EventLoop::create() {
  UniqueFd wakeUp(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!wakeUp) return posixError(errno, "making the event loop");
  const sigset_t ending = endingSignals();
  UniqueFd signals(::signalfd(-1, &ending, SFD_CLOEXEC | SFD_NONBLOCK));
  if (!signals) return posixError(errno, "making the event loop");

  std::unique_ptr<EventLoop> loop(new EventLoop);
  loop->wakeUp_ = std::move(wakeUp);
  loop->signals_ = std::move(signals);
  ::pthread_sigmask(SIG_BLOCK, &ending, &loop->previousMask_);
  struct sigaction ignore {};
  ignore.sa_handler = SIG_IGN;
  ::sigaction(SIGPIPE, &ignore, &loop->previousPipeAction_);
  return loop;
}

EventLoop::~EventLoop() {
  ::sigaction(SIGPIPE, &previousPipeAction_, nullptr);
  ::pthread_sigmask(SIG_SETMASK, &previousMask_, nullptr);
}

void EventLoop::run() {
  std::array<pollfd, 2> watched{{{wakeUp_.get(), POLLIN, 0}, {signals_.get(), POLLIN, 0}}};
  for (;;) {
    // Interrupted or short of memory, it is asked again.
    if (::poll(watched.data(), watched.size(), -1) <= 0) continue;
    if (watched[0].revents != 0) runPosted();
    signalfd_siginfo signal{};
    if (watched[1].revents != 0 && ::read(signals_.get(), &signal, sizeof signal) == sizeof signal) return;
  }
}

void EventLoop::runPosted() {
  std::uint64_t count = 0;
  while (::read(wakeUp_.get(), &count, sizeof count) < 0 && errno == EINTR) continue;
  // Only what is there now, so that tasks which post tasks cannot keep a signal waiting.
  std::deque<Task> tasks;
  {
    const std::lock_guard lock(mutex_);
    tasks.swap(posted_);
  }
  for (Task &task : tasks) {
    task();
    task = nullptr;
  }
}

void EventLoop::post(Task task) {
  {
    const std::lock_guard lock(mutex_);
    posted_.push_back(std::move(task));
  }
  const std::uint64_t one = 1;
  while (::write(wakeUp_.get(), &one, sizeof one) < 0 && errno == EINTR) continue;
}

}  // namespace storix::linuxhost
