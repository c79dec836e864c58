#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "platform/ThreadPool.h"

namespace storix::linuxhost {

/// Waits for file descriptors and calls back when they are ready, on a few threads of its own that
/// share the work: whichever thread waits takes the next ready descriptor and serves it to the end,
/// while another one waits in its place. So a request costs no change of thread, and a slow one
/// delays nobody else: when every thread is busy, one more is started, up to a limit. Having served a
/// descriptor, a thread waits a little for that one alone: who goes on asking is served faster.
///
///  1. The handler of one watch never runs on two threads at once.
///  2. After a watch is destroyed its handler does not start again; the destructor waits for one that
///     is running, unless it runs inside that very handler.
///  3. Tasks that a handler submits to the pool run after it, on the same thread (`LocalTasks`),
///     unless the handler blocks.
class IoLoop {
 public:
  /// What comes on a descriptor. A thread that waits for a peer that asks may wait for one that answers,
  /// too, since what is asked and answered in turn needs no second thread. Where the handler of one of
  /// them blocks (`BlockingScope`), all threads wait for the other again.
  enum class Expected { requests, answers };

  /// Takes what epoll reports (EPOLLIN, EPOLLHUP, ...).
  using Handler = std::function<void(std::uint32_t events)>;

  class Watch {
   public:
    virtual ~Watch() = default;
    /// Changes what is waited for; 0 pauses the watch. May be called from any thread.
    virtual void setEvents(std::uint32_t events) = 0;
  };

  /// `pool` must outlive the loop.
  explicit IoLoop(ThreadPool &pool);

  /// As `end`. Watches must not be used afterwards, but may still be destroyed.
  ~IoLoop();

  /// Waits for the handlers that run, and ends the threads: no handler starts afterwards, though watches
  /// may still be made, changed and destroyed. Not from a handler; a second call does nothing.
  void end();

  /// Level-triggered: calls the handler as long as the descriptor is ready. The descriptor stays the
  /// caller's and must live as long as the watch. Null when the kernel refuses.
  std::unique_ptr<Watch> watch(int fd, std::uint32_t events, Handler handler, Expected expected = Expected::requests);

 private:
  struct Implementation;
  std::shared_ptr<Implementation> implementation_;
};

}  // namespace storix::linuxhost
