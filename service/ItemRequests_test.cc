#include "service/ServicerTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::ElementsAreArray;

constexpr const char *identify = "IdentifierForItemAtURL";

/// One of the three requests, and what is its own.
struct Request {
  const char *label;
  std::string_view name;
  std::string operation;     // of the provider object
  std::string message;       // to the extension
  std::string successLine;   // of the provider object, up to the URL
  std::string failureLine;   // of the provider object, up to the URL
  std::string earlyFailure;  // up to the URL
  bool looksUpByURL;
};

class ItemRequestsTest : public ServicerTest {
 protected:
  void SetUp() override {
    ServicerTest::SetUp();
    connect({{readEntitlement, true}});
  }

  static constexpr const char *admitted = "entitlementValue peer 100 com.tessel.storix.acl-read";

  [[nodiscard]] std::vector<std::string> ownerFound() const {
    return {compared("org.a", *item_), "log info [INFO] Resolved URL to provider org.a."};
  }

  void expectEarlyFailure(const Request &request, const Arguments &given, const std::vector<std::string> &lookup,
                          const SXError &error) {
    call(request.name, given);
    const auto argument = [&given](std::size_t i) { return logDescription(given[i]); };
    EXPECT_THAT(trace(), ElementsAreArray(
                             joined({served(request.name, given),
                                     {admitted},
                                     lookup,
                                     {"log fault " + request.earlyFailure + " " + argument(0) + " from provider ID " +
                                          argument(1) + " to consumer ID " + argument(2) + ". Error: " + text(error),
                                      reply(request.name, "(" + text(error) + ")", global)}})));
  }
};

const Request placeholder{"placeholder",
                          SXDaemon::providePlaceholderName,
                          "providePlaceholderForItemAtURL:completionHandler:",
                          "_providePlaceholderAtURL:completion:",
                          "[DEBUG] Successfully provided placeholder at URL ",
                          "[ERROR] Proxy failed to provide placeholder at URL ",
                          "[ERROR] Could not provide placeholder for URL",
                          false};
const Request start{"start",
                    SXDaemon::startProvidingName,
                    "startProvidingItemAtURL:completionHandler:",
                    "_startProvidingItemAtURL:completion:",
                    "[DEBUG] Successfully provided item at URL ",
                    "[ERROR] Proxy failed to start providing item at URL ",
                    "[ERROR] Cannot provide item at URL",
                    true};
const Request stop{"stop",
                   SXDaemon::stopProvidingName,
                   "stopProvidingItemAtURL:completionHandler:",
                   "_stopProvidingItemAtURL:completion:",
                   "[DEBUG] Successfully stopped providing item at URL ",
                   "[ERROR] Proxy failed to stop providing item at URL ",
                   "[ERROR] Could not stop providing item at URL",
                   true};

const auto labelOf = [](const ::testing::TestParamInfo<Request> &request) { return request.param.label; };

// --- What all three share

class EveryItemRequestTest : public ItemRequestsTest, public ::testing::WithParamInterface<Request> {};
INSTANTIATE_TEST_SUITE_P(Requests, EveryItemRequestTest, ::testing::Values(placeholder, start, stop), labelOf);

TEST_P(EveryItemRequestTest, AClientWithoutEntitlementIsRefused) {
  connect({});
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(GetParam().name, given);
  EXPECT_THAT(trace(),
              ElementsAreArray(joined(
                  {served(GetParam().name, given),
                   {admitted, "entitlementValue peer 100 com.tessel.storix.acl-write", "peerProcessIdentifier peer 100",
                    "log fault [ERROR] Rejecting request from PID 100 because it does not have any of "
                    "these entitlements: (com.tessel.storix.acl-read, com.tessel.storix.acl-write)",
                    reply(GetParam().name, "(" + text(SXClientLacksEntitlement()) + ")", global)}})));
}

TEST_P(EveryItemRequestTest, EitherEntitlementAdmits) {
  grant("org.a", "f/i", "org.app");
  for (const char *entitlement : {readEntitlement, writeEntitlement}) {
    connect({{entitlement, true}});
    call(GetParam().name, arguments(item_, "org.a", "org.app"));
    EXPECT_EQ(platform().trace().count("answer request-"), GetParam().label == std::string("stop") ? 1U : 2U);
    trace();
  }
}

TEST_P(EveryItemRequestTest, TheFirstAbsentArgumentIsNamed) {
  expectEarlyFailure(GetParam(), arguments(std::nullopt, std::nullopt, std::nullopt), {},
                     SXInvalidParameterError("URL", std::nullopt));
  expectEarlyFailure(GetParam(), arguments(item_, std::nullopt, std::nullopt), {},
                     SXInvalidParameterError("providerID", std::nullopt));
  expectEarlyFailure(GetParam(), arguments(item_, "org.a", std::nullopt), {},
                     SXInvalidParameterError("consumerID", std::nullopt));
}

TEST_P(EveryItemRequestTest, AProviderThatIsNotThereIsNotFoundByItsIdentifier) {
  const std::optional<URL> elsewhere = URL::fromString("file:///elsewhere");
  std::vector<std::string> lookup;
  if (GetParam().looksUpByURL) lookup = {compared("org.a", *elsewhere), compared("org.b", *elsewhere)};
  expectEarlyFailure(GetParam(), arguments(elsewhere, "org.none", "org.app"), lookup, SXNotFoundError("org.none"));
}

TEST_P(EveryItemRequestTest, WithoutAReplyHandlerTheWorkIsDoneAndNobodyIsCalled) {
  grant("org.a", "f/i", "org.app");
  client_->callWithoutReply(GetParam().name, arguments(item_, "org.a", "org.app"));
  runUntilIdle();
  EXPECT_TRUE(
      platform().log().contains(LogSeverity::debug, GetParam().successLine + itemText() + " for extension org.a."));
  client_->callWithoutReply(GetParam().name, arguments(item_, "org.a", "org.other"));
  client_->callWithoutReply(GetParam().name, {});
  process("org.a").setBeginFailure(someError("no process"));
  client_->callWithoutReply(GetParam().name, arguments(item_, "org.a", "org.app"));
  runUntilIdle();
  connect({});
  client_->callWithoutReply(GetParam().name, {});
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("reply"), 0U);
}

TEST_P(EveryItemRequestTest, AnAnswerAfterTheClientIsGoneHarmsNobody) {
  grant("org.a", "f/i", "org.app");
  process("org.a").setAnswer(GetParam().message, VendorAnswer::values().held());
  client_->call(GetParam().name, arguments(item_, "org.a", "org.app"));
  runUntilIdle();
  ASSERT_EQ(process("org.a").heldAnswerCount(), 1U);
  client_->close();
  client_.reset();
  server_.reset();
  process("org.a").releaseAllAnswers();
  runUntilIdle();
  EXPECT_TRUE(
      platform().log().contains(LogSeverity::debug, GetParam().successLine + itemText() + " for extension org.a."));
}

// --- What placeholder and start share

class GrantedItemRequestTest : public ItemRequestsTest, public ::testing::WithParamInterface<Request> {
 protected:
  [[nodiscard]] std::vector<std::string> lookup() const {
    return GetParam().looksUpByURL ? ownerFound() : std::vector<std::string>();
  }
  /// From the request to the item's identifier.
  std::vector<std::string> identified(const Arguments &given) {
    return joined({served(GetParam().name, given), {admitted}, lookup(), identification("org.a", "request-3", *item_)});
  }
};
INSTANTIATE_TEST_SUITE_P(Requests, GrantedItemRequestTest, ::testing::Values(placeholder, start), labelOf);

TEST_P(GrantedItemRequestTest, AGrantedItemIsForwardedAndTheProvidersAnswerIsTheReply) {
  grant("org.a", "f/i", "org.app");
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(GetParam().name, given);
  std::vector<std::string> forwarded =
      message(GetParam().operation, "org.a", "request-4", GetParam().message, itemText(), "()");
  // Begun inside the completion of the first message, so before that one's request ends.
  const std::vector<std::string> begun(forwarded.begin(), forwarded.begin() + 2);
  const std::vector<std::string> rest(forwarded.begin() + 2, forwarded.end());
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined({identified(given),
                               begun,
                               {cancel("org.a", "request-3")},
                               rest,
                               {"log debug " + GetParam().successLine + itemText() + " for extension org.a.",
                                reply(GetParam().name, "((null))", platformThread), cancel("org.a", "request-4")}})));
}

TEST_P(GrantedItemRequestTest, AFailureOfTheProviderIsTheReplyUnchanged) {
  grant("org.a", "f/i", "org.app");
  const SXError error = someError("offline");
  Arguments answer{Argument(error)};
  if (!GetParam().looksUpByURL) answer = {Argument(), Argument(error)};
  process("org.a").setAnswer(GetParam().message, VendorAnswer::values(answer));
  const std::shared_ptr<fake::FakeReply> answered = call(GetParam().name, arguments(item_, "org.a", "org.app"));
  EXPECT_EQ(answered->error(0), SXPluginOperationFailedError(error));
  EXPECT_EQ(answered->answer().context, platformThread);
  // The provider object's line alone.
  EXPECT_EQ(platform().trace().count("log fault"), 1U);
  EXPECT_EQ(platform().trace().count("log fault " + GetParam().failureLine), 1U);
}

TEST_P(GrantedItemRequestTest, AConsumerWithoutGrantIsNotPermitted) {
  grant("org.a", "f/i", "org.another");
  grant("org.a", "other", "org.app");
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(GetParam().name, given);
  EXPECT_THAT(trace(), ElementsAreArray(
                           joined({identified(given),
                                   {"log fault [ERROR] Consumer ID org.app is not allowed to access item ID “f/i” from "
                                    "provider ID org.a.",
                                    reply(GetParam().name, "(" + text(SXNotPermittedError()) + ")", platformThread),
                                    cancel("org.a", "request-3")}})));
}

TEST_P(GrantedItemRequestTest, AProviderThatCannotNameTheItemIsAnOperationThatFailed) {
  const SXError error = someError("no such item");
  process("org.a").setAnswer(identify, VendorAnswer::values({Argument(error), Argument("f/i")}));
  const std::shared_ptr<fake::FakeReply> answered = call(GetParam().name, arguments(item_, "org.a", "org.app"));
  EXPECT_EQ(answered->error(0), SXPluginOperationFailedError(SXPluginOperationFailedError(error)));
  EXPECT_EQ(answered->answer().context, platformThread);
  EXPECT_EQ(platform().trace().count("log fault"), 1U);
}

TEST_P(GrantedItemRequestTest, AMissingItemIdentifierIsNotPermitted) {
  process("org.a").setAnswer(identify, VendorAnswer::values());
  EXPECT_EQ(call(GetParam().name, arguments(item_, "org.a", "org.app"))->error(0), SXNotPermittedError());
  EXPECT_TRUE(platform().log().contains(
      LogSeverity::fault,
      "[ERROR] Consumer ID org.app is not allowed to access item ID “(null)” from provider ID org.a."));
}

TEST_P(GrantedItemRequestTest, WithoutAServerNothingIsAllowed) {
  grant("org.a", "f/i", "org.app");
  server_.reset();
  EXPECT_EQ(call(GetParam().name, arguments(item_, "org.a", "org.app"))->error(0), SXNotPermittedError());
}

TEST_P(GrantedItemRequestTest, ALateConnectionFailureRepliesAgain) {
  grant("org.a", "f/i", "org.app");
  process("org.a").setAnswer(GetParam().message,
                             VendorAnswer::valuesThenConnectionFailure({}, someError("the process ended")));
  EXPECT_EQ(call(GetParam().name, arguments(item_, "org.a", "org.app"))->answers().size(), 2U);
}

// --- What each has for itself

TEST_F(ItemRequestsTest, APlaceholderIsAskedOfTheNamedProviderWhoeverOwnsTheURL) {
  const SXError error = someError("not mine");
  process("org.b").setAnswer(identify, VendorAnswer::values({Argument(error), Argument()}));
  const std::shared_ptr<fake::FakeReply> answered = call(placeholder.name, arguments(item_, "org.b", "org.app"));
  EXPECT_EQ(answered->error(0), SXPluginOperationFailedError(SXPluginOperationFailedError(error)));
  EXPECT_EQ(platform().trace().count("directoryRelationship"), 0U);
}

TEST_F(ItemRequestsTest, StartNamesTheIdentifierThatDoesNotFitTheOwner) {
  expectEarlyFailure(start, arguments(item_, "org.b", "org.app"), ownerFound(),
                     SXInvalidParameterError("providerID", "org.b"));
  expectEarlyFailure(start, arguments(item_, "ORG.A", "org.app"), ownerFound(),
                     SXInvalidParameterError("providerID", "ORG.A"));
}

TEST_F(ItemRequestsTest, StopDoesNotNameTheIdentifierThatDoesNotFitTheOwner) {
  expectEarlyFailure(stop, arguments(item_, "org.b", "org.app"), ownerFound(),
                     SXInvalidParameterError("providerID", std::nullopt));
}

TEST_F(ItemRequestsTest, AProvidersDirectoryItselfHasNoOwner) {
  const std::optional<URL> directory = storageURL("org.a");
  const std::vector<std::string> lookup{
      compared("org.a", *directory),
      "log debug [DEBUG] Ignoring URLs that exactly match the document container folder"};
  expectEarlyFailure(start, arguments(directory, "org.a", "org.app"), lookup, SXNotFoundError("org.a"));
  expectEarlyFailure(stop, arguments(directory, "org.a", "org.app"), lookup, SXNotFoundError("org.a"));
}

TEST_F(ItemRequestsTest, StopIsForwardedWithoutAGrantAndAlwaysAnswersWithAnError) {
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

TEST_F(ItemRequestsTest, AFailedStopIsLoggedAndWrapped) {
  const SXError error = someError("busy");
  process("org.a").setAnswer(stop.message, VendorAnswer::values({Argument(error)}));
  const std::shared_ptr<fake::FakeReply> answered = call(stop.name, arguments(item_, "org.a", "org.app"));
  const SXError wrapped = SXPluginOperationFailedError(error);
  EXPECT_EQ(answered->error(0), SXPluginOperationFailedError(wrapped));
  EXPECT_EQ(answered->answer().context, platformThread);
  const std::vector<std::string> lines = trace();
  ASSERT_GE(lines.size(), 4U);
  EXPECT_EQ(lines[lines.size() - 4],
            "log fault " + stop.failureLine + itemText() + " for extension org.a. Error: " + text(error));
  EXPECT_EQ(lines[lines.size() - 3],
            "log fault [ERROR] Could not ask provider ID org.a to stop providing item at URL " + itemText() +
                ". Error: " + text(wrapped));
}

}  // namespace
}  // namespace storix
