#pragma once

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/Executor.h"
#include "platform/ManualExecutor.h"
#include "platform/Queue.h"
#include "platform/ThreadPool.h"

namespace storix::fake {

/// What the calling thread is doing now, for tests that care where a handler runs: "queue <label>",
/// "operation queue <name>", "platform thread" (a callback of the platform's own), "main event loop"
/// (a system notification), or "caller" (none of these: the test's own thread).
std::string currentContext();

/// The executor under the queues of one fake host: run by hand, or by threads. Knows when no task is
/// left. Thread-safe.
class FakeExecutor : public Executor {
 public:
  enum class Kind { manual, threads };

  explicit FakeExecutor(Kind kind);
  ~FakeExecutor() override;

  [[nodiscard]] Kind kind() const { return manual_ ? Kind::manual : Kind::threads; }

  void execute(Task task) override;
  void executeAfter(std::chrono::nanoseconds delay, Task task) override;
  [[nodiscard]] std::chrono::steady_clock::time_point now() const override {
    return manual_ ? manual_->now() : threads_->now();
  }
  void willBlock() override;
  void didUnblock() override;
  [[nodiscard]] bool hasThreads() const override { return !manual_; }

  /// Runs one task by hand; false when there is none, or when threads run them.
  bool runOne();

  /// Runs all tasks, or waits until the threads have run them, those that they submit included. What
  /// waits for its delay does not count.
  void runUntilIdle();

  /// Moves the clock of an executor that is run by hand.
  void advance(std::chrono::nanoseconds time);

  /// Tells of every task that is submitted, for tests that care when. Set before anything runs.
  void setSubmissionObserver(std::function<void()> observer) { submissionObserver_ = std::move(observer); }

  /// Runs the task as a callback of the platform's own, outside every queue.
  void runOnPlatformThread(Task task);
  /// As above, marked as the main event loop.
  void runOnMainEventLoop(Task task);

 private:
  Task counted(Task task);

  mutable std::mutex mutex_;
  std::condition_variable idle_;
  std::size_t outstanding_ = 0;
  std::function<void()> submissionObserver_;
  // Last, so that the threads end before what they use.
  std::unique_ptr<ManualExecutor> manual_;
  std::unique_ptr<ThreadPool> threads_;
};

/// Runs tasks on the platform's own threads one at a time, in order. Thread-safe.
class PlatformLane {
 public:
  /// `executor` must outlive the lane's tasks.
  explicit PlatformLane(FakeExecutor &executor);
  void submit(Task task);

 private:
  struct State;
  static void runNext(const std::shared_ptr<State> &state);

  std::shared_ptr<State> state_;
};

/// Marks the calling thread for `currentContext`.
class ContextMark {
 public:
  explicit ContextMark(const char *name);
  ~ContextMark();
  ContextMark(const ContextMark &) = delete;
  ContextMark &operator=(const ContextMark &) = delete;

 private:
  const char *previous_;
};

}  // namespace storix::fake
