#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/Executor.h"
#include "platform/Extensions.h"
#include "platform/linux/extensions/ExtensionBundles.h"
#include "platform/linux/sockets/IoLoop.h"

namespace storix::linuxhost {

/// Finds the installed extensions and finds them again when their directories change. Thread-safe.
///
/// Directories are read, records made and handlers called by one task at a time on the executor. What
/// cannot be read is left out, with one log line that is not repeated as long as nothing about it
/// changes. When the process runs out of descriptors or memory, what was found before stays and
/// another look follows.
class ExtensionDiscovery {
 public:
  /// Makes the record of a bundle. Bundles that are equal to one whose record is still held by the
  /// discovery get the same record.
  using RecordFactory = std::function<std::shared_ptr<ExtensionRecord>(std::shared_ptr<const ExtensionBundle>)>;

  /// `executor` and `loop` must outlive the discovery and its handles.
  ExtensionDiscovery(ExtensionPlaces places, Executor &executor, IoLoop &loop, RecordFactory makeRecord);

  /// Ends all matching; a handler that runs is not waited for.
  ~ExtensionDiscovery();

  /// As `PlatformServices::beginMatchingExtensions`. Of the attributes the extension point alone
  /// counts; without one nothing matches.
  std::shared_ptr<ExtensionMatching> beginMatching(const Dictionary &attributes, ExtensionMatchingHandler handler);

  /// The bundle that the last look found, or null. Looks first where nobody has yet.
  std::shared_ptr<const ExtensionBundle> bundleForIdentifier(const std::string &identifier);

 private:
  struct Implementation;
  std::shared_ptr<Implementation> implementation_;
};

}  // namespace storix::linuxhost
