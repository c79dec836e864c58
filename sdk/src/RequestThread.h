#pragma once

#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <thread>
#include <utility>

#include "sdk/src/BusLoop.h"
#include "sdk/src/Pending.h"

namespace storix::sdk {

/// The thread of a client or of a file coordinator, on which its connections are driven and its
/// handlers run. Held by its owner, which ends it, and by what may outlive the owner. Thread-safe.
class RequestThread : public std::enable_shared_from_this<RequestThread> {
 public:
  static std::shared_ptr<RequestThread> start();

  /// Closes the connections and returns when all handlers have run; on the thread itself it returns at
  /// once, and they run soon after.
  void end();

  [[nodiscard]] BusLoop &loop() { return loop_; }
  [[nodiscard]] bool isCurrent() const { return loop_.isCurrentThread(); }

  /// Runs the task soon on the thread. False when the thread has ended: it never runs then.
  [[nodiscard]] bool post(Task task);

  template <class Answer>
  PendingPointer<Answer> begin(std::function<void(Answer)> handler, BusLoop::Clock::time_point deadline) {
    auto pending = std::make_shared<Pending<Answer>>(loop_, deadline, std::move(handler));
    pending->start();
    return pending;
  }

  template <class Answer>
  void failLater(const PendingPointer<Answer> &pending, SXError error) {
    loop_.later([pending, error = std::move(error)] { pending->finish(error); });
  }

  /// Waits for the answer that `send`'s handler gets.
  template <class Answer>
  Answer wait(const std::function<void(std::function<void(Answer)>)> &send) const {
    if (isCurrent()) return posixError(EDEADLK, "waiting for an answer on the thread that would bring it");
    struct Waiting {
      std::mutex mutex;
      std::condition_variable answered;
      std::optional<Answer> answer;
    };
    const auto waiting = std::make_shared<Waiting>();
    send([waiting](Answer answer) {
      const std::lock_guard lock(waiting->mutex);
      waiting->answer.emplace(std::move(answer));
      waiting->answered.notify_one();
    });
    std::unique_lock lock(waiting->mutex);
    waiting->answered.wait(lock, [&waiting] { return waiting->answer.has_value(); });
    return *std::move(waiting->answer);
  }

 private:
  void run();

  BusLoop loop_;
  std::thread thread_;
  std::mutex mutex_;
  bool ended_ = false;  ///< Under the mutex.
};

}  // namespace storix::sdk
