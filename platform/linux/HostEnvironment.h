#pragma once

#include <functional>
#include <map>
#include <string>
#include <vector>

#include "platform/Log.h"
#include "platform/Result.h"
#include "platform/linux/extensions/ExtensionBundles.h"
#include "platform/linux/extensions/ExtensionConfinement.h"

namespace storix::linuxhost {

/// Environment variables by their names.
using EnvironmentVariables = std::map<std::string, std::string, std::less<>>;

/// Those of this process, as they are now.
EnvironmentVariables processEnvironment();

/// Everything that the host takes from its environment, read once: whatever needs a place is given it
/// from here, so that tests can give their own. A value; all paths are absolute and do not end in "/".
struct HostEnvironment {
  std::string homeDirectory;
  std::string runtimeDirectory;
  /// Where the session's other services have their sockets; empty when it is not known.
  std::string sessionRuntimeDirectory;
  ExtensionPlaces extensionPlaces;
  ConfinementPolicy confinement = ConfinementPolicy::preferred;
  /// Of application manifests, in the order of precedence.
  std::vector<std::string> applicationDirectories;
  LogSeverity logSeverity = LogSeverity::standard;
  /// Whether standard error is the journal's.
  bool logsToJournal = false;
  /// "NAME=value": what an extension's process gets of the daemon's environment.
  std::vector<std::string> extensionEnvironment;
  /// Sentences about values that are left out, for the log.
  std::vector<std::string> warnings;

  /// A variable that is empty counts as unset, but for the lists of STORIX_*, where it names nothing; one
  /// of XDG's that is not absolute is ignored. The error says which variable is wrong and what it should
  /// be.
  static Result<HostEnvironment> fromVariables(const EnvironmentVariables &variables);

  /// What matters to the sandboxes of extensions: they see nothing that lets them act as their user, or as
  /// another extension.
  [[nodiscard]] ConfinementPlaces confinementPlaces() const;
};

}  // namespace storix::linuxhost
