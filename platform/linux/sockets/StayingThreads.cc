#include "platform/linux/sockets/StayingThreads.h"

#include <poll.h>
#include <sys/eventfd.h>

#include <utility>

namespace storix::linuxhost {

namespace {

/// A peer that goes on asking is answered by one thread so long, and epoll has nothing to do with it.
/// Longer than a tick of the kernel's clock: for what ends before the next tick the processor's timer is
/// set anew at each wait, and that costs more than all else in it. Of many peers few are served so: threads
/// that wait for all find the next one without going to sleep.
constexpr int stayingMilliseconds = 20;

}  // namespace

struct StayingThreads::Round {
  std::array<pollfd, 3> waited{};
  std::array<std::shared_ptr<WatchedDescriptor>, 3> descriptors;  // the first one is for what wakes the thread
  nfds_t count = 0;
};

StayingThreads::StayingThreads(ThreadPool &pool, const Epoll &epoll, std::function<bool()> mayStay)
    : pool_(pool), epoll_(epoll), mayStay_(std::move(mayStay)) {
  for (Place &place : places_) place.wake.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
}

bool StayingThreads::stay(const std::shared_ptr<WatchedDescriptor> &descriptor) {
  Place *free = nullptr;
  {
    const std::lock_guard lock(mutex_);
    if (!mayStay_()) return false;
    if (joinWhoAsks(descriptor)) return true;
    for (Place &place : places_) {
      if (!place.isTaken && place.wake) free = &place;
    }
    if (!free || !add(*free, descriptor)) return false;
    free->isTaken = true;
  }
  stayAt(*free);
  return true;
}

void StayingThreads::wake() {
  for (const Place &place : places_) {
    if (place.wake) eventfd_write(place.wake.get(), 1);
  }
}

/// With the mutex held: the place's thread stays with the descriptor from now on, unless that is paused. At
/// no time between does anyone else take it for free.
bool StayingThreads::add(Place &place, const std::shared_ptr<WatchedDescriptor> &descriptor) {
  const std::lock_guard lock(descriptor->mutex);
  if (descriptor->isPaused()) return false;
  descriptor->stayingThread = &place.wake;
  place.descriptors.push_back(descriptor);
  (void)descriptor->finishRunning();
  return true;
}

/// With the mutex held. Where answers come on the descriptor, and a thread stays with one that asks, that
/// thread stays with both, so that a request that needs an answer needs no other thread.
bool StayingThreads::joinWhoAsks(const std::shared_ptr<WatchedDescriptor> &descriptor) {
  if (descriptor->expected != IoLoop::Expected::answers) return false;
  for (Place &place : places_) {
    if (place.isServing || place.descriptors.size() != 1) continue;
    if (place.descriptors.front()->expected != IoLoop::Expected::requests) continue;
    if (!add(place, descriptor)) return false;
    eventfd_write(place.wake.get(), 1);
    return true;
  }
  return false;
}

/// Waits a little for what this thread stays with, and serves it, again and again.
void StayingThreads::stayAt(Place &place) {
  const WatchedDescriptor *served = nullptr;
  // So that nobody waits because somebody else's handler does.
  const std::function<void()> whenBlocking = [this, &place, &served] { leave(place, served); };
  for (;;) {
    Round round;
    if (!beginRound(place, round)) break;
    if (::poll(round.waited.data(), round.count, stayingMilliseconds) <= 0) break;
    eventfd_t wakes = 0;
    if (round.waited[0].revents != 0) eventfd_read(place.wake.get(), &wakes);
    {
      const std::lock_guard lock(mutex_);
      place.isServing = true;
    }
    for (nfds_t i = 1; i < round.count; ++i) {
      if (round.waited[i].revents == 0) continue;
      WatchedDescriptor &descriptor = *round.descriptors[i];
      {
        const std::lock_guard lock(descriptor.mutex);
        // Left meanwhile, while the other one's handler waited.
        if (descriptor.stayingThread != &place.wake || descriptor.isPaused()) continue;
        descriptor.beginRunning();
      }
      served = &descriptor;
      {
        const ThreadPool::LocalTasks localTasks(pool_, &whenBlocking);
        descriptor.handler(static_cast<std::uint32_t>(round.waited[i].revents));
      }
      IoLoop::Handler unused;
      const std::lock_guard lock(descriptor.mutex);
      unused = descriptor.finishRunning();
    }
  }
  leave(place, nullptr);
  const std::lock_guard lock(mutex_);
  place.isTaken = place.isServing = false;
}

/// Tells what to wait for. False when the thread is to stay no longer.
bool StayingThreads::beginRound(Place &place, Round &round) {
  const std::lock_guard lock(mutex_);
  place.isServing = false;
  if (place.descriptors.size() == 1 && joinWhoAsks(place.descriptors.front())) place.descriptors.clear();
  round.waited[round.count++] = {place.wake.get(), POLLIN, 0};
  std::erase_if(place.descriptors, [&place, &round](const std::shared_ptr<WatchedDescriptor> &descriptor) {
    const std::lock_guard descriptorLock(descriptor->mutex);
    descriptor->stayingThread = descriptor->isPaused() ? nullptr : &place.wake;
    if (!descriptor->stayingThread) return true;
    round.waited[round.count] = {descriptor->fd, static_cast<short>(descriptor->events), 0};
    round.descriptors[round.count++] = descriptor;
    return false;
  });
  return mayStay_() && !place.descriptors.empty();
}

/// Has epoll wait for what the thread stays with.
void StayingThreads::leave(Place &place, const WatchedDescriptor *except) {
  std::vector<std::shared_ptr<WatchedDescriptor>> left;
  const std::lock_guard lock(mutex_);
  std::erase_if(place.descriptors, [except, &left](const std::shared_ptr<WatchedDescriptor> &descriptor) {
    if (descriptor.get() == except) return false;
    left.push_back(descriptor);
    return true;
  });
  for (const std::shared_ptr<WatchedDescriptor> &descriptor : left) {
    const std::lock_guard descriptorLock(descriptor->mutex);
    descriptor->stayingThread = nullptr;
    if (!descriptor->isPaused()) (void)epoll_.arm(*descriptor);
  }
}

}  // namespace storix::linuxhost
