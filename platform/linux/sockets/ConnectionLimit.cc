#include "platform/linux/sockets/ConnectionLimit.h"

#include <sys/resource.h>

#include <algorithm>
#include <utility>

#include "platform/linux/identity/Sandbox.h"

namespace storix::linuxhost {

namespace {

/// The socket, the peer's pidfd, and where the peer may send descriptors, a socket pair and the one that it sent.
constexpr std::size_t descriptorsPerConnection = 5;
/// For the daemon's own files, the extensions (a socket, a pidfd and a pipe each), and the files that
/// clients have proved.
constexpr std::size_t reservedDescriptors = 512 + Sandbox::proofsAltogether;

}  // namespace

std::size_t ConnectionLimit::connectionsFor(std::size_t descriptors) {
  const std::size_t reserved = std::min(reservedDescriptors, descriptors / 2);
  return std::clamp<std::size_t>((descriptors - reserved) / descriptorsPerConnection, 1, mostConnections);
}

std::size_t ConnectionLimit::connectionsForThisProcess() {
  constexpr rlim_t wanted = mostConnections * descriptorsPerConnection + reservedDescriptors;
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return connectionsFor(1024);
  if (limit.rlim_cur < wanted) {
    rlimit raised = limit;
    raised.rlim_cur = std::min(wanted, limit.rlim_max);
    if (setrlimit(RLIMIT_NOFILE, &raised) == 0) limit = raised;
  }
  return connectionsFor(static_cast<std::size_t>(std::min(limit.rlim_cur, wanted)));
}

ConnectionLimit::ConnectionLimit(std::size_t connections) : state_(std::make_shared<State>()) {
  state_->free = connections;
}

std::optional<ConnectionLimit::Place> ConnectionLimit::take(std::function<void()> whenFree) {
  const std::lock_guard lock(state_->mutex);
  if (state_->free == 0) {
    state_->waiting.push_back(std::move(whenFree));
    return std::nullopt;
  }
  --state_->free;
  return Place(state_);
}

ConnectionLimit::Place::~Place() {
  if (!limit_) return;
  std::vector<std::function<void()>> waiting;
  {
    const std::lock_guard lock(limit_->mutex);
    ++limit_->free;
    waiting = std::exchange(limit_->waiting, {});
  }
  for (const auto &whenFree : waiting) whenFree();
}

}  // namespace storix::linuxhost
