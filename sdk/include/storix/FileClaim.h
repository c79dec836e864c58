#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <stop_token>
#include <string>

#include "platform/SXError.h"

namespace storix {

namespace sdk {
class Claim;
}

/// A time by which something must have happened: a point in time, or so and so long from now.
class Deadline {
 public:
  using Clock = std::chrono::steady_clock;

  Deadline(Clock::time_point time) : time_(time) {}
  /// One that is too far away to be a point in time never passes; one in the past has passed.
  template <class Count, class Period>
  Deadline(std::chrono::duration<Count, Period> fromNow) : time_(Clock::now()) {
    const std::chrono::duration<double> farthest(Clock::time_point::max() - time_);
    const std::chrono::duration<double> wanted(fromNow);
    if (wanted > std::chrono::duration<double>::zero()) {
      time_ = wanted < farthest / 2 ? time_ + std::chrono::ceil<Clock::duration>(fromNow) : Clock::time_point::max();
    }
  }

  [[nodiscard]] Clock::time_point time() const { return time_; }

 private:
  Clock::time_point time_;
};

/// How a claim on a file is waited for. Without a deadline it is waited for as long as it takes.
struct ClaimOptions {
  /// The reader ID or writer ID, which the provider of the file hears of.
  std::optional<std::string> identifier = std::nullopt;
  /// Passed before the claim is held: `timedOut`, and the claim is withdrawn.
  std::optional<Deadline> deadline = std::nullopt;
  /// Stopped before the claim is held, from any thread: `cancelled`, and the claim is withdrawn.
  std::stop_token cancellation = {};
};

/// A claim on a file, which ends when this goes out of scope. Given by `FileCoordinator` and `Client`;
/// may outlive them, but then it is lost. Move-only; one made from nothing, or moved from, holds
/// nothing. Not thread-safe by itself; may be used and destroyed on any thread.
class FileClaim {
 public:
  FileClaim();
  /// Ends what it holds, and does not wait for the daemon.
  ~FileClaim();
  FileClaim(FileClaim &&other) noexcept;
  FileClaim &operator=(FileClaim &&other) noexcept;
  FileClaim(const FileClaim &) = delete;
  FileClaim &operator=(const FileClaim &) = delete;

  /// Whether it holds a claim: neither ended nor lost.
  [[nodiscard]] bool isHeld() const;

  /// Whether the claim ended because the connection to the daemon did. Others may have written to the
  /// file since.
  [[nodiscard]] bool lost() const;

  /// Ends the claim and waits until the daemon has done so; of a write the file's provider is told then.
  /// Absent on success, and when nothing was held. Errors: `connectionLost` (also when it was lost
  /// before), `timedOut`. On the thread that runs handlers: EDEADLK, and the claim ends all the same;
  /// there it is let go of instead.
  [[nodiscard]] std::optional<SXError> end();

 private:
  friend class sdk::Claim;
  explicit FileClaim(std::shared_ptr<sdk::Claim> claim);

  std::shared_ptr<sdk::Claim> claim_;
};

}  // namespace storix
