#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>

#include "platform/PlatformServices.h"

namespace storix::linuxhost {

/// The file operations of `PlatformServices`. Owned by the platform object; thread-safe.
///
/// Remembers which files it could not read, so that what stands in one of them is kept as
/// "<name>.corrupt" when it is written over.
class Files {
 public:
  static bool fileExists(const std::string &path);

  /// New directories get the mode 0700 and are on the disk when this returns. With intermediate
  /// directories, a directory that is there already is a success.
  static std::optional<SXError> createDirectory(const std::string &path, bool withIntermediateDirectories);

  /// Null for everything but a regular file.
  std::unique_ptr<InputStream> openFileInputStream(const std::string &path);

  /// All of what is read may be changed, whatever the mutability.
  Result<Value> readKeyedValueStream(InputStream &stream, KeyedValueMutability mutability);

  /// Waits for the disk. What went wrong is logged.
  bool writeKeyedValueFileAtomically(const Dictionary &content, const std::string &path);

 private:
  void setUnread(const std::string &path, bool unread);

  std::mutex mutex_;
  /// Paths as they were given, of files that are there and could not be read.
  std::set<std::string> unread_;
};

}  // namespace storix::linuxhost
