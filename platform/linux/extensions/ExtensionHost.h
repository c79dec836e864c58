#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Executor.h"
#include "platform/Extensions.h"
#include "platform/linux/extensions/ExtensionBundles.h"
#include "platform/linux/extensions/ExtensionConfinement.h"
#include "platform/linux/sockets/IoLoop.h"

namespace storix::linuxhost {

/// All of `PlatformServices` that is about extensions: finds them, and runs their processes.
/// Thread-safe; records that it has given may outlive it, and their requests fail then.
class ExtensionHost {
 public:
  /// `environment` is what every extension gets, as "NAME=value", beside what is its own. `executor` and
  /// `loop` must outlive the host and its records. Without a confinement extensions run with all that
  /// their user may do.
  ExtensionHost(ExtensionPlaces places, std::vector<std::string> environment, Executor &executor, IoLoop &loop,
                std::unique_ptr<ExtensionConfinement> confinement = nullptr);

  /// Ends discovery and all processes, and waits until they are reaped: SIGTERM, then SIGKILL after
  /// two seconds.
  ~ExtensionHost();

  std::shared_ptr<ExtensionMatching> beginMatchingExtensions(const Dictionary &attributes,
                                                             ExtensionMatchingHandler handler);
  std::shared_ptr<BundleRecord> bundleRecordForIdentifier(const std::optional<std::string> &identifier);
  void registerExtensionContextClass(std::string_view name, ExtensionContextClass contextClass);

  /// Whether that is the number of a process that was started for the extension and is not reaped yet,
  /// so that it means no other process.
  [[nodiscard]] bool isProcessOfExtension(std::string_view identifier, pid_t process) const;

 private:
  struct Implementation;
  std::shared_ptr<Implementation> implementation_;
};

}  // namespace storix::linuxhost
