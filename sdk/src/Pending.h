#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <stop_token>
#include <utility>

#include "sdk/src/BusLoop.h"
#include "sdk/src/ClientErrors.h"

namespace storix::sdk {

/// One request on its way: whatever comes first, answer, failure, deadline or cancellation, reaches the
/// handler, and nothing after it. Used on the loop's thread; only one without cancellation may be
/// started on another.
template <class Answer>
class Pending : public std::enable_shared_from_this<Pending<Answer>> {
 public:
  using Time = BusLoop::Clock::time_point;

  Pending(BusLoop &loop, std::optional<Time> deadline, std::function<void(Answer)> handler)
      : loop_(loop), deadline_(deadline), handler_(std::move(handler)) {}

  void start() {
    if (deadline_) loop_.at(*deadline_, this, [self = this->shared_from_this()] { self->passDeadline(); });
  }

  /// One that can be cancelled. It is finished at once where the deadline has passed already, or the
  /// request was cancelled before.
  void start(const std::stop_token &cancellation) {
    if (cancellation.stop_requested()) return cancel();
    if (deadline_ && *deadline_ <= BusLoop::Clock::now()) return passDeadline();
    start();
    cancellation_.emplace(cancellation, [this, weak = this->weak_from_this()] {
      // The loop is there: finishing waits for this call, and nothing is pending when the loop ends.
      loop_.later([weak] {
        if (const auto self = weak.lock()) self->cancel();
      });
    });
  }

  /// What to do, before the handler runs, when the deadline passes or the request is cancelled.
  void setGivenUpHandler(Task handler) { givenUp_ = std::move(handler); }

  [[nodiscard]] bool isFinished() const { return finished_; }

  void finish(Answer answer) {
    if (finished_) return;
    finished_ = true;
    if (deadline_) loop_.cancel(*deadline_, this);
    cancellation_.reset();
    givenUp_ = nullptr;
    if (const auto handler = std::exchange(handler_, nullptr)) handler(std::move(answer));
  }

 private:
  void passDeadline() { giveUp(clientError(ClientErrorCode::timedOut, "The document broker did not answer in time.")); }
  void cancel() { giveUp(clientError(ClientErrorCode::cancelled, "The request was cancelled.")); }
  void giveUp(SXError error) {
    if (finished_) return;
    if (const auto givenUp = std::exchange(givenUp_, nullptr)) givenUp();
    finish(std::move(error));
  }

  BusLoop &loop_;
  const std::optional<Time> deadline_;
  std::function<void(Answer)> handler_;
  Task givenUp_;
  std::optional<std::stop_callback<std::function<void()>>> cancellation_;
  bool finished_ = false;
};

template <class Answer>
using PendingPointer = std::shared_ptr<Pending<Answer>>;

}  // namespace storix::sdk
