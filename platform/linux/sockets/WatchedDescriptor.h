#pragma once

#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <thread>

#include "platform/linux/sockets/IoLoop.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// One descriptor that the loop watches, guarded by its mutex. Lives until its watch and the thread that
/// serves it have let go.
struct WatchedDescriptor {
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
  /// Where a thread stays with it: what wakes that thread, so that it looks at the descriptor again.
  const UniqueFd *stayingThread = nullptr;
  IoLoop::Handler handler;

  /// With the mutex held.
  [[nodiscard]] bool isPaused() const { return destroyed || events == 0; }
  [[nodiscard]] bool isTaken() const { return running || stayingThread; }
  void beginRunning() {
    running = true;
    runner = std::this_thread::get_id();
  }
  /// Gives the handler that is never needed again, for whoever destroys it without the mutex.
  [[nodiscard]] IoLoop::Handler finishRunning() {
    running = false;
    served.notify_all();
    return destroyed ? std::move(handler) : IoLoop::Handler();
  }
};

/// What waits for all descriptors with which no thread stays. Each is reported once, until it is armed
/// again. Thread-safe.
class Epoll {
 public:
  Epoll();

  /// False when the kernel has refused to make it.
  [[nodiscard]] bool isOpen() const { return static_cast<bool>(fd_); }
  [[nodiscard]] int fd() const { return fd_.get(); }

  /// With the descriptor's mutex held: waits for what is wanted of it. False when the kernel refuses.
  [[nodiscard]] bool arm(WatchedDescriptor &descriptor) const;
  /// With the descriptor's mutex held. Waiting for nothing would still report a hang-up, so the
  /// descriptor is taken out.
  void disarm(WatchedDescriptor &descriptor) const;

 private:
  const UniqueFd fd_;
};

}  // namespace storix::linuxhost
