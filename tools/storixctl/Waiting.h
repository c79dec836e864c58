#pragma once

#include <signal.h>

#include <chrono>
#include <optional>

#include "platform/SXError.h"
#include "wire/UniqueFd.h"

namespace storix::ctl {

/// How the program waits: for a descriptor, for the time, and never longer than until somebody
/// interrupts it. Used on one thread. Tests have their own, whose time they move.
class Waiting {
 public:
  using Clock = std::chrono::steady_clock;
  enum class Woken { ready, timePassed, interrupted };

  virtual ~Waiting() = default;

  virtual Clock::time_point now() = 0;

  /// Waits for what `poll` calls `events` on the descriptor, at most until that time. Errors and the
  /// other end's closing make a descriptor ready too.
  virtual Woken wait(int descriptor, short events, std::optional<Clock::time_point> until) = 0;

  /// Does not wait. Once true it stays so.
  virtual bool isInterrupted() = 0;

  /// The number of the signal that interrupted; 0 when none has.
  [[nodiscard]] virtual int signalNumber() const = 0;
};

/// What ends when the program is interrupted fails with this error, `ClientErrorCode::cancelled`.
SXError interruptedError();

/// The real thing. Uninterruptible until `watchSignals`.
class ProcessWaiting : public Waiting {
 public:
  /// From now on until the first of them comes, SIGINT, SIGTERM and SIGHUP do no more than interrupt,
  /// except those that were ignored; and SIGPIPE is ignored, so that what cannot be written any more is
  /// an error. A second signal does what it always does, should something hang. Call it before there
  /// are threads.
  void watchSignals();

  Clock::time_point now() override { return Clock::now(); }
  Woken wait(int descriptor, short events, std::optional<Clock::time_point> until) override;
  bool isInterrupted() override;
  [[nodiscard]] int signalNumber() const override { return signalNumber_; }

 private:
  void takeSignal();

  sigset_t watched_{};
  UniqueFd signals_;  ///< a signalfd
  int signalNumber_ = 0;
};

}  // namespace storix::ctl
