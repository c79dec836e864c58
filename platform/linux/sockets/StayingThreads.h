#pragma once

#include <array>
#include <functional>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/ThreadPool.h"
#include "platform/linux/sockets/WatchedDescriptor.h"

namespace storix::linuxhost {

/// The few threads of a loop that, having served a descriptor, wait a little for that one alone, and
/// perhaps for one on which answers come beside it. Thread-safe.
class StayingThreads {
 public:
  /// `mayStay` tells whether threads enough wait for all other descriptors. `pool` and `epoll` outlive this
  /// object.
  StayingThreads(ThreadPool &pool, const Epoll &epoll, std::function<bool()> mayStay);

  /// For a descriptor whose handler has just run on this thread: sees to it that a thread, this one or
  /// another, stays with it. Returns when this thread is free again; false where epoll is to wait for the
  /// descriptor, which still counts as running then.
  [[nodiscard]] bool stay(const std::shared_ptr<WatchedDescriptor> &descriptor);

  /// Has all of them ask `mayStay` anew.
  void wake();

 private:
  static constexpr std::size_t maximum = 2;

  /// What one of the threads stays with. Guarded by the mutex, but for what wakes the thread.
  struct Place {
    UniqueFd wake;
    bool isTaken = false;
    /// Whether its thread runs a handler, so that it would not notice what is added, however long that takes.
    bool isServing = false;
    std::vector<std::shared_ptr<WatchedDescriptor>> descriptors;
  };

  /// What a thread waits for at a time.
  struct Round;

  [[nodiscard]] static bool add(Place &place, const std::shared_ptr<WatchedDescriptor> &descriptor);
  [[nodiscard]] bool joinWhoAsks(const std::shared_ptr<WatchedDescriptor> &descriptor);
  void stayAt(Place &place);
  [[nodiscard]] bool beginRound(Place &place, Round &round);
  void leave(Place &place, const WatchedDescriptor *except);

  ThreadPool &pool_;
  const Epoll &epoll_;
  const std::function<bool()> mayStay_;
  std::mutex mutex_;
  std::array<Place, maximum> places_;
};

}  // namespace storix::linuxhost
