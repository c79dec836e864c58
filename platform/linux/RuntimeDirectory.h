#pragma once

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Result.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// The directory of the sockets, the token key and the lock file, held for one daemon: as long as the
/// object lives no other daemon can hold the same directory. Owned by the platform object; unchanging.
class RuntimeDirectory {
 public:
  /// Makes the directory (0700) where it is missing, and takes its lock. Refused, with a sentence that
  /// says what to do: what is no directory of the daemon's own user that nobody else may enter, and one
  /// that another daemon holds.
  static Result<std::unique_ptr<RuntimeDirectory>> open(std::string path);

  /// Absolute, without a "/" at its end.
  [[nodiscard]] const std::string &path() const { return path_; }

  /// The directory itself, open for as long as this lives: "/proc/self/fd/<fd>/<name>" reaches into it
  /// however long its path is.
  [[nodiscard]] int fd() const { return directory_.get(); }

 private:
  RuntimeDirectory(std::string path, UniqueFd directory, UniqueFd lock);

  std::string path_;
  UniqueFd directory_;
  UniqueFd lock_;
};

inline constexpr std::string_view lockFileName = "storixd.lock";

/// Listening sockets by their names, as the service manager handed them over.
using ActivatedSockets = std::map<std::string, UniqueFd, std::less<>>;

/// Takes the sockets that the service manager handed to this process, if any; a second call gives none.
/// An error where one of them is no listening unix stream socket. Changes the environment: call it
/// before any thread starts.
Result<ActivatedSockets> takeActivatedSockets();

}  // namespace storix::linuxhost
