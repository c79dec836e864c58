#pragma once

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <utility>

#include "storix/ProviderExtension.h"

namespace storix::example {

/// Calls the operations of a provider that answers at once, as the daemon would for the document at a
/// path.
class ProviderCalls : public ::testing::Test {
 protected:
  virtual ProviderExtension &extension() = 0;
  [[nodiscard]] virtual URL item(const std::string &path) const = 0;

  template <class Outcome = std::optional<SXError>, class Call>
  static Outcome answer(const Call &call) {
    std::optional<Outcome> given;
    call([&given](Outcome outcome) { given.emplace(std::move(outcome)); });
    EXPECT_TRUE(given.has_value());
    return *std::move(given);
  }
  std::optional<SXError> setUp() {
    return answer([&](auto done) { extension().performInitialSetup(done); });
  }
  std::optional<SXError> start(const std::string &path) {
    return answer([&](auto done) { extension().startProviding(item(path), done); });
  }
  std::optional<SXError> changed(const std::string &path) {
    return answer([&](auto done) { extension().itemChanged(item(path), done); });
  }
  std::optional<SXError> stop(const std::string &path) {
    return answer([&](auto done) { extension().stopProviding(item(path), done); });
  }
  Result<URL> placeholder(const std::string &path) {
    return answer<Result<URL>>([&](auto done) { extension().providePlaceholder(item(path), done); });
  }
};

}  // namespace storix::example
