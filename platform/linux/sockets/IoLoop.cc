#include "platform/linux/sockets/IoLoop.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <list>
#include <mutex>
#include <system_error>
#include <thread>
#include <unordered_map>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/sockets/StayingThreads.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

namespace {

constexpr std::size_t maximumThreads = 64;
/// So many threads wait at most for long; those beyond them end after a while without work.
constexpr std::size_t keptWaitingThreads = 2;
constexpr int idleMilliseconds = 10'000;
/// The identifier under which epoll reports the end of the loop.
constexpr std::uint64_t endIdentifier = 0;

}  // namespace

struct IoLoop::Implementation {
  explicit Implementation(ThreadPool &threadPool) : pool(threadPool) {}

  ThreadPool &pool;
  const Epoll epoll;
  const UniqueFd endEvent{eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
  StayingThreads stayingThreads{pool, epoll, [this] { return !ended && waiting != 0; }};

  std::mutex mutex;
  /// Both are written under the mutex.
  std::atomic<bool> ended = false;
  std::atomic<std::size_t> waiting = 0;
  std::uint64_t nextIdentifier = endIdentifier + 1;
  std::unordered_map<std::uint64_t, std::shared_ptr<WatchedDescriptor>> watched;
  std::list<std::thread> threads;
  std::list<std::thread> finished;

  /// With `mutex` held. When the system refuses a thread, those that exist go on.
  void startThread(const std::shared_ptr<Implementation> &self) {
    try {
      threads.emplace_back();
      const auto position = std::prev(threads.end());
      *position = std::thread([self, position] { self->work(self, position); });
      ++waiting;
    } catch (const std::system_error &) {
      threads.pop_back();
    }
  }

  void forget(std::uint64_t identifier) {
    const std::lock_guard lock(mutex);
    watched.erase(identifier);
  }

  class EpollWatch;
  void work(const std::shared_ptr<Implementation> &self, std::list<std::thread>::iterator own);
  void serve(std::uint64_t identifier, std::uint32_t events);
};

void IoLoop::Implementation::work(const std::shared_ptr<Implementation> &self, std::list<std::thread>::iterator own) {
  sigset_t all;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, nullptr);
  for (;;) {
    epoll_event event{};
    const int count = epoll_wait(epoll.fd(), &event, 1, idleMilliseconds);
    std::unique_lock lock(mutex);
    if (ended) return;
    if (count <= 0) {
      if (count == 0 && waiting > keptWaitingThreads) {
        --waiting;
        finished.splice(finished.end(), threads, own);
        return;
      }
      continue;
    }
    if (--waiting == 0 && threads.size() < maximumThreads) {
      for (std::thread &thread : finished) thread.join();
      finished.clear();
      startThread(self);
    }
    lock.unlock();
    serve(event.data.u64, event.events);
    lock.lock();
    ++waiting;
  }
}

void IoLoop::Implementation::serve(std::uint64_t identifier, std::uint32_t events) {
  std::shared_ptr<WatchedDescriptor> descriptor;
  {
    const std::lock_guard lock(mutex);
    const auto found = watched.find(identifier);
    if (found == watched.end()) return;
    descriptor = found->second;
  }
  {
    const std::lock_guard lock(descriptor->mutex);
    // Armed anew while another thread was on its way to serve it: that one arms it when it is done.
    // Paused meanwhile: it is armed when it goes on.
    if (descriptor->isTaken() || descriptor->isPaused()) return;
    descriptor->beginRunning();
  }
  {
    const ThreadPool::LocalTasks localTasks(pool);
    descriptor->handler(events);
  }
  if (stayingThreads.stay(descriptor)) return;
  Handler unused;
  const std::lock_guard lock(descriptor->mutex);
  // Fails only where the descriptor was closed too early; then it is never ready again.
  if (!descriptor->destroyed) (void)epoll.arm(*descriptor);
  unused = descriptor->finishRunning();
}

class IoLoop::Implementation::EpollWatch : public IoLoop::Watch {
 public:
  EpollWatch(std::shared_ptr<Implementation> implementation, std::shared_ptr<WatchedDescriptor> descriptor)
      : implementation_(std::move(implementation)), descriptor_(std::move(descriptor)) {}

  ~EpollWatch() override {
    implementation_->forget(descriptor_->identifier);
    std::unique_lock lock(descriptor_->mutex);
    descriptor_->destroyed = true;
    implementation_->epoll.disarm(*descriptor_);
    wakeStayingThread();
    if (descriptor_->running && descriptor_->runner == std::this_thread::get_id()) return;
    descriptor_->served.wait(lock, [this] { return !descriptor_->running; });
    const IoLoop::Handler unused = std::move(descriptor_->handler);
    lock.unlock();
  }

  void setEvents(std::uint32_t events) override {
    const std::lock_guard lock(descriptor_->mutex);
    if (descriptor_->events == events) return;
    descriptor_->events = events;
    if (!descriptor_->isTaken()) (void)implementation_->epoll.arm(*descriptor_);
    wakeStayingThread();
  }

 private:
  /// With the descriptor's mutex held.
  void wakeStayingThread() const {
    if (descriptor_->stayingThread) eventfd_write(descriptor_->stayingThread->get(), 1);
  }

  std::shared_ptr<Implementation> implementation_;
  std::shared_ptr<WatchedDescriptor> descriptor_;
};

IoLoop::IoLoop(ThreadPool &pool) : implementation_(std::make_shared<Implementation>(pool)) {
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = endIdentifier;
  if (!implementation_->epoll.isOpen() || !implementation_->endEvent ||
      epoll_ctl(implementation_->epoll.fd(), EPOLL_CTL_ADD, implementation_->endEvent.get(), &event) != 0) {
    sx_default_log().fault("[ERROR] Could not make the event loop: %@", posixError(errno, "epoll"));
    return;
  }
  const std::lock_guard lock(implementation_->mutex);
  implementation_->startThread(implementation_);
}

IoLoop::~IoLoop() { end(); }

void IoLoop::end() {
  std::list<std::thread> threads;
  {
    const std::lock_guard lock(implementation_->mutex);
    implementation_->ended = true;
    threads.splice(threads.end(), implementation_->threads);
    threads.splice(threads.end(), implementation_->finished);
  }
  if (implementation_->endEvent) eventfd_write(implementation_->endEvent.get(), 1);
  implementation_->stayingThreads.wake();
  for (std::thread &thread : threads) thread.join();
}

std::unique_ptr<IoLoop::Watch> IoLoop::watch(int fd, std::uint32_t events, Handler handler, Expected expected) {
  auto descriptor = std::make_shared<WatchedDescriptor>();
  descriptor->fd = fd;
  descriptor->events = events;
  descriptor->handler = std::move(handler);
  descriptor->expected = expected;
  {
    const std::lock_guard lock(implementation_->mutex);
    descriptor->identifier = implementation_->nextIdentifier++;
    implementation_->watched.emplace(descriptor->identifier, descriptor);
  }
  {
    const std::lock_guard lock(descriptor->mutex);
    if (implementation_->epoll.arm(*descriptor))
      return std::make_unique<Implementation::EpollWatch>(implementation_, descriptor);
  }
  implementation_->forget(descriptor->identifier);
  return nullptr;
}

}  // namespace storix::linuxhost
