#pragma once

#include <cstdint>
#include <functional>

#include "platform/Result.h"
#include "tools/storixctl/Waiting.h"

namespace storix::ctl {

/// Copies what comes from one descriptor, from where it stands to its end, to another, from where that
/// stands: files, pipes, sockets, terminals. In the kernel where it can, else through a buffer; the
/// descriptors' modes stay as they are. `progress` hears of the bytes so far, now and then.
///
/// The number of bytes, or the error that names the side that failed by the word given for it. A pipe
/// whose reader has gone is the "posix" error EPIPE. Interrupted, also while it waits for either side:
/// `interruptedError`.
struct ContentCopy {
  int from;
  int to;
  std::string fromName;
  std::string toName;

  Result<std::uint64_t> run(Waiting &waiting, const std::function<void(std::uint64_t)> &progress) const;
};

}  // namespace storix::ctl
