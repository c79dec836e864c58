#pragma once

#include <memory>
#include <optional>
#include <string>

#include "providers/ProvidersTest.h"

namespace storix {

/// The providers "org.a" and "org.b" are registered; an item lies below the directory of the first.
class FileCoordinatorCallbacksTest : public ProvidersTest {
 protected:
  void SetUp() override {
    startRegistry({"org.a", "org.b"});
    process("org.a").setAnswer("_identifierForItemAtURL:completion:",
                               fake::VendorAnswer::values({Argument(), Argument("f/i")}));
    url_ = itemURL("org.a", "r");
  }

  std::shared_ptr<SXExtensionStorix> provider() { return SXExtensionStorix::providerWithIdentifier("org.a"); }
  [[nodiscard]] std::string urlText() const { return url_->absoluteString(); }

  std::optional<URL> url_;
};

}  // namespace storix
