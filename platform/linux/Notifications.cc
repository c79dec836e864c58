#include "platform/linux/Notifications.h"

namespace storix::linuxhost {

void Notifications::addObserver(std::string_view name, std::function<void()> callback) {
  const std::lock_guard lock(mutex_);
  observers_[std::string(name)].push_back(std::move(callback));
}

void Notifications::post(std::string_view name) {
  std::vector<std::function<void()>> callbacks;
  {
    const std::lock_guard lock(mutex_);
    const auto found = observers_.find(name);
    if (found == observers_.end()) return;
    callbacks = found->second;
  }
  loop_.post([callbacks = std::move(callbacks)] {
    for (const std::function<void()> &callback : callbacks) callback();
  });
}

}  // namespace storix::linuxhost
