#pragma once

#include <mutex>
#include <string>
#include <string_view>

namespace storix::linuxhost {

inline constexpr std::string_view lockStateFileName = "vaultkeepd.kvs";

/// What the guard of the device says about its lock, in a keyed-value file in the runtime directory:
/// "lockState", a whole number, and "unlockedSinceBoot", a boolean (false where it is missing). No file
/// means a device without a passcode. What cannot be read or understood is one line in the log and
/// counts as locked since boot. Owned by the platform object; thread-safe; looks at the file each time.
class LockState {
 public:
  explicit LockState(const std::string &runtimeDirectory);

  int lockState();
  bool unlockedSinceBoot();

 private:
  struct Answer {
    int lockState = 0;
    bool unlockedSinceBoot = false;
  };
  Answer read();
  void complain(const std::string &reason);

  std::string path_;
  std::mutex mutex_;
  std::string lastComplaint_;
};

}  // namespace storix::linuxhost
