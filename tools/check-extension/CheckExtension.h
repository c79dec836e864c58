#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.h"
#include "tools/check-extension/Findings.h"

namespace storix::check {

/// What to check, and with what.
struct ExtensionCheck {
  std::string bundle;              ///< absolute
  std::vector<std::string> items;  ///< identifiers of documents that the provider has
  std::vector<std::string> files;  ///< the same by their paths relative to the provided-items directory
  /// A directory that the provider takes for its group's container; a fresh one if absent.
  std::optional<std::string> container;
  std::chrono::milliseconds timeout{60'000};
  /// Of what the extension prints; on a thread of the check's.
  std::function<void(std::string_view)> takeOutputLine = [](std::string_view) {};
};

/// Starts the extension as the daemon would, but without one, asks it for everything that a daemon may ask,
/// and gives what is wrong. The error says why nothing could be checked. The daemon's own directories are
/// left alone.
Result<std::vector<Finding>> checkExtension(const ExtensionCheck &check);

}  // namespace storix::check
