#include "tests/conformance/FileCoordinatorCallbacksTest.h"

namespace storix {
namespace {

using ::testing::ElementsAre;
using ::testing::ElementsAreArray;

class FinishedWriteTest : public FileCoordinatorCallbacksTest {
 protected:
  /// The owner of the URL is found.
  [[nodiscard]] static std::vector<std::string> routed(const URL &url, const std::string &owner) {
    const std::string written = url.absoluteString();
    std::vector<std::string> lines{"log info [INFO] KTFileCoordinator is telling us the item at URL " + written +
                                   " was changed by writer ID writer-1."};
    for (const char *provider : {"org.a", "org.b"}) {
      lines.push_back("directoryRelationship " + storageText(provider) + " " + written);
      if (provider == owner) break;
    }
    lines.push_back("log info [INFO] Resolved URL to provider " + owner + ".");
    lines.push_back("log debug [DEBUG] The item at URL " + written + " is provided by the etxension " + owner);
    return lines;
  }
  /// The owner is found and told.
  [[nodiscard]] static std::vector<std::string> told(const URL &url, const std::string &owner,
                                                     const std::string &answer = "()") {
    return joined({routed(url, owner), message("itemChangedAtURL:", owner, "request-3",
                                               "_itemChangedAtURL:completion:", url.absoluteString(), answer)});
  }
};

TEST_F(FinishedWriteTest, AFinishedWriteIsToldToTheOwnerOfTheURL) {
  provider()->_writerWithID("writer-1", url_);
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(joined({told(*url_, "org.a"), {cancel("org.a", "request-3")}})));
}

TEST_F(FinishedWriteTest, AWriteUnderAnotherProviderGoesToThatOne) {
  const URL other = itemURL("org.b", "r");
  provider()->_writerWithID("writer-1", other);
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(joined({told(other, "org.b"), {cancel("org.b", "request-3")}})));
}

TEST_F(FinishedWriteTest, AWriteOutsideEveryProviderIsAnError) {
  provider()->_writerWithID(std::nullopt, *URL::fromString("file:///elsewhere"));
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAre("log info [INFO] KTFileCoordinator is telling us the item at URL file:///elsewhere "
                                   "was changed by writer ID (null).",
                                   "directoryRelationship " + storageText("org.a") + " file:///elsewhere",
                                   "directoryRelationship " + storageText("org.b") + " file:///elsewhere",
                                   "log fault [ERROR] Could not find any extension that provides an item at URL "
                                   "file:///elsewhere"));
}

TEST_F(FinishedWriteTest, AWriteOfAProvidersDirectoryItselfIsPassedOver) {
  provider()->_writerWithID("writer-1", storageURL("org.a"));
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAre("log info [INFO] KTFileCoordinator is telling us the item at URL " +
                                       storageText("org.a") + " was changed by writer ID writer-1.",
                                   "directoryRelationship " + storageText("org.a") + " " + storageText("org.a"),
                                   "log debug [DEBUG] Ignoring URLs that exactly match the document container folder"));
}

TEST_F(FinishedWriteTest, AFailedBeginIsLoggedWithoutItsErrorAndTheRequestIsEnded) {
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  provider()->_writerWithID("writer-1", url_);
  runUntilIdle();
  std::vector<std::string> begun = failedBegin("itemChangedAtURL:", "org.a", "request-3", "", error);
  begun.back() = "log fault [ERROR] Cannot tell extension org.a that item at URL " + urlText() + " has changed.";
  EXPECT_THAT(trace(), ElementsAreArray(joined({routed(*url_, "org.a"), begun, {cancel("org.a", "request-3")}})));
}

TEST_F(FinishedWriteTest, TheExtensionsErrorIsLoggedAndTheRequestIsEnded) {
  const SXError error = someError("busy");
  process("org.a").setAnswer("_itemChangedAtURL:completion:", fake::VendorAnswer::values({Argument(error)}));
  provider()->_writerWithID("writer-1", url_);
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAreArray(joined({told(*url_, "org.a", "(" + text(error) + ")"),
                                                {"log fault [ERROR] Could not tell extension org.a that item at URL " +
                                                     urlText() + " has changed. Error: " + text(error),
                                                 cancel("org.a", "request-3")}})));
}

}  // namespace
}  // namespace storix
