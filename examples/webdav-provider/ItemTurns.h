#pragma once

#include <condition_variable>
#include <mutex>
#include <set>
#include <stop_token>
#include <string>
#include <utility>

namespace storix::example {

/// Keeps each item to one thread at a time. Thread-safe.
class ItemTurns {
 public:
  /// An item's turn, until it goes out of scope. False when the wait was broken off.
  class Turn {
   public:
    Turn(ItemTurns &turns, std::string path, const std::stop_token &cancellation)
        : turns_(turns), path_(std::move(path)) {
      std::unique_lock lock(turns_.mutex_);
      taken_ = turns_.given_.wait(lock, cancellation, [this] { return !turns_.taken_.contains(path_); });
      if (taken_) turns_.taken_.insert(path_);
    }
    ~Turn() {
      if (!taken_) return;
      {
        const std::lock_guard lock(turns_.mutex_);
        turns_.taken_.erase(path_);
      }
      turns_.given_.notify_all();
    }
    Turn(const Turn &) = delete;
    Turn &operator=(const Turn &) = delete;
    explicit operator bool() const { return taken_; }

   private:
    ItemTurns &turns_;
    std::string path_;
    bool taken_ = false;
  };

 private:
  std::mutex mutex_;
  std::condition_variable_any given_;
  std::set<std::string> taken_;  ///< Under the mutex.
};

}  // namespace storix::example
