#include <chrono>
#include <cstdint>

#include "providers/ProvidersTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

using namespace std::chrono_literals;

constexpr const char *ownName =
    "log debug [DEBUG] -[SXExtensionStorix registerWithFileCoordinatorRetryCount:completion:]";
constexpr const char *setup = "_performInitialSetupWithCompletion:";
constexpr const char *queueName = "operation queue Operation queue for org.a";

class FileCoordinatorRegistrationTest : public ProvidersTest {
 protected:
  void SetUp() override { provider_ = makeProvider("org.a"); }
  void TearDown() override {
    provider_.reset();
    ProvidersTest::TearDown();
  }

  static Arguments setupError(const SXError &error) { return {Argument("name"), Argument(), Argument(error)}; }

  /// One try up to the sent message.
  static std::vector<std::string> tryOf(const std::string &request) {
    return {ownName,
            "beginExtensionRequest org.a version 1 " + request,
            "begun " + request,
            "log debug [DEBUG] Beginning extension request.",
            "extensionContextForRequest org.a version 1 " + request,
            "remoteProxyWithErrorHandler " + request,
            "send " + request + " " + setup + " ()"};
  }
  static std::vector<std::string> failedSetup(const std::string &request, const SXError &error) {
    std::vector<std::string> lines = tryOf(request);
    lines.push_back("answer " + request + " " + setup + " (name, (null), " + text(error) + ")");
    lines.push_back("log fault [ERROR] Storix provider extension org.a failed to initialize. Error: " + text(error) +
                    ".");
    return lines;
  }
  static std::vector<std::string> failedBegin(const std::string &request, const SXError &error) {
    return {ownName,
            "beginExtensionRequest org.a version 1 " + request,
            "begin failed " + request + " " + text(error),
            "log debug [DEBUG] Beginning extension request.",
            "log fault [ERROR] Extension request failed. Error: " + text(error),
            "log fault [ERROR] Error registering storix provider extension org.a: " + text(error) + "."};
  }
  static std::string triesLeft(int count) {
    return "log default [NOTICE] Trying to register storix provider extension org.a again. Tries left: " +
           std::to_string(count);
  }
  static std::string cancel(const std::string &request) { return "cancelExtensionRequest org.a version 1 " + request; }
  static constexpr const char *pause = "runAfterDelay 2000000000 on queue global queue";

  std::vector<std::string> traceAfterPause() {
    platform().advance(2s);
    runUntilIdle();
    return trace();
  }

  std::shared_ptr<SXExtensionStorix> provider_;
};

std::vector<std::string> followedBy(std::vector<std::string> first, const std::vector<std::string> &rest) {
  first.insert(first.end(), rest.begin(), rest.end());
  return first;
}

TEST_F(FileCoordinatorRegistrationTest, ASuccessfulSetupAddsTheProviderOnItsOwnQueue) {
  process("org.a").setAnswer(setup,
                             VendorAnswer::values({Argument("name"), Argument(storageURL("org.a")), Argument()}));
  provider_->registerWithFileCoordinatorRetryCount(3, recording<SXError>("registered"));
  runUntilIdle();
  EXPECT_THAT(trace(),
              ElementsAreArray(followedBy(
                  tryOf("request-1"),
                  {std::string("answer request-1 ") + setup + " (name, " + storageText("org.a") + ", (null))",
                   // The request ends when the operation is submitted, not when it has run.
                   cancel("request-1"), "addProvider org.a",
                   "log info [INFO] Registered storix provider extension org.a for path " + storageText("org.a"),
                   std::string("registered ((null)) on ") + queueName})));
  EXPECT_THAT(platform().fileCoordination().providers(), ElementsAre(provider_));
}

TEST_F(FileCoordinatorRegistrationTest, AFailedSetupIsTriedThreeTimesTwoSecondsApart) {
  const SXError error = someError("not ready");
  process("org.a").setAnswer(setup, VendorAnswer::values(setupError(error)));
  provider_->registerWithFileCoordinatorRetryCount(3, recording<SXError>("registered"));
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(
                           followedBy(failedSetup("request-1", error), {triesLeft(2), pause, cancel("request-1")})));
  platform().advance(1999ms);
  runUntilIdle();
  EXPECT_THAT(trace(), IsEmpty());
  platform().advance(1ms);
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(
                           followedBy(failedSetup("request-2", error), {triesLeft(1), pause, cancel("request-2")})));
  EXPECT_THAT(traceAfterPause(), ElementsAreArray(followedBy(
                                     failedSetup("request-3", error),
                                     {"registered (" + text(error) + ") on platform thread", cancel("request-3")})));
  EXPECT_THAT(platform().delayedTasks(), IsEmpty());
}

TEST_F(FileCoordinatorRegistrationTest, AFailedRequestIsTriedAgainAndNotCancelled) {
  const SXError error = someError("no process");
  process("org.a").queueBeginFailure(error, 3);
  provider_->registerWithFileCoordinatorRetryCount(3, recording<SXError>("registered"));
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(followedBy(failedBegin("request-1", error), {triesLeft(2), pause})));
  EXPECT_THAT(traceAfterPause(), ElementsAreArray(followedBy(failedBegin("request-2", error), {triesLeft(1), pause})));
  EXPECT_THAT(traceAfterPause(), ElementsAreArray(followedBy(failedBegin("request-3", error),
                                                             {"registered (" + text(error) + ") on platform thread"})));
}

TEST_F(FileCoordinatorRegistrationTest, TheLastTrysErrorIsReportedUnwrapped) {
  process("org.a").queueBeginFailure(someError("first"));
  platform().extensions().removeProxy("request-2");
  provider_->registerWithFileCoordinatorRetryCount(2, recording<SXError>("registered"));
  runUntilIdle();
  trace();
  EXPECT_EQ(traceAfterPause().back(),
            "registered (" + text(SXProxyNotFoundError("org.a", std::nullopt)) + ") on platform thread");
}

TEST_F(FileCoordinatorRegistrationTest, ATryAfterAFailureCanSucceed) {
  process("org.a").queueBeginFailure(someError("first"));
  provider_->registerWithFileCoordinatorRetryCount(3, recording<SXError>("registered"));
  runUntilIdle();
  EXPECT_EQ(traceAfterPause().back(), std::string("registered ((null)) on ") + queueName);
  EXPECT_THAT(platform().delayedTasks(), IsEmpty());
}

TEST_F(FileCoordinatorRegistrationTest, ACountOfZeroFailsSilentlyOnTheGlobalQueue) {
  provider_->registerWithFileCoordinatorRetryCount(0, recording<SXError>("registered"));
  EXPECT_THAT(trace(), IsEmpty());
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAre("registered (" + text(SXPluginOperationFailedError(std::nullopt)) +
                                   ") on queue global queue"));
}

TEST_F(FileCoordinatorRegistrationTest, ACountOfZeroWithoutCompletionDoesNothing) {
  provider_->registerWithFileCoordinatorRetryCount(0, {});
  EXPECT_FALSE(platform().runOne());
  EXPECT_THAT(trace(), IsEmpty());
}

TEST_F(FileCoordinatorRegistrationTest, ANegativeCountMakesOneTry) {
  for (const std::int32_t count : {-1, std::numeric_limits<std::int32_t>::min()}) {
    const SXError error = someError("no process");
    process("org.a").queueBeginFailure(error);
    provider_->registerWithFileCoordinatorRetryCount(count, recording<SXError>("registered"));
    runUntilIdle();
    EXPECT_EQ(trace().back(), "registered (" + text(error) + ") on platform thread");
    EXPECT_THAT(platform().delayedTasks(), IsEmpty());
  }
}

TEST_F(FileCoordinatorRegistrationTest, TheShortFormNeverTriesAgain) {
  const SXError error = someError("no process");
  process("org.a").queueBeginFailure(error);
  provider_->registerWithFileCoordinatorCompletion(recording<SXError>("registered"));
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(followedBy(failedBegin("request-1", error),
                                                   {"registered (" + text(error) + ") on platform thread"})));
}

TEST_F(FileCoordinatorRegistrationTest, RegistersAndFailsWithoutACompletion) {
  process("org.a").queueBeginFailure(someError("no process"));
  provider_->registerWithFileCoordinatorCompletion({});
  runUntilIdle();
  EXPECT_THAT(platform().fileCoordination().providers(), IsEmpty());
  provider_->registerWithFileCoordinatorCompletion({});
  runUntilIdle();
  EXPECT_THAT(platform().fileCoordination().providers(), ElementsAre(provider_));
}

TEST_F(FileCoordinatorRegistrationTest, AConnectionFailureInPlaceOfTheReplyStartsARetryWithTheSameCount) {
  const SXError error = someError("the process ended");
  process("org.a").queueAnswer(setup, VendorAnswer::connectionFailure(error));
  provider_->registerWithFileCoordinatorRetryCount(3, recording<SXError>("registered"));
  runUntilIdle();
  EXPECT_THAT(trace(),
              ElementsAreArray(followedBy(
                  tryOf("request-1"),
                  {"connection failed request-1 " + text(error),
                   "log fault [ERROR] Error getting remote proxy object for provider extension. Error: " + text(error),
                   "log fault [ERROR] Error registering storix provider extension org.a: " + text(error) + ".",
                   triesLeft(2), pause})));
}

TEST_F(FileCoordinatorRegistrationTest, ALateConnectionFailureStartsAFurtherChain) {
  const SXError error = someError("the process ended");
  process("org.a").queueAnswer(setup, VendorAnswer::valuesThenConnectionFailure(setupError(someError("no")), error));
  provider_->registerWithFileCoordinatorRetryCount(3, recording<SXError>("registered"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count(triesLeft(2)), 2U);
  EXPECT_EQ(platform().delayedTasks().size(), 2U);
}

TEST_F(FileCoordinatorRegistrationTest, AScheduledTryKeepsTheProviderAndRunsThoughItWasWithdrawn) {
  const std::weak_ptr<SXExtensionStorix> observed = provider_;
  process("org.a").queueBeginFailure(someError("no process"));
  provider_->registerWithFileCoordinatorRetryCount(2, recording<SXError>("registered"));
  runUntilIdle();
  provider_->unregisterFromFileCoordinator();
  provider_.reset();
  runUntilIdle();
  EXPECT_FALSE(observed.expired());
  trace();
  EXPECT_EQ(traceAfterPause().back(), std::string("registered ((null)) on ") + queueName);
}

TEST_F(FileCoordinatorRegistrationTest, WithdrawalRunsOnTheProvidersQueueWithoutALine) {
  provider_->unregisterFromFileCoordinator();
  EXPECT_THAT(trace(), IsEmpty());
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAre("removeProvider org.a"));
}

TEST_F(FileCoordinatorRegistrationTest, WithdrawalComesAfterTheRegistrationThatWasSubmittedBefore) {
  provider_->registerWithFileCoordinatorCompletion(
      [this](const std::optional<SXError> &) { provider_->unregisterFromFileCoordinator(); });
  runUntilIdle();
  EXPECT_EQ(trace().back(), "removeProvider org.a");
  EXPECT_THAT(platform().fileCoordination().providers(), IsEmpty());
}

TEST_F(FileCoordinatorRegistrationTest, RegisteringTwiceAddsTwice) {
  provider_->registerWithFileCoordinatorCompletion({});
  provider_->registerWithFileCoordinatorCompletion({});
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("addProvider org.a"), 2U);
}

}  // namespace
}  // namespace storix
