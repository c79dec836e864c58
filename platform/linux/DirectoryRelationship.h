#pragma once

#include <optional>

#include "platform/PlatformServices.h"

namespace storix::linuxhost {

/// `PlatformServices::directoryRelationship`. Decided on whole components once symbolic links are
/// resolved; of an item that does not exist, its nearest existing ancestor is. Any thread.
Result<DirectoryRelationship> directoryRelationship(const std::optional<URL> &directory,
                                                    const std::optional<URL> &item);

}  // namespace storix::linuxhost
