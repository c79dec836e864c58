#include "wire/FrameLimit.h"

#include <sys/ioctl.h>
#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <cstdint>

namespace storix::wire {

namespace {

constexpr std::size_t fixedHeaderSize = 16;
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

std::size_t bytesInSocket(int fd) {
  int count = 0;
  return ioctl(fd, FIONREAD, &count) == 0 && count > 0 ? static_cast<std::size_t>(count) : 0;
}

}  // namespace

FrameLimit::Verdict FrameLimit::beforeProcess(int fd) {
  switch (position_) {
    case Position::login:
    case Position::inMessage:
      return Verdict::read;
    case Position::afterLogin:
    case Position::unknown:
      pending_ = bytesInSocket(fd);
      return Verdict::read;
    case Position::boundary:
      break;
  }
  FixedHeader header{};
  const ssize_t count = recv(fd, header.data(), header.size(), MSG_PEEK | MSG_DONTWAIT);
  if (count < 0 && (errno == EAGAIN || errno == EINTR)) return Verdict::nothing;
  if (count == static_cast<ssize_t>(header.size()) && (header[0] == 'l' || header[0] == 'B')) {
    if (messageSize(header) > maximumMessageSize) return Verdict::tooLarge;
    position_ = Position::inMessage;
    return Verdict::read;
  }
  // The end, an error, junk or a part of a header: sd-bus finds out.
  position_ = Position::unknown;
  pending_ = bytesInSocket(fd);
  return Verdict::read;
}

FrameLimit::Verdict FrameLimit::afterProcess(int fd, bool loggedIn, bool gotMessage, bool drained) {
  switch (position_) {
    case Position::login:
      if (loggedIn) position_ = Position::afterLogin;
      break;
    case Position::boundary:
      // Called to write; something may have come in meanwhile and have been taken up in part.
      position_ = Position::unknown;
      counted_ = 0;
      break;
    case Position::inMessage:
      break;
    case Position::afterLogin:
    case Position::unknown:
      counted_ += pending_;
      if (counted_ > maximumMessageSize) {
        const std::size_t left = gotMessage ? bytesInSocket(fd) : 0;
        if (counted_ > maximumMessageSize + left) return Verdict::tooLarge;
      }
      if (position_ == Position::afterLogin && drained) position_ = Position::unknown;
      break;
  }
  if (gotMessage) {
    counted_ = 0;
    if (position_ != Position::login && position_ != Position::afterLogin) position_ = Position::boundary;
  }
  return Verdict::read;
}

}  // namespace storix::wire
