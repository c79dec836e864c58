#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/Value.h"

namespace storix::linuxhost {

/// What a sandbox says of the application in it.
struct FlatpakInfo {
  /// The name in [Application]; absent when there is none or it is empty.
  std::optional<std::string> applicationName;
  /// From the [Policy <subsystem>] groups, each entry under "<subsystem>.<key>": "true" and "false" as
  /// booleans, decimal numbers as numbers, all else as strings.
  Dictionary entitlements;
  friend bool operator==(const FlatpakInfo &, const FlatpakInfo &) = default;
};

/// Parses the text of a .flatpak-info file. None when it is not UTF-8, has a line that is no group, no
/// entry and no comment, or says something twice: whoever cannot be understood is nobody.
std::optional<FlatpakInfo> parseFlatpakInfo(std::string_view text);

}  // namespace storix::linuxhost
