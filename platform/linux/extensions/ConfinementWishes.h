#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.h"
#include "platform/Value.h"

namespace storix::linuxhost {

inline constexpr std::string_view confinementWishesKey = "KTSandbox";

/// What a bundle asks for beyond what every confined extension has. Asking is not getting:
/// `ExtensionConfinement` decides.
struct ConfinementWishes {
  bool network = false;
  /// Absolute, or beginning with "~/"; without "." and ".." and without a "/" at the end.
  std::vector<std::string> readOnly;
  std::vector<std::string> readWrite;
  friend bool operator==(const ConfinementWishes &, const ConfinementWishes &) = default;
};

/// From the "KTSandbox" of an Info.kvs, which may be missing. What is not understood is an error: nobody
/// can tell what its author relied on.
Result<ConfinementWishes> confinementWishes(const Dictionary &info);

}  // namespace storix::linuxhost
