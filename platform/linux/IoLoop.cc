#include "platform/linux/IoLoop.h"

#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>

#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <csignal>
#include <list>
#include <mutex>
#include <system_error>
#include <thread>
#include <unordered_map>
#include <utility>

#include "platform/Log.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

namespace {

constexpr std::size_t maximumThreads = 64;
/// So many threads wait at most for long; those beyond them end after a while without work.
constexpr std::size_t keptWaitingThreads = 2;
constexpr int idleMilliseconds = 10'000;
/// How long a thread that has served a descriptor waits for that one alone before it waits for all. A
/// peer that goes on asking is answered by one thread then, and epoll has nothing to do with it. Of many
/// peers few are served so: threads that wait for all find the next one without going to sleep.
constexpr int stayingMilliseconds = 1;
constexpr std::size_t maximumStayingThreads = 2;
/// The identifier under which epoll reports the end of the loop.
constexpr std::uint64_t endIdentifier = 0;

/// One watched descriptor. Lives until its watch and the thread that serves it have let go.
struct Entry {
  std::mutex mutex;
  std::condition_variable served;
  std::uint64_t identifier = 0;
  int fd = -1;
  std::uint32_t events = 0;
  bool registered = false;
  bool destroyed = false;
  bool running = false;
  std::thread::id runner;
  IoLoop::Handler handler;
};

}  // namespace

struct IoLoop::Implementation {
  explicit Implementation(ThreadPool &threadPool) : pool(threadPool) {}

  ThreadPool &pool;
  UniqueFd epoll;
  UniqueFd endEvent;

  std::mutex mutex;
  std::atomic<bool> ended = false;  // written under the mutex
  std::uint64_t nextIdentifier = endIdentifier + 1;
  std::unordered_map<std::uint64_t, std::shared_ptr<Entry>> entries;
  std::list<std::thread> threads;
  std::list<std::thread> finished;
  std::size_t waiting = 0;
  std::size_t staying = 0;

  /// With `entry.mutex` held: makes epoll wait for what the entry wants.
  [[nodiscard]] bool arm(Entry &entry) const {
    if (entry.events == 0) {
      disarm(entry);
      return true;
    }
    epoll_event event{};
    event.events = entry.events | EPOLLONESHOT;
    event.data.u64 = entry.identifier;
    const int operation = entry.registered ? EPOLL_CTL_MOD : EPOLL_CTL_ADD;
    if (epoll_ctl(epoll.get(), operation, entry.fd, &event) != 0) return false;
    entry.registered = true;
    return true;
  }

  /// With `entry.mutex` held. Waiting for nothing would still report a hang-up, so the descriptor is
  /// taken out.
  void disarm(Entry &entry) const {
    if (!entry.registered) return;
    epoll_ctl(epoll.get(), EPOLL_CTL_DEL, entry.fd, nullptr);
    entry.registered = false;
  }

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
    entries.erase(identifier);
  }

  class EpollWatch;
  void work(const std::shared_ptr<Implementation> &self, std::list<std::thread>::iterator own);
  void serve(std::uint64_t identifier, std::uint32_t events);
  [[nodiscard]] std::uint32_t stayWith(Entry &entry, bool &stays);
};

void IoLoop::Implementation::work(const std::shared_ptr<Implementation> &self, std::list<std::thread>::iterator own) {
  sigset_t all;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, nullptr);
  for (;;) {
    epoll_event event{};
    const int count = epoll_wait(epoll.get(), &event, 1, idleMilliseconds);
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
  std::shared_ptr<Entry> entry;
  {
    const std::lock_guard lock(mutex);
    const auto found = entries.find(identifier);
    if (found == entries.end()) return;
    entry = found->second;
  }
  {
    const std::lock_guard lock(entry->mutex);
    // Armed anew while another thread was on its way to serve it: that one arms it when it is done.
    // Paused meanwhile: it is armed when it goes on.
    if (entry->destroyed || entry->running || entry->events == 0) return;
    entry->running = true;
    entry->runner = std::this_thread::get_id();
  }
  bool stays = false;
  do {
    const ThreadPool::LocalTasks localTasks(pool);
    entry->handler(events);
  } while ((events = stayWith(*entry, stays)) != 0);
  if (stays) {
    const std::lock_guard lock(mutex);
    --staying;
  }
  Handler unused;
  const std::lock_guard lock(entry->mutex);
  entry->running = false;
  if (entry->destroyed) {
    unused = std::move(entry->handler);
  } else {
    // Fails only where the descriptor was closed too early; then it is never ready again.
    (void)arm(*entry);
  }
  entry->served.notify_all();
}

/// Waits a little for the entry that this thread has just served, if another thread waits for all
/// others meanwhile; `stays` says that it has been counted. Gives what the descriptor is ready for; 0 where it is to be
/// armed again.
std::uint32_t IoLoop::Implementation::stayWith(Entry &entry, bool &stays) {
  pollfd waited{entry.fd, 0, 0};
  {
    const std::lock_guard lock(entry.mutex);
    if (entry.destroyed || entry.events == 0) return 0;
    waited.events = static_cast<short>(entry.events);
  }
  if (ended) return 0;
  if (!stays) {
    const std::lock_guard lock(mutex);
    if (waiting == 0 || staying == maximumStayingThreads) return 0;
    ++staying;
    stays = true;
  }
  if (::poll(&waited, 1, stayingMilliseconds) <= 0) return 0;
  const std::lock_guard lock(entry.mutex);
  return entry.destroyed || entry.events == 0 ? 0 : static_cast<std::uint32_t>(waited.revents);
}

class IoLoop::Implementation::EpollWatch : public IoLoop::Watch {
 public:
  EpollWatch(std::shared_ptr<Implementation> implementation, std::shared_ptr<Entry> entry)
      : implementation_(std::move(implementation)), entry_(std::move(entry)) {}

  ~EpollWatch() override {
    implementation_->forget(entry_->identifier);
    std::unique_lock lock(entry_->mutex);
    entry_->destroyed = true;
    implementation_->disarm(*entry_);
    if (entry_->running && entry_->runner == std::this_thread::get_id()) return;
    entry_->served.wait(lock, [this] { return !entry_->running; });
    const IoLoop::Handler unused = std::move(entry_->handler);
    lock.unlock();
  }

  void setEvents(std::uint32_t events) override {
    const std::lock_guard lock(entry_->mutex);
    if (entry_->events == events) return;
    entry_->events = events;
    if (!entry_->running) (void)implementation_->arm(*entry_);
  }

 private:
  std::shared_ptr<Implementation> implementation_;
  std::shared_ptr<Entry> entry_;
};

IoLoop::IoLoop(ThreadPool &pool) : implementation_(std::make_shared<Implementation>(pool)) {
  implementation_->epoll.reset(epoll_create1(EPOLL_CLOEXEC));
  implementation_->endEvent.reset(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.u64 = endIdentifier;
  if (!implementation_->epoll || !implementation_->endEvent ||
      epoll_ctl(implementation_->epoll.get(), EPOLL_CTL_ADD, implementation_->endEvent.get(), &event) != 0) {
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
  for (std::thread &thread : threads) thread.join();
}

std::unique_ptr<IoLoop::Watch> IoLoop::watch(int fd, std::uint32_t events, Handler handler) {
  auto entry = std::make_shared<Entry>();
  entry->fd = fd;
  entry->events = events;
  entry->handler = std::move(handler);
  {
    const std::lock_guard lock(implementation_->mutex);
    entry->identifier = implementation_->nextIdentifier++;
    implementation_->entries.emplace(entry->identifier, entry);
  }
  {
    const std::lock_guard lock(entry->mutex);
    if (implementation_->arm(*entry)) return std::make_unique<Implementation::EpollWatch>(implementation_, entry);
  }
  implementation_->forget(entry->identifier);
  return nullptr;
}

}  // namespace storix::linuxhost
