#include "platform/FileCoordination.h"

#include <gtest/gtest.h>

namespace storix {
namespace {

/// Answers no optional member.
class PlainProvider : public KTStorix {
 public:
  using KTStorix::_provideItemAtURL;
  std::optional<URL> _providedItemsURL() override { return std::nullopt; }
  std::shared_ptr<OperationQueue> _providedItemsOperationQueue() override { return nullptr; }
  void _provideItemAtURL(std::optional<URL> /*url*/, Completion completionHandler) override {
    completionHandler(SXNotPermittedError());
  }
  [[nodiscard]] bool answers(OptionalMember /*member*/) const override { return false; }
};

TEST(KTStorix, OptionalMembersThatAreLeftOutDoNothing) {
  PlainProvider provider;
  const URL url = *URL::fromString("file:///a");
  int completions = 0;
  provider._provideItemAtURL(url, "reader", [&completions](const std::optional<SXError> &error) {
    EXPECT_FALSE(error);
    ++completions;
  });
  EXPECT_EQ(completions, 1);
  provider._provideItemAtURL(url, "reader", {});
  provider._cancelProvidingItemAtURL(url, "reader");
  provider._writerWithID("writer", url);
  provider._providedItemAtURLDidGainPresenterWithID(url, "presenter");
  provider._providedItemAtURLDidLosePresenterWithID(url, "presenter");
  provider._providedItemAtURLWithPresenterWithIDDidMoveToURL(url, "presenter", url);
  EXPECT_FALSE(provider._physicalURLForURL(url));
  EXPECT_FALSE(provider._fileReactorID());
}

}  // namespace
}  // namespace storix
