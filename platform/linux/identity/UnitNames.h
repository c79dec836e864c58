#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace storix::linuxhost {

/// The application's identifier from the name of the systemd unit that an application was started in:
/// "app[-<launcher>]-<identifier>-<random>.scope" or "app[-<launcher>]-<identifier>[@<random>].service",
/// with "\x2d" standing for "-". None for every other name.
std::optional<std::string> applicationIdentifierFromUnit(std::string_view unit);

/// The same from the text of /proc/<pid>/cgroup: of the last component of the path that is such a unit.
std::optional<std::string> applicationIdentifierFromCgroup(std::string_view cgroupText);

}  // namespace storix::linuxhost
