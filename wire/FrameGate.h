#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "wire/BusTarget.h"
#include "wire/Framing.h"
#include "wire/UniqueFd.h"

namespace storix::wire {

/// Stands between sd-bus and a peer that may send file descriptors.
///
/// sd-bus collects descriptors for as long as a message is not complete, and forgets those of one that
/// it drops as malformed: a peer could use up all that the process may have. So it reads from one end
/// of a socket pair here, and into the other go the lines of the login one by one, and then the
/// messages, each when it is complete and the one before has been read. One that carries a descriptor
/// goes in only as a call that takes it; else it ends the connection, and its descriptor is closed. A
/// connection holds one descriptor of its peer's at most before sd-bus has it.
class FrameGate : public Framing {
 public:
  using TakesDescriptor = std::function<bool(const BusTarget &target, std::string_view signature)>;

  /// Gives sd-bus's end of the pair in `busEnd`. Null, with errno, when the system refuses the pair.
  static std::unique_ptr<FrameGate> make(TakesDescriptor takesDescriptor, UniqueFd &busEnd);

  Verdict beforeProcess(int fd, bool hasUnwritten) override;
  [[nodiscard]] Verdict afterProcess(int fd, const Processed &processed) override;
  [[nodiscard]] bool atBoundary() const override { return collected_.empty(); }
  [[nodiscard]] bool holdsUnread() const override { return passing_; }
  void release() override;

 private:
  FrameGate(TakesDescriptor takesDescriptor, UniqueFd end)
      : takesDescriptor_(std::move(takesDescriptor)), end_(std::move(end)) {}

  Verdict collectLine(int fd);
  Verdict collectMessage(int fd);
  Verdict take(int fd, std::size_t count);
  Verdict pass();

  const TakesDescriptor takesDescriptor_;
  UniqueFd end_;
  bool loggedIn_ = false;
  /// A line of the login or a message, and what came with it.
  std::string collected_;
  UniqueFd descriptor_;
  /// It is complete, and `passed_` bytes of it are in the pair.
  bool passing_ = false;
  std::size_t passed_ = 0;
};

}  // namespace storix::wire
