#include "platform/Queue.h"

#include <algorithm>
#include <chrono>
#include <limits>

#include "platform/QueueCore.h"

namespace storix {

const Queue *Queue::current() { return QueueCore::currentQueue(); }

void runAfterDelay(Executor &executor, std::uint64_t nanoseconds, std::shared_ptr<Queue> queue, Task task) {
  constexpr std::uint64_t longest = std::numeric_limits<std::chrono::nanoseconds::rep>::max();
  const std::chrono::nanoseconds delay(static_cast<std::chrono::nanoseconds::rep>(std::min(nanoseconds, longest)));
  executor.executeAfter(
      delay, [queue = std::move(queue), task = std::move(task)]() mutable { queue->async(std::move(task)); });
}

}  // namespace storix
