#pragma once

#include <string_view>

namespace storix::wire {

/// What a request is addressed to, as it lies in the message.
struct BusTarget {
  std::string_view path;
  std::string_view interface;  ///< Empty where the caller leaves it open.
  std::string_view member;

  [[nodiscard]] bool names(std::string_view wantedInterface, std::string_view wantedMember) const {
    return member == wantedMember && (interface.empty() || interface == wantedInterface);
  }
};

}  // namespace storix::wire
