// From a bookmarkable string to an open document in one call.

#include <unistd.h>

#include <filesystem>
#include <future>

#include "tests/e2e/CoordinationTest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

class OpenDocument : public CoordinationTest {
 protected:
  /// Shares the item with this process itself, and has it fetched away again.
  [[nodiscard]] std::string share(Client &client, const std::string &item) const {
    grantAndStart(client, provider, item);
    const Result<std::string> bookmark = client.extendBookmark(itemURL(provider, item), "org.sample.files");
    EXPECT_TRUE(bookmark) << bookmark.error().message();
    fs::remove(session.storage(provider) / item);
    return bookmark ? bookmark.value() : "";
  }

  static std::string contents(const UniqueFd &fd) {
    std::string text(4096, '\0');
    const ssize_t count = ::pread(fd.get(), text.data(), text.size(), 0);
    text.resize(count < 0 ? 0 : static_cast<std::size_t>(count));
    return text;
  }
};

TEST_F(OpenDocument, IsFetchedOpenedAndLeftToOthers) {
  session.installProvider(provider);
  serve();
  const std::unique_ptr<Client> client = makeClient();
  const std::string bookmark = share(*client, "folder/report");
  const auto opened = client->openDocument(bookmark, {.deadline = patience});
  ASSERT_TRUE(opened) << opened.error().message();
  EXPECT_EQ(itemURL(provider, "folder/report"), opened.value().document.url);
  EXPECT_EQ("contents of folder/report", contents(opened.value().descriptor));
  EXPECT_FALSE(opened.value().claim.isHeld());
  expectHeld(makeCoordinator()->write(itemURL(provider, "folder/report"), {.deadline = patience}));
}

TEST_F(OpenDocument, ForWritingIsHeldUntilTheClaimEndsAndTheProviderHearsOfIt) {
  session.installProvider(provider);
  serve();
  const std::unique_ptr<Client> client = makeClient();
  const std::string bookmark = share(*client, "report");
  auto opened = client->openDocumentForWriting(bookmark, {.deadline = patience});
  ASSERT_TRUE(opened) << opened.error().message();
  EXPECT_EQ("contents of report", contents(opened.value().descriptor));
  EXPECT_EQ(3, ::pwrite(opened.value().descriptor.get(), "new", 3, 0));
  ASSERT_TRUE(opened.value().claim.isHeld());
  expectTimedOut(makeCoordinator()->write(itemURL(provider, "report"), {.deadline = impatience}));
  EXPECT_EQ(0U, daemon->countLines("called changed"));
  const auto error = opened.value().claim.end();
  EXPECT_FALSE(error) << error->message();
  EXPECT_TRUE(daemon->waitForLine("changed report"));
  EXPECT_EQ("newtents of report", Session::read(session.storage(provider) / "report"));
}

TEST_F(OpenDocument, IsSharedByAConfinedProcessThatProvesByItselfThatItMayWrite) {
  session.installProvider(provider);
  serve();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, provider, "report");
  const fs::path report = session.storage(provider) / "report";
  const std::string tool = session.installApplication("org.sample.confined", builtProgram("storixctl")).string();
  // No new privileges: nobody can tell from outside what such a process may write.
  const auto share = [&] {
    return run({"setpriv", "--no-new-privs", tool, "share", report.string(), "org.sample.files"}, session.environment);
  };
  const Finished shared = share();
  EXPECT_EQ(0, shared.status) << shared.errors;
  EXPECT_TRUE(client->openDocument("storix:org.sample.docs/report", {.deadline = patience}));

  // What it cannot open for writing it cannot prove, and may not share: a directory in the file's place.
  fs::remove(report);
  fs::create_directory(report);
  const Finished refused = share();
  EXPECT_EQ(1, refused.status);
  EXPECT_NE(std::string::npos, refused.errors.find("may not have this document")) << refused.errors;
}

TEST_F(OpenDocument, NotSharedWithTheCallerIsRefused) {
  session.installProvider(provider);
  serve();
  const auto opened = makeClient()->openDocument("storix:org.sample.docs/report");
  ASSERT_FALSE(opened);
  EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::notPermitted), opened.error().code());
  EXPECT_EQ(0U, daemon->countLines("called start")) << "nothing is fetched for a stranger";
}

TEST_F(OpenDocument, TextThatNamesNothingIsRefused) {
  session.installProvider(provider);
  serve();
  const auto opened = makeClient()->openDocumentForWriting("report");
  ASSERT_FALSE(opened);
  EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::invalidBookmarkableString), opened.error().code());
}

TEST_F(OpenDocument, DocumentThatSomebodyWritesIsWaitedForUntilTheDeadline) {
  session.installProvider(provider);
  serve();
  const std::unique_ptr<Client> client = makeClient();
  const std::string bookmark = share(*client, "report");
  const std::unique_ptr<Process> writer = holder("write", itemURL(provider, "report"));
  for (const bool writing : {false, true}) {
    const ClaimOptions options{.deadline = impatience};
    const auto opened =
        writing ? client->openDocumentForWriting(bookmark, options) : client->openDocument(bookmark, options);
    ASSERT_FALSE(opened);
    EXPECT_TRUE(isClientError(opened.error(), ClientErrorCode::timedOut)) << opened.error().message();
  }
  kill(*writer);
  EXPECT_TRUE(client->openDocument(bookmark, {.deadline = patience}));
}

TEST_F(OpenDocument, ProvidersRefusalIsTold) {
  session.installProvider(provider, "start fail no disk today");
  serve();
  const std::unique_ptr<Client> client = makeClient();
  ASSERT_TRUE(client->extendSandbox(itemURL(provider, "report"), provider, "org.sample.files"));
  const auto opened = client->openDocument("storix:org.sample.docs/report", {.deadline = patience});
  ASSERT_FALSE(opened);
  ASSERT_NE(nullptr, opened.error().underlyingError()) << opened.error().message();
  EXPECT_EQ("no disk today", opened.error().underlyingError()->message());
}

TEST_F(OpenDocument, ProviderThatNeverAnswersIsWaitedForUntilTheDeadlineOrACancellation) {
  session.installProvider(provider, "start never");
  serve();
  const std::unique_ptr<Client> client = makeClient();
  ASSERT_TRUE(client->extendSandbox(itemURL(provider, "report"), provider, "org.sample.files"));
  const std::string bookmark = "storix:org.sample.docs/report";
  const auto late = client->openDocument(bookmark, {.deadline = impatience});
  ASSERT_FALSE(late);
  EXPECT_TRUE(isClientError(late.error(), ClientErrorCode::timedOut)) << late.error().message();

  std::stop_source stop;
  std::promise<SXError> failed;
  client->openDocument(bookmark, {.cancellation = stop.get_token()},
                       [&failed](const Result<OpenedDocument> &opened) { failed.set_value(opened.error()); });
  stop.request_stop();
  const SXError error = failed.get_future().get();
  EXPECT_TRUE(isClientError(error, ClientErrorCode::cancelled)) << error.message();
  EXPECT_FALSE(client->wakeUp());
}

}  // namespace
}  // namespace storix::e2e
