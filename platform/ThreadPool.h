#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>

#include "platform/Executor.h"

namespace storix {

/// The real executor: threads that start when there is work, as many as the machine has processors,
/// one more for each that says it is waiting, and that end after a while without work.
class ThreadPool : public Executor {
 public:
  /// `concurrency` is the number of threads that work at the same time; 0 means one a processor,
  /// and two at least. A thread that had no work for `idleTime` ends.
  explicit ThreadPool(std::size_t concurrency = 0, std::chrono::nanoseconds idleTime = std::chrono::seconds(10));

  /// As `end`.
  ~ThreadPool() override;

  /// Drops what waits for its delay, runs what was given to `execute` and what that gives, and ends all
  /// threads. What comes later is dropped unrun. Not from a task of the pool; a second call does nothing.
  void end();

  void execute(Task task) override;
  void executeAfter(std::chrono::nanoseconds delay, Task task) override;
  void willBlock() override;
  void didUnblock() override;

  /// While it stands on a thread, tasks that this thread gives to the pool wait for its end and run
  /// there, on this thread, in order; if the thread says that it blocks, they go to the pool after
  /// all. A worker that serves a connection wraps each request in one, so that a reply that is
  /// submitted to the global queue costs no change of thread.
  class LocalTasks {
   public:
    /// `whenBlocking` (may be null) runs each time that the thread says that it blocks.
    explicit LocalTasks(ThreadPool &pool, const std::function<void()> *whenBlocking = nullptr);
    ~LocalTasks();
    LocalTasks(const LocalTasks &) = delete;
    LocalTasks &operator=(const LocalTasks &) = delete;

   private:
    friend class ThreadPool;
    struct State;
    std::unique_ptr<State> state_;
  };

 private:
  struct Implementation;
  std::unique_ptr<Implementation> implementation_;
};

}  // namespace storix
