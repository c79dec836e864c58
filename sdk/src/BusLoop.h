#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Executor.h"
#include "platform/Result.h"
#include "wire/BusConnection.h"
#include "wire/UniqueFd.h"

namespace storix::sdk {

/// Drives a few connections, and timers, from one thread: the one that calls `run`. A client gives it
/// a thread of its own, an extension its main thread. Everything but `run` may be called from any
/// thread. All handlers of the connections and all tasks run on that one thread.
class BusLoop {
 public:
  using Clock = std::chrono::steady_clock;
  using Descriptors = wire::BusConnection::Descriptors;

  BusLoop();
  BusLoop(const BusLoop &) = delete;
  BusLoop &operator=(const BusLoop &) = delete;

  /// Takes over a connected socket and starts the login. The loop itself sees to `runLater`. `prepare`
  /// exports objects and sets handlers before anything is processed.
  Result<std::shared_ptr<wire::BusConnection>> add(UniqueFd socket, wire::BusConnection::Options options,
                                                   const std::function<void(wire::BusConnection &)> &prepare = {});

  /// Runs the task soon, not inside this call.
  void later(Task task);

  /// Runs the task at that time, unless it is cancelled before with the same words. `owner` only tells
  /// timers of the same time apart.
  void at(Clock::time_point time, const void *owner, Task task);
  void cancel(Clock::time_point time, const void *owner);

  /// Works until `stop`; then closes the connections, and returns when their handlers and all tasks
  /// have run.
  void run();
  void stop();

  [[nodiscard]] bool isCurrentThread() const;

 private:
  void wake();
  bool runTasks();
  void waitAndProcess(const std::vector<std::shared_ptr<wire::BusConnection>> &connections);
  void dropEnded();

  UniqueFd wakeUp_;  ///< an eventfd

  std::mutex mutex_;
  // Under the mutex:
  std::vector<std::shared_ptr<wire::BusConnection>> connections_;
  std::vector<Task> tasks_;
  std::map<std::pair<Clock::time_point, const void *>, Task> timers_;
  bool stopped_ = false;

  std::atomic<std::thread::id> thread_;  ///< of `run`
};

}  // namespace storix::sdk
