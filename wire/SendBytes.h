#pragma once

#include <sys/types.h>

#include <span>
#include <string_view>

namespace storix::wire {

/// Writes the bytes to a socket in one `sendmsg`, with copies of the descriptors (253 at most), which
/// stay the caller's. Gives how many bytes the socket took, or -1 with errno; a peer that is gone is
/// EPIPE. Blocks where the socket does.
ssize_t sendBytes(int socket, std::string_view bytes, std::span<const int> descriptors);

}  // namespace storix::wire
