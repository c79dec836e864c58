#include "platform/linux/sockets/IoLoop.h"

#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>

#include <array>
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
#include <vector>

#include "platform/Log.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

namespace {

UniqueFd makeEvent() { return UniqueFd(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)); }

constexpr std::size_t maximumThreads = 64;
/// So many threads wait at most for long; those beyond them end after a while without work.
constexpr std::size_t keptWaitingThreads = 2;
constexpr int idleMilliseconds = 10'000;
/// How long a thread that has served a descriptor waits for that one alone before it waits for all. A
/// peer that goes on asking is answered by one thread then, and epoll has nothing to do with it. Longer
/// than a tick of the kernel's clock: for what ends before the next tick the processor's timer is set
/// anew at each wait, and that costs more than all else in it. Of many peers few are served so: threads
/// that wait for all find the next one without going to sleep.
constexpr int stayingMilliseconds = 20;
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
  IoLoop::Expected expected = IoLoop::Expected::requests;
  bool running = false;
  std::thread::id runner;
  /// Where a thread stays with it: what wakes that thread, so that it looks at the entry again.
  const UniqueFd *stayingThread = nullptr;
  IoLoop::Handler handler;

  /// With the mutex held.
  [[nodiscard]] bool isPaused() const { return destroyed || events == 0; }
  [[nodiscard]] bool isTaken() const { return running || stayingThread; }
  /// With the mutex held. Gives the handler that is never needed again, for whoever destroys it without.
  [[nodiscard]] IoLoop::Handler finishRunning() {
    running = false;
    served.notify_all();
    return destroyed ? std::move(handler) : IoLoop::Handler();
  }
};

/// What one of the few threads that stay stays with: a descriptor, and beside it perhaps one on which
/// answers come. Guarded by the loop's mutex.
struct Place {
  UniqueFd wake;
  bool isTaken = false;
  /// Whether its thread runs a handler, so that it would not notice what is added, however long that takes.
  bool isServing = false;
  std::vector<std::shared_ptr<Entry>> entries;
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
  std::array<Place, maximumStayingThreads> places;

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
  [[nodiscard]] bool stay(const std::shared_ptr<Entry> &entry);
  [[nodiscard]] static bool add(Place &place, const std::shared_ptr<Entry> &entry);
  [[nodiscard]] bool joinWhoAsks(const std::shared_ptr<Entry> &entry);
  void stayAt(Place &place);
  void leave(Place &place, const Entry *except);
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
    if (entry->isTaken() || entry->isPaused()) return;
    entry->running = true;
    entry->runner = std::this_thread::get_id();
  }
  {
    const ThreadPool::LocalTasks localTasks(pool);
    entry->handler(events);
  }
  if (stay(entry)) return;
  Handler unused;
  const std::lock_guard lock(entry->mutex);
  // Fails only where the descriptor was closed too early; then it is never ready again.
  if (!entry->destroyed) (void)arm(*entry);
  unused = entry->finishRunning();
}

/// Sees to it that a thread, this one or another, stays with the entry that has just been served, if
/// some thread waits for all others meanwhile. False where epoll is to wait for it.
bool IoLoop::Implementation::stay(const std::shared_ptr<Entry> &entry) {
  Place *free = nullptr;
  {
    const std::lock_guard lock(mutex);
    if (ended || waiting == 0) return false;
    if (joinWhoAsks(entry)) return true;
    for (Place &place : places) {
      if (!place.isTaken && place.wake) free = &place;
    }
    if (!free || !add(*free, entry)) return false;
    free->isTaken = true;
  }
  stayAt(*free);
  return true;
}

/// With `mutex` held: the place's thread stays with the entry from now on, unless that is paused. At no
/// time between does anyone else take it for free.
bool IoLoop::Implementation::add(Place &place, const std::shared_ptr<Entry> &entry) {
  const std::lock_guard lock(entry->mutex);
  if (entry->isPaused()) return false;
  entry->stayingThread = &place.wake;
  place.entries.push_back(entry);
  (void)entry->finishRunning();
  return true;
}

/// With `mutex` held. Where answers come on the entry, and a thread stays with one that asks, that
/// thread stays with both, so that a request that needs an answer needs no other thread.
bool IoLoop::Implementation::joinWhoAsks(const std::shared_ptr<Entry> &entry) {
  if (entry->expected != Expected::answers) return false;
  for (Place &place : places) {
    if (place.isServing || place.entries.size() != 1 || place.entries.front()->expected != Expected::requests) continue;
    if (!add(place, entry)) return false;
    eventfd_write(place.wake.get(), 1);
    return true;
  }
  return false;
}

/// Waits a little for what this thread stays with, and serves it, again and again.
void IoLoop::Implementation::stayAt(Place &place) {
  const Entry *served = nullptr;
  // So that nobody waits because somebody else's handler does.
  const std::function<void()> whenBlocking = [this, &place, &served] { leave(place, served); };
  for (;;) {
    std::array<pollfd, 3> waited{{{place.wake.get(), POLLIN, 0}}};
    std::array<std::shared_ptr<Entry>, 3> polled;
    nfds_t count = 1;
    {
      const std::lock_guard lock(mutex);
      place.isServing = false;
      if (place.entries.size() == 1 && joinWhoAsks(place.entries.front())) place.entries.clear();
      std::erase_if(place.entries, [&place, &waited, &polled, &count](const std::shared_ptr<Entry> &entry) {
        const std::lock_guard entryLock(entry->mutex);
        entry->stayingThread = entry->isPaused() ? nullptr : &place.wake;
        if (!entry->stayingThread) return true;
        waited[count] = {entry->fd, static_cast<short>(entry->events), 0};
        polled[count++] = entry;
        return false;
      });
      if (ended || waiting == 0 || place.entries.empty()) break;
    }
    if (::poll(waited.data(), count, stayingMilliseconds) <= 0) break;
    eventfd_t wakes = 0;
    if (waited[0].revents != 0) eventfd_read(place.wake.get(), &wakes);
    {
      const std::lock_guard lock(mutex);
      place.isServing = true;
    }
    for (nfds_t i = 1; i < count; ++i) {
      if (waited[i].revents == 0) continue;
      Entry &entry = *polled[i];
      {
        const std::lock_guard lock(entry.mutex);
        // Left meanwhile, while the other one's handler waited.
        if (entry.stayingThread != &place.wake || entry.isPaused()) continue;
        entry.running = true;
        entry.runner = std::this_thread::get_id();
      }
      served = &entry;
      {
        const ThreadPool::LocalTasks localTasks(pool, &whenBlocking);
        entry.handler(static_cast<std::uint32_t>(waited[i].revents));
      }
      Handler unused;
      const std::lock_guard lock(entry.mutex);
      unused = entry.finishRunning();
    }
  }
  leave(place, nullptr);
  const std::lock_guard lock(mutex);
  place.isTaken = place.isServing = false;
}

/// Has epoll wait for what the thread stays with.
void IoLoop::Implementation::leave(Place &place, const Entry *except) {
  std::vector<std::shared_ptr<Entry>> left;
  const std::lock_guard lock(mutex);
  std::erase_if(place.entries, [except, &left](const std::shared_ptr<Entry> &entry) {
    if (entry.get() == except) return false;
    left.push_back(entry);
    return true;
  });
  for (const std::shared_ptr<Entry> &entry : left) {
    const std::lock_guard entryLock(entry->mutex);
    entry->stayingThread = nullptr;
    if (!entry->isPaused()) (void)arm(*entry);
  }
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
    wakeStayingThread();
    if (entry_->running && entry_->runner == std::this_thread::get_id()) return;
    entry_->served.wait(lock, [this] { return !entry_->running; });
    const IoLoop::Handler unused = std::move(entry_->handler);
    lock.unlock();
  }

  void setEvents(std::uint32_t events) override {
    const std::lock_guard lock(entry_->mutex);
    if (entry_->events == events) return;
    entry_->events = events;
    if (!entry_->isTaken()) (void)implementation_->arm(*entry_);
    wakeStayingThread();
  }

 private:
  /// With the entry's mutex held.
  void wakeStayingThread() const {
    if (entry_->stayingThread) eventfd_write(entry_->stayingThread->get(), 1);
  }

  std::shared_ptr<Implementation> implementation_;
  std::shared_ptr<Entry> entry_;
};

IoLoop::IoLoop(ThreadPool &pool) : implementation_(std::make_shared<Implementation>(pool)) {
  implementation_->epoll.reset(epoll_create1(EPOLL_CLOEXEC));
  implementation_->endEvent = makeEvent();
  for (Place &place : implementation_->places) place.wake = makeEvent();
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
  for (const Place &place : implementation_->places) {
    if (place.wake) eventfd_write(place.wake.get(), 1);
  }
  for (std::thread &thread : threads) thread.join();
}

std::unique_ptr<IoLoop::Watch> IoLoop::watch(int fd, std::uint32_t events, Handler handler, Expected expected) {
  auto entry = std::make_shared<Entry>();
  entry->fd = fd;
  entry->events = events;
  entry->handler = std::move(handler);
  entry->expected = expected;
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
