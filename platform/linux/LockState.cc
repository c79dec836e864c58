#include "platform/linux/LockState.h"

#include <cerrno>
#include <limits>

#include "platform/Log.h"
#include "platform/PlatformServices.h"
#include "platform/linux/files/KeyedValueFile.h"

namespace storix::linuxhost {

LockState::LockState(const std::string &runtimeDirectory)
    : path_(runtimeDirectory + "/" + std::string(lockStateFileName)) {}

int LockState::lockState() { return read().lockState; }

bool LockState::unlockedSinceBoot() { return read().unlockedSinceBoot; }

LockState::Answer LockState::read() {
  const Result<Dictionary> content = readKeyedValueFile(path_);
  if (!content) {
    if (content.error().domain() == posixErrorDomain && content.error().code() == ENOENT) {
      return {deviceLockStateNoPasscode, true};
    }
    complain(content.error().message());
    return {};
  }

  const auto state = content.value().find("lockState");
  const std::int64_t *number = state == content.value().end() ? nullptr : state->second.integer();
  if (!number || *number < std::numeric_limits<int>::min() || *number > std::numeric_limits<int>::max()) {
    complain("\"lockState\" must be there and be a whole number.");
    return {};
  }
  const auto unlocked = content.value().find("unlockedSinceBoot");
  if (unlocked == content.value().end()) return {static_cast<int>(*number), false};
  const bool *flag = unlocked->second.boolean();
  if (!flag) {
    complain("\"unlockedSinceBoot\" must be true or false.");
    return {};
  }
  return {static_cast<int>(*number), *flag};
}

void LockState::complain(const std::string &reason) {
  {
    const std::lock_guard lock(mutex_);
    if (lastComplaint_ == reason) return;
    lastComplaint_ = reason;
  }
  sx_default_log().fault("[ERROR] The lock state in %@ counts as locked since boot: %@", path_, reason);
}

}  // namespace storix::linuxhost
