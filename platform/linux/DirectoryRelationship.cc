#include "platform/linux/DirectoryRelationship.h"

#include <cerrno>

#include "platform/linux/PathText.h"
#include "platform/linux/ResolvedPath.h"

namespace storix::linuxhost {

Result<DirectoryRelationship> directoryRelationship(const std::optional<URL> &directory,
                                                    const std::optional<URL> &item) {
  if (!directory) return posixError(EINVAL, "No directory to compare with");
  if (!item) return posixError(EINVAL, "No item to compare");

  const std::string directoryPath = directory->fileSystemRepresentation();
  const std::optional<std::string> resolvedDirectory = resolveExistingPath(directoryPath);
  if (!resolvedDirectory) {
    if (errno == ENOENT || errno == ENOTDIR) return fileNotFoundForReading(*directory);
    return posixError(errno, "Cannot look at " + quotedPath(directoryPath));
  }
  const std::string itemPath = item->fileSystemRepresentation();
  const std::optional<ResolvedPath> resolvedItem = resolvePath(itemPath);
  if (!resolvedItem) return posixError(errno, "Cannot look at " + quotedPath(itemPath));

  const std::optional<std::string_view> below = pathBelow(*resolvedDirectory, resolvedItem->path);
  if (!below) return DirectoryRelationship::other;
  return below->empty() ? DirectoryRelationship::same : DirectoryRelationship::contains;
}

}  // namespace storix::linuxhost
