#include "platform/ThreadPool.h"

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <list>
#include <mutex>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "platform/DelayTimer.h"

namespace storix {

struct ThreadPool::LocalTasks::State {
  State(Implementation &ofPool, State *around, const std::function<void()> *callback)
      : pool(ofPool), outer(around), whenBlocking(callback) {}

  Implementation &pool;
  State *const outer;
  const std::function<void()> *const whenBlocking;
  std::vector<Task> tasks;
  std::size_t next = 0;  // those before it have run
};

/// Whoever may work counts in `working`: a thread that is started or woken is counted by the one who
/// does so, and a thread that finds nothing to do, or says that it waits, stops counting.
struct ThreadPool::Implementation {
  using Threads = std::list<std::thread>;

  struct Worker {
    Implementation &pool;
    std::condition_variable wake;
    bool mayWork = true;
  };

  Implementation(std::size_t threadsAtWork, std::chrono::nanoseconds patience)
      : concurrency(threadsAtWork > 0 ? threadsAtWork : std::max(std::thread::hardware_concurrency(), 2U)),
        idleTime(patience),
        timer([this](Task task) { submit(std::move(task)); }) {}

  void submit(Task task);
  void end();

  // Under the mutex:
  void putOneToWork();
  void startThread();
  void endThread(std::unique_lock<std::mutex> &lock, Threads::iterator self);

  void work(Threads::iterator self);

  /// The innermost scope of this thread for this pool, or null.
  LocalTasks::State *localTasks() const;
  static void submitAllLocalTasks();

  static thread_local Worker *worker;                // this thread's, if it is one of a pool's
  static thread_local LocalTasks::State *innermost;  // this thread's innermost scope
  static thread_local unsigned blocked;              // how many waits this thread is in

  const std::size_t concurrency;
  const std::chrono::nanoseconds idleTime;

  std::mutex mutex;
  std::deque<Task> ready;
  std::vector<Worker *> idle;
  Threads threads;
  Threads ended;  // still to be joined
  std::condition_variable allEnded;
  std::size_t working = 0;
  bool ending = false;
  bool over = false;  // what comes now is dropped

  DelayTimer timer;
};

constinit thread_local ThreadPool::Implementation::Worker *ThreadPool::Implementation::worker = nullptr;
constinit thread_local ThreadPool::LocalTasks::State *ThreadPool::Implementation::innermost = nullptr;
constinit thread_local unsigned ThreadPool::Implementation::blocked = 0;

void ThreadPool::Implementation::submit(Task task) {
  const std::lock_guard lock(mutex);
  if (over) return;
  ready.push_back(std::move(task));
  putOneToWork();
}

void ThreadPool::Implementation::putOneToWork() {
  if (ready.empty() || working >= concurrency) return;
  if (idle.empty()) {
    startThread();
    return;
  }
  // The one that became idle last, so that the others get to their end.
  Worker &woken = *idle.back();
  idle.pop_back();
  woken.mayWork = true;
  ++working;
  woken.wake.notify_one();
}

void ThreadPool::Implementation::startThread() {
  const Threads::iterator thread = threads.emplace(threads.end());
  try {
    *thread = std::thread(&Implementation::work, this, thread);
    ++working;
  } catch (const std::system_error &) {
    // The system has no more threads: the task waits for one that there is.
    threads.erase(thread);
  }
}

void ThreadPool::Implementation::work(Threads::iterator self) {
  Worker me{.pool = *this, .wake = {}};
  worker = &me;
  std::unique_lock lock(mutex);
  while (true) {
    while (!ready.empty() && working <= concurrency) {
      Task task = std::move(ready.front());
      ready.pop_front();
      lock.unlock();
      task();
      task = nullptr;
      lock.lock();
    }
    --working;
    if (ending) break;
    me.mayWork = false;
    idle.push_back(&me);
    me.wake.wait_for(lock, idleTime, [this, &me] { return me.mayWork || ending; });
    if (!me.mayWork) {
      std::erase(idle, &me);
      break;
    }
  }
  endThread(lock, self);
}

/// Each thread that ends joins those that ended before it.
void ThreadPool::Implementation::endThread(std::unique_lock<std::mutex> &lock, Threads::iterator self) {
  Threads earlier;
  earlier.swap(ended);
  ended.splice(ended.end(), threads, self);
  if (threads.empty()) allEnded.notify_all();
  lock.unlock();
  for (std::thread &thread : earlier) thread.join();
}

void ThreadPool::Implementation::end() {
  timer.stop();
  std::unique_lock lock(mutex);
  ending = true;
  for (Worker *waiting : idle) waiting->wake.notify_one();
  while (true) {
    allEnded.wait(lock, [this] { return threads.empty(); });
    if (ready.empty()) break;
    // No thread could be started for these.
    const Task task = std::move(ready.front());
    ready.pop_front();
    lock.unlock();
    task();
    lock.lock();
  }
  over = true;
  Threads last;
  last.swap(ended);
  lock.unlock();
  for (std::thread &thread : last) thread.join();
}

ThreadPool::LocalTasks::State *ThreadPool::Implementation::localTasks() const {
  LocalTasks::State *state = innermost;
  while (state && &state->pool != this) state = state->outer;
  return state;
}

void ThreadPool::Implementation::submitAllLocalTasks() {
  for (LocalTasks::State *state = innermost; state; state = state->outer) {
    for (; state->next < state->tasks.size(); ++state->next) state->pool.submit(std::move(state->tasks[state->next]));
    if (state->whenBlocking) (*state->whenBlocking)();
  }
}

ThreadPool::ThreadPool(std::size_t concurrency, std::chrono::nanoseconds idleTime)
    : implementation_(std::make_unique<Implementation>(concurrency, idleTime)) {}

ThreadPool::~ThreadPool() { implementation_->end(); }

void ThreadPool::end() { implementation_->end(); }

void ThreadPool::execute(Task task) {
  LocalTasks::State *local = Implementation::blocked == 0 ? implementation_->localTasks() : nullptr;
  if (local) {
    local->tasks.push_back(std::move(task));
  } else {
    implementation_->submit(std::move(task));
  }
}

void ThreadPool::executeAfter(std::chrono::nanoseconds delay, Task task) {
  if (delay <= std::chrono::nanoseconds::zero()) {
    execute(std::move(task));
  } else {
    implementation_->timer.add(delay, std::move(task));
  }
}

void ThreadPool::willBlock() {
  if (Implementation::blocked++ > 0) return;
  Implementation::submitAllLocalTasks();
  if (!Implementation::worker) return;
  Implementation &own = Implementation::worker->pool;
  const std::lock_guard lock(own.mutex);
  --own.working;
  own.putOneToWork();
}

void ThreadPool::didUnblock() {
  if (--Implementation::blocked > 0 || !Implementation::worker) return;
  Implementation &own = Implementation::worker->pool;
  const std::lock_guard lock(own.mutex);
  ++own.working;
}

ThreadPool::LocalTasks::LocalTasks(ThreadPool &pool, const std::function<void()> *whenBlocking)
    : state_(std::make_unique<State>(*pool.implementation_, Implementation::innermost, whenBlocking)) {
  Implementation::innermost = state_.get();
}

ThreadPool::LocalTasks::~LocalTasks() {
  while (state_->next < state_->tasks.size()) {
    const Task task = std::move(state_->tasks[state_->next++]);
    task();
  }
  Implementation::innermost = state_->outer;
}

}  // namespace storix
