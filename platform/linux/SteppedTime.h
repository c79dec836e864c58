#pragma once

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/ThreadPool.h"

namespace storix::linuxhost {

/// An executor for tests: tasks run at once on a pool, but time stands still until the test moves it.
/// With it the pool ends, since what still runs there may ask for the time. Thread-safe.
class SteppedTime : public Executor {
 public:
  explicit SteppedTime(ThreadPool &pool) : pool_(pool) {}
  ~SteppedTime() override { pool_.end(); }
  SteppedTime(const SteppedTime &) = delete;
  SteppedTime &operator=(const SteppedTime &) = delete;

  void execute(Task task) override { pool_.execute(std::move(task)); }

  void executeAfter(std::chrono::nanoseconds delay, Task task) override {
    {
      const std::lock_guard lock(mutex_);
      delayed_.push_back({now_ + delay, std::move(task)});
    }
    changed_.notify_all();
  }

  [[nodiscard]] std::chrono::steady_clock::time_point now() const override {
    const std::lock_guard lock(mutex_);
    return std::chrono::steady_clock::time_point(now_);
  }

  /// How many tasks wait for their time.
  [[nodiscard]] std::size_t delayedCount() const {
    const std::lock_guard lock(mutex_);
    return delayed_.size();
  }

  /// Waits until a task is to run in just that time; false when none comes.
  [[nodiscard]] bool waitForTaskIn(std::chrono::nanoseconds delay) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, std::chrono::seconds(60), [this, delay] {
      return std::any_of(delayed_.begin(), delayed_.end(),
                         [this, delay](const Delayed &delayed) { return delayed.due == now_ + delay; });
    });
  }

  /// Moves the clock; what is due is run soon.
  void advance(std::chrono::nanoseconds time) {
    std::vector<Delayed> due;
    {
      const std::lock_guard lock(mutex_);
      now_ += time;
      const auto later = std::stable_partition(delayed_.begin(), delayed_.end(),
                                               [this](const Delayed &delayed) { return delayed.due > now_; });
      due.assign(std::make_move_iterator(later), std::make_move_iterator(delayed_.end()));
      delayed_.erase(later, delayed_.end());
    }
    std::stable_sort(due.begin(), due.end(), [](const Delayed &a, const Delayed &b) { return a.due < b.due; });
    for (Delayed &delayed : due) pool_.execute(std::move(delayed.task));
  }

 private:
  struct Delayed {
    std::chrono::nanoseconds due;
    Task task;
  };

  ThreadPool &pool_;
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::chrono::nanoseconds now_{0};
  std::vector<Delayed> delayed_;
};

}  // namespace storix::linuxhost
