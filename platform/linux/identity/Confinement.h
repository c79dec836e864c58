#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <utility>

namespace storix::linuxhost {

/// What the kernel says of a process that bears on what it may do beside its user's rights.
struct ProcessRestrictions {
  bool noNewPrivileges = false;
  /// 0 none, 1 strict, 2 filters; and how many filters, where the kernel tells.
  int seccompMode = 0;
  std::optional<int> seccompFilters;
  /// Device and inode of the namespaces.
  std::pair<dev_t, ino_t> mountNamespace;
  std::pair<dev_t, ino_t> userNamespace;
  /// Empty where the kernel gives processes none.
  std::string securityLabel;
};

/// Reads them from a process's directory in /proc. None when one of them could not be found out.
std::optional<ProcessRestrictions> readRestrictions(int processDirectory);

/// Whether the process may do less than its user may elsewhere, measured by the daemon's own state.
/// What is not known counts as confined.
bool isConfined(const std::optional<ProcessRestrictions> &process, const std::optional<ProcessRestrictions> &own);

}  // namespace storix::linuxhost
