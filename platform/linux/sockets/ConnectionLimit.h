#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>
#include <vector>

namespace storix::linuxhost {

/// How many connections all sockets together may have, so that a flood of them leaves the daemon the
/// file descriptors that it needs for itself. Owned by the platform object; places may outlive it.
/// Thread-safe.
class ConnectionLimit {
  struct State;

 public:
  static constexpr std::size_t mostConnections = 1024;

  /// As many as the process's file descriptors allow; raises their soft limit where the hard one lets
  /// it.
  static std::size_t connectionsForThisProcess();
  /// The same for that many descriptors.
  static std::size_t connectionsFor(std::size_t descriptors);

  explicit ConnectionLimit(std::size_t connections);

  /// One connection's place, free again when this is destroyed.
  class Place {
   public:
    Place(Place &&other) noexcept = default;
    Place &operator=(Place &&) = delete;
    ~Place();

   private:
    friend class ConnectionLimit;
    explicit Place(std::shared_ptr<State> limit) : limit_(std::move(limit)) {}
    std::shared_ptr<State> limit_;
  };

  /// A place; or, when there is none, none, and `whenFree` is called once, on any thread, when there
  /// may be one again.
  std::optional<Place> take(std::function<void()> whenFree);

 private:
  struct State {
    std::mutex mutex;
    std::size_t free = 0;
    std::vector<std::function<void()>> waiting;
  };
  std::shared_ptr<State> state_;
};

}  // namespace storix::linuxhost
