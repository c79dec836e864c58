#pragma once

#include <cstddef>

namespace storix::wire {

inline constexpr std::size_t maximumMessageSize = std::size_t{1} << 20;

/// Refuses messages beyond 1 MiB, since sd-bus itself would collect 128 MiB of one.
///
/// Between two messages it looks at the next header without taking it from the socket, and reads the
/// message's length there; that also tells when there is nothing to read. Where it cannot know that a
/// message begins here (sd-bus reads ahead during the login, and takes up what arrives of a header that
/// is not all there), it has the kernel count what sd-bus takes from the socket until the next message
/// is complete. Belongs to one connection and is guarded by its mutex.
class FrameLimit {
 public:
  enum class Verdict { read, nothing, tooLarge, otherVersion };

  /// Before each `sd_bus_process`. `hasUnwritten` says that it has something to write; without, it
  /// need not be called when the answer is `nothing`.
  Verdict beforeProcess(int fd, bool hasUnwritten);
  /// After it. `drained` means that it found nothing more to do.
  [[nodiscard]] Verdict afterProcess(int fd, bool loggedIn, bool gotMessage, bool drained);

  /// True where sd-bus holds no bytes of a further message: whatever there is, is in the socket.
  [[nodiscard]] bool atBoundary() const { return position_ == Position::boundary; }

 private:
  enum class Position { login, afterLogin, unknown, boundary, inMessage };

  Position position_ = Position::login;
};

}  // namespace storix::wire
