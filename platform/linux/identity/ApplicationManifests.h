#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Value.h"

namespace storix::linuxhost {

/// What a manifest says of one application.
struct ApplicationManifest {
  std::string bundleIdentifier;
  Dictionary entitlements;
  friend bool operator==(const ApplicationManifest &, const ApplicationManifest &) = default;
};

/// The application manifests, `<bundle identifier>.kvs`, in some directories: which application a
/// program belongs to, and what that application is entitled to. Every look-up first looks whether a
/// directory or a file has changed. A manifest that cannot be read or understood is left out, and
/// logged once. Thread-safe; a look-up may wait for the disk.
class ApplicationManifests {
 public:
  /// In the order of precedence; a directory need not exist.
  explicit ApplicationManifests(std::vector<std::string> directories);

  /// The manifest whose "Executable" is now that file; of several the first in the order of the
  /// directories, then of names.
  std::optional<ApplicationManifest> manifestForExecutable(dev_t device, ino_t inode);

  /// The first manifest with that identifier.
  std::optional<ApplicationManifest> manifestForIdentifier(std::string_view bundleIdentifier);

 private:
  /// The state of a file or directory, to see that it has changed. While the last change is so young
  /// that another one could bear the same time, it is not `settled` and must be read again.
  struct Stamp {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    std::int64_t changed = 0;
    bool settled = false;

    static Stamp of(const struct stat &status);
    [[nodiscard]] bool isStillGood(const Stamp &now) const { return settled && sameState(now); }
    [[nodiscard]] bool sameState(const Stamp &other) const {
      return device == other.device && inode == other.inode && size == other.size && changed == other.changed;
    }
  };

  struct File {
    std::string path;
    Stamp stamp;
    /// Of the state that was last complained about.
    Stamp complained;
    ApplicationManifest manifest;
    std::string executable;
    bool usable = false;
  };

  struct Directory {
    std::string path;
    Stamp stamp;
    Stamp complained;
    /// In the order of names.
    std::vector<File> files;
  };

  void refresh();
  static void listFiles(Directory &directory, const Stamp &now);
  static void readFile(File &file, const Stamp &now);

  std::mutex mutex_;
  std::vector<Directory> directories_;
};

}  // namespace storix::linuxhost
