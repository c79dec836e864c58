#include "service/ServicerTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::ElementsAreArray;

constexpr std::string_view extend = SXDaemon::extendSandboxName;
constexpr const char *identify = "IdentifierForItemAtURL";

class ExtendSandboxTest : public ServicerTest {
 protected:
  void SetUp() override {
    ServicerTest::SetUp();
    connect({{writeEntitlement, true}});
  }

  static std::string absentAfter(const SXError &error) { return "(" + text(error) + ", (null), (null), (null))"; }

  void expectEarlyFailure(const Arguments &request, const SXError &error) {
    call(extend, request);
    const auto argument = [&request](std::size_t i) { return logDescription(request[i]); };
    EXPECT_THAT(trace(), ElementsAreArray(joined({served(extend, request),
                                                  {"entitlementValue peer 100 com.tessel.storix.acl-write",
                                                   "log fault [ERROR] Could not extend sandbox for URL " + argument(0) +
                                                       " from provider ID " + argument(1) + " to consumer ID " +
                                                       argument(2) + ", error: " + text(error),
                                                   reply(extend, absentAfter(error), global)}})));
    EXPECT_TRUE(platform().files().content("/home/u/Library/Storix/AccessControl.kvs") == std::nullopt);
  }
};

TEST_F(ExtendSandboxTest, GrantsAndIssuesTokensOnTheExtensionsThread) {
  const Arguments request = arguments(item_, "org.a", "org.app");
  call(extend, request);
  const URL companion = itemURL("org.a", ".report.txt");
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {served(extend, request),
           {"entitlementValue peer 100 com.tessel.storix.acl-write"},
           identification("org.a", "request-3", *item_),
           {"log info [INFO] Allowing provider ID org.a to provide item ID “f/i” to consumer ID org.app",
            "log info [INFO] Committing access control list",
            "writeKeyedValueFileAtomically /home/u/Library/Storix/AccessControl.kvs {org.a = {org.app = "
            "{AllowedItemIDs = (f/i)}}}",
            "issueSandboxExtension readWrite " + item_->path() + " flags=0",
            "issueSandboxExtension readWrite " + companion.path() + " flags=0",
            "log info [INFO] Successfully extended sandbox for URL " + itemText() +
                " from provider ID org.a to consumer ID org.app.",
            reply(extend,
                  "((null), " + token(*item_) + ", " + companion.absoluteString() + ", " + token(companion) + ")",
                  platformThread),
            cancel("org.a", "request-3")}})));
}

TEST_F(ExtendSandboxTest, AClientWithTheReadEntitlementAloneIsRefused) {
  connect({{readEntitlement, true}});
  const Arguments request = arguments(item_, "org.a", "org.app");
  call(extend, request);
  EXPECT_THAT(trace(), ElementsAreArray(joined(
                           {served(extend, request),
                            {"entitlementValue peer 100 com.tessel.storix.acl-write", "peerProcessIdentifier peer 100",
                             "log fault [ERROR] Rejecting request from PID 100 because it does not have any of these "
                             "entitlements: (com.tessel.storix.acl-write)",
                             reply(extend, absentAfter(SXClientLacksEntitlement()), global)}})));
}

TEST_F(ExtendSandboxTest, TheFirstAbsentArgumentIsNamed) {
  expectEarlyFailure(arguments(std::nullopt, std::nullopt, std::nullopt), SXInvalidParameterError("URL", std::nullopt));
  expectEarlyFailure(arguments(std::nullopt, "org.a", std::nullopt), SXInvalidParameterError("URL", std::nullopt));
  expectEarlyFailure(arguments(item_, std::nullopt, std::nullopt), SXInvalidParameterError("providerID", std::nullopt));
  expectEarlyFailure(arguments(item_, "org.a", std::nullopt), SXInvalidParameterError("consumerID", std::nullopt));
}

TEST_F(ExtendSandboxTest, AnUnknownProviderIsNotFound) {
  expectEarlyFailure(arguments(item_, "org.none", "org.app"), SXNotFoundError("org.none"));
  expectEarlyFailure(arguments(item_, "", "org.app"), SXNotFoundError(""));
}

TEST_F(ExtendSandboxTest, AProviderThatCannotNameTheItemGrantsNothing) {
  const SXError error = someError("no such item");
  process("org.a").setAnswer(identify, VendorAnswer::values({Argument(error), Argument()}));
  const Arguments request = arguments(item_, "org.a", "org.app");
  call(extend, request);
  // Wrapped by the operation and once more by the request.
  const SXError wrapped = SXPluginOperationFailedError(SXPluginOperationFailedError(error));
  EXPECT_THAT(trace(), ElementsAreArray(joined(
                           {served(extend, request),
                            {"entitlementValue peer 100 com.tessel.storix.acl-write"},
                            failedIdentification("org.a", "request-3", *item_, "(" + text(error) + ", (null))", error),
                            {reply(extend, absentAfter(wrapped), platformThread), cancel("org.a", "request-3")}})));
}

TEST_F(ExtendSandboxTest, TheGrantBearsTheIdentifierThatTheClientGave) {
  call(extend, arguments(itemURL("org.b", "x"), "org.a", "org.app"));
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
  EXPECT_FALSE(store()->isProviderWithIdentifier("org.b", "f/i", "org.app"));
}

TEST_F(ExtendSandboxTest, ATokenThatCannotBeIssuedIsAbsentInASuccessfulReply) {
  platform().sandbox().failExtension(item_->path());
  platform().sandbox().failExtension(itemURL("org.a", ".report.txt").path());
  const std::shared_ptr<fake::FakeReply> answer = call(extend, arguments(item_, "org.a", "org.app"));
  EXPECT_EQ(answer->answer().values,
            (Arguments{Argument(), Argument(), Argument(itemURL("org.a", ".report.txt")), Argument()}));
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
}

TEST_F(ExtendSandboxTest, WithoutAReplyHandlerTheGrantIsMadeAllTheSame) {
  client_->callWithoutReply(extend, arguments(item_, "org.a", "org.app"));
  runUntilIdle();
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
  client_->callWithoutReply(extend, arguments(item_, "org.none", "org.app"));
  client_->callWithoutReply(extend, {});
  connect({});
  client_->callWithoutReply(extend, {});
  process("org.a").setBeginFailure(someError("no process"));
  client_->callWithoutReply(extend, arguments(item_, "org.a", "org.app"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("reply"), 0U);
}

TEST_F(ExtendSandboxTest, AnAnswerAfterTheClientIsGoneStillGrantsAndHarmsNobody) {
  process("org.a").setAnswer(identify, VendorAnswer::values({Argument(), Argument("f/i")}).held());
  client_->call(extend, arguments(item_, "org.a", "org.app"));
  runUntilIdle();
  const std::weak_ptr<ExportedObject> exported = client_->exportedObject();
  client_->close();
  EXPECT_TRUE(exported.expired());
  client_.reset();
  process("org.a").releaseAllAnswers();
  runUntilIdle();
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
}

TEST_F(ExtendSandboxTest, WithoutAServerNothingIsGranted) {
  server_.reset();
  const std::shared_ptr<fake::FakeReply> answer = call(extend, arguments(item_, "org.a", "org.app"));
  EXPECT_EQ(answer->error(0), std::nullopt);
  EXPECT_FALSE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
}

TEST_F(ExtendSandboxTest, ALateConnectionFailureRepliesAgain) {
  process("org.a").setAnswer(identify, VendorAnswer::valuesThenConnectionFailure({Argument(), Argument("f/i")},
                                                                                 someError("the process ended")));
  const std::shared_ptr<fake::FakeReply> answer = call(extend, arguments(item_, "org.a", "org.app"));
  ASSERT_EQ(answer->answers().size(), 2U);
  EXPECT_EQ(answer->error(0), std::nullopt);
  EXPECT_EQ(
      answer->answers()[1].values,
      (Arguments{Argument(SXPluginOperationFailedError(SXPluginOperationFailedError(someError("the process ended")))),
                 Argument(), Argument(), Argument()}));
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
}

using ExtendSandboxDeathTest = ExtendSandboxTest;

TEST_F(ExtendSandboxDeathTest, AProviderThatGivesNeitherIdentifierNorErrorIsPassedOnToTheStore) {
  process("org.a").setAnswer(identify, VendorAnswer::values());
  EXPECT_DEATH(call(extend, arguments(item_, "org.a", "org.app")), "programming error");
}

TEST_F(ExtendSandboxTest, AFailedBeginGrantsNothingAndLeavesTheRequestOpen) {
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  const Arguments request = arguments(item_, "org.a", "org.app");
  call(extend, request);
  const SXError wrapped = SXPluginOperationFailedError(SXPluginOperationFailedError(error));
  EXPECT_THAT(trace(), ElementsAreArray(joined({served(extend, request),
                                                {"entitlementValue peer 100 com.tessel.storix.acl-write"},
                                                failedBegin("itemIDForURL:completionHandler:", "org.a", "request-3",
                                                            "Cannot get item ID for URL " + itemText(), error),
                                                {reply(extend, absentAfter(wrapped), platformThread)}})));
  EXPECT_FALSE(platform().files().exists("/home/u/Library/Storix/AccessControl.kvs"));
}

TEST_F(ExtendSandboxTest, TheSameGrantAgainIsNotWrittenAgainButGetsTokens) {
  grant("org.a", "f/i", "org.app");
  const std::shared_ptr<fake::FakeReply> answer = call(extend, arguments(item_, "org.a", "org.app"));
  EXPECT_EQ(answer->error(0), std::nullopt);
  EXPECT_TRUE(answer->answer().values.at(1));
  EXPECT_EQ(platform().trace().count("writeKeyedValueFileAtomically"), 0U);
  EXPECT_TRUE(platform().log().contains(
      LogSeverity::info,
      "[INFO] Provider ID org.a is already allowed to provide item ID “f/i” to consumer ID org.app."));
}

TEST_F(ExtendSandboxTest, AGrantThatCannotBeWrittenIsGivenAllTheSame) {
  platform().files().setUnwritable("/home/u/Library/Storix/AccessControl.kvs");
  const std::shared_ptr<fake::FakeReply> answer = call(extend, arguments(item_, "org.a", "org.app"));
  EXPECT_EQ(answer->error(0), std::nullopt);
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
  EXPECT_TRUE(platform().log().contains(LogSeverity::fault,
                                        "[ERROR] Could not write to /home/u/Library/Storix/AccessControl.kvs"));
}

}  // namespace
}  // namespace storix
