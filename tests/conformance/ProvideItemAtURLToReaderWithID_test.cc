#include "tests/conformance/FileCoordinatorCallbacksTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::Contains;
using ::testing::ElementsAre;

constexpr const char *identify = "_identifierForItemAtURL:completion:";
constexpr const char *start = "_startProvidingItemAtURL:completion:";

using ProvideItemTest = FileCoordinatorCallbacksTest;

TEST_F(ProvideItemTest, AReadAsksForTheIdentifierAndThenProvides) {
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  // Requests 1 and 2 were the registrations.
  EXPECT_THAT(
      trace(),
      ElementsAre(
          "log info [INFO] KTFileCoordinator requested us to provide item at URL " + urlText() +
              " for consumer reader-1",
          "log debug [DEBUG] -[SXExtensionStorix itemIDForURL:completionHandler:]",
          "beginExtensionRequest org.a version 1 request-3", "begun request-3",
          "log debug [DEBUG] Beginning extension request.", "extensionContextForRequest org.a version 1 request-3",
          "remoteProxyWithErrorHandler request-3", std::string("send request-3 ") + identify + " (" + urlText() + ")",
          std::string("answer request-3 ") + identify + " ((null), i)",
          "log debug [DEBUG] Successfully got item ID “i” for URL " + urlText() + " from extension org.a",
          "cancelExtensionRequest org.a version 1 request-3",
          "log debug [DEBUG] -[SXExtensionStorix startProvidingItemAtURL:completionHandler:]",
          "beginExtensionRequest org.a version 1 request-4", "begun request-4",
          "log debug [DEBUG] Beginning extension request.", "extensionContextForRequest org.a version 1 request-4",
          "remoteProxyWithErrorHandler request-4", std::string("send request-4 ") + start + " (" + urlText() + ")",
          std::string("answer request-4 ") + start + " ()",
          "log debug [DEBUG] Successfully provided item at URL " + urlText() + " for extension org.a.",
          "answered ((null)) on platform thread", "cancelExtensionRequest org.a version 1 request-4"));
}

TEST_F(ProvideItemTest, ProvidingStartsOnTheGlobalQueue) {
  process("org.a").setAnswer(identify, VendorAnswer::values({Argument(), Argument("i")}).held());
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  const std::shared_ptr<ConcurrentQueue> &global = platform().globalQueue();
  global->suspend();
  process("org.a").releaseAllAnswers();
  runUntilIdle();
  trace();
  platform().log().take();
  global->resume();
  runUntilIdle();
  EXPECT_EQ(trace().front(), "log debug [DEBUG] -[SXExtensionStorix startProvidingItemAtURL:completionHandler:]");
}

TEST_F(ProvideItemTest, AnUnknownItemIsReportedAsReceived) {
  const SXError cause = someError("no such item");
  process("org.a").setAnswer(identify, VendorAnswer::values({Argument(cause), Argument()}));
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  const std::string error = text(SXPluginOperationFailedError(cause));
  EXPECT_EQ(platform().trace().count(std::string("send request-4")), 0U);
  const std::vector<std::string> lines = trace();
  ASSERT_GE(lines.size(), 4U);
  EXPECT_EQ(lines[lines.size() - 4], "log fault [ERROR] Proxy failed to get item ID for URL " + urlText() +
                                         " for extension org.a. Error: " + text(cause));
  EXPECT_EQ(lines[lines.size() - 3], "log fault [ERROR] Could not provide item at URL " + urlText() +
                                         " from extension org.a to reader reader-1. Error: " + error);
  EXPECT_EQ(lines[lines.size() - 2], "answered (" + error + ") on platform thread");
}

TEST_F(ProvideItemTest, AFailureToProvideIsTheOperationsError) {
  const SXError cause = someError("offline");
  process("org.a").setAnswer(start, VendorAnswer::values({Argument(cause)}));
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  EXPECT_TRUE(platform().log().contains(LogSeverity::fault, "[ERROR] Proxy failed to start providing item at URL " +
                                                                urlText() +
                                                                " for extension org.a. Error: " + text(cause)));
  EXPECT_EQ(platform().trace().count("answered (" + text(SXPluginOperationFailedError(cause)) + ")"), 1U);
}

TEST_F(ProvideItemTest, AReadWithoutCompletionIsServedAllTheSame) {
  provider()->_provideItemAtURL(url_, "reader-1", {});
  runUntilIdle();
  EXPECT_EQ(platform().trace().count(std::string("answer request-4 ") + start), 1U);
  process("org.a").setBeginFailure(someError("no process"));
  provider()->_provideItemAtURL(url_, "reader-1", {});
  runUntilIdle();
}

TEST_F(ProvideItemTest, TheDeprecatedCallbackIsAReadWithoutReader) {
  provider()->_provideItemAtURL(url_, recording<SXError>("answered"));
  runUntilIdle();
  EXPECT_THAT(
      platform().log().lines()[0],
      (fake::LogLine{LogSeverity::fault, "[ERROR] Calling deprecated method: _provideItemAtURL:completionHandler:"}));
  EXPECT_THAT(platform().log().lines()[1],
              (fake::LogLine{LogSeverity::info, "[INFO] KTFileCoordinator requested us to provide item at URL " +
                                                    urlText() + " for consumer (null)"}));
  EXPECT_THAT(trace(), Contains("answered ((null)) on platform thread"));
}

TEST_F(ProvideItemTest, TheServiceReachesTheProviderOnItsOwnQueueAndGetsItsAnswer) {
  ASSERT_TRUE(platform().fileCoordination().read(*url_, "reader-1", {}));
  runUntilIdle();
  EXPECT_THAT(trace(), Contains("provided " + urlText() + " (null) on platform thread"));
}

TEST_F(ProvideItemTest, NoGrantIsAskedFor) {
  provider()->_provideItemAtURL(url_, "reader-nobody-knows", recording<SXError>("answered"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("answered ((null))"), 1U);
}

TEST_F(ProvideItemTest, AFailedBeginIsReportedAndTheRequestStaysOpen) {
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("answered (" + text(SXPluginOperationFailedError(error)) + ")"), 1U);
  EXPECT_EQ(platform().trace().count("cancelExtensionRequest"), 0U);
}

TEST_F(ProvideItemTest, ALateConnectionFailureAnswersAgain) {
  const SXError error = someError("it ended");
  process("org.a").setAnswer(start, VendorAnswer::valuesThenConnectionFailure({}, error));
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("answered ((null))"), 1U);
  EXPECT_EQ(platform().trace().count("answered (" + text(SXPluginOperationFailedError(error)) + ")"), 1U);
}

}  // namespace
}  // namespace storix
