#pragma once

#include <memory>
#include <string>

#include "platform/linux/extensions/ExtensionBundles.h"
#include "tools/check-extension/Findings.h"

namespace storix::check {

/// A bundle that can be started.
struct CheckedBundle {
  std::shared_ptr<const linuxhost::ExtensionBundle> bundle;
  std::string executable;
};

/// Holds the directory and its Info.kvs against what the daemon asks of them. None when there is nothing
/// that could be started; the findings tell why. `path` is absolute.
std::optional<CheckedBundle> checkBundle(const std::string &path, Findings &findings);

}  // namespace storix::check
