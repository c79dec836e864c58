#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace storix::linuxhost {

/// What a path means once symbolic links, "." and ".." are resolved.
struct ResolvedPath {
  /// Absolute, without "/" at its end (but for the root).
  std::string path;
  /// Whether something is there. If not, only the beginning of the path exists.
  bool exists = false;
};

/// Resolves a path that exists. None, with errno set, when it does not or cannot be looked at.
std::optional<std::string> resolveExistingPath(const std::string &path);

/// Resolves the nearest ancestor that exists, and appends the rest as it is written; ".." in the rest
/// takes the component before it away. None, with errno set, when the path is not absolute, or when
/// an ancestor cannot be looked at or is no directory.
std::optional<ResolvedPath> resolvePath(const std::string &path);

/// The part of the path after the directory, without a "/" at its beginning: empty when they are the
/// same, none when the path is not in the directory. Both as `resolvePath` gives them.
std::optional<std::string_view> pathBelow(std::string_view directory, std::string_view path);

}  // namespace storix::linuxhost
