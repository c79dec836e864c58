#include "service/ServicerTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;

constexpr const char *identify = "IdentifierForItemAtURL";
constexpr const char *locate = "URLForItemIdentifier";

class ProvidersRequestTest : public ServicerTest {};

TEST_F(ProvidersRequestTest, AReaderGetsTheListOnTheGlobalQueue) {
  connect({{readEntitlement, true}});
  call(SXDaemon::providersName);
  const std::string list = "{org.a = {documentStorageURL = " + storageText("org.a") +
                           "; providerIdentifier = org.a}; org.b = {documentStorageURL = " + storageText("org.b") +
                           "; providerIdentifier = org.b}}";
  EXPECT_THAT(trace(),
              ElementsAreArray(joined({served(SXDaemon::providersName, {}),
                                       {"entitlementValue peer 100 com.tessel.storix.acl-read",
                                        "log debug [DEBUG] providersCompletionHandler:: returning providers " + list,
                                        reply(SXDaemon::providersName, "((null), " + list + ")", global)}})));
}

TEST_F(ProvidersRequestTest, AClientWithoutEntitlementIsRefused) {
  connect({{readEntitlement, false}});
  call(SXDaemon::providersName);
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {served(SXDaemon::providersName, {}),
           {"entitlementValue peer 100 com.tessel.storix.acl-read",
            "entitlementValue peer 100 com.tessel.storix.acl-write", "peerProcessIdentifier peer 100",
            "log fault [ERROR] Rejecting request from PID 100 because it does not have any of these entitlements: "
            "(com.tessel.storix.acl-read, com.tessel.storix.acl-write)",
            "log debug [DEBUG] providersCompletionHandler:: Client is missing entitlement",
            reply(SXDaemon::providersName, "(" + text(SXClientLacksEntitlement()) + ", (null))", global)}})));
}

TEST_F(ProvidersRequestTest, TheListIsTakenAtOnce) {
  connect({{writeEntitlement, true}});
  platform().globalQueue()->suspend();
  const std::shared_ptr<fake::FakeReply> answered = client_->call(SXDaemon::providersName);
  runUntilIdle();
  platform().extensions().remove("org.a");
  platform().extensions().deliver();
  runUntilIdle();
  EXPECT_EQ(SXExtensionStorix::providerWithIdentifier("org.a"), nullptr);
  platform().globalQueue()->resume();
  runUntilIdle();
  EXPECT_EQ(answered->answer().values.at(1)->dictionary()->size(), 2U);
}

TEST_F(ProvidersRequestTest, WithoutAReplyHandlerTheListIsLoggedAllTheSame) {
  connect({{readEntitlement, true}});
  client_->callWithoutReply(SXDaemon::providersName);
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("log debug [DEBUG] providersCompletionHandler:: returning providers {org.a"), 1U);
  connect({});
  client_->callWithoutReply(SXDaemon::providersName);
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("reply"), 0U);
}

class BookmarkableStringRequestTest : public ServicerTest {
 protected:
  static constexpr std::string_view name = SXDaemon::bookmarkableStringName;

  void SetUp() override {
    ServicerTest::SetUp();
    connect({});
  }

  static Arguments request(const std::optional<URL> &url) { return packArguments<URL>(url); }

  /// The first lines, which check nothing.
  [[nodiscard]] std::vector<std::string> start(const std::optional<URL> &url) const {
    return {"request peer 100 " + std::string(name) + " (" + logDescription(url) + ")",
            "log debug [DEBUG] Getting bookmarkable string for URL " + logDescription(url)};
  }
};

TEST_F(BookmarkableStringRequestTest, AnyClientGetsTheStringOfAnItem) {
  call(name, request(item_));
  EXPECT_THAT(trace(),
              ElementsAreArray(
                  joined({start(item_),
                          {compared("org.a", *item_), "log info [INFO] Resolved URL to provider org.a."},
                          identification("org.a", "request-3", *item_),
                          {"log debug [DEBUG] Successfully generated bookmarkable string "
                           "“storix:org.a/f/i” from URL " +
                               itemText() + ".",
                           reply(name, "(storix:org.a/f/i, (null))", platformThread), cancel("org.a", "request-3")}})));
  EXPECT_FALSE(platform().files().exists("/home/u/Library/Storix/AccessControl.kvs"));
}

TEST_F(BookmarkableStringRequestTest, AURLOutsideEveryProviderGetsNeitherStringNorError) {
  const std::optional<URL> url = URL::fromString("file:///elsewhere");
  call(name, request(url));
  EXPECT_THAT(trace(),
              ElementsAreArray(joined({start(url),
                                       {compared("org.a", *url), compared("org.b", *url),
                                        "log info [INFO] Could not find the provider for URL file:///elsewhere",
                                        reply(name, "((null), (null))", global)}})));
}

TEST_F(BookmarkableStringRequestTest, AnAbsentURLIsNobodys) {
  const std::shared_ptr<fake::FakeReply> answered = call(name, request(std::nullopt));
  EXPECT_EQ(answered->answer().values, (Arguments{Argument(), Argument()}));
  EXPECT_TRUE(platform().log().contains(LogSeverity::info, "[INFO] Could not find the provider for URL (null)"));
}

TEST_F(BookmarkableStringRequestTest, TheProviderObjectsErrorIsPassedOnUnchanged) {
  const SXError error = someError("no such item");
  process("org.a").setAnswer(identify, VendorAnswer::values({Argument(error), Argument("f/i")}));
  call(name, request(item_));
  EXPECT_EQ(platform().trace().count(
                reply(name, "((null), " + text(SXPluginOperationFailedError(error)) + ")", platformThread)),
            1U);
  EXPECT_EQ(platform().trace().count("log fault"), 1U);
}

TEST_F(BookmarkableStringRequestTest, NeitherIdentifierNorErrorIsAnErrorLineAndAnEmptyReply) {
  process("org.a").setAnswer(identify, VendorAnswer::values());
  call(name, request(item_));
  EXPECT_TRUE(
      platform().log().contains(LogSeverity::fault, "[ERROR] Could not get Item ID for URL " + itemText() + "."));
  EXPECT_EQ(platform().trace().count(reply(name, "((null), (null))", platformThread)), 1U);
}

TEST_F(BookmarkableStringRequestTest, NeedsNoReplyHandler) {
  client_->callWithoutReply(name, request(item_));
  client_->callWithoutReply(name, request(URL::fromString("file:///elsewhere")));
  runUntilIdle();
  process("org.a").setAnswer(identify, VendorAnswer::values());
  client_->callWithoutReply(name, request(item_));
  process("org.a").setBeginFailure(someError("no process"));
  client_->callWithoutReply(name, request(item_));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("reply"), 0U);
}

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
  static std::string failed(const SXError &error, const char *where) {
    return reply(name, "((null), (null), (null), (null), " + text(error) + ")", where);
  }
};

TEST_F(DocumentURLRequestTest, AGrantedItemIsLocatedAndGetsTokens) {
  grant("org.a", "f/i", "org.app");
  call(name, request("storix:org.a/f/i"));
  const URL companion = itemURL("org.a", ".report.txt");
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {start("storix:org.a/f/i"),
           message("URLForItemID:completionHandler:", "org.a", "request-3", "_URLForItemIdentifier:completion:", "f/i",
                   "((null), " + itemText() + ")"),
           {"log debug [DEBUG] Successfully retrieved URL " + itemText() + " for item ID “f/i” from extension org.a",
            "issueSandboxExtension readWrite " + item_->path() + " flags=0",
            "issueSandboxExtension readWrite " + companion.path() + " flags=0",
            "log info [INFO] Successfully extended sandbox of URL " + itemText() +
                " from provider ID org.a to consumer ID org.app.",
            reply(name,
                  "(" + itemText() + ", " + token(*item_) + ", " + companion.absoluteString() + ", " +
                      token(companion) + ", (null))",
                  platformThread),
            cancel("org.a", "request-3")}})));
}

TEST_F(DocumentURLRequestTest, ACallerWithoutBundleIsNotPermittedWhateverTheString) {
  connect({{writeEntitlement, true}});
  for (const char *string : {"storix:org.a/f/i", "nonsense"}) {
    call(name, request(string));
    EXPECT_THAT(trace(), ElementsAreArray(joined({start(string), {failed(SXNotPermittedError(), global)}})));
  }
}

TEST_F(DocumentURLRequestTest, AMalformedStringIsInvalid) {
  for (const char *string : {"storix:org.sample.docs//a", "storix:/a", "storix:org.sample.docs",
                             " storix:org.sample.docs/a", "Storix:org.sample.docs/a", ""}) {
    call(name, request(string));
    EXPECT_THAT(trace(),
                ElementsAreArray(joined({start(string), {failed(SXInvalidBookmarkableStringError(), global)}})));
  }
}

TEST_F(DocumentURLRequestTest, AnAbsentStringIsInvalid) {
  EXPECT_EQ(call(name, request(std::nullopt))->error(4), SXInvalidBookmarkableStringError());
  EXPECT_TRUE(platform().log().contains(LogSeverity::debug, "[DEBUG] Getting URL from bookmarkable string: “(null)”."));
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
  EXPECT_EQ(platform().trace().count("send request-3 _URLForItemIdentifier:completion: (a/b/c)"), 1U);
  call(name, request("storix:org.a/a/"));
  EXPECT_EQ(platform().trace().count("send request-4 _URLForItemIdentifier:completion: (a/)"), 1U);
}

TEST_F(DocumentURLRequestTest, AProviderThatIsNotThereIsNeverAnswered) {
  grant("org.none", "i", "org.app");
  const std::shared_ptr<fake::FakeReply> answered = call(name, request("storix:org.none/i"));
  EXPECT_THAT(trace(), ElementsAreArray(start("storix:org.none/i")));
  EXPECT_FALSE(answered->isAnswered());
}

TEST_F(DocumentURLRequestTest, AProviderThatCannotLocateTheItemIsASandboxFailure) {
  grant("org.a", "f/i", "org.app");
  process("org.a").setAnswer(locate, VendorAnswer::values({Argument(someError("gone")), Argument(*item_)}));
  call(name, request("storix:org.a/f/i"));
  EXPECT_EQ(platform().trace().count(failed(SXSandboxExtensionFailedError(std::nullopt), platformThread)), 1U);
  EXPECT_EQ(platform().trace().count("issueSandboxExtension"), 0U);
}

TEST_F(DocumentURLRequestTest, AProviderThatGivesNoURLIsASuccessWithNothing) {
  grant("org.a", "f/i", "org.app");
  process("org.a").setAnswer(locate, VendorAnswer::values());
  EXPECT_EQ(call(name, request("storix:org.a/f/i"))->answer().values, Arguments(5));
  EXPECT_TRUE(platform().log().contains(LogSeverity::info,
                                        "[INFO] Successfully extended sandbox of URL (null) from "
                                        "provider ID org.a to consumer ID org.app."));
}

TEST_F(DocumentURLRequestTest, NoGrantIsWritten) {
  grant("org.a", "f/i", "org.app");
  call(name, request("storix:org.a/f/i"));
  EXPECT_EQ(platform().trace().count("writeKeyedValueFileAtomically"), 0U);
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

}  // namespace
}  // namespace storix
