#include "sdk/src/BusLoop.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <iterator>
#include <optional>

namespace storix::sdk {

namespace {

/// How long poll may wait, rounded up so that it never returns just before the time.
int millisecondsUntil(std::optional<BusLoop::Clock::time_point> time) {
  if (!time) return -1;
  const auto now = BusLoop::Clock::now();
  if (*time <= now) return 0;
  const auto remaining = std::chrono::ceil<std::chrono::milliseconds>(*time - now).count();
  return static_cast<int>(std::min<std::int64_t>(remaining, 3'600'000));
}

}  // namespace

BusLoop::BusLoop() : wakeUp_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

Result<std::shared_ptr<wire::BusConnection>> BusLoop::add(UniqueFd socket, wire::BusConnection::Options options,
                                                          const std::function<void(wire::BusConnection &)> &prepare) {
  if (!wakeUp_) return posixError(EMFILE, "making an event descriptor");
  {
    const std::lock_guard lock(mutex_);
    if (stopped_) return posixError(ESHUTDOWN, "connecting while everything ends");
  }
  options.runLater = [this](Task task) { later(std::move(task)); };
  auto opened = wire::BusConnection::open(std::move(socket), std::move(options));
  if (!opened) return opened;
  opened.value()->setWantedChangedHandler([this] { wake(); });
  if (prepare) prepare(*opened.value());
  {
    const std::lock_guard lock(mutex_);
    connections_.push_back(opened.value());
  }
  wake();
  return opened;
}

void BusLoop::later(Task task) {
  {
    const std::lock_guard lock(mutex_);
    tasks_.push_back(std::move(task));
  }
  if (!isCurrentThread()) wake();
}

void BusLoop::at(Clock::time_point time, const void *owner, Task task) {
  bool earliest = false;
  {
    const std::lock_guard lock(mutex_);
    const auto added = timers_.insert_or_assign({time, owner}, std::move(task)).first;
    earliest = added == timers_.begin();
  }
  if (earliest && !isCurrentThread()) wake();
}

void BusLoop::cancel(Clock::time_point time, const void *owner) {
  Task cancelled;  // destroyed after the mutex is released: it may own anything
  const std::lock_guard lock(mutex_);
  if (const auto found = timers_.find({time, owner}); found != timers_.end()) {
    cancelled = std::move(found->second);
    timers_.erase(found);
  }
}

void BusLoop::run() {
  thread_ = std::this_thread::get_id();
  for (;;) {
    while (runTasks()) {
    }
    std::vector<std::shared_ptr<wire::BusConnection>> connections;
    bool stopping = false;
    {
      const std::lock_guard lock(mutex_);
      connections = connections_;
      stopping = stopped_;
    }
    if (stopping) {
      for (const auto &connection : connections) connection->close();
      while (runTasks()) {
      }
      return dropEnded();
    }
    waitAndProcess(connections);
    dropEnded();
  }
}

void BusLoop::stop() {
  {
    const std::lock_guard lock(mutex_);
    stopped_ = true;
  }
  wake();
}

bool BusLoop::isCurrentThread() const { return thread_.load() == std::this_thread::get_id(); }

void BusLoop::wake() {
  const std::uint64_t one = 1;
  // It can only fail when the counter is full, and then the loop is awake.
  [[maybe_unused]] const ssize_t ignored = ::write(wakeUp_.get(), &one, sizeof one);
}

bool BusLoop::runTasks() {
  std::vector<Task> due;
  {
    const std::lock_guard lock(mutex_);
    due.swap(tasks_);
    const auto now = Clock::now();
    while (!timers_.empty() && timers_.begin()->first.first <= now) {
      due.push_back(std::move(timers_.begin()->second));
      timers_.erase(timers_.begin());
    }
  }
  for (const auto &task : due) task();
  return !due.empty();
}

void BusLoop::waitAndProcess(const std::vector<std::shared_ptr<wire::BusConnection>> &connections) {
  std::optional<Clock::time_point> wakeAt;
  const auto notLaterThan = [&wakeAt](Clock::time_point time) { wakeAt = wakeAt ? std::min(*wakeAt, time) : time; };
  {
    const std::lock_guard lock(mutex_);
    if (!tasks_.empty()) notLaterThan(Clock::time_point::min());
    if (!timers_.empty()) notLaterThan(timers_.begin()->first.first);
  }
  std::vector<pollfd> waited{{wakeUp_.get(), POLLIN, 0}};
  std::vector<std::optional<Clock::time_point>> deadlines;
  for (const auto &connection : connections) {
    const auto wanted = connection->wanted();
    waited.push_back({connection->fd(), wanted.events, 0});
    deadlines.push_back(wanted.deadline);
    if (wanted.deadline) notLaterThan(*wanted.deadline);
  }
  if (::poll(waited.data(), waited.size(), millisecondsUntil(wakeAt)) < 0) return;  // EINTR: look again
  if (waited[0].revents != 0) {
    std::uint64_t count = 0;
    [[maybe_unused]] const ssize_t ignored = ::read(wakeUp_.get(), &count, sizeof count);
  }
  const auto now = Clock::now();
  for (std::size_t i = 0; i < connections.size(); ++i) {
    if (waited[i + 1].revents != 0 || (deadlines[i] && *deadlines[i] <= now)) connections[i]->process();
  }
}

void BusLoop::dropEnded() {
  std::vector<std::shared_ptr<wire::BusConnection>> ended;
  {
    const std::lock_guard lock(mutex_);
    const auto open = [](const auto &connection) { return connection->isOpen(); };
    const auto firstEnded = std::stable_partition(connections_.begin(), connections_.end(), open);
    ended.assign(std::make_move_iterator(firstEnded), std::make_move_iterator(connections_.end()));
    connections_.erase(firstEnded, connections_.end());
  }
  for (const auto &connection : ended) connection->releaseSocket();
}

}  // namespace storix::sdk
