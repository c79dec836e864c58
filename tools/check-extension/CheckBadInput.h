#pragma once

#include <string>

#include "platform/URL.h"
#include "tools/check-extension/CheckedExtension.h"

namespace storix::check {

/// Asks for what no provider has: places outside of its directory, names that lead there, documents that
/// do not exist, nothing at all, messages that do not fit. `storage` is the provided-items directory, which
/// exists; `workingDirectory` one of the check's own, outside of it.
void checkBadInput(CheckedExtension &extension, const URL &storage, const std::string &workingDirectory);

/// Whether the URL names something below the directory: not the directory itself, nothing that ".." leads
/// out of.
bool liesBelow(const URL &url, const URL &directory);

}  // namespace storix::check
