#pragma once

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <limits>
#include <mutex>

#include "platform/Executor.h"

namespace storix {

class Queue;
class OperationQueue;

/// What all kinds of queues are made of: tasks in submission order, each plain or exclusive, and the
/// rule when the first of them may start. A serial queue has exclusive tasks alone.
///
/// One word counts what runs. While nothing waits and nothing is suspended, a synchronous task enters
/// and leaves by changing that word and touches nothing else; otherwise the word is marked `slow`, and
/// every step is taken under the mutex.
///
/// The core is a member of its queue and ends it: a queue is given away with a deleter that calls
/// `close`, and is deleted when nothing of it waits or runs any more.
class QueueCore {
 public:
  enum class Kind : bool { plain, exclusive };

  static constexpr std::size_t unlimited = std::numeric_limits<std::uint32_t>::max();

  QueueCore(Executor &executor, Queue &owner);
  QueueCore(Executor &executor, OperationQueue &owner, std::size_t maximumConcurrency);
  QueueCore(const QueueCore &) = delete;
  QueueCore &operator=(const QueueCore &) = delete;

  void async(Task task, Kind kind);

  template <class Function>
  void sync(const Function &function, Kind kind) {
    if (!tryEnter(kind)) enterSlowly(kind);
    {
      const Frame frame(*this, kind);
      function();
    }
    // From here on the queue may be gone.
    if (!tryLeave(kind)) leaveSlowly(kind);
  }

  void suspend();
  void resume();
  void setMaximumConcurrency(std::size_t maximum);

  /// The last reference is gone. Deletes the queue, at once or when its last task has ended.
  void close();

  static const Queue *currentQueue();
  static const OperationQueue *currentOperationQueue();

 private:
  /// A task that runs on this thread, and the one around it.
  class Frame {
   public:
    Frame(const QueueCore &core, Kind kind) : core_(core), kind_(kind), outer_(innermost_) { innermost_ = this; }
    ~Frame() { innermost_ = outer_; }
    Frame(const Frame &) = delete;
    Frame &operator=(const Frame &) = delete;

   private:
    friend class QueueCore;
    const QueueCore &core_;
    const Kind kind_;
    const Frame *const outer_;
  };

  class Drain;

  /// A thread that waits in `sync`.
  struct Waiter {
    std::condition_variable changed;
    bool started = false;
  };

  struct Entry {
    Task task;       // empty where a thread waits
    Waiter *waiter;  // null where none does
    Kind kind;
  };

  /// What is left to do once the mutex is free.
  struct Consequences {
    std::size_t drains = 0;
    bool destroy = false;
  };

  // `state_`: how many plain tasks run, whether an exclusive one does, and whether tasks wait, the
  // queue is suspended, or it is closed.
  static constexpr std::uint64_t slow = std::uint64_t{1} << 63;
  static constexpr std::uint64_t exclusive = std::uint64_t{1} << 62;

  bool tryEnter(Kind kind) {
    if (kind == Kind::exclusive) {
      std::uint64_t idle = 0;
      return state_.compare_exchange_strong(idle, exclusive, std::memory_order_acquire, std::memory_order_relaxed);
    }
    std::uint64_t state = state_.load(std::memory_order_relaxed);
    while (!(state & (slow | exclusive))) {
      if (state_.compare_exchange_weak(state, state + 1, std::memory_order_acquire, std::memory_order_relaxed)) {
        return true;
      }
    }
    return false;
  }

  bool tryLeave(Kind kind) {
    std::uint64_t state = state_.load(std::memory_order_relaxed);
    while (!(state & slow)) {
      if (state_.compare_exchange_weak(state, state - weight(kind), std::memory_order_release,
                                       std::memory_order_relaxed)) {
        return true;
      }
    }
    return false;
  }

  static constexpr std::uint64_t weight(Kind kind) { return kind == Kind::exclusive ? exclusive : 1; }

  void enterSlowly(Kind kind);
  void leaveSlowly(Kind kind);
  void refuseOwnTask(Kind kind) const;

  void drain();
  void drainCopied();
  void drainDropped();
  void runFirst(std::unique_lock<std::mutex> &lock);

  // Under the mutex:
  [[nodiscard]] bool mayStart(Kind kind) const;
  [[nodiscard]] bool firstIsReadyTask() const;
  Entry startFirst();
  Consequences advance();
  void conclude(std::unique_lock<std::mutex> &lock);

  static thread_local const Frame *innermost_;

  Executor &executor_;
  Queue *const queue_;
  OperationQueue *const operationQueue_;

  std::atomic<std::uint64_t> state_{0};

  std::mutex mutex_;
  std::deque<Entry> waiting_;
  std::deque<Waiter *> waiters_;  // those in `waiting_`, in their order
  std::size_t covered_ = 0;       // so many of the first in `waiting_` have been announced to the executor
  std::size_t drains_ = 0;        // given to the executor and neither run nor dropped
  std::size_t suspensions_ = 0;
  std::size_t maximumConcurrency_ = unlimited;
  bool closed_ = false;
  bool abandoned_ = false;  // the executor has dropped a drain: it is gone
};

}  // namespace storix
