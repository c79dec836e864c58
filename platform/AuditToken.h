#pragma once

#include <array>
#include <cstdint>

namespace storix {

/// Names one peer process to the platform that made it. Opaque: only the platform looks inside.
/// All zero (the default) stands for a peer that is not there.
struct AuditToken {
  std::array<std::uint32_t, 8> words{};
  friend bool operator==(const AuditToken &, const AuditToken &) = default;
};

}  // namespace storix
