#pragma once

#include <cstddef>
#include <optional>
#include <string>

namespace storix::linuxhost {

/// The whole of a small file: /proc's, for instance. None, with errno set, when it cannot be read, is
/// no regular file, or is longer than `limit` (EFBIG). Follows no symbolic link in the last component.
std::optional<std::string> readSmallFile(int directory, const char *name, std::size_t limit);

}  // namespace storix::linuxhost
