#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/Executor.h"

namespace storix {

/// Hands tasks on when their delay has passed, never earlier, those that are due at the same time in
/// the order in which they were added. Its thread is started with the first delayed task. Thread-safe.
class DelayTimer {
 public:
  /// `due` takes each task, on the timer's thread.
  explicit DelayTimer(std::function<void(Task)> due);
  ~DelayTimer();
  DelayTimer(const DelayTimer &) = delete;
  DelayTimer &operator=(const DelayTimer &) = delete;

  void add(std::chrono::nanoseconds delay, Task task);

  /// Drops what still waits and ends the thread; what is added later is dropped.
  void stop();

 private:
  using Clock = std::chrono::steady_clock;

  struct Delayed {
    Clock::time_point due;
    std::uint64_t number;
    Task task;
  };

  static bool isLater(const Delayed &one, const Delayed &other);
  void run();

  const std::function<void(Task)> due_;

  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Delayed> waiting_;  // a heap, the one that is due first on top
  std::uint64_t lastNumber_ = 0;
  bool stopped_ = false;
  std::thread thread_;
};

}  // namespace storix
