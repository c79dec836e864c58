#include "tests/conformance/FileCoordinatorCallbacksTest.h"

namespace storix {
namespace {

using ::testing::ElementsAre;

using FinishedWriteTest = FileCoordinatorCallbacksTest;

TEST_F(FinishedWriteTest, AFinishedWriteIsToldToTheOwnerOfTheURL) {
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

TEST_F(FinishedWriteTest, AWriteUnderAnotherProviderGoesToThatOne) {
  const URL other = itemURL("org.b", "r");
  provider()->_writerWithID("writer-1", other);
  runUntilIdle();
  EXPECT_TRUE(platform().log().contains(
      LogSeverity::debug, "[DEBUG] The item at URL " + other.absoluteString() + " is provided by the etxension org.b"));
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.b"), 1U);
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.a"), 0U);
}

TEST_F(FinishedWriteTest, AWriteOutsideEveryProviderIsAnError) {
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

TEST_F(FinishedWriteTest, AWriteOfAProvidersDirectoryItselfIsPassedOver) {
  provider()->_writerWithID("writer-1", storageURL("org.a"));
  runUntilIdle();
  EXPECT_THAT(logTexts(), ElementsAre("[INFO] KTFileCoordinator is telling us the item at URL " + storageText("org.a") +
                                          " was changed by writer ID writer-1.",
                                      "[DEBUG] Ignoring URLs that exactly match the document container folder"));
  EXPECT_EQ(platform().trace().count("beginExtensionRequest"), 0U);
}

TEST_F(FinishedWriteTest, AFailedBeginIsLoggedWithoutItsErrorAndTheRequestIsEnded) {
  process("org.a").setBeginFailure(someError("no process"));
  provider()->_writerWithID("writer-1", url_);
  runUntilIdle();
  const std::vector<std::string> lines = trace();
  ASSERT_GE(lines.size(), 2U);
  EXPECT_EQ(lines[lines.size() - 2],
            "log fault [ERROR] Cannot tell extension org.a that item at URL " + urlText() + " has changed.");
  EXPECT_EQ(lines.back(), "cancelExtensionRequest org.a version 1 request-3");
}

TEST_F(FinishedWriteTest, TheExtensionsErrorIsLoggedAndTheRequestIsEnded) {
  const SXError error = someError("busy");
  process("org.a").setAnswer("_itemChangedAtURL:completion:", fake::VendorAnswer::values({Argument(error)}));
  provider()->_writerWithID("writer-1", url_);
  runUntilIdle();
  const std::vector<std::string> lines = trace();
  ASSERT_GE(lines.size(), 2U);
  EXPECT_EQ(lines[lines.size() - 2], "log fault [ERROR] Could not tell extension org.a that item at URL " + urlText() +
                                         " has changed. Error: " + text(error));
  EXPECT_EQ(lines.back(), "cancelExtensionRequest org.a version 1 request-3");
}

}  // namespace
}  // namespace storix
