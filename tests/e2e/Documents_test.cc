// A document on its way from a provider to an application.

#include <unistd.h>

#include <filesystem>

#include "tests/e2e/E2ETest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

using Documents = E2ETest;

constexpr const char *provider = "org.sample.docs";
constexpr const char *consumer = "org.sample.editor";

std::string contents(const UniqueFd &fd) {
  std::string text(4096, '\0');
  const ssize_t count = ::pread(fd.get(), text.data(), text.size(), 0);
  text.resize(count < 0 ? 0 : static_cast<std::size_t>(count));
  return text;
}

TEST_F(Documents, GrantedDocumentIsProvidedAndOpenedWithItsToken) {
  session.installProvider(provider);
  start();
  const std::unique_ptr<Client> client = makeClient();
  const URL url = itemURL(provider, "folder/50% é.txt");
  const Result<GrantedDocument> granted = client->extendSandbox(url, provider, consumer);
  ASSERT_TRUE(granted) << granted.error().message();
  EXPECT_EQ(itemURL(provider, "folder/.50% é.txt"), granted.value().companionURL);
  const Client::Outcome started = client->startProviding(url, provider, consumer);
  ASSERT_FALSE(started) << started->message();

  const Result<UniqueFd> document = client->openDocument(granted.value());
  ASSERT_TRUE(document) << document.error().message();
  EXPECT_EQ("contents of folder/50% é.txt", contents(document.value()));
}

TEST_F(Documents, CompanionIsMadeWhenItIsOpened) {
  session.installProvider(provider);
  start();
  const std::unique_ptr<Client> client = makeClient();
  const Result<GrantedDocument> granted = client->extendSandbox(itemURL(provider, "report"), provider, consumer);
  ASSERT_TRUE(granted) << granted.error().message();
  const Result<UniqueFd> companion = client->openCompanion(granted.value());
  ASSERT_TRUE(companion) << companion.error().message();
  EXPECT_TRUE(fs::exists(session.storage(provider) / ".report"));
}

TEST_F(Documents, DocumentThatWasNotProvidedYetCannotBeOpened) {
  session.installProvider(provider);
  start();
  const std::unique_ptr<Client> client = makeClient();
  const Result<GrantedDocument> granted = client->extendSandbox(itemURL(provider, "report"), provider, consumer);
  ASSERT_TRUE(granted) << granted.error().message();
  const Result<UniqueFd> document = client->openDocument(granted.value());
  ASSERT_FALSE(document);
  EXPECT_TRUE(isClientError(document.error(), ClientErrorCode::refused)) << document.error().message();
}

TEST_F(Documents, ConsumerWithoutAGrantIsNotServed) {
  session.installProvider(provider);
  start();
  const std::unique_ptr<Client> client = makeClient();
  const Client::Outcome outcome = client->startProviding(itemURL(provider, "report"), provider, consumer);
  ASSERT_TRUE(outcome);
  EXPECT_EQ(storixErrorDomain, outcome->domain());
  EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::notPermitted), outcome->code());
  EXPECT_FALSE(fs::exists(session.storage(provider) / "report"));
}

TEST_F(Documents, GrantSurvivesARestartOfTheDaemon) {
  session.installProvider(provider);
  start();
  {
    const std::unique_ptr<Client> client = makeClient();
    ASSERT_TRUE(client->extendSandbox(itemURL(provider, "report"), provider, consumer));
  }
  stop();
  start();
  ASSERT_TRUE(daemon->waitForLine("[INFO] Successfully read access control from disk."));
  const Client::Outcome outcome = makeClient()->startProviding(itemURL(provider, "report"), provider, consumer);
  EXPECT_FALSE(outcome) << outcome->message();
}

TEST_F(Documents, ClientWithoutTheEntitlementIsRefused) {
  session.beApplication("org.sample.files", R"({"com.tessel.storix.acl-read": true})");
  session.installProvider(provider);
  start();
  const std::unique_ptr<Client> client = makeClient();
  const Result<GrantedDocument> granted = client->extendSandbox(itemURL(provider, "report"), provider, consumer);
  ASSERT_FALSE(granted);
  EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::clientLacksEntitlement), granted.error().code());
  EXPECT_TRUE(client->providers());
  EXPECT_TRUE(
      daemon->waitForLine("[ERROR] Rejecting request from PID " + std::to_string(::getpid()) +
                          " because it does not have any of these entitlements: (com.tessel.storix.acl-write)"));
}

TEST_F(Documents, EntitlementThatIsATextDoesNotCount) {
  session.beApplication("org.sample.files", R"({"com.tessel.storix.acl-write": "true"})");
  start();
  const auto providers = makeClient()->providers();
  ASSERT_FALSE(providers);
  EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::clientLacksEntitlement), providers.error().code());
}

TEST_F(Documents, StoppedDocumentIsDroppedAndTheAnswerMeansSuccess) {
  session.installProvider(provider);
  start();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, provider, "report");
  ASSERT_TRUE(fs::exists(session.storage(provider) / "report"));
  const Client::Outcome stopped = client->stopProviding(itemURL(provider, "report"), provider, consumer);
  EXPECT_FALSE(stopped) << stopped->message();
  EXPECT_FALSE(fs::exists(session.storage(provider) / "report"));
}

TEST_F(Documents, PlaceholderIsMadeForAGrantedDocument) {
  session.installProvider(provider);
  start();
  const std::unique_ptr<Client> client = makeClient();
  const URL url = itemURL(provider, "report");
  ASSERT_TRUE(client->extendSandbox(url, provider, consumer));
  const Client::Outcome made = client->providePlaceholder(url, provider, consumer);
  EXPECT_FALSE(made) << made->message();
  EXPECT_EQ("placeholder", Session::read(session.storage(provider) / ".report"));
}

TEST_F(Documents, DocumentSharedAsABookmarkIsResolvedByTheOneItWasSharedWith) {
  session.installProvider(provider);
  start();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, provider, "folder/report");
  const URL url = itemURL(provider, "folder/report");

  // The test is its own second application.
  const Result<std::string> bookmark = client->extendBookmark(url, "org.sample.files");
  ASSERT_TRUE(bookmark) << bookmark.error().message();
  EXPECT_EQ("storix:org.sample.docs/folder/report", bookmark.value());
  const auto same = client->bookmarkableString(url);
  ASSERT_TRUE(same) << same.error().message();
  EXPECT_EQ(bookmark.value(), same.value());

  const Result<GrantedDocument> resolved = client->resolveBookmark(bookmark.value());
  ASSERT_TRUE(resolved) << resolved.error().message();
  EXPECT_EQ(url, resolved.value().url);
  const Result<UniqueFd> document = client->openDocument(resolved.value());
  ASSERT_TRUE(document) << document.error().message();
  EXPECT_EQ("contents of folder/report", contents(document.value()));
}

TEST_F(Documents, BookmarkThatWasNotSharedWithTheCallerIsRefused) {
  session.installProvider(provider);
  start();
  const Result<GrantedDocument> resolved = makeClient()->resolveBookmark("storix:org.sample.docs/report");
  ASSERT_FALSE(resolved);
  EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::notPermitted), resolved.error().code());
}

TEST_F(Documents, URLOutsideEveryProviderHasNoBookmarkAndNoError) {
  session.installProvider(provider);
  start();
  const auto bookmark = makeClient()->bookmarkableString(*URL::fromString("file:///etc/hostname"));
  ASSERT_TRUE(bookmark) << bookmark.error().message();
  EXPECT_FALSE(bookmark.value());
}

}  // namespace
}  // namespace storix::e2e
