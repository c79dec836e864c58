#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

#include "platform/Result.h"
#include "platform/linux/extensions/ExtensionBundles.h"
#include "platform/linux/extensions/ExtensionLauncher.h"

namespace storix::linuxhost {

/// Sends a signal to what runs confined below that process, which must be bubblewrap's and not be reaped.
/// False when there is nothing yet, or it cannot be found out.
[[nodiscard]] bool signalConfined(pid_t process, int signal);

/// Kills that process, which must be bubblewrap's and not be reaped, and the sandbox, whole or in the making:
/// bubblewrap that is killed alone while it makes one leaves behind what it has begun.
void killConfined(pid_t process);

/// What becomes of extensions where bubblewrap is not there, or does not work.
enum class ConfinementPolicy {
  preferred,  ///< they run with all that their user may do
  required,   ///< they are not started
  off,        ///< the same everywhere: they run with all that their user may do
};

/// The places of the session that matter to what an extension may see. All absolute.
struct ConfinementPlaces {
  std::string homeDirectory;
  ExtensionPlaces extensions;
  /// Shown to no extension, whatever its Info.kvs asks for.
  std::vector<std::string> hidden;
  /// Given to no extension for writing.
  std::vector<std::string> unwritable;
};

/// Has extensions run inside a sandbox that bubblewrap makes: with their bundle, the system's programs and
/// libraries and what Info.kvs asks for; with their group containers for writing; with processes, network,
/// devices and /tmp of their own; and with nothing else of their user's. docs/confinement.md has the list.
///
/// Owned by `ExtensionHost`. `confine` is called on the launcher's thread alone.
class ExtensionConfinement {
 public:
  static constexpr const char *bubblewrap = "/usr/bin/bwrap";

  ExtensionConfinement(ConfinementPlaces places, ConfinementPolicy policy, std::string program = bubblewrap);

  /// Makes the description that of a process which runs the same program confined, or leaves it as it is
  /// where the policy lets it. The first call finds out by trying whether bubblewrap works, and says in
  /// one log line if it does not. With an error the extension must not be started.
  [[nodiscard]] std::optional<SXError> confine(LaunchDescription &description, const ExtensionBundle &bundle);

 private:
  struct Grant;

  [[nodiscard]] std::optional<SXError> settleWhetherItWorks();
  [[nodiscard]] std::optional<SXError> checkProgram(const LaunchDescription &description,
                                                    const ExtensionBundle &bundle) const;
  [[nodiscard]] Result<Grant> grant(const std::string &wish, bool writable) const;
  [[nodiscard]] std::vector<Grant> grantsOf(const ExtensionBundle &bundle) const;

  const ConfinementPlaces places_;
  const ConfinementPolicy policy_;
  const std::string program_;
  /// Not known before the first call.
  std::optional<bool> works_;
  /// Why extensions are not started, where they are not.
  std::optional<SXError> refusal_;
};

}  // namespace storix::linuxhost
