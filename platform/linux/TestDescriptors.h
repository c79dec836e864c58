#pragma once

#include <sys/socket.h>

#include <array>
#include <cstring>

#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// What came from a test's other process: one byte, and perhaps a descriptor with it.
struct ReceivedByte {
  /// False when nothing came.
  bool isThere = false;
  unsigned char value = 0;
  UniqueFd descriptor;
};

inline ReceivedByte receiveByte(int socket) {
  ReceivedByte received;
  iovec content{&received.value, 1};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
  msghdr message{};
  message.msg_iov = &content;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  received.isThere = ::recvmsg(socket, &message, MSG_CMSG_CLOEXEC) == 1;
  if (const cmsghdr *header = CMSG_FIRSTHDR(&message); received.isThere && header) {
    int number = -1;
    std::memcpy(&number, CMSG_DATA(header), sizeof number);
    received.descriptor.reset(number);
  }
  return received;
}

}  // namespace storix::linuxhost
