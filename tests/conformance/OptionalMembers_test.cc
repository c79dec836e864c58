#include "tests/conformance/FileCoordinatorCallbacksTest.h"

namespace storix {
namespace {

using OptionalMembersTest = FileCoordinatorCallbacksTest;

TEST_F(OptionalMembersTest, OnlyThreeOptionalMembersAreAnswered) {
  using enum KTStorix::OptionalMember;
  EXPECT_TRUE(provider()->answers(provideItemAtURLToReaderWithID));
  EXPECT_TRUE(provider()->answers(writerWithIDDidFinishWritingForURL));
  EXPECT_TRUE(provider()->answers(fileReactorID));
  EXPECT_FALSE(provider()->answers(cancelProvidingItemAtURLToReaderWithID));
  EXPECT_FALSE(provider()->answers(physicalURLForURL));
  EXPECT_FALSE(provider()->answers(providedItemAtURLDidGainPresenterWithID));
  EXPECT_FALSE(provider()->answers(providedItemAtURLDidLosePresenterWithID));
  EXPECT_FALSE(provider()->answers(providedItemAtURLWithPresenterWithIDDidMoveToURL));
}

}  // namespace
}  // namespace storix
