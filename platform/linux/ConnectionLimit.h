#pragma once

#include <cstddef>
#include <functional>
#include <mutex>
#include <optional>
#include <utility>
#include <vector>

namespace storix::linuxhost {

/// How many connections all sockets together may have, so that a flood of them leaves the daemon the
/// file descriptors that it needs for itself. Owned by the platform object; outlives its places.
/// Thread-safe.
class ConnectionLimit {
 public:
  static constexpr std::size_t mostConnections = 1024;

  /// As many as the process's file descriptors allow; raises their soft limit where the hard one lets
  /// it.
  static std::size_t connectionsForThisProcess();
  /// The same for that many descriptors.
  static std::size_t connectionsFor(std::size_t descriptors);

  explicit ConnectionLimit(std::size_t connections) : free_(connections) {}

  /// One connection's place, free again when this is destroyed.
  class Place {
   public:
    Place(Place &&other) noexcept : limit_(std::exchange(other.limit_, nullptr)) {}
    Place &operator=(Place &&) = delete;
    ~Place() {
      if (limit_) limit_->release();
    }

   private:
    friend class ConnectionLimit;
    explicit Place(ConnectionLimit *limit) : limit_(limit) {}
    ConnectionLimit *limit_;
  };

  /// A place; or, when there is none, none, and `whenFree` is called once, on any thread, when there
  /// may be one again.
  std::optional<Place> take(std::function<void()> whenFree);

 private:
  void release();

  std::mutex mutex_;
  std::size_t free_;
  std::vector<std::function<void()>> waiting_;
};

}  // namespace storix::linuxhost
