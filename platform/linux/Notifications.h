#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/EventLoop.h"

namespace storix::linuxhost {

/// The system-wide notifications: names that are posted on the platform socket, and those who observe
/// them. Owned by the platform object; thread-safe.
class Notifications {
 public:
  /// `loop` must outlive it; the observers are called on it.
  explicit Notifications(EventLoop &loop) : loop_(loop) {}

  /// Calls back on every delivery, for ever.
  void addObserver(std::string_view name, std::function<void()> callback);

  /// Delivers once to everyone who observes that name now, in the order in which they came.
  void post(std::string_view name);

 private:
  EventLoop &loop_;
  std::mutex mutex_;
  std::map<std::string, std::vector<std::function<void()>>, std::less<>> observers_;
};

}  // namespace storix::linuxhost
