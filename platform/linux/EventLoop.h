#pragma once

#include <csignal>
#include <deque>
#include <memory>
#include <mutex>

#include "platform/Executor.h"
#include "platform/Result.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// The main thread's loop: runs what other threads post to it, one task at a time and in order, until
/// the process is asked to end by SIGTERM or SIGINT. Owned by the platform object.
class EventLoop {
 public:
  /// Make it before any thread starts: from now on those signals are for the loop alone, and writing to
  /// a closed pipe or socket is an error and no signal.
  static Result<std::unique_ptr<EventLoop>> create();
  /// Drops what has not run, and gives the signals back what they did before.
  ~EventLoop();
  EventLoop(const EventLoop &) = delete;
  EventLoop &operator=(const EventLoop &) = delete;

  /// Runs until a signal came, on the calling thread. Call it once.
  void run();

  /// Runs the task on the loop's thread, as soon as `run` has been called. From any thread.
  void post(Task task);

 private:
  EventLoop() = default;
  void runPosted();

  sigset_t previousMask_{};
  struct sigaction previousPipeAction_ {};
  UniqueFd signals_;
  UniqueFd wakeUp_;

  std::mutex mutex_;
  std::deque<Task> posted_;
};

}  // namespace storix::linuxhost
