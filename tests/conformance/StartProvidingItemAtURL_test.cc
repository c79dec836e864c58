#include "tests/conformance/ItemRequestTest.h"

namespace storix {
namespace {

using StartProvidingTest = ItemRequestsTest;

TEST_F(StartProvidingTest, StartNamesTheIdentifierThatDoesNotFitTheOwner) {
  expectEarlyFailure(start, arguments(item_, "org.b", "org.app"), ownerFound(),
                     SXInvalidParameterError("providerID", "org.b"));
  expectEarlyFailure(start, arguments(item_, "ORG.A", "org.app"), ownerFound(),
                     SXInvalidParameterError("providerID", "ORG.A"));
}

TEST_F(StartProvidingTest, AProvidersDirectoryItselfHasNoOwner) {
  const std::optional<URL> directory = storageURL("org.a");
  const std::vector<std::string> lookup{
      compared("org.a", *directory),
      "log debug [DEBUG] Ignoring URLs that exactly match the document container folder"};
  expectEarlyFailure(start, arguments(directory, "org.a", "org.app"), lookup, SXNotFoundError("org.a"));
}

TEST_F(StartProvidingTest, AFailedBeginIsReportedTwiceWrappedAndTheRequestStaysOpen) {
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  const std::shared_ptr<fake::FakeReply> answered = call(start.name, arguments(item_, "org.a", "org.app"));
  EXPECT_EQ(answered->error(0), SXPluginOperationFailedError(SXPluginOperationFailedError(error)));
  EXPECT_EQ(platform().trace().count("cancelExtensionRequest"), 0U);
  EXPECT_EQ(platform().trace().count("log fault [ERROR] Cannot get item ID for URL " + itemText()), 1U);
}

TEST_F(StartProvidingTest, ASecondBeginThatFailsIsReportedOnceWrappedAndThatRequestStaysOpen) {
  grant("org.a", "f/i", "org.app");
  const SXError error = someError("no process");
  process("org.a").setAnswer("IdentifierForItemAtURL", [this, &error](const Arguments &) {
    process("org.a").setBeginFailure(error);
    return fake::VendorAnswer::values({Argument(), Argument("f/i")});
  });
  const std::shared_ptr<fake::FakeReply> answered = call(start.name, arguments(item_, "org.a", "org.app"));
  EXPECT_EQ(answered->error(0), SXPluginOperationFailedError(error));
  EXPECT_EQ(platform().trace().count(cancel("org.a", "request-3")), 1U);
  EXPECT_EQ(platform().trace().count("cancelExtensionRequest"), 1U);
  EXPECT_EQ(platform().trace().count("log fault [ERROR] Cannot provide item at URL " + itemText() +
                                     " for extension org.a. Error: " + text(error)),
            1U);
}

}  // namespace
}  // namespace storix
