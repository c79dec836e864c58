#include "tests/e2e/hostile/RawClient.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "tests/e2e/Process.h"
#include "wire/SendBytes.h"

namespace storix::e2e {

namespace {

using namespace std::string_view_literals;

constexpr std::size_t fixedHeader = 16;

std::uint32_t numberAt(std::string_view bytes, std::size_t position) {
  std::uint32_t number = 0;
  std::memcpy(&number, bytes.data() + position, sizeof number);
  return number;
}

std::size_t aligned(std::size_t position, std::size_t boundary) {
  return (position + boundary - 1) / boundary * boundary;
}

/// Waits until the socket is ready. False, and a failed test, at the deadline.
bool await(int fd, short events) {
  pollfd waited{fd, events, 0};
  const int ready = ::poll(&waited, 1, static_cast<int>(std::chrono::milliseconds(deadline).count()));
  EXPECT_EQ(1, ready) << "the daemon neither read nor answered";
  return ready == 1;
}

/// Takes what matters of the header's fields, whose types are one letter each.
void takeFields(std::string_view fields, RawAnswer &answer) {
  std::size_t position = 0;
  while (position + 4 < fields.size()) {
    const auto code = static_cast<std::uint8_t>(fields[position]);
    const char type = fields[position + 2];
    position += 4;
    if (type == 'g') {
      position += 2 + static_cast<std::uint8_t>(fields[position]);
    } else {
      position = aligned(position, 4);
      const std::uint32_t number = numberAt(fields, position);
      position += 4;
      if (type == 'u') {
        if (code == 5) answer.replyTo = number;
      } else {
        if (code == 4) answer.errorName = fields.substr(position, number);
        position += number + 1;
      }
    }
    position = aligned(position, 8);
  }
}

}  // namespace

std::string_view loginBytes() { return "\0AUTH EXTERNAL\r\nDATA\r\nNEGOTIATE_UNIX_FD\r\nBEGIN\r\n"sv; }

RawClient::RawClient(const std::filesystem::path &socket, Login login)
    : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  socket.string().copy(address.sun_path, sizeof address.sun_path - 1);
  EXPECT_EQ(0, ::connect(fd(), reinterpret_cast<const sockaddr *>(&address), sizeof address)) << std::strerror(errno);
  if (login == Login::done) this->login();
}

void RawClient::login() {
  send(loginBytes());
  // The server's lines end with its word on descriptors.
  std::string line;
  std::string byte;
  while (line.find("AGREE_UNIX_FD\r\n") == std::string::npos && line.find("ERROR") == std::string::npos) {
    if (!readBytes(byte, 1)) return;
    line += byte;
  }
  while (!line.ends_with("\r\n") && readBytes(byte, 1)) line += byte;
}

bool RawClient::send(std::string_view bytes) const {
  while (!bytes.empty()) {
    const ssize_t count = ::send(fd(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count < 0 && errno == EAGAIN) {
      if (!await(fd(), POLLOUT)) return false;
      continue;
    }
    if (count < 0) return false;
    bytes.remove_prefix(static_cast<std::size_t>(count));
  }
  return true;
}

bool RawClient::sendWithDescriptors(std::string_view bytes, int descriptor, std::size_t count) const {
  const std::vector<int> descriptors(count, descriptor);
  return wire::sendBytes(fd(), bytes, descriptors) == static_cast<ssize_t>(bytes.size());
}

std::size_t RawClient::offer(std::string_view bytes) const {
  const ssize_t count = ::send(fd(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
  return count > 0 ? static_cast<std::size_t>(count) : 0;
}

bool RawClient::readBytes(std::string &out, std::size_t count) {
  while (received_.size() < count) {
    if (!await(fd(), POLLIN)) return false;
    char buffer[65536];
    const ssize_t taken = ::recv(fd(), buffer, sizeof buffer, MSG_DONTWAIT);
    if (taken <= 0) return false;
    received_.append(buffer, static_cast<std::size_t>(taken));
  }
  out = received_.substr(0, count);
  received_.erase(0, count);
  return true;
}

std::optional<RawAnswer> RawClient::read() {
  std::string header;
  std::string fields;
  RawAnswer answer;
  if (!readBytes(header, fixedHeader)) return std::nullopt;
  answer.type = static_cast<std::uint8_t>(header[1]);
  const std::size_t length = numberAt(header, 12);
  if (!readBytes(fields, aligned(length, 8)) || !readBytes(answer.body, numberAt(header, 4))) return std::nullopt;
  takeFields(std::string_view(fields).substr(0, length), answer);
  return answer;
}

std::optional<RawAnswer> RawClient::readAnswerTo(std::uint32_t serial) {
  for (;;) {
    std::optional<RawAnswer> answer = read();
    if (!answer || answer->replyTo == serial) return answer;
  }
}

std::string RawClient::call(const Message &message) {
  if (!send(message)) return "closed";
  const std::optional<RawAnswer> answer = readAnswerTo(message.serial);
  return answer ? answer->errorName : "closed";
}

bool RawClient::isClosed() {
  char buffer[4096];
  for (;;) {
    if (!await(fd(), POLLIN)) return false;
    const ssize_t count = ::recv(fd(), buffer, sizeof buffer, MSG_DONTWAIT);
    if (count <= 0) return count == 0 || errno == ECONNRESET;
  }
}

}  // namespace storix::e2e
