#include "platform/QueueCore.h"

#include <algorithm>
#include <string>
#include <utility>

#include "platform/Log.h"
#include "platform/Queue.h"

namespace storix {

constinit thread_local const QueueCore::Frame *QueueCore::innermost_ = nullptr;

/// What the executor is given for each task that may start: runs whichever stands first when its turn
/// comes. One that is dropped unrun says so.
class QueueCore::Drain {
 public:
  explicit Drain(QueueCore &core) : core_(&core) {}
  Drain(const Drain &other) : core_(other.core_) {
    if (core_) core_->drainCopied();
  }
  Drain(Drain &&other) noexcept : core_(std::exchange(other.core_, nullptr)) {}
  Drain &operator=(const Drain &) = delete;
  ~Drain() {
    if (core_) core_->drainDropped();
  }
  void operator()() {
    if (core_) std::exchange(core_, nullptr)->drain();
  }

 private:
  QueueCore *core_;
};

QueueCore::QueueCore(Executor &executor, Queue &owner)
    : executor_(executor), queue_(&owner), operationQueue_(nullptr) {}

QueueCore::QueueCore(Executor &executor, OperationQueue &owner, std::size_t maximumConcurrency)
    : executor_(executor), queue_(nullptr), operationQueue_(&owner), maximumConcurrency_(maximumConcurrency) {}

void QueueCore::async(Task task, Kind kind) {
  std::unique_lock lock(mutex_);
  waiting_.push_back({std::move(task), nullptr, kind});
  conclude(lock);
}

void QueueCore::enterSlowly(Kind kind) {
  Waiter self;
  std::unique_lock lock(mutex_);
  refuseOwnTask(kind);
  waiting_.push_back({nullptr, &self, kind});
  waiters_.push_back(&self);
  conclude(lock);

  // An exclusive task waits for the end of all before it in any case, so it may as well run them.
  const bool runsEarlierTasks = kind == Kind::exclusive || !executor_.hasThreads();
  lock.lock();
  while (!self.started) {
    if (runsEarlierTasks && firstIsReadyTask()) {
      runFirst(lock);
      lock.lock();
      continue;
    }
    lock.unlock();
    {
      const BlockingScope blocking(executor_);
      lock.lock();
      self.changed.wait(
          lock, [this, &self, runsEarlierTasks] { return self.started || (runsEarlierTasks && firstIsReadyTask()); });
      lock.unlock();
    }
    lock.lock();
  }
}

void QueueCore::leaveSlowly(Kind kind) {
  std::unique_lock lock(mutex_);
  state_.fetch_sub(weight(kind), std::memory_order_acq_rel);
  conclude(lock);
}

void QueueCore::suspend() {
  std::unique_lock lock(mutex_);
  if (!closed_) ++suspensions_;
  conclude(lock);
}

void QueueCore::resume() {
  std::unique_lock lock(mutex_);
  if (closed_) return;
  if (suspensions_ == 0) {
    endProcessForProgrammingError("queue \"" + queue_->label() + "\" was resumed more often than suspended");
  }
  --suspensions_;
  conclude(lock);
}

void QueueCore::setMaximumConcurrency(std::size_t maximum) {
  std::unique_lock lock(mutex_);
  maximumConcurrency_ = std::max<std::size_t>(maximum, 1);
  conclude(lock);
}

void QueueCore::close() {
  std::unique_lock lock(mutex_);
  closed_ = true;
  suspensions_ = 0;
  conclude(lock);
}

void QueueCore::drain() {
  std::unique_lock lock(mutex_);
  --drains_;
  if (firstIsReadyTask()) {
    runFirst(lock);
  } else {
    conclude(lock);
  }
}

void QueueCore::drainCopied() {
  const std::lock_guard lock(mutex_);
  ++drains_;
}

void QueueCore::drainDropped() {
  std::deque<Entry> dropped;
  std::unique_lock lock(mutex_);
  --drains_;
  abandoned_ = true;
  std::deque<Entry> kept;
  for (Entry &entry : waiting_) (entry.waiter ? kept : dropped).push_back(std::move(entry));
  waiting_ = std::move(kept);
  covered_ = 0;
  conclude(lock);
}

/// Runs the first waiting task on this thread and returns without the lock.
void QueueCore::runFirst(std::unique_lock<std::mutex> &lock) {
  Entry entry = startFirst();
  conclude(lock);
  {
    const Frame frame(*this, entry.kind);
    entry.task();
    entry.task = nullptr;
  }
  leaveSlowly(entry.kind);
}

bool QueueCore::mayStart(Kind kind) const {
  if (suspensions_ > 0) return false;
  const std::uint64_t running = state_.load(std::memory_order_acquire) & ~slow;
  if (kind == Kind::exclusive) return running == 0;
  return !(running & exclusive) && running < maximumConcurrency_;
}

bool QueueCore::firstIsReadyTask() const {
  return !waiting_.empty() && !waiting_.front().waiter && mayStart(waiting_.front().kind);
}

QueueCore::Entry QueueCore::startFirst() {
  Entry entry = std::move(waiting_.front());
  waiting_.pop_front();
  if (covered_ > 0) --covered_;
  state_.fetch_add(weight(entry.kind), std::memory_order_acq_rel);
  return entry;
}

QueueCore::Consequences QueueCore::advance() {
  // Nobody enters or leaves without the mutex from here on.
  state_.fetch_or(slow, std::memory_order_acq_rel);

  while (!waiting_.empty() && waiting_.front().waiter && mayStart(waiting_.front().kind)) {
    Waiter &waiter = *startFirst().waiter;
    waiters_.pop_front();
    waiter.started = true;
    waiter.changed.notify_one();
  }

  Consequences consequences;
  if (firstIsReadyTask() && !abandoned_) {
    const std::uint64_t running = state_.load(std::memory_order_relaxed) & ~slow;
    if (waiting_.front().kind == Kind::exclusive) {
      covered_ = 1;
    } else {
      while (covered_ < waiting_.size() && running + covered_ < maximumConcurrency_ && !waiting_[covered_].waiter &&
             waiting_[covered_].kind == Kind::plain) {
        ++covered_;
      }
    }
    if (covered_ > drains_) consequences.drains = covered_ - drains_;
    drains_ += consequences.drains;
    if (!executor_.hasThreads() && !waiters_.empty()) waiters_.front()->changed.notify_one();
  }

  if (waiting_.empty() && suspensions_ == 0) {
    if (!closed_) {
      state_.fetch_and(~slow, std::memory_order_acq_rel);
    } else {
      consequences.destroy = drains_ == 0 && state_.load(std::memory_order_acquire) == slow;
    }
  }
  return consequences;
}

/// Ends every step that was taken under the mutex: starts what may start now and frees the mutex. The
/// queue may be gone afterwards, unless a task of it keeps it.
void QueueCore::conclude(std::unique_lock<std::mutex> &lock) {
  const Consequences consequences = advance();
  Executor &executor = executor_;
  lock.unlock();
  for (std::size_t i = 0; i < consequences.drains; ++i) executor.execute(Drain(*this));
  if (!consequences.destroy) return;
  if (queue_) {
    delete queue_;
  } else {
    delete operationQueue_;
  }
}

/// Ends the process if this thread runs a task of this queue that the new one would have to wait for.
void QueueCore::refuseOwnTask(Kind kind) const {
  for (const Frame *frame = innermost_; frame; frame = frame->outer_) {
    if (&frame->core_ != this) continue;
    const bool barrierWaits =
        std::any_of(waiting_.begin(), waiting_.end(), [](const Entry &entry) { return entry.kind == Kind::exclusive; });
    if (kind == Kind::exclusive || frame->kind_ == Kind::exclusive || barrierWaits) {
      endProcessForProgrammingError("synchronous task on queue \"" + queue_->label() +
                                    "\" from a task of that queue, which would wait for itself");
    }
  }
}

const Queue *QueueCore::currentQueue() {
  for (const Frame *frame = innermost_; frame; frame = frame->outer_) {
    if (frame->core_.queue_) return frame->core_.queue_;
  }
  return nullptr;
}

const OperationQueue *QueueCore::currentOperationQueue() {
  for (const Frame *frame = innermost_; frame; frame = frame->outer_) {
    if (frame->core_.operationQueue_) return frame->core_.operationQueue_;
  }
  return nullptr;
}

}  // namespace storix
