// Changed documents on their way to a real server, and what may have happened there meanwhile.

#include <future>

#include "examples/webdav-provider/WebDavProviderTest.h"

namespace storix::example {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;
using ::testing::SizeIs;

class Uploads : public WebDavProviderTest {
 protected:
  /// Waits until the work that setup began has come to the item, and is done with it.
  void waitForCatchingUp(const std::string &path, std::size_t puts) {
    proxy_.waitForRequests("PUT", puts);
    EXPECT_EQ(start(path), succeeded);
  }
};

TEST_F(Uploads, AChangeReachesTheServerOverTheVersionItWasMadeFrom) {
  provide("a.txt", "hello");
  change("a.txt", "hello, world");
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "hello, world");
  ASSERT_THAT(proxy_.requests("PUT"), SizeIs(1));
  EXPECT_THAT(proxy_.requests("PUT")[0], HasSubstr("If-Match: \"5-"));
  // And what was uploaded is what is here.
  EXPECT_EQ(start("a.txt"), succeeded);
  EXPECT_EQ(local("a.txt"), "hello, world");
  EXPECT_THAT(proxy_.requests("GET").back(), HasSubstr("If-None-Match"));
}

TEST_F(Uploads, OneChangeAfterTheOtherReachesTheServer) {
  provide("a.txt", "0");
  for (const std::string content : {"1", "22", "333"}) {
    change("a.txt", content);
    ASSERT_EQ(changed("a.txt"), succeeded);
    EXPECT_EQ(server_.read("a.txt"), content);
  }
  EXPECT_FALSE(isHere("a (conflict).txt"));
}

TEST_F(Uploads, WhatDidNotChangeIsNotUploaded) {
  provide("a.txt", "hello");
  ASSERT_EQ(changed("a.txt"), succeeded);
  change("a.txt", "hello");
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_THAT(proxy_.requests("PUT"), SizeIs(0));
}

TEST_F(Uploads, AChangeThatKeepsSizeAndTimeIsNoticed) {
  provide("a.txt", "hello");
  const auto time = fs::last_write_time(localPath("a.txt"));
  change("a.txt", "HELLO");
  fs::last_write_time(localPath("a.txt"), time);
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "HELLO");
}

TEST_F(Uploads, ANewDocumentIsMadeWithTheFoldersAboveIt) {
  fs::create_directories(localPath("new/50% \xC3\xA9"));
  change("new/50% \xC3\xA9/a.txt", "hello");
  ASSERT_EQ(changed("new/50% \xC3\xA9/a.txt"), succeeded);
  EXPECT_EQ(server_.read("new/50% \xC3\xA9/a.txt"), "hello");
  EXPECT_THAT(proxy_.requests("PUT")[0], HasSubstr("If-None-Match: *"));
  EXPECT_THAT(proxy_.requests("MKCOL"), SizeIs(2));
}

TEST_F(Uploads, ABigDocumentArrivesWhole) {
  std::string content(3'000'000, 'x');
  for (std::size_t i = 0; i < content.size(); i += 991) content[i] = static_cast<char>('a' + i % 26);
  change("big", content);
  ASSERT_EQ(changed("big"), succeeded);
  EXPECT_EQ(server_.read("big"), content);
}

TEST_F(Uploads, WhatChangedInBothPlacesIsKeptTwice) {
  provide("a.b/report.txt", "base");
  change("a.b/report.txt", "mine");
  server_.write("a.b/report.txt", "theirs");
  ASSERT_EQ(changed("a.b/report.txt"), succeeded);
  EXPECT_EQ(local("a.b/report.txt"), "theirs");
  EXPECT_EQ(server_.read("a.b/report.txt"), "theirs");
  EXPECT_EQ(local("a.b/report (conflict).txt"), "mine");
  EXPECT_EQ(server_.read("a.b/report (conflict).txt"), "mine");
  EXPECT_TRUE(nothingHalfDownloaded());

  // The next one has a name of its own.
  change("a.b/report.txt", "mine again");
  server_.write("a.b/report.txt", "theirs again");
  ASSERT_EQ(changed("a.b/report.txt"), succeeded);
  EXPECT_EQ(server_.read("a.b/report (conflict).txt"), "mine");
  EXPECT_EQ(server_.read("a.b/report (conflict 2).txt"), "mine again");
  EXPECT_EQ(local("a.b/report.txt"), "theirs again");
}

TEST_F(Uploads, AConflictNameThatIsTakenOnTheServerIsAConflictOfItsOwn) {
  provide("a.txt", "base");
  server_.write("a (conflict).txt", "somebody else's");
  change("a.txt", "mine");
  server_.write("a.txt", "theirs");
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(local("a.txt"), "theirs");
  EXPECT_EQ(local("a (conflict).txt"), "somebody else's");
  EXPECT_EQ(server_.read("a (conflict).txt"), "somebody else's");
  EXPECT_EQ(local("a (conflict 2).txt"), "mine");
  EXPECT_EQ(server_.read("a (conflict 2).txt"), "mine");
}

TEST_F(Uploads, AChangeOnTheServerAtTheLastMomentIsNotOverwritten) {
  provide("a.txt", "base");
  change("a.txt", "mine");
  proxy_.next({"PUT", [this] { server_.write("a.txt", "theirs"); }, {}, {}, {}});
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "theirs");
  EXPECT_EQ(local("a.txt"), "theirs");
  EXPECT_EQ(server_.read("a (conflict).txt"), "mine");
}

TEST_F(Uploads, ANewDocumentThatSomebodyElseMadeMeanwhileIsNotOverwritten) {
  change("a.txt", "mine");
  proxy_.next({"PUT", [this] { server_.write("a.txt", "theirs"); }, {}, {}, {}});
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "theirs");
  EXPECT_EQ(server_.read("a (conflict).txt"), "mine");
}

TEST_F(Uploads, TheSameChangeInBothPlacesIsNoConflict) {
  provide("a.txt", "base");
  change("a.txt", "same");
  server_.write("a.txt", "same");
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_FALSE(isHere("a (conflict).txt"));
  change("a.txt", "later");
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "later");
}

TEST_F(Uploads, AnAnswerThatIsLostIsNoConflict) {
  provide("a.txt", "base");
  change("a.txt", "mine");
  proxy_.next({"PUT", {}, 0, {}, {}});
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "mine");
  EXPECT_EQ(local("a.txt"), "mine");
  EXPECT_FALSE(isHere("a (conflict).txt"));
  EXPECT_THAT(proxy_.requests("PUT"), SizeIs(2));
}

TEST_F(Uploads, AVersionThatTheDownloadDidNotNameIsAskedFor) {
  server_.write("a.txt", "hello");
  proxy_.next({"GET", {}, {}, {}, "HTTP/1.1 200 OK\r\nContent-Length: 5\r\nConnection: close\r\n\r\nhello"});
  ASSERT_EQ(start("a.txt"), succeeded);
  change("a.txt", "mine");
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "mine");
  EXPECT_FALSE(isHere("a (conflict).txt"));
}

TEST_F(Uploads, AVersionThatCannotBeTheUploadedOneIsNotTakenForIt) {
  provide("a.txt", "base");
  change("a.txt", "mine");
  proxy_.next({"PROPFIND", {}, {}, {}, {}});
  // Somebody is quicker than the question after the upload.
  proxy_.next({"PROPFIND", [this] { server_.write("a.txt", "somebody else's"); }, {}, {}, {}});
  ASSERT_EQ(changed("a.txt"), succeeded);
  change("a.txt", "mine again");
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "somebody else's");
  EXPECT_EQ(server_.read("a (conflict).txt"), "mine again");
}

TEST_F(Uploads, WhatWasRemovedOnTheServerIsMadeAgainByAChange) {
  provide("a.txt", "base");
  fs::remove(server_.path("a.txt"));
  change("a.txt", "mine");
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "mine");
}

TEST_F(Uploads, AFullServerIsSaidSoAndNothingIsLost) {
  provide("a.txt", "base");
  change("a.txt", "mine");
  proxy_.next({"PUT", {}, {}, {}, FaultProxy::answerWithStatus(507)});
  EXPECT_THAT(changed("a.txt"), failsWith(ENOSPC, "no room"));
  EXPECT_EQ(local("a.txt"), "mine");
  EXPECT_EQ(start("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "mine");
}

TEST_F(Uploads, AChangeThatNobodyToldOfIsUploadedBeforeAnythingIsDownloaded) {
  provide("a.txt", "base");
  change("a.txt", "mine");
  ASSERT_EQ(start("a.txt"), succeeded);
  EXPECT_EQ(server_.read("a.txt"), "mine");
  EXPECT_EQ(local("a.txt"), "mine");
  change("a.txt", "mine again");
  server_.write("a.txt", "theirs");
  ASSERT_EQ(start("a.txt"), succeeded);
  EXPECT_EQ(local("a.txt"), "theirs");
  EXPECT_EQ(server_.read("a (conflict).txt"), "mine again");
}

TEST_F(Uploads, AnUploadThatFailedIsMadeUpForByTheNextProcess) {
  provide("a.txt", "base");
  change("a.txt", "mine");
  proxy_.setGone(true);
  EXPECT_THAT(changed("a.txt"), failsWith(ECONNREFUSED));
  EXPECT_EQ(start("a.txt"), succeeded) << "the newest content is here";
  EXPECT_EQ(local("a.txt"), "mine");
  restart();
  proxy_.setGone(false);
  ASSERT_EQ(setUp(), succeeded);
  waitForCatchingUp("a.txt", 1);
  EXPECT_EQ(server_.read("a.txt"), "mine");
  EXPECT_EQ(local("a.txt"), "mine");
}

TEST_F(Uploads, ADocumentMadeWhileNobodyListenedIsUploadedBySetup) {
  change("new.txt", "mine");
  ASSERT_EQ(setUp(), succeeded);
  waitForCatchingUp("new.txt", 1);
  EXPECT_EQ(server_.read("new.txt"), "mine");
}

TEST_F(Uploads, AnUploadWhoseRecordWasLostIsRecognised) {
  provide("a.txt", "base");
  change("a.txt", "mine");
  ASSERT_EQ(changed("a.txt"), succeeded);
  restart();
  fs::remove_all(folder_.path("group/WebDAV State"));
  ASSERT_EQ(start("a.txt"), succeeded);
  EXPECT_EQ(local("a.txt"), "mine");
  EXPECT_FALSE(isHere("a (conflict).txt"));
  EXPECT_THAT(proxy_.requests("PUT"), SizeIs(1));
}

TEST_F(Uploads, ARecordThatIsDamagedCostsNothing) {
  provide("a.txt", "base");
  change("a.txt", "mine");
  for (const auto &entry : fs::directory_iterator(folder_.path("group/WebDAV State"))) {
    if (entry.is_regular_file()) fs::resize_file(entry.path(), 20);
  }
  ASSERT_EQ(changed("a.txt"), succeeded);
  EXPECT_EQ(local("a.txt"), "base");
  EXPECT_EQ(server_.read("a (conflict).txt"), "mine");
}

TEST_F(Uploads, StoppingDropsWhatTheServerHas) {
  provide("a.txt", "hello");
  ASSERT_EQ(stop("a.txt"), succeeded);
  EXPECT_FALSE(isHere("a.txt"));
  EXPECT_EQ(server_.read("a.txt"), "hello");
  EXPECT_EQ(stop("a.txt"), succeeded);
  EXPECT_EQ(start("a.txt"), succeeded);
  EXPECT_EQ(local("a.txt"), "hello");
}

TEST_F(Uploads, StoppingUploadsChangesFirst) {
  provide("a.txt", "hello");
  change("a.txt", "mine");
  ASSERT_EQ(stop("a.txt"), succeeded);
  EXPECT_FALSE(isHere("a.txt"));
  EXPECT_EQ(server_.read("a.txt"), "mine");
}

TEST_F(Uploads, StoppingKeepsChangesThatCannotBeUploaded) {
  provide("a.txt", "hello");
  change("a.txt", "mine");
  proxy_.setGone(true);
  EXPECT_THAT(stop("a.txt"), failsWith(ECONNREFUSED));
  EXPECT_EQ(local("a.txt"), "mine");
}

TEST_F(Uploads, WhatIsNotHereCannotBeUploaded) {
  EXPECT_THAT(changed("missing"), failsWith(ENOENT, "missing"));
  fs::create_directory(localPath("folder"));
  EXPECT_THAT(changed("folder"), failsWith(EISDIR));
}

TEST_F(Uploads, SetupAsksWhatIsThereAfterItHasCaughtUp) {
  change("new.txt", "mine");
  std::promise<void> listed;
  // Two questions about the document come first, before and after its upload; the third is the list.
  proxy_.next({"PROPFIND", {}, {}, {}, {}});
  proxy_.next({"PROPFIND", {}, {}, {}, {}});
  proxy_.next({"PROPFIND", [&listed] { listed.set_value(); }, {}, {}, {}});
  ASSERT_EQ(setUp(), succeeded);
  ASSERT_EQ(listed.get_future().wait_for(std::chrono::seconds(60)), std::future_status::ready);
  EXPECT_EQ(server_.read("new.txt"), "mine");
  proxy_.waitForRequests("PROPFIND", 3);
  EXPECT_THAT(proxy_.requests("PROPFIND").back(), HasSubstr("Depth: 1"));
}

TEST_F(Uploads, SetupNeedsNoServerButAConfiguration) {
  proxy_.setGone(true);
  EXPECT_EQ(setUp(), succeeded);
  restart();
  fs::remove(folder_.path("group/WebDAV.kvs"));
  EXPECT_THAT(setUp(), failsWith(ENOENT, "WebDAV.kvs"));
}

}  // namespace
}  // namespace storix::example
