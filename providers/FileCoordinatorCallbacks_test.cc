#include "providers/ProvidersTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::Contains;
using ::testing::ElementsAre;

constexpr const char *identify = "_identifierForItemAtURL:completion:";
constexpr const char *start = "_startProvidingItemAtURL:completion:";

class FileCoordinatorCallbacksTest : public ProvidersTest {
 protected:
  void SetUp() override {
    startRegistry({"org.a", "org.b"});
    process("org.a").setAnswer(identify, VendorAnswer::values({Argument(), Argument("i")}));
    url_ = itemURL("org.a", "r");
  }

  std::shared_ptr<SXExtensionStorix> provider() { return SXExtensionStorix::providerWithIdentifier("org.a"); }
  [[nodiscard]] std::string urlText() const { return url_->absoluteString(); }

  std::optional<URL> url_;
};

TEST_F(FileCoordinatorCallbacksTest, AReadAsksForTheIdentifierAndThenProvides) {
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

TEST_F(FileCoordinatorCallbacksTest, ProvidingStartsOnTheGlobalQueue) {
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

TEST_F(FileCoordinatorCallbacksTest, AnUnknownItemIsReportedAsReceived) {
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

TEST_F(FileCoordinatorCallbacksTest, AFailureToProvideIsTheOperationsError) {
  const SXError cause = someError("offline");
  process("org.a").setAnswer(start, VendorAnswer::values({Argument(cause)}));
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  EXPECT_TRUE(platform().log().contains(LogSeverity::fault, "[ERROR] Proxy failed to start providing item at URL " +
                                                                urlText() +
                                                                " for extension org.a. Error: " + text(cause)));
  EXPECT_EQ(platform().trace().count("answered (" + text(SXPluginOperationFailedError(cause)) + ")"), 1U);
}

TEST_F(FileCoordinatorCallbacksTest, AReadWithoutCompletionIsServedAllTheSame) {
  provider()->_provideItemAtURL(url_, "reader-1", {});
  runUntilIdle();
  EXPECT_EQ(platform().trace().count(std::string("answer request-4 ") + start), 1U);
  process("org.a").setBeginFailure(someError("no process"));
  provider()->_provideItemAtURL(url_, "reader-1", {});
  runUntilIdle();
}

TEST_F(FileCoordinatorCallbacksTest, TheDeprecatedCallbackIsAReadWithoutReader) {
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

TEST_F(FileCoordinatorCallbacksTest, TheServiceReachesTheProviderOnItsOwnQueueAndGetsItsAnswer) {
  ASSERT_TRUE(platform().fileCoordination().read(*url_, "reader-1", {}));
  runUntilIdle();
  EXPECT_THAT(trace(), Contains("provided " + urlText() + " (null) on platform thread"));
}

TEST_F(FileCoordinatorCallbacksTest, OnlyThreeOptionalMembersAreAnswered) {
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

TEST_F(FileCoordinatorCallbacksTest, AFinishedWriteIsToldToTheOwnerOfTheURL) {
  provider()->_writerWithID("writer-1", url_);
  runUntilIdle();
  EXPECT_THAT(
      trace(),
      ElementsAre(
          "log info [INFO] KTFileCoordinator is telling us the item at URL " + urlText() +
              " was changed by writer ID writer-1.",
          "directoryRelationship " + storageText("org.a") + " " + urlText(),
          "log info [INFO] Resolved URL to provider org.a.",
          "log debug [DEBUG] The item at URL " + urlText() + " is provided by the etxension org.a",
          "log debug [DEBUG] -[SXExtensionStorix itemChangedAtURL:]", "beginExtensionRequest org.a version 1 request-3",
          "begun request-3", "log debug [DEBUG] Beginning extension request.",
          "extensionContextForRequest org.a version 1 request-3", "remoteProxyWithErrorHandler request-3",
          "send request-3 _itemChangedAtURL:completion: (" + urlText() + ")",
          "answer request-3 _itemChangedAtURL:completion: ()", "cancelExtensionRequest org.a version 1 request-3"));
}

TEST_F(FileCoordinatorCallbacksTest, AWriteUnderAnotherProviderGoesToThatOne) {
  const URL other = itemURL("org.b", "r");
  provider()->_writerWithID("writer-1", other);
  runUntilIdle();
  EXPECT_TRUE(platform().log().contains(
      LogSeverity::debug, "[DEBUG] The item at URL " + other.absoluteString() + " is provided by the etxension org.b"));
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.b"), 1U);
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.a"), 0U);
}

TEST_F(FileCoordinatorCallbacksTest, AWriteOutsideEveryProviderIsAnError) {
  provider()->_writerWithID(std::nullopt, *URL::fromString("file:///elsewhere"));
  runUntilIdle();
  EXPECT_THAT(platform().log().take(),
              ElementsAre(fake::LogLine{LogSeverity::info,
                                        "[INFO] KTFileCoordinator is telling us the item at URL "
                                        "file:///elsewhere was changed by writer ID (null)."},
                          fake::LogLine{LogSeverity::fault,
                                        "[ERROR] Could not find any extension that provides an "
                                        "item at URL file:///elsewhere"}));
  EXPECT_EQ(platform().trace().count("beginExtensionRequest"), 0U);
}

TEST_F(FileCoordinatorCallbacksTest, AWriteOfAProvidersDirectoryItselfIsPassedOver) {
  provider()->_writerWithID("writer-1", storageURL("org.a"));
  runUntilIdle();
  EXPECT_THAT(logTexts(), ElementsAre("[INFO] KTFileCoordinator is telling us the item at URL " + storageText("org.a") +
                                          " was changed by writer ID writer-1.",
                                      "[DEBUG] Ignoring URLs that exactly match the document container folder"));
  EXPECT_EQ(platform().trace().count("beginExtensionRequest"), 0U);
}

}  // namespace
}  // namespace storix
