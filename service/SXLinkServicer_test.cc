#include "service/SXLinkServicer.h"

#include "service/ServicerTest.h"

namespace storix {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

class SXLinkServicerTest : public ServicerTest {
 protected:
  const std::vector<std::string> both_{readEntitlement, writeEntitlement};

  /// Asks a servicer of its own for a client with these entitlements.
  bool admits(Dictionary entitlements) {
    fake::FakePeer peer;
    peer.entitlements = std::move(entitlements);
    const std::shared_ptr<fake::FakeClientConnection> client = platform().connections().makeConnection(peer);
    SXLinkServicer servicer;
    servicer.setConnection(client);
    return servicer.clientHasOneOfAllowedEntitlements(both_);
  }
};

TEST_F(SXLinkServicerTest, ATrueNumberOrBooleanAdmits) {
  EXPECT_TRUE(admits({{readEntitlement, true}}));
  EXPECT_TRUE(admits({{writeEntitlement, 1}}));
  EXPECT_TRUE(admits({{readEntitlement, false}, {writeEntitlement, 0.5}}));
}

TEST_F(SXLinkServicerTest, AValueOfAnyOtherKindDoesNotAdmit) {
  EXPECT_FALSE(admits({{readEntitlement, "true"}}));
  EXPECT_FALSE(admits({{readEntitlement, "1"}, {writeEntitlement, List{true}}}));
  EXPECT_FALSE(admits({{readEntitlement, Dictionary{{"x", true}}}}));
  EXPECT_FALSE(admits({{readEntitlement, false}, {writeEntitlement, 0}}));
  EXPECT_FALSE(admits({{"com.tessel.storix.other", true}}));
}

TEST_F(SXLinkServicerTest, EntitlementsAreTriedInOrderUntilOneAdmits) {
  EXPECT_TRUE(admits({{readEntitlement, true}, {writeEntitlement, true}}));
  EXPECT_THAT(trace(), ElementsAre("entitlementValue peer 100 com.tessel.storix.acl-read"));
}

TEST_F(SXLinkServicerTest, ARejectionNamesThePeerAndAllEntitlementsInTheOrderTried) {
  EXPECT_FALSE(admits({{readEntitlement, false}, {writeEntitlement, false}}));
  EXPECT_THAT(trace(),
              ElementsAre("entitlementValue peer 100 com.tessel.storix.acl-read",
                          "entitlementValue peer 100 com.tessel.storix.acl-write", "peerProcessIdentifier peer 100",
                          "log fault [ERROR] Rejecting request from PID 100 because it does not have any of these "
                          "entitlements: (com.tessel.storix.acl-read, com.tessel.storix.acl-write)"));
}

TEST_F(SXLinkServicerTest, WithoutAConnectionEveryEntitlementIsAbsentAndThePIDIsZero) {
  SXLinkServicer servicer;
  EXPECT_EQ(servicer.connection(), nullptr);
  EXPECT_FALSE(servicer.clientHasOneOfAllowedEntitlements({writeEntitlement}));
  EXPECT_THAT(logTexts(), ElementsAre("[ERROR] Rejecting request from PID 0 because it does not have any of these "
                                      "entitlements: (com.tessel.storix.acl-write)"));
}

TEST_F(SXLinkServicerTest, TheConnectionAndTheServerAreHeldWeakly) {
  SXLinkServicer servicer;
  std::shared_ptr<fake::FakeClientConnection> client = platform().connections().makeConnection({});
  servicer.setConnection(client);
  servicer.setServer(server_);
  EXPECT_EQ(servicer.connection(), client);
  EXPECT_EQ(servicer.server(), server_);
  client.reset();
  server_.reset();
  EXPECT_EQ(servicer.connection(), nullptr);
  EXPECT_EQ(servicer.server(), nullptr);
}

TEST_F(SXLinkServicerTest, TheSandboxCheckAsksForWritingOfThePathWithoutAReport) {
  const std::shared_ptr<fake::FakeClientConnection> client = platform().connections().makeConnection({});
  SXLinkServicer servicer;
  servicer.setConnection(client);
  const std::optional<URL> url = URL::fromString("file:///a%20b");
  platform().sandbox().allowAccess(client->auditToken(), "/a b");
  EXPECT_TRUE(servicer.clientHasSandboxAccessToFile(url));
  EXPECT_THAT(trace(),
              ElementsAre("peerAuditToken peer 100", "checkSandboxAccess peer 100 file-write-data pathNoReport /a b"));
  for (int answer : {1, -1}) {
    platform().sandbox().setAccessAnswer(client->auditToken(), "/a b", answer);
    EXPECT_FALSE(servicer.clientHasSandboxAccessToFile(url));
  }
  EXPECT_THAT(logTexts(), IsEmpty());
}

TEST_F(SXLinkServicerTest, TheSandboxCheckOfAGoneConnectionOrAnAbsentURLIsAskedAllTheSame) {
  SXLinkServicer servicer;
  platform().sandbox().allowAccess(AuditToken{}, "/x");
  EXPECT_TRUE(servicer.clientHasSandboxAccessToFile(URL::fromString("file:///x")));
  EXPECT_FALSE(servicer.clientHasSandboxAccessToFile(std::nullopt));
  EXPECT_THAT(trace(), ElementsAre("checkSandboxAccess no peer file-write-data pathNoReport /x",
                                   "checkSandboxAccess no peer file-write-data pathNoReport "));
}

TEST(SXDaemonProtocol, HasItsNineOperationsInOrder) {
  using enum ValueKind;
  const auto url = ValueKind::URL;
  const std::vector<ExpectedRow> rows{
      {"wakeUpCompletion:", {}, {}},
      {"extendSandboxForFileURL:fromProviderID:toConsumerID:completionHandler:",
       {url, string, string},
       {error, data, url, data}},
      {"providePlaceholderForItemAtURL:fromProviderID:forConsumerID:completionHandler:",
       {url, string, string},
       {error}},
      {"startProvidingItemAtURL:fromProviderID:forConsumerID:completionHandler:", {url, string, string}, {error}},
      {"stopProvidingItemAtURL:fromProviderID:forConsumerID:completionHandler:", {url, string, string}, {error}},
      {"providersCompletionHandler:", {}, {error, dictionary}},
      {"extendBookmarkForFileURL:toConsumerID:completionHandler:", {url, string}, {string, error}},
      {"bookmarkableStringFromDocumentURL:completion:", {url}, {string, error}},
      {"documentURLFromBookmarkableString:completion:", {string}, {url, data, url, data, error}},
  };
  expectRows(SXDaemonProtocol().description(), rows);
}

TEST(SXDaemonProtocol, HasItsWordsForTheWire) {
  const ProtocolDescription &description = SXDaemonProtocol().description();
  EXPECT_EQ(description.name, "SXDaemon");
  EXPECT_EQ(description.interfaceName, "com.tessel.Storix.Daemon");
  EXPECT_EQ(description.objectPath, "/com/tessel/Storix");
  EXPECT_EQ(words(description),
            "WakeUp() -> ()\n"
            "ExtendSandboxForFileURL(fileURL, providerID, consumerID) -> (error, tokenData, companionURL, "
            "companionTokenData)\n"
            "ProvidePlaceholderForItemAtURL(URL, providerID, consumerID) -> (error)\n"
            "StartProvidingItemAtURL(URL, providerID, consumerID) -> (error)\n"
            "StopProvidingItemAtURL(URL, providerID, consumerID) -> (error)\n"
            "Providers() -> (error, providers)\n"
            "ExtendBookmarkForFileURL(fileURL, consumerID) -> (bookmarkableString, error)\n"
            "BookmarkableStringFromDocumentURL(URL) -> (bookmarkableString, error)\n"
            "DocumentURLFromBookmarkableString(bookmarkableString) -> (URL, tokenData, companionURL, "
            "companionTokenData, error)\n");
}

}  // namespace
}  // namespace storix
