#pragma once

#include <optional>
#include <string>

namespace storix {

/// Whether a provider may hand one of its items to a consumer. Thread-safe.
class SXAccessControl {
 public:
  virtual ~SXAccessControl() = default;
  /// False when any of the three is absent.
  [[nodiscard]] virtual bool isProviderWithIdentifier(const std::optional<std::string> &providerID,
                                                      const std::optional<std::string> &allowedToProvideItemID,
                                                      const std::optional<std::string> &toConsumerWithIdentifier) = 0;
};

}  // namespace storix
