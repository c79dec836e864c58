#include "wire/FrameLimit.h"

#include <sys/socket.h>

#include <cerrno>

namespace storix::wire {

namespace {

/// The kernel moves the offset for peeking back by every byte that is taken from the socket: an exact
/// count of what somebody else reads there. Far enough away that it never reaches 0.
constexpr int countingOffset = 1 << 30;

void startCounting(int fd) { setsockopt(fd, SOL_SOCKET, SO_PEEK_OFF, &countingOffset, sizeof countingOffset); }

void stopCounting(int fd) {
  constexpr int none = -1;
  setsockopt(fd, SOL_SOCKET, SO_PEEK_OFF, &none, sizeof none);
}

std::size_t countedBytes(int fd) {
  int offset = countingOffset;
  socklen_t length = sizeof offset;
  getsockopt(fd, SOL_SOCKET, SO_PEEK_OFF, &offset, &length);
  return offset >= 0 && offset < countingOffset ? static_cast<std::size_t>(countingOffset - offset) : 0;
}

}  // namespace

Framing::Verdict FrameLimit::beforeProcess(int fd, bool hasUnwritten) {
  if (position_ != Position::boundary) return Verdict::read;
  FixedHeader header;
  const ssize_t count = recv(fd, header.bytes.data(), header.bytes.size(), MSG_PEEK | MSG_DONTWAIT);
  if (count < 0 && (errno == EAGAIN || errno == EINTR) && !hasUnwritten) return Verdict::nothing;
  if (count == static_cast<ssize_t>(FixedHeader::size)) {
    const Verdict verdict = header.verdict();
    if (verdict == Verdict::read) position_ = Position::inMessage;
    return verdict;
  }
  // The end, an error, or a part of a header: sd-bus finds out. Or nothing yet, but sd-bus may
  // meet something when it has written.
  position_ = Position::unknown;
  startCounting(fd);
  return Verdict::read;
}

Framing::Verdict FrameLimit::afterProcess(int fd, const Processed &processed) {
  switch (position_) {
    case Position::login:
      if (!processed.loggedIn) return Verdict::read;
      position_ = Position::afterLogin;
      startCounting(fd);
      return Verdict::read;
    case Position::afterLogin:
    case Position::unknown:
      if (countedBytes(fd) > maximumMessageSize) return Verdict::tooLarge;
      break;
    case Position::boundary:
    case Position::inMessage:
      break;
  }
  if (processed.gotMessage && position_ != Position::afterLogin) {
    if (position_ == Position::unknown) stopCounting(fd);
    position_ = Position::boundary;
  } else if (processed.gotMessage || position_ == Position::inMessage) {
    // There may be more in what was read ahead; or a part of the message is missing, or sd-bus has
    // dropped or answered it by itself.
    if (position_ == Position::inMessage) position_ = Position::unknown;
    startCounting(fd);
  } else if (processed.drained) {
    position_ = Position::unknown;
  }
  return Verdict::read;
}

}  // namespace storix::wire
