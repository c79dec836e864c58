#pragma once

#include <chrono>
#include <functional>

namespace storix {

using Task = std::function<void()>;

/// Where the tasks of queues run. Thread-safe. `ThreadPool` is the real one, `ManualExecutor` the
/// one that tests run by hand.
class Executor {
 public:
  virtual ~Executor() = default;

  /// Runs the task later, on a thread of the executor's; never inside this call.
  virtual void execute(Task task) = 0;

  /// As `execute`, once the delay has passed. Never earlier.
  virtual void executeAfter(std::chrono::nanoseconds delay, Task task) = 0;

  /// The time by which delays are counted.
  [[nodiscard]] virtual std::chrono::steady_clock::time_point now() const { return std::chrono::steady_clock::now(); }

  /// A task that is about to wait for something says so, and says when the wait is over, so that the
  /// executor can have another thread work meanwhile. Use `BlockingScope`.
  virtual void willBlock() {}
  virtual void didUnblock() {}

  /// False where nothing runs unless somebody calls for it; a `sync` that waits for earlier tasks then
  /// runs them itself.
  [[nodiscard]] virtual bool hasThreads() const { return true; }
};

/// Around every wait for another thread, or for the disk, inside a task.
class BlockingScope {
 public:
  explicit BlockingScope(Executor &executor) : executor_(executor) { executor_.willBlock(); }
  ~BlockingScope() { executor_.didUnblock(); }
  BlockingScope(const BlockingScope &) = delete;
  BlockingScope &operator=(const BlockingScope &) = delete;

 private:
  Executor &executor_;
};

}  // namespace storix
