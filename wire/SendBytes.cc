#include "wire/SendBytes.h"

#include <sys/socket.h>

#include <array>
#include <cerrno>
#include <cstring>

namespace storix::wire {

namespace {

/// The kernel takes no more with one message.
constexpr std::size_t mostDescriptors = 253;

}  // namespace

ssize_t sendBytes(int socket, std::string_view bytes, std::span<const int> descriptors) {
  iovec content{const_cast<char *>(bytes.data()), bytes.size()};
  msghdr message{};
  message.msg_iov = &content;
  message.msg_iovlen = 1;
  alignas(cmsghdr) std::array<char, CMSG_SPACE(mostDescriptors * sizeof(int))> control;
  if (!descriptors.empty()) {
    if (descriptors.size() > mostDescriptors) {
      errno = EINVAL;
      return -1;
    }
    message.msg_control = control.data();
    message.msg_controllen = CMSG_SPACE(descriptors.size_bytes());
    std::memset(control.data(), 0, message.msg_controllen);
    cmsghdr *header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(descriptors.size_bytes());
    std::memcpy(CMSG_DATA(header), descriptors.data(), descriptors.size_bytes());
  }
  return sendmsg(socket, &message, MSG_NOSIGNAL);
}

}  // namespace storix::wire
