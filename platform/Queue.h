#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <type_traits>
#include <utility>

#include "platform/Executor.h"

namespace storix {

/// Work queues. Tasks never throw.
///
/// What every queue promises:
///  1. Tasks start in the order in which they were submitted, whether synchronously or not; what one
///     thread submits first is first.
///  2. `async` and `asyncBarrier` never run the task inside the call.
///  3. `sync` and `syncBarrier` return after the task has run, and the task runs on the caller's
///     thread. Where nothing stands before it, that costs about an uncontended lock and no
///     allocation. Calling it from a task of the same queue is a programming error, but for a plain
///     `sync` on a concurrent queue from a plain task while no barrier waits.
///  4. What a task wrote is visible to every task that the queue starts after it has ended, and to
///     the caller of `sync` after it returns; what the submitter wrote before is visible to the task.
///  5. While a queue is suspended no task of it starts, synchronous ones included; a task that has
///     started runs to its end. Suspensions are counted; a queue runs again when each has been
///     resumed. A task may suspend its own queue. More resumes than suspensions are a programming
///     error.
///  6. A queue whose last reference is gone runs what was submitted to it first, also if it is
///     suspended then; a task may hold the last reference to its own queue.
///  7. A task that waits (in `sync`, for another queue's task) never keeps other tasks from running,
///     however many wait at the same time.
///
/// Serial queues:
///  8. One task at a time.
///
/// Concurrent queues:
///  9. Plain tasks run side by side.
/// 10. A barrier task runs alone: after all that was submitted before it has ended, and before
///     anything submitted after it starts.
///
/// Operation queues:
/// 11. At most `maximumConcurrency` operations at a time.
///
/// Delayed tasks (`PlatformServices::runAfterDelay`):
/// 12. A delayed task is submitted to its queue when the delay has passed and not before.
///
/// Run once (`OnceToken`):
/// 13. The task runs the first time only; concurrent first callers wait until it has run.
class Queue : public std::enable_shared_from_this<Queue> {
 public:
  virtual ~Queue() = default;
  Queue(const Queue &) = delete;
  Queue &operator=(const Queue &) = delete;

  [[nodiscard]] const std::string &label() const { return label_; }

  /// Submits the task and returns at once.
  virtual void async(Task task) = 0;

  /// Runs the task after what was submitted before, and returns when it has run.
  template <class Function>
  void sync(Function &&function) {
    runSync(TaskReference(function));
  }

  virtual void suspend() = 0;
  virtual void resume() = 0;

  /// The queue whose task runs on this thread now, the innermost one; null outside of all.
  static const Queue *current();

 protected:
  /// A callable that outlives the call it is given to; nothing is copied or allocated.
  class TaskReference {
   public:
    template <class Function>
    explicit TaskReference(Function &function)
        : object_(const_cast<void *>(static_cast<const void *>(std::addressof(function)))),
          call_([](void *object) { (*static_cast<std::remove_reference_t<Function> *>(object))(); }) {}
    void operator()() const { call_(object_); }

   private:
    void *object_;
    void (*call_)(void *);
  };

  explicit Queue(std::string label) : label_(std::move(label)) {}
  virtual void runSync(TaskReference task) = 0;

 private:
  std::string label_;
};

/// Runs one task at a time in submission order.
class SerialQueue : public Queue {
 public:
  /// `executor` must outlive the queue.
  static std::shared_ptr<SerialQueue> create(Executor &executor, std::string label);

 protected:
  using Queue::Queue;
};

/// Runs plain tasks side by side and barrier tasks alone.
class ConcurrentQueue : public Queue {
 public:
  /// `executor` must outlive the queue.
  static std::shared_ptr<ConcurrentQueue> create(Executor &executor, std::string label);

  virtual void asyncBarrier(Task task) = 0;

  template <class Function>
  void syncBarrier(Function &&function) {
    runSyncBarrier(TaskReference(function));
  }

 protected:
  using Queue::Queue;
  virtual void runSyncBarrier(TaskReference task) = 0;
};

/// Submits the task to the queue when the delay has passed. `executor` is the one of the queue.
void runAfterDelay(Executor &executor, std::uint64_t nanoseconds, std::shared_ptr<Queue> queue, Task task);

/// Runs operations in submission order, by default one at a time, so that what is added first (a
/// registration, say) is over before what is added later (its withdrawal) starts.
class OperationQueue {
 public:
  static constexpr std::size_t defaultMaximumConcurrency = 1;

  /// `executor` must outlive the queue.
  static std::shared_ptr<OperationQueue> create(Executor &executor, std::string name);

  virtual ~OperationQueue() = default;
  OperationQueue(const OperationQueue &) = delete;
  OperationQueue &operator=(const OperationQueue &) = delete;

  [[nodiscard]] const std::string &name() const { return name_; }

  /// Submits the operation and returns at once.
  virtual void addOperation(Task operation) = 0;

  /// 0 counts as 1.
  virtual void setMaximumConcurrency(std::size_t maximum) = 0;

  /// The operation queue whose operation runs on this thread now; null outside of all.
  static const OperationQueue *current();

 protected:
  explicit OperationQueue(std::string name) : name_(std::move(name)) {}

 private:
  std::string name_;
};

}  // namespace storix
