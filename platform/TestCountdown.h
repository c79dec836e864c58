#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <mutex>

namespace storix {

/// What tests of threads wait for: that something has happened so many times. Thread-safe.
class TestCountdown {
 public:
  explicit TestCountdown(std::size_t count = 1) : left_(count) {}

  void arrive() {
    const std::lock_guard lock(mutex_);
    if (left_ > 0 && --left_ == 0) changed_.notify_all();
  }

  /// False when it did not come to that within a time that no healthy machine needs.
  [[nodiscard]] bool wait() {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, std::chrono::seconds(90), [this] { return left_ == 0; });
  }

  /// For tasks that meet: arrives, and waits for the others.
  [[nodiscard]] bool arriveAndWait() {
    arrive();
    return wait();
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::size_t left_;
};

}  // namespace storix
