#include "tests/conformance/ItemRequestTest.h"

namespace storix {
namespace {

using ::testing::ElementsAreArray;

using StopProvidingTest = ItemRequestsTest;

TEST_F(StopProvidingTest, StopDoesNotNameTheIdentifierThatDoesNotFitTheOwner) {
  expectEarlyFailure(stop, arguments(item_, "org.b", "org.app"), ownerFound(),
                     SXInvalidParameterError("providerID", std::nullopt));
}

TEST_F(StopProvidingTest, StopIsForwardedWithoutAGrantAndAlwaysAnswersWithAnError) {
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(stop.name, given);
  EXPECT_THAT(trace(),
              ElementsAreArray(joined(
                  {served(stop.name, given),
                   {admitted},
                   ownerFound(),
                   message(stop.operation, "org.a", "request-3", stop.message, itemText(), "()"),
                   {"log debug " + stop.successLine + itemText() + " for extension org.a.",
                    reply(stop.name, "(" + text(SXPluginOperationFailedError(std::nullopt)) + ")", platformThread),
                    cancel("org.a", "request-3")}})));
}

TEST_F(StopProvidingTest, AFailedStopIsLoggedAndWrapped) {
  const SXError error = someError("busy");
  process("org.a").setAnswer(stop.message, fake::VendorAnswer::values({Argument(error)}));
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(stop.name, given);
  const SXError wrapped = SXPluginOperationFailedError(error);
  EXPECT_THAT(trace(),
              ElementsAreArray(joined(
                  {served(stop.name, given),
                   {admitted},
                   ownerFound(),
                   message(stop.operation, "org.a", "request-3", stop.message, itemText(), "(" + text(error) + ")"),
                   {"log fault " + stop.failureLine + itemText() + " for extension org.a. Error: " + text(error),
                    "log fault [ERROR] Could not ask provider ID org.a to stop providing item at URL " + itemText() +
                        ". Error: " + text(wrapped),
                    reply(stop.name, "(" + text(SXPluginOperationFailedError(wrapped)) + ")", platformThread),
                    cancel("org.a", "request-3")}})));
}

TEST_F(StopProvidingTest, AProvidersDirectoryItselfHasNoOwner) {
  const std::optional<URL> directory = storageURL("org.a");
  const std::vector<std::string> lookup{
      compared("org.a", *directory),
      "log debug [DEBUG] Ignoring URLs that exactly match the document container folder"};
  expectEarlyFailure(stop, arguments(directory, "org.a", "org.app"), lookup, SXNotFoundError("org.a"));
}

TEST_F(StopProvidingTest, AFailedBeginIsLoggedTwiceAndTheRequestStaysOpen) {
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(stop.name, given);
  const SXError wrapped = SXPluginOperationFailedError(error);
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {served(stop.name, given),
           {admitted},
           ownerFound(),
           failedBegin(stop.operation, "org.a", "request-3", "Cannot stop providing item at URL " + itemText(), error),
           {"log fault [ERROR] Could not ask provider ID org.a to stop providing item at URL " + itemText() +
                ". Error: " + text(wrapped),
            reply(stop.name, "(" + text(SXPluginOperationFailedError(wrapped)) + ")", platformThread)}})));
}

TEST_F(StopProvidingTest, ALateConnectionFailureRepliesAgainWithItsError) {
  const SXError error = someError("it ended");
  process("org.a").setAnswer(stop.message, fake::VendorAnswer::valuesThenConnectionFailure({}, error));
  const std::shared_ptr<fake::FakeReply> answered = call(stop.name, arguments(item_, "org.a", "org.app"));
  ASSERT_EQ(answered->answers().size(), 2U);
  EXPECT_EQ(answered->error(0), SXPluginOperationFailedError(std::nullopt));
  EXPECT_EQ(answered->answers()[1].values,
            (Arguments{Argument(SXPluginOperationFailedError(SXPluginOperationFailedError(error)))}));
}

}  // namespace
}  // namespace storix
