#include "tests/conformance/ItemRequestTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;

constexpr const char *identify = "IdentifierForItemAtURL";

using ProvidePlaceholderTest = ItemRequestsTest;

TEST_F(ProvidePlaceholderTest, APlaceholderIsAskedOfTheNamedProviderWhoeverOwnsTheURL) {
  const SXError error = someError("not mine");
  process("org.b").setAnswer(identify, VendorAnswer::values({Argument(error), Argument()}));
  const std::shared_ptr<fake::FakeReply> answered = call(placeholder.name, arguments(item_, "org.b", "org.app"));
  EXPECT_EQ(answered->error(0), SXPluginOperationFailedError(SXPluginOperationFailedError(error)));
  EXPECT_EQ(platform().trace().count("directoryRelationship"), 0U);
}

}  // namespace
}  // namespace storix
