#pragma once

#include <optional>

#include "platform/PlatformServices.h"

namespace storix::linuxhost {

/// `PlatformServices::directoryRelationship`. Decided on whole components once symbolic links are
/// resolved; of an item that does not exist, its nearest existing ancestor is. Any thread.
///
/// "Contains" and "same" are what the directory and the item are at the moment of the call. "Other" may
/// rest on where the item was a few milliseconds ago, when the same thread compared it with another
/// directory: a lookup over many directories resolves its item once, and costs one `stat` for each
/// directory. Comparing the item with the directory with which a lookup began looks at it anew.
Result<DirectoryRelationship> directoryRelationship(const std::optional<URL> &directory,
                                                    const std::optional<URL> &item);

}  // namespace storix::linuxhost
