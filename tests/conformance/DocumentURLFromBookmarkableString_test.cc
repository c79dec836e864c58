#include "service/ServicerTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::ElementsAreArray;

constexpr const char *locate = "URLForItemIdentifier";

class DocumentURLRequestTest : public ServicerTest {
 protected:
  static constexpr std::string_view name = SXDaemon::documentURLName;

  void SetUp() override {
    ServicerTest::SetUp();
    process("org.a").setAnswer(locate, VendorAnswer::values({Argument(), Argument(*item_)}));
    connect({}, "org.app");
  }

  static Arguments request(const Text &string) { return packArguments<std::string>(string); }

  [[nodiscard]] std::vector<std::string> start(const std::string &string) const {
    return {"request peer 100 " + std::string(name) + " (" + string + ")",
            "log debug [DEBUG] Getting URL from bookmarkable string: “" + string + "”.", "peerAuditToken peer 100",
            "bundleIdentifierForAuditToken peer 100"};
  }
  /// The provider is asked where the item is, and answers with `item_`, for which tokens are issued.
  [[nodiscard]] std::vector<std::string> located(const std::string &item, const std::string &number) const {
    const URL companion = itemURL("org.a", ".report.txt");
    return joined({message("URLForItemID:completionHandler:", "org.a", number,
                           "_URLForItemIdentifier:completion:", item, "((null), " + itemText() + ")"),
                   {"log debug [DEBUG] Successfully retrieved URL " + itemText() + " for item ID “" + item +
                        "” from extension org.a",
                    "issueSandboxExtension readWrite " + item_->path() + " flags=0",
                    "issueSandboxExtension readWrite " + companion.path() + " flags=0",
                    "log info [INFO] Successfully extended sandbox of URL " + itemText() +
                        " from provider ID org.a to consumer ID org.app.",
                    reply(name,
                          "(" + itemText() + ", " + token(*item_) + ", " + companion.absoluteString() + ", " +
                              token(companion) + ", (null))",
                          platformThread),
                    cancel("org.a", number)}});
  }
  static std::string failed(const SXError &error, const char *where) {
    return reply(name, "((null), (null), (null), (null), " + text(error) + ")", where);
  }
};

TEST_F(DocumentURLRequestTest, AGrantedItemIsLocatedAndGetsTokens) {
  grant("org.a", "f/i", "org.app");
  call(name, request("storix:org.a/f/i"));
  EXPECT_THAT(trace(), ElementsAreArray(joined({start("storix:org.a/f/i"), located("f/i", "request-3")})));
  EXPECT_EQ(platform().files().writeCount("/home/u/Library/Storix/AccessControl.kvs"), 1U);  // the grant above
}

TEST_F(DocumentURLRequestTest, ACallerWithoutBundleIsNotPermittedWhateverTheString) {
  connect({{writeEntitlement, true}});
  for (const char *string : {"storix:org.a/f/i", "nonsense"}) {
    call(name, request(string));
    EXPECT_THAT(trace(), ElementsAreArray(joined({start(string), {failed(SXNotPermittedError(), global)}})));
  }
}

TEST_F(DocumentURLRequestTest, AMalformedStringIsInvalid) {
  for (const std::string &string :
       {std::string(), std::string("storix:"), std::string("storix:/"), std::string("storix://"), std::string("//"),
        std::string("storix:/a"), std::string("storix:org.sample.docs"), std::string("storix:org.sample.docs/"),
        std::string("storix:org.sample.docs//a"), std::string("storix:org.sample.docs//"),
        std::string(" storix:org.sample.docs/a"), std::string("  storix:org.sample.docs/a"),
        std::string("Storix:org.sample.docs/a"), std::string("STORIX:org.sample.docs/a"),
        std::string("xstorix:org.sample.docs/a"), "storix:" + std::string(65536, '/'), std::string(65536, '/')}) {
    call(name, request(string));
    EXPECT_THAT(trace(),
                ElementsAreArray(joined({start(string), {failed(SXInvalidBookmarkableStringError(), global)}})));
  }
}

TEST_F(DocumentURLRequestTest, AnAbsentStringIsInvalid) {
  call(name, request(std::nullopt));
  EXPECT_THAT(trace(),
              ElementsAreArray(joined({start("(null)"), {failed(SXInvalidBookmarkableStringError(), global)}})));
}

TEST_F(DocumentURLRequestTest, WithoutAGrantToTheCallerItIsNotPermitted) {
  grant("org.a", "f/i", "org.other");
  grant("org.a", "f", "org.app");
  call(name, request("storix:org.a/f/i"));
  EXPECT_THAT(trace(), ElementsAreArray(joined(
                           {start("storix:org.a/f/i"),
                            {"log fault [ERROR] Provider ID org.a is not allowed to provide item ID “f/i” to consumer "
                             "ID org.app",
                             failed(SXNotPermittedError(), global)}})));
}

TEST_F(DocumentURLRequestTest, TheItemKeepsItsSlashes) {
  grant("org.a", "a/b/c", "org.app");
  grant("org.a", "a/", "org.app");
  call(name, request("storix:org.a/a/b/c"));
  EXPECT_THAT(trace(), ElementsAreArray(joined({start("storix:org.a/a/b/c"), located("a/b/c", "request-3")})));
  call(name, request("storix:org.a/a/"));
  EXPECT_THAT(trace(), ElementsAreArray(joined({start("storix:org.a/a/"), located("a/", "request-4")})));
}

TEST_F(DocumentURLRequestTest, AProviderThatIsNotThereIsNeverAnswered) {
  grant("org.none", "i", "org.app");
  const std::shared_ptr<fake::FakeReply> answered = call(name, request("storix:org.none/i"));
  EXPECT_THAT(trace(), ElementsAreArray(start("storix:org.none/i")));
  EXPECT_FALSE(answered->isAnswered());
}

TEST_F(DocumentURLRequestTest, AProviderThatCannotLocateTheItemIsASandboxFailure) {
  grant("org.a", "f/i", "org.app");
  const SXError error = someError("gone");
  process("org.a").setAnswer(locate, VendorAnswer::values({Argument(error), Argument(*item_)}));
  call(name, request("storix:org.a/f/i"));
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {start("storix:org.a/f/i"),
           message("URLForItemID:completionHandler:", "org.a", "request-3", "_URLForItemIdentifier:completion:", "f/i",
                   "(" + text(error) + ", " + itemText() + ")"),
           {"log fault [ERROR] Proxy failed to get URL for item ID “f/i” for extension org.a. Error: " + text(error),
            failed(SXSandboxExtensionFailedError(std::nullopt), platformThread), cancel("org.a", "request-3")}})));
}

TEST_F(DocumentURLRequestTest, AProviderThatGivesNoURLIsASuccessWithNothing) {
  grant("org.a", "f/i", "org.app");
  process("org.a").setAnswer(locate, VendorAnswer::values());
  call(name, request("storix:org.a/f/i"));
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {start("storix:org.a/f/i"),
           message("URLForItemID:completionHandler:", "org.a", "request-3", "_URLForItemIdentifier:completion:", "f/i",
                   "()"),
           {"log debug [DEBUG] Successfully retrieved URL (null) for item ID “f/i” from extension org.a",
            "log info [INFO] Successfully extended sandbox of URL (null) from provider ID org.a to consumer ID "
            "org.app.",
            reply(name, "((null), (null), (null), (null), (null))", platformThread), cancel("org.a", "request-3")}})));
}

TEST_F(DocumentURLRequestTest, TheStoreIsTheSharedOneServerOrNot) {
  grant("org.a", "f/i", "org.app");
  server_.reset();
  EXPECT_EQ(call(name, request("storix:org.a/f/i"))->error(4), std::nullopt);
}

TEST_F(DocumentURLRequestTest, NeedsNoReplyHandler) {
  grant("org.a", "f/i", "org.app");
  client_->callWithoutReply(name, request("storix:org.a/f/i"));
  client_->callWithoutReply(name, request("nonsense"));
  runUntilIdle();
  process("org.a").setBeginFailure(someError("no process"));
  client_->callWithoutReply(name, request("storix:org.a/f/i"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("reply"), 0U);
}

TEST_F(DocumentURLRequestTest, WhatStaysUnansweredStaysSoWhenTheProviderComesLater) {
  grant("org.c", "i", "org.app");
  const std::shared_ptr<fake::FakeReply> answered = call(name, request("storix:org.c/i"));
  platform().extensions().install(fake::completeProvider("org.c"));
  platform().extensions().deliver();
  runUntilIdle();
  ASSERT_NE(SXExtensionStorix::providerWithIdentifier("org.c"), nullptr);
  platform().advance(std::chrono::hours(24));
  call(SXDaemon::wakeUpName);
  EXPECT_FALSE(answered->isAnswered());
  EXPECT_EQ(platform().trace().count("send request-3 _URLForItemIdentifier:"), 0U);
  // The same string sent now is answered.
  EXPECT_TRUE(call(name, request("storix:org.c/i"))->isAnswered());
}

TEST_F(DocumentURLRequestTest, AFailedBeginIsASandboxFailureAndTheRequestStaysOpen) {
  grant("org.a", "f/i", "org.app");
  const SXError error = someError("no process");
  process("org.a").setBeginFailure(error);
  call(name, request("storix:org.a/f/i"));
  EXPECT_THAT(trace(),
              ElementsAreArray(joined({start("storix:org.a/f/i"),
                                       failedBegin("URLForItemID:completionHandler:", "org.a", "request-3",
                                                   "Cannot get URL for item ID “f/i”", error),
                                       {failed(SXSandboxExtensionFailedError(std::nullopt), platformThread)}})));
}

TEST_F(DocumentURLRequestTest, ALateConnectionFailureRepliesAgainWithAnError) {
  grant("org.a", "f/i", "org.app");
  process("org.a").setAnswer(
      locate, VendorAnswer::valuesThenConnectionFailure({Argument(), Argument(*item_)}, someError("it ended")));
  const std::shared_ptr<fake::FakeReply> answered = call(name, request("storix:org.a/f/i"));
  ASSERT_EQ(answered->answers().size(), 2U);
  EXPECT_EQ(answered->error(4), std::nullopt);
  EXPECT_EQ(answered->answers()[1].values.at(4), Argument(SXSandboxExtensionFailedError(std::nullopt)));
}

}  // namespace
}  // namespace storix
