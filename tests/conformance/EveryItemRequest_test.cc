#include "tests/conformance/ItemRequestTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::ElementsAreArray;

constexpr const char *identify = "IdentifierForItemAtURL";

const auto labelOf = [](const ::testing::TestParamInfo<ItemRequestCase> &request) { return request.param.label; };

// --- What all three share

class EveryItemRequestTest : public ItemRequestsTest, public ::testing::WithParamInterface<ItemRequestCase> {};
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

class GrantedItemRequestTest : public ItemRequestsTest, public ::testing::WithParamInterface<ItemRequestCase> {
 protected:
  [[nodiscard]] std::vector<std::string> lookup() const {
    return GetParam().looksUpByURL ? ownerFound() : std::vector<std::string>();
  }
  /// From the request to the item's identifier.
  std::vector<std::string> identified(const Arguments &given) {
    return joined({served(GetParam().name, given), {admitted}, lookup(), identification("org.a", "request-3", *item_)});
  }
  /// The message itself. It is begun inside the completion of the first message, so before that one's
  /// request ends.
  [[nodiscard]] std::vector<std::string> forwarded(const std::string &answer) const {
    std::vector<std::string> lines =
        message(GetParam().operation, "org.a", "request-4", GetParam().message, itemText(), answer);
    lines.insert(lines.begin() + 2, cancel("org.a", "request-3"));
    return lines;
  }
};
INSTANTIATE_TEST_SUITE_P(Requests, GrantedItemRequestTest, ::testing::Values(placeholder, start), labelOf);

TEST_P(GrantedItemRequestTest, AGrantedItemIsForwardedAndTheProvidersAnswerIsTheReply) {
  grant("org.a", "f/i", "org.app");
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(GetParam().name, given);
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined({identified(given),
                               forwarded("()"),
                               {"log debug " + GetParam().successLine + itemText() + " for extension org.a.",
                                reply(GetParam().name, "((null))", platformThread), cancel("org.a", "request-4")}})));
}

TEST_P(GrantedItemRequestTest, AFailureOfTheProviderIsTheReplyUnchanged) {
  grant("org.a", "f/i", "org.app");
  const SXError error = someError("offline");
  Arguments answer{Argument(error)};
  if (!GetParam().looksUpByURL) answer = {Argument(), Argument(error)};
  process("org.a").setAnswer(GetParam().message, VendorAnswer::values(answer));
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(GetParam().name, given);
  EXPECT_THAT(trace(),
              ElementsAreArray(joined(
                  {identified(given),
                   forwarded(fake::traced(answer)),
                   {"log fault " + GetParam().failureLine + itemText() + " for extension org.a. Error: " + text(error),
                    reply(GetParam().name, "(" + text(SXPluginOperationFailedError(error)) + ")", platformThread),
                    cancel("org.a", "request-4")}})));
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
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(GetParam().name, given);
  const SXError wrapped = SXPluginOperationFailedError(SXPluginOperationFailedError(error));
  EXPECT_THAT(
      trace(),
      ElementsAreArray(
          joined({served(GetParam().name, given),
                  {admitted},
                  lookup(),
                  failedIdentification("org.a", "request-3", *item_, "(" + text(error) + ", f/i)", error),
                  {reply(GetParam().name, "(" + text(wrapped) + ")", platformThread), cancel("org.a", "request-3")}})));
}

TEST_P(GrantedItemRequestTest, AMissingItemIdentifierIsNotPermitted) {
  process("org.a").setAnswer(identify, VendorAnswer::values());
  const Arguments given = arguments(item_, "org.a", "org.app");
  call(GetParam().name, given);
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {served(GetParam().name, given),
           {admitted},
           lookup(),
           message("itemIDForURL:completionHandler:", "org.a", "request-3",
                   "_identifierForItemAtURL:completion:", itemText(), "()"),
           {"log debug [DEBUG] Successfully got item ID “(null)” for URL " + itemText() + " from extension org.a",
            "log fault [ERROR] Consumer ID org.app is not allowed to access item ID “(null)” from provider ID org.a.",
            reply(GetParam().name, "(" + text(SXNotPermittedError()) + ")", platformThread),
            cancel("org.a", "request-3")}})));
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
  const std::shared_ptr<fake::FakeReply> answered = call(GetParam().name, arguments(item_, "org.a", "org.app"));
  ASSERT_EQ(answered->answers().size(), 2U);
  EXPECT_EQ(answered->answer().values, Arguments(1));
  EXPECT_EQ(answered->answers()[1].values,
            (Arguments{Argument(SXPluginOperationFailedError(someError("the process ended")))}));
}

}  // namespace
}  // namespace storix
