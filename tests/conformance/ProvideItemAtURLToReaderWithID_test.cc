#include "tests/conformance/FileCoordinatorCallbacksTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::Contains;
using ::testing::ElementsAreArray;

constexpr const char *identify = "_identifierForItemAtURL:completion:";
constexpr const char *start = "_startProvidingItemAtURL:completion:";

class ProvideItemTest : public FileCoordinatorCallbacksTest {
 protected:
  [[nodiscard]] std::vector<std::string> requested(const std::string &reader) const {
    return {"log info [INFO] KTFileCoordinator requested us to provide item at URL " + urlText() + " for consumer " +
            reader};
  }
  /// The item's identifier is asked for, then the item; requests 1 and 2 were the registrations.
  [[nodiscard]] std::vector<std::string> asked(const std::string &answer) const {
    return joined(
        {identification("org.a", "request-3", *url_),
         {cancel("org.a", "request-3")},
         message("startProvidingItemAtURL:completionHandler:", "org.a", "request-4", start, urlText(), answer)});
  }
  [[nodiscard]] std::vector<std::string> provided() const {
    return joined({asked("()"),
                   {"log debug [DEBUG] Successfully provided item at URL " + urlText() + " for extension org.a.",
                    "answered ((null)) on platform thread", cancel("org.a", "request-4")}});
  }
};

TEST_F(ProvideItemTest, AReadAsksForTheIdentifierAndThenProvides) {
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  // Requests 1 and 2 were the registrations.
  EXPECT_THAT(trace(), ElementsAreArray(joined({requested("reader-1"), provided()})));
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
  EXPECT_THAT(trace(), ElementsAreArray(joined(
                           {requested("reader-1"),
                            failedIdentification("org.a", "request-3", *url_, "(" + text(cause) + ", (null))", cause),
                            {"log fault [ERROR] Could not provide item at URL " + urlText() +
                                 " from extension org.a to reader reader-1. Error: " + error,
                             "answered (" + error + ") on platform thread", cancel("org.a", "request-3")}})));
}

TEST_F(ProvideItemTest, AFailureToProvideIsTheOperationsError) {
  const SXError cause = someError("offline");
  process("org.a").setAnswer(start, VendorAnswer::values({Argument(cause)}));
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(
                           joined({requested("reader-1"),
                                   asked("(" + text(cause) + ")"),
                                   {"log fault [ERROR] Proxy failed to start providing item at URL " + urlText() +
                                        " for extension org.a. Error: " + text(cause),
                                    "answered (" + text(SXPluginOperationFailedError(cause)) + ") on platform thread",
                                    cancel("org.a", "request-4")}})));
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
      trace(),
      ElementsAreArray(joined({{"log fault [ERROR] Calling deprecated method: _provideItemAtURL:completionHandler:"},
                               requested("(null)"),
                               provided()})));
}

TEST_F(ProvideItemTest, TheServiceReachesTheProviderOnItsOwnQueueAndGetsItsAnswer) {
  ASSERT_TRUE(platform().fileCoordination().read(*url_, "reader-1", {}));
  runUntilIdle();
  EXPECT_THAT(trace(), Contains("provided " + urlText() + " (null) on platform thread"));
}

TEST_F(ProvideItemTest, NoGrantIsAskedFor) {
  provider()->_provideItemAtURL(url_, "reader-nobody-knows", recording<SXError>("answered"));
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(joined({requested("reader-nobody-knows"), provided()})));
}

TEST_F(ProvideItemTest, AFailedBeginIsReportedAndTheRequestStaysOpen) {
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  provider()->_provideItemAtURL(url_, "reader-1", recording<SXError>("answered"));
  runUntilIdle();
  const std::string wrapped = text(SXPluginOperationFailedError(error));
  EXPECT_THAT(trace(), ElementsAreArray(joined({requested("reader-1"),
                                                failedBegin("itemIDForURL:completionHandler:", "org.a", "request-3",
                                                            "Cannot get item ID for URL " + urlText(), error),
                                                {"log fault [ERROR] Could not provide item at URL " + urlText() +
                                                     " from extension org.a to reader reader-1. Error: " + wrapped,
                                                 "answered (" + wrapped + ") on platform thread"}})));
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
