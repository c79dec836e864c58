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
  if (position_ == Position::login) {
    if (!loggedIn) return Verdict::read;
    position_ = Position::afterLogin;
    counted_ = 0;
    pending_ = 0;
  }
  const bool counting = position_ == Position::afterLogin || position_ == Position::unknown;
  if (counting && (gotMessage || drained)) {
    counted_ += pending_;
    const std::size_t left = gotMessage && counted_ > maximumMessageSize ? bytesInSocket(fd) : 0;
    if (counted_ > maximumMessageSize + left) return Verdict::tooLarge;
  }
  if (gotMessage) {
    counted_ = 0;
    if (position_ != Position::afterLogin) position_ = Position::boundary;
    return Verdict::read;
  }
  // sd-bus may hold a part of a message now, or may have dropped or answered one by itself.
  if (!counting) counted_ = 0;
  if (drained || !counting) position_ = Position::unknown;
  return Verdict::read;
}

}  // namespace storix::wire
