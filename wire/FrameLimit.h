#pragma once

#include "wire/Framing.h"

namespace storix::wire {

/// Lets sd-bus read from the peer's socket by itself, and refuses messages beyond 1 MiB.
///
/// Between two messages it looks at the next header without taking it from the socket, and reads the
/// message's length there; that also tells when there is nothing to read. Where it cannot know that a
/// message begins here (sd-bus reads ahead during the login, and takes up what arrives of a header that
/// is not all there), it has the kernel count what sd-bus takes from the socket until the next message
/// is complete.
class FrameLimit : public Framing {
 public:
  Verdict beforeProcess(int fd, bool hasUnwritten) override;
  [[nodiscard]] Verdict afterProcess(int fd, const Processed &processed) override;
  [[nodiscard]] bool atBoundary() const override { return position_ == Position::boundary; }
  [[nodiscard]] bool holdsUnread() const override { return false; }

 private:
  enum class Position { login, afterLogin, unknown, boundary, inMessage };

  Position position_ = Position::login;
};

}  // namespace storix::wire
