#include "wire/FrameLimit.h"

#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <cstdint>

namespace storix::wire {

namespace {

constexpr std::size_t fixedHeaderSize = 16;
constexpr std::uint8_t protocolVersion = 1;
using FixedHeader = std::array<std::uint8_t, fixedHeaderSize>;

std::size_t numberAt(const FixedHeader &header, std::size_t offset) {
  std::size_t number = 0;
  for (std::size_t i = 0; i < 4; ++i) {
    const std::size_t position = header[0] == 'B' ? offset + i : offset + 3 - i;
    number = number << 8 | header[position];
  }
  return number;
}

/// The length of the whole message: the fixed header, its fields padded to 8, the body.
std::size_t messageSize(const FixedHeader &header) {
  const std::size_t body = numberAt(header, 4);
  const std::size_t fields = numberAt(header, 12);
  return fixedHeaderSize + ((fields + 7) & ~std::size_t{7}) + body;
}

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

FrameLimit::Verdict FrameLimit::beforeProcess(int fd, bool hasUnwritten) {
  if (position_ != Position::boundary) return Verdict::read;
  FixedHeader header{};
  const ssize_t count = recv(fd, header.data(), header.size(), MSG_PEEK | MSG_DONTWAIT);
  if (count < 0 && (errno == EAGAIN || errno == EINTR) && !hasUnwritten) return Verdict::nothing;
  if (count == static_cast<ssize_t>(header.size()) && (header[0] == 'l' || header[0] == 'B')) {
    // sd-bus would read a later version in its own way, and wait for what never comes.
    if (header[3] != protocolVersion) return Verdict::otherVersion;
    if (messageSize(header) > maximumMessageSize) return Verdict::tooLarge;
    position_ = Position::inMessage;
    return Verdict::read;
  }
  // The end, an error, junk, or a part of a header: sd-bus finds out. Or nothing yet, but sd-bus may
  // meet something when it has written.
  position_ = Position::unknown;
  startCounting(fd);
  return Verdict::read;
}

FrameLimit::Verdict FrameLimit::afterProcess(int fd, bool loggedIn, bool gotMessage, bool drained) {
  switch (position_) {
    case Position::login:
      if (!loggedIn) return Verdict::read;
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
  if (gotMessage && position_ != Position::afterLogin) {
    if (position_ == Position::unknown) stopCounting(fd);
    position_ = Position::boundary;
  } else if (gotMessage || position_ == Position::inMessage) {
    // There may be more in what was read ahead; or a part of the message is missing, or sd-bus has
    // dropped or answered it by itself.
    if (position_ == Position::inMessage) position_ = Position::unknown;
    startCounting(fd);
  } else if (drained) {
    position_ = Position::unknown;
  }
  return Verdict::read;
}

}  // namespace storix::wire
