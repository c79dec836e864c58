#pragma once

#include <chrono>
#include <cstddef>
#include <deque>
#include <mutex>
#include <vector>

#include "platform/Executor.h"

namespace storix {

/// An executor that a test runs by hand: nothing runs until the test says so, and time stands still
/// until the test moves it. A `sync` on one of its queues runs what stands before it in that queue on
/// the caller's thread.
class ManualExecutor : public Executor {
 public:
  ManualExecutor() = default;

  /// Drops what has not run.
  ~ManualExecutor() override;

  void execute(Task task) override;
  void executeAfter(std::chrono::nanoseconds delay, Task task) override;

  [[nodiscard]] std::chrono::steady_clock::time_point now() const override;

  [[nodiscard]] bool hasThreads() const override { return false; }

  /// Runs the task that has waited longest; false when there is none.
  bool runOne();

  /// Runs tasks, those that they submit included, until none is left; gives their number.
  std::size_t runUntilIdle();

  /// Moves the clock; tasks whose delay has passed become ready, in the order of their times, but
  /// run only when told to.
  void advance(std::chrono::nanoseconds time);

  [[nodiscard]] std::size_t readyCount() const;
  [[nodiscard]] std::size_t delayedCount() const;

 private:
  struct Delayed {
    std::chrono::nanoseconds due;
    Task task;
  };

  mutable std::mutex mutex_;
  std::deque<Task> ready_;
  std::vector<Delayed> delayed_;
  std::chrono::nanoseconds now_{0};
};

}  // namespace storix
