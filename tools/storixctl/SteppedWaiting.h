#pragma once

#include <poll.h>
#include <sys/eventfd.h>

#include <array>
#include <csignal>

#include "tools/storixctl/Waiting.h"

namespace storix::ctl {

/// Waiting for tests: the time stands still but while somebody waits for it, and then it comes at once.
class SteppedWaiting : public Waiting {
 public:
  Clock::time_point now() override { return now_ += step_; }

  Woken wait(int descriptor, short events, std::optional<Clock::time_point> until) override {
    std::array<pollfd, 2> waited{{{descriptor, events, 0}, {interrupted_.get(), POLLIN, 0}}};
    // A moment for the others whose answer is waited for; how long it takes changes nothing.
    const int count = ::poll(waited.data(), waited.size(), until && !still_ ? 1 : 60'000);
    if (isInterrupted()) return Woken::interrupted;
    if (count != 0) return Woken::ready;
    if (until) now_ = *until;
    return Woken::timePassed;
  }

  bool isInterrupted() override {
    pollfd interrupted{interrupted_.get(), POLLIN, 0};
    return ::poll(&interrupted, 1, 0) == 1;
  }
  [[nodiscard]] int signalNumber() const override { return SIGINT; }

  /// From now on no time goes by while somebody waits.
  void standStill() { still_ = true; }
  /// From now on so much time goes by whenever somebody looks.
  void setStep(Clock::duration step) { step_ = step; }
  void advance(Clock::duration time) { now_ += time; }
  /// From any thread.
  void interrupt() { ::eventfd_write(interrupted_.get(), 1); }

 private:
  Clock::time_point now_{};
  Clock::duration step_{};
  bool still_ = false;
  UniqueFd interrupted_{::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
};

}  // namespace storix::ctl
