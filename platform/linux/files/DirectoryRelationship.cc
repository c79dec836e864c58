#include "platform/linux/files/DirectoryRelationship.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <ctime>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/linux/files/PathText.h"
#include "platform/linux/files/ResolvedPath.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

/// What the kernel knows a file or directory by.
struct Identity {
  dev_t device;
  ino_t inode;
  friend bool operator==(const Identity &, const Identity &) = default;
};

/// What a lookup has found out about its item and asks again for each directory: the identities of the
/// item and of all directories that it lies in. A directory that is none of these does not hold the
/// item, and one call that tells the directory's identity shows it.
///
/// A lookup asks about one item and many directories, each of them once. So what is known of the item
/// counts for the thread that found it out, until that thread asks about another item, or about the
/// first directory again, or a little time has passed. It only ever answers "other": where it does not,
/// everything is looked at anew, so that no directory is ever said to hold what lies elsewhere.
class ItemMemory {
 public:
  /// Whether the directory is known not to hold the item.
  [[nodiscard]] bool rulesOut(const URL &directory, const URL &item) {
    if (!holds_ || item != *item_ || directory == *firstDirectory_ || now() > forgotten_) {
      holds_ = false;
      return false;
    }
    struct stat status {};
    if (::stat(directory.fileSystemRepresentation().c_str(), &status) != 0) return false;
    if (!ancestorsKnown_ && !lookAtAncestors()) {
      holds_ = false;
      return false;
    }
    return std::find(ancestors_.begin(), ancestors_.end(), Identity{status.st_dev, status.st_ino}) == ancestors_.end();
  }

  /// The item was compared with the directory, does not lie in it, and `path` is its own, resolved.
  void remember(const URL &directory, const URL &item, std::string path) {
    if (holds_) return;
    holds_ = true;
    ancestorsKnown_ = false;
    firstDirectory_ = directory;
    item_ = item;
    path_ = std::move(path);
    forgotten_ = now() + memoryTime;
  }

  void forget() { holds_ = false; }

 private:
  static constexpr std::chrono::milliseconds memoryTime{10};

  /// Exact to a few milliseconds, and a tenth of the price of an exact one.
  static std::chrono::nanoseconds now() {
    timespec time{};
    ::clock_gettime(CLOCK_MONOTONIC_COARSE, &time);
    return std::chrono::seconds(time.tv_sec) + std::chrono::nanoseconds(time.tv_nsec);
  }

  /// False when the item has gone elsewhere meanwhile. Of what does not exist there is no identity.
  [[nodiscard]] bool lookAtAncestors() {
    ancestors_.clear();
    for (std::size_t end = 0; end != std::string::npos;) {
      end = path_.find('/', end + 1);
      const std::string ancestor = end == std::string::npos ? path_ : path_.substr(0, end);
      struct stat status {};
      if (::lstat(ancestor.c_str(), &status) != 0) {
        if (errno != ENOENT && errno != ENOTDIR) return false;
        break;
      }
      if (S_ISLNK(status.st_mode)) return false;
      ancestors_.push_back({status.st_dev, status.st_ino});
    }
    struct stat root {};
    if (::stat("/", &root) != 0) return false;
    ancestors_.push_back({root.st_dev, root.st_ino});
    ancestorsKnown_ = true;
    return true;
  }

  bool holds_ = false;
  bool ancestorsKnown_ = false;
  std::optional<URL> firstDirectory_;
  std::optional<URL> item_;
  std::string path_;
  std::vector<Identity> ancestors_;
  std::chrono::nanoseconds forgotten_{};
};

thread_local ItemMemory itemMemory;

bool hasDotComponent(std::string_view path) {
  while (!path.empty()) {
    const std::size_t slash = path.find('/');
    const std::string_view component = path.substr(0, slash);
    if (component == "." || component == "..") return true;
    path.remove_prefix(slash == std::string_view::npos ? path.size() : slash + 1);
  }
  return false;
}

/// Whether the item's path goes on where the directory's ends, and goes through no symbolic link from
/// there: then the item lies in the directory wherever both are. What does not exist counts as it is
/// written. False also where that cannot be told so easily.
bool leadsStraightDown(const std::string &directoryPath, const std::string &itemPath) {
  const std::optional<std::string_view> below = pathBelow(directoryPath, itemPath);
  if (!below || below->empty() || hasDotComponent(*below)) return false;
  if (directoryPath.find('\0') != std::string::npos || itemPath.find('\0') != std::string::npos) return false;
  const std::size_t start = below->find_first_not_of('/');
  if (start == std::string_view::npos) return false;
  const UniqueFd directory(::open(directoryPath.c_str(), O_PATH | O_CLOEXEC));
  if (!directory) return false;
  open_how how{};
  how.flags = O_PATH | O_CLOEXEC;
  how.resolve = RESOLVE_NO_SYMLINKS;
  const std::string rest(below->substr(start));
  const UniqueFd item(static_cast<int>(::syscall(SYS_openat2, directory.get(), rest.c_str(), &how, sizeof how)));
  return item || errno == ENOENT || errno == ENOTDIR;
}

}  // namespace

Result<DirectoryRelationship> directoryRelationship(const std::optional<URL> &directory,
                                                    const std::optional<URL> &item) {
  if (!directory) return posixError(EINVAL, "No directory to compare with");
  if (!item) return posixError(EINVAL, "No item to compare");
  if (itemMemory.rulesOut(*directory, *item)) return DirectoryRelationship::other;

  const std::string directoryPath = directory->fileSystemRepresentation();
  const std::string itemPath = item->fileSystemRepresentation();
  if (leadsStraightDown(directoryPath, itemPath)) {
    itemMemory.forget();
    return DirectoryRelationship::contains;
  }
  const std::optional<std::string> resolvedDirectory = resolveExistingPath(directoryPath);
  if (!resolvedDirectory) {
    if (errno == ENOENT || errno == ENOTDIR) return fileNotFoundForReading(*directory);
    return posixError(errno, "Cannot look at " + quotedPath(directoryPath));
  }
  std::optional<ResolvedPath> resolvedItem = resolvePath(itemPath);
  if (!resolvedItem) return posixError(errno, "Cannot look at " + quotedPath(itemPath));

  const std::optional<std::string_view> below = pathBelow(*resolvedDirectory, resolvedItem->path);
  if (!below) {
    itemMemory.remember(*directory, *item, std::move(resolvedItem->path));
    return DirectoryRelationship::other;
  }
  // The lookup has come to its end.
  itemMemory.forget();
  return below->empty() ? DirectoryRelationship::same : DirectoryRelationship::contains;
}

}  // namespace storix::linuxhost
