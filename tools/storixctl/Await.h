#pragma once

#include <poll.h>
#include <sys/eventfd.h>

#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>

#include "platform/Result.h"
#include "tools/storixctl/Waiting.h"
#include "wire/UniqueFd.h"

namespace storix::ctl {

/// How often the one who waits is told that time goes by.
inline constexpr std::chrono::milliseconds tickInterval{100};

/// Starts something that answers on another thread, by calling the handler that `start` gets, and waits
/// for the answer. Calls `tick` meanwhile. Interrupted: `interruptedError` at once; the answer is
/// dropped when it comes.
template <class T>
Result<T> await(Waiting &waiting, const std::function<void(std::function<void(Result<T>)>)> &start,
                const std::function<void()> &tick) {
  struct Answer {
    UniqueFd came{::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
    std::mutex mutex;
    std::optional<Result<T>> result;
  };
  const auto answer = std::make_shared<Answer>();
  if (!answer->came) return posixError(errno, "making a descriptor to wait on");
  start([weak = std::weak_ptr<Answer>(answer)](Result<T> result) {
    const auto waited = weak.lock();
    if (!waited) return;
    {
      const std::lock_guard lock(waited->mutex);
      waited->result.emplace(std::move(result));
    }
    ::eventfd_write(waited->came.get(), 1);
  });
  for (;;) {
    const auto woken = waiting.wait(answer->came.get(), POLLIN, waiting.now() + tickInterval);
    if (woken == Waiting::Woken::interrupted) return interruptedError();
    if (woken == Waiting::Woken::ready) {
      const std::lock_guard lock(answer->mutex);
      return *std::move(answer->result);
    }
    tick();
  }
}

}  // namespace storix::ctl
