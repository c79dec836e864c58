#include "platform/DelayTimer.h"

#include <algorithm>
#include <system_error>
#include <utility>

namespace storix {

DelayTimer::DelayTimer(std::function<void(Task)> due) : due_(std::move(due)) {}

DelayTimer::~DelayTimer() { stop(); }

bool DelayTimer::isLater(const Delayed &one, const Delayed &other) {
  return one.due != other.due ? one.due > other.due : one.number > other.number;
}

void DelayTimer::add(std::chrono::nanoseconds delay, Task task) {
  const Clock::time_point now = Clock::now();
  const Clock::time_point due = delay > Clock::time_point::max() - now ? Clock::time_point::max() : now + delay;
  const std::lock_guard lock(mutex_);
  if (stopped_) return;
  waiting_.push_back({due, ++lastNumber_, std::move(task)});
  std::push_heap(waiting_.begin(), waiting_.end(), isLater);
  if (!thread_.joinable()) {
    try {
      thread_ = std::thread(&DelayTimer::run, this);
    } catch (const std::system_error &) {
      // The system has no more threads: the next task that is added tries again.
    }
  } else if (waiting_.front().number == lastNumber_) {
    changed_.notify_one();
  }
}

void DelayTimer::run() {
  std::unique_lock lock(mutex_);
  while (!stopped_) {
    if (waiting_.empty()) {
      changed_.wait(lock);
    } else if (waiting_.front().due > Clock::now()) {
      // A copy: what stands in the heap moves while this waits.
      const Clock::time_point due = waiting_.front().due;
      changed_.wait_until(lock, due);
    } else {
      std::pop_heap(waiting_.begin(), waiting_.end(), isLater);
      Task task = std::move(waiting_.back().task);
      waiting_.pop_back();
      lock.unlock();
      due_(std::move(task));
      lock.lock();
    }
  }
}

void DelayTimer::stop() {
  std::vector<Delayed> dropped;
  std::thread thread;
  {
    const std::lock_guard lock(mutex_);
    stopped_ = true;
    dropped.swap(waiting_);
    thread.swap(thread_);
    changed_.notify_one();
  }
  if (thread.joinable()) thread.join();
}

}  // namespace storix
