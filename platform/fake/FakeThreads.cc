#include "platform/fake/FakeThreads.h"

#include <utility>

namespace storix::fake {
namespace {

thread_local const char *contextOfThread = nullptr;

}  // namespace

ContextMark::ContextMark(const char *name) : previous_(std::exchange(contextOfThread, name)) {}

ContextMark::~ContextMark() { contextOfThread = previous_; }

std::string currentContext() {
  if (const Queue *queue = Queue::current()) return "queue " + queue->label();
  if (const OperationQueue *queue = OperationQueue::current()) return "operation queue " + queue->name();
  return contextOfThread ? contextOfThread : "caller";
}

FakeExecutor::FakeExecutor(Kind kind) {
  if (kind == Kind::manual) {
    manual_ = std::make_unique<ManualExecutor>();
  } else {
    threads_ = std::make_unique<ThreadPool>();
  }
}

FakeExecutor::~FakeExecutor() = default;

Task FakeExecutor::counted(Task task) {
  {
    const std::lock_guard lock(mutex_);
    ++outstanding_;
  }
  return [this, task = std::move(task)]() mutable {
    task();
    task = nullptr;  // what it holds goes before the executor counts as idle
    const std::lock_guard lock(mutex_);
    if (--outstanding_ == 0) idle_.notify_all();
  };
}

void FakeExecutor::execute(Task task) {
  if (submissionObserver_) submissionObserver_();
  if (manual_) {
    manual_->execute(std::move(task));
  } else {
    threads_->execute(counted(std::move(task)));
  }
}

void FakeExecutor::executeAfter(std::chrono::nanoseconds delay, Task task) {
  if (manual_) {
    manual_->executeAfter(delay, std::move(task));
  } else {
    threads_->executeAfter(delay, std::move(task));
  }
}

void FakeExecutor::willBlock() {
  if (threads_) threads_->willBlock();
}

void FakeExecutor::didUnblock() {
  if (threads_) threads_->didUnblock();
}

bool FakeExecutor::runOne() { return manual_ && manual_->runOne(); }

void FakeExecutor::runUntilIdle() {
  if (manual_) {
    manual_->runUntilIdle();
    return;
  }
  std::unique_lock lock(mutex_);
  idle_.wait(lock, [this] { return outstanding_ == 0; });
}

void FakeExecutor::advance(std::chrono::nanoseconds time) {
  if (manual_) manual_->advance(time);
}

void FakeExecutor::runOnPlatformThread(Task task) {
  execute([task = std::move(task)] {
    const ContextMark mark("platform thread");
    task();
  });
}

void FakeExecutor::runOnMainEventLoop(Task task) {
  execute([task = std::move(task)] {
    const ContextMark mark("main event loop");
    task();
  });
}

struct PlatformLane::State {
  explicit State(FakeExecutor &e) : executor(e) {}
  FakeExecutor &executor;
  std::mutex mutex;
  bool running = false;
  std::deque<Task> tasks;
};

PlatformLane::PlatformLane(FakeExecutor &executor) : state_(std::make_shared<State>(executor)) {}

void PlatformLane::submit(Task task) {
  {
    const std::lock_guard lock(state_->mutex);
    state_->tasks.push_back(std::move(task));
    if (std::exchange(state_->running, true)) return;
  }
  state_->executor.runOnPlatformThread([state = state_] { runNext(state); });
}

void PlatformLane::runNext(const std::shared_ptr<State> &state) {
  std::unique_lock lock(state->mutex);
  Task task = std::move(state->tasks.front());
  state->tasks.pop_front();
  lock.unlock();
  task();
  task = nullptr;
  lock.lock();
  if (state->tasks.empty()) {
    state->running = false;
    return;
  }
  lock.unlock();
  state->executor.runOnPlatformThread([state] { runNext(state); });
}

}  // namespace storix::fake
