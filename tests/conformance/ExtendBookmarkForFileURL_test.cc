#include "service/ServicerTest.h"

namespace storix {
namespace {

using fake::VendorAnswer;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;

constexpr std::string_view bookmark = SXDaemon::extendBookmarkName;
constexpr const char *identify = "IdentifierForItemAtURL";

class ExtendBookmarkTest : public ServicerTest {
 protected:
  void SetUp() override {
    ServicerTest::SetUp();
    connect({}, "org.caller");
    platform().sandbox().allowAccess(client_->auditToken(), item_->path());
  }

  static Arguments request(const std::optional<URL> &url, const Text &consumer) {
    return packArguments<URL, std::string>(url, consumer);
  }

  /// The request's start: who asks, and whether it may write the file.
  std::vector<std::string> start(const std::optional<URL> &url, const std::string &bundle,
                                 const std::string &consumer) {
    const std::string urlText = logDescription(url);
    return {"request peer 100 " + std::string(bookmark) + " (" + urlText + ", " + consumer + ")",
            "peerAuditToken peer 100",
            "bundleIdentifierForAuditToken peer 100",
            "log debug [DEBUG] Extending bookmark privileges for URL: “" + urlText + "” from bundle " + bundle +
                " to " + consumer + ".",
            "peerAuditToken peer 100",
            "checkSandboxAccess peer 100 file-write-data pathNoReport " + (url ? url->path() : "")};
  }

  std::vector<std::string> failure(const std::optional<URL> &url, const std::string &bundle,
                                   const std::string &consumer, const SXError &error) {
    return {"log fault [ERROR] Could not extend bookmark privileges for URL " + logDescription(url) + " from bundle " +
                bundle + " to consumer ID " + consumer + ", error: " + text(error),
            reply(bookmark, "((null), " + text(error) + ")", global)};
  }
};

TEST_F(ExtendBookmarkTest, GrantsAndNamesTheItem) {
  call(bookmark, request(item_, "org.app"));
  EXPECT_THAT(trace(),
              ElementsAreArray(joined(
                  {start(item_, "org.caller", "org.app"),
                   ownerFound(),
                   identification("org.a", "request-3", *item_),
                   {"log info [INFO] Allowing provider ID org.a to provide item ID “f/i” to consumer ID org.app",
                    "log info [INFO] Committing access control list",
                    "writeKeyedValueFileAtomically /home/u/Library/Storix/AccessControl.kvs {org.a = {org.app = "
                    "{AllowedItemIDs = (f/i)}}}",
                    "log debug [DEBUG] Successfully generated bookmarkable string “storix:org.a/f/i” from URL " +
                        itemText() + ".",
                    reply(bookmark, "(storix:org.a/f/i, (null))", platformThread), cancel("org.a", "request-3")}})));
}

TEST_F(ExtendBookmarkTest, WithoutAConsumerItIsNotPermittedThoughTheFileIsLookedAt) {
  call(bookmark, request(item_, std::nullopt));
  EXPECT_THAT(trace(), ElementsAreArray(joined({start(item_, "org.caller", "(null)"),
                                                failure(item_, "org.caller", "(null)", SXNotPermittedError())})));
}

TEST_F(ExtendBookmarkTest, ACallerWithoutBundleIsNotPermittedThoughItMayWrite) {
  connect({{writeEntitlement, true}});
  call(bookmark, request(item_, "org.app"));
  EXPECT_THAT(trace(), ElementsAreArray(joined({start(item_, "(null)", "org.app"),
                                                failure(item_, "(null)", "org.app", SXNotPermittedError())})));
}

TEST_F(ExtendBookmarkTest, ACallerThatMayNotWriteIsNotPermitted) {
  platform().sandbox().setAccessAnswer(client_->auditToken(), item_->path(), 1);
  call(bookmark, request(item_, "org.app"));
  EXPECT_THAT(trace(), ElementsAreArray(joined({start(item_, "org.caller", "org.app"),
                                                failure(item_, "org.caller", "org.app", SXNotPermittedError())})));
}

TEST_F(ExtendBookmarkTest, AnAbsentURLIsCheckedAsTheEmptyPath) {
  call(bookmark, request(std::nullopt, "org.app"));
  EXPECT_THAT(trace(),
              ElementsAreArray(joined({start(std::nullopt, "org.caller", "org.app"),
                                       failure(std::nullopt, "org.caller", "org.app", SXNotPermittedError())})));
}

TEST_F(ExtendBookmarkTest, AURLThatNoProviderOwnsIsNotFound) {
  const std::optional<URL> url = URL::fromString("file:///elsewhere");
  platform().sandbox().allowAccess(client_->auditToken(), "/elsewhere");
  call(bookmark, request(url, "org.app"));
  EXPECT_THAT(trace(), ElementsAreArray(joined({start(url, "org.caller", "org.app"),
                                                {compared("org.a", *url), compared("org.b", *url)},
                                                failure(url, "org.caller", "org.app", SXNotFoundErrorURL(url))})));
}

TEST_F(ExtendBookmarkTest, AProviderThatCannotNameTheItemGrantsNothing) {
  const SXError error = someError("no such item");
  process("org.a").setAnswer(identify, VendorAnswer::values({Argument(error), Argument()}));
  call(bookmark, request(item_, "org.app"));
  const SXError wrapped = SXPluginOperationFailedError(SXPluginOperationFailedError(error));
  EXPECT_THAT(
      trace(),
      ElementsAreArray(joined(
          {start(item_, "org.caller", "org.app"),
           ownerFound(),
           failedIdentification("org.a", "request-3", *item_, "(" + text(error) + ", (null))", error),
           {reply(bookmark, "((null), " + text(wrapped) + ")", platformThread), cancel("org.a", "request-3")}})));
}

TEST_F(ExtendBookmarkTest, TheGrantBearsTheOwnersIdentifier) {
  const URL url = itemURL("org.b", "x");
  platform().sandbox().allowAccess(client_->auditToken(), url.path());
  call(bookmark, request(url, "org.app"));
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.b", "f/i", "org.app"));
}

TEST_F(ExtendBookmarkTest, NeedsNoReplyHandlerAndNoServer) {
  client_->callWithoutReply(bookmark, request(item_, "org.app"));
  client_->callWithoutReply(bookmark, request(std::nullopt, "org.app"));
  runUntilIdle();
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
  server_.reset();
  EXPECT_EQ(call(bookmark, request(item_, "org.other"))->answer().values.front(), Argument("storix:org.a/f/i"));
  EXPECT_FALSE(store()->isProviderWithIdentifier("org.a", "f/i", "org.other"));
  process("org.a").setBeginFailure(someError("no process"));
  client_->callWithoutReply(bookmark, request(item_, "org.app"));
  runUntilIdle();
}

TEST_F(ExtendBookmarkTest, WithoutAConnectionTheTokenIsAllZero) {
  SXLinkServicer servicer;
  servicer.setServer(server_);
  servicer.extendBookmarkForFileURL(item_, "org.app", recording<std::string, SXError>("answered"));
  runUntilIdle();
  EXPECT_THAT(trace(),
              ElementsAre("bundleIdentifierForAuditToken no peer",
                          "log debug [DEBUG] Extending bookmark privileges for URL: “" + itemText() +
                              "” from bundle (null) to org.app.",
                          "checkSandboxAccess no peer file-write-data pathNoReport " + item_->path(),
                          "log fault [ERROR] Could not extend bookmark privileges for URL " + itemText() +
                              " from bundle (null) to consumer ID org.app, error: " + text(SXNotPermittedError()),
                          "answered ((null), " + text(SXNotPermittedError()) + ") on " + global));
}

TEST_F(ExtendBookmarkTest, AProvidersDirectoryItselfIsNotFound) {
  const std::optional<URL> directory = storageURL("org.a");
  platform().sandbox().allowAccess(client_->auditToken(), directory->path());
  call(bookmark, request(directory, "org.app"));
  EXPECT_THAT(trace(), ElementsAreArray(
                           joined({start(directory, "org.caller", "org.app"),
                                   {compared("org.a", *directory),
                                    "log debug [DEBUG] Ignoring URLs that exactly match the document container folder"},
                                   failure(directory, "org.caller", "org.app", SXNotFoundErrorURL(directory))})));
}

TEST_F(ExtendBookmarkTest, AFailureLeavesTheStoreAndItsFileAsTheyWere) {
  grant("org.a", "other", "org.app");
  process("org.a").setAnswer(identify, VendorAnswer::values({Argument(someError("no such item")), Argument("f/i")}));
  call(bookmark, request(item_, "org.app"));
  call(bookmark, request(std::nullopt, "org.app"));
  EXPECT_FALSE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", "other", "org.app"));
  EXPECT_EQ(platform().files().writeCount("/home/u/Library/Storix/AccessControl.kvs"), 1U);
}

TEST_F(ExtendBookmarkTest, ALateConnectionFailureRepliesAgainWithAnErrorAndTheGrantStays) {
  const SXError error = someError("it ended");
  process("org.a").setAnswer(identify, VendorAnswer::valuesThenConnectionFailure({Argument(), Argument("f/i")}, error));
  const std::shared_ptr<fake::FakeReply> answered = call(bookmark, request(item_, "org.app"));
  ASSERT_EQ(answered->answers().size(), 2U);
  EXPECT_EQ(answered->answer().values, (Arguments{Argument("storix:org.a/f/i"), Argument()}));
  EXPECT_EQ(answered->answers()[1].values,
            (Arguments{Argument(), Argument(SXPluginOperationFailedError(SXPluginOperationFailedError(error)))}));
  EXPECT_TRUE(store()->isProviderWithIdentifier("org.a", "f/i", "org.app"));
}

}  // namespace
}  // namespace storix
