#include "tests/conformance/ItemRequestTest.h"

namespace storix {
namespace {

using ::testing::ElementsAreArray;

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
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(start.name, given);
  const SXError wrapped = SXPluginOperationFailedError(SXPluginOperationFailedError(error));
  EXPECT_THAT(trace(), ElementsAreArray(joined({served(start.name, given),
                                                {admitted},
                                                ownerFound(),
                                                failedBegin("itemIDForURL:completionHandler:", "org.a", "request-3",
                                                            "Cannot get item ID for URL " + itemText(), error),
                                                {reply(start.name, "(" + text(wrapped) + ")", platformThread)}})));
}

TEST_F(StartProvidingTest, ASecondBeginThatFailsIsReportedOnceWrappedAndThatRequestStaysOpen) {
  grant("org.a", "f/i", "org.app");
  const SXError error = someError("no process");
  process("org.a").setAnswer("IdentifierForItemAtURL", [this, &error](const Arguments &) {
    process("org.a").setBeginFailure(error);
    return fake::VendorAnswer::values({Argument(), Argument("f/i")});
  });
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(start.name, given);
  std::vector<std::string> second =
      failedBegin(start.operation, "org.a", "request-4", "Cannot provide item at URL " + itemText(), error);
  second.insert(second.begin() + 2, cancel("org.a", "request-3"));
  EXPECT_THAT(trace(),
              ElementsAreArray(joined(
                  {served(start.name, given),
                   {admitted},
                   ownerFound(),
                   identification("org.a", "request-3", *item_),
                   second,
                   {reply(start.name, "(" + text(SXPluginOperationFailedError(error)) + ")", platformThread)}})));
}

}  // namespace
}  // namespace storix
