#include "tests/conformance/ItemRequestTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;

constexpr const char *identify = "IdentifierForItemAtURL";

using ProvidePlaceholderTest = ItemRequestsTest;

TEST_F(ProvidePlaceholderTest, APlaceholderIsAskedOfTheNamedProviderWhoeverOwnsTheURL) {
  const SXError error = someError("not mine");
  process("org.b").setAnswer(identify, VendorAnswer::values({Argument(error), Argument()}));
  const Arguments given = arguments(item_, "org.b", "org.app");
  call(placeholder.name, given);
  const SXError wrapped = SXPluginOperationFailedError(SXPluginOperationFailedError(error));
  EXPECT_THAT(
      trace(),
      ::testing::ElementsAreArray(joined(
          {served(placeholder.name, given),
           {admitted},
           failedIdentification("org.b", "request-3", *item_, "(" + text(error) + ", (null))", error),
           {reply(placeholder.name, "(" + text(wrapped) + ")", platformThread), cancel("org.b", "request-3")}})));
}

}  // namespace
}  // namespace storix
