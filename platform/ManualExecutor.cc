#include "platform/ManualExecutor.h"

#include <algorithm>
#include <utility>

namespace storix {

ManualExecutor::~ManualExecutor() {
  // What is dropped may hold the last reference to a queue, which then submits what it still has.
  while (readyCount() + delayedCount() > 0) {
    std::deque<Task> ready;
    std::vector<Delayed> delayed;
    const std::lock_guard lock(mutex_);
    ready.swap(ready_);
    delayed.swap(delayed_);
  }
}

void ManualExecutor::execute(Task task) {
  const std::lock_guard lock(mutex_);
  ready_.push_back(std::move(task));
}

void ManualExecutor::executeAfter(std::chrono::nanoseconds delay, Task task) {
  const std::lock_guard lock(mutex_);
  if (delay <= std::chrono::nanoseconds::zero()) {
    ready_.push_back(std::move(task));
    return;
  }
  const std::chrono::nanoseconds due =
      delay > std::chrono::nanoseconds::max() - now_ ? std::chrono::nanoseconds::max() : now_ + delay;
  const auto later =
      std::upper_bound(delayed_.begin(), delayed_.end(), due,
                       [](std::chrono::nanoseconds time, const Delayed &other) { return time < other.due; });
  delayed_.insert(later, {due, std::move(task)});
}

std::chrono::steady_clock::time_point ManualExecutor::now() const {
  const std::lock_guard lock(mutex_);
  return std::chrono::steady_clock::time_point(now_);
}

bool ManualExecutor::runOne() {
  std::unique_lock lock(mutex_);
  if (ready_.empty()) return false;
  const Task task = std::move(ready_.front());
  ready_.pop_front();
  lock.unlock();
  task();
  return true;
}

std::size_t ManualExecutor::runUntilIdle() {
  std::size_t count = 0;
  while (runOne()) ++count;
  return count;
}

void ManualExecutor::advance(std::chrono::nanoseconds time) {
  const std::lock_guard lock(mutex_);
  now_ += time;
  const auto firstLater =
      std::find_if(delayed_.begin(), delayed_.end(), [this](const Delayed &delayed) { return delayed.due > now_; });
  for (auto delayed = delayed_.begin(); delayed != firstLater; ++delayed) ready_.push_back(std::move(delayed->task));
  delayed_.erase(delayed_.begin(), firstLater);
}

std::size_t ManualExecutor::readyCount() const {
  const std::lock_guard lock(mutex_);
  return ready_.size();
}

std::size_t ManualExecutor::delayedCount() const {
  const std::lock_guard lock(mutex_);
  return delayed_.size();
}

}  // namespace storix
