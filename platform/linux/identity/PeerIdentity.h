#pragma once

#include <optional>
#include <string>

#include "platform/Value.h"

namespace storix::linuxhost {

class ApplicationManifests;

/// Which application a process is, and what it is entitled to.
struct PeerIdentity {
  std::optional<std::string> bundleIdentifier;
  Dictionary entitlements;
};

/// Finds it out from a process's directory in /proc: what its sandbox says; or else the manifest of
/// the program that it runs; or else the systemd unit that it was started in. Whoever may be in a
/// sandbox that cannot be read is nobody. The caller sees to it that the process still lives after.
PeerIdentity readIdentity(int processDirectory, ApplicationManifests &manifests);

}  // namespace storix::linuxhost
