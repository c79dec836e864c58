// Documents on their way from a real server, and what may go wrong there.

#include <sys/resource.h>

#include <atomic>
#include <csignal>
#include <fstream>
#include <thread>

#include "examples/webdav-provider/WebDavProviderTest.h"

namespace storix::example {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;
using ::testing::Not;
using ::testing::SizeIs;

class Downloads : public WebDavProviderTest {
 protected:
  /// A few hundred kilobytes in which no part is like another.
  static std::string longContent(char salt = 'a') {
    std::string content;
    for (int i = 0; content.size() < 400'000; ++i) content += salt + std::to_string(i) + "\n";
    return content;
  }
  void cutNextDownload(std::size_t after, std::function<void()> before = {}) {
    proxy_.next({"GET", std::move(before), after, {}, {}});
  }
};

TEST_F(Downloads, ADocumentArrivesWholeWithTheServersTime) {
  server_.write("reports/may.txt", longContent());
  ASSERT_EQ(start("reports/may.txt"), succeeded);
  EXPECT_EQ(local("reports/may.txt"), longContent());
  EXPECT_EQ(fs::last_write_time(localPath("reports/may.txt")), fs::last_write_time(server_.path("reports/may.txt")));
  EXPECT_TRUE(nothingHalfDownloaded());
}

TEST_F(Downloads, AnEmptyDocumentArrives) {
  server_.write("empty", "");
  ASSERT_EQ(start("empty"), succeeded);
  EXPECT_TRUE(isHere("empty"));
  EXPECT_EQ(local("empty"), "");
}

TEST_F(Downloads, NamesThatURLsMustEncodeAreFound) {
  for (const std::string path :
       {"a b.txt", "50%.txt", "100%25.txt", "caf\xC3\xA9/\xE2\x82\xAC", "a;b?c#d&e=f", "x+y", "[1]"}) {
    server_.write(path, "content of " + path);
    EXPECT_EQ(start(path), succeeded) << path;
    EXPECT_EQ(local(path), "content of " + path);
    const auto identifier =
        answer<Result<std::string>>([&](auto done) { provider().itemIdentifier(item(path), done); });
    ASSERT_TRUE(identifier.ok()) << path;
    EXPECT_EQ(identifier.value(), path);
    const auto url = answer<Result<URL>>([&](auto done) { provider().itemURL(path, done); });
    ASSERT_TRUE(url.ok()) << path;
    EXPECT_EQ(url.value(), item(path));
  }
}

TEST_F(Downloads, WhatIsCurrentIsAskedAboutAndNotDownloadedAgain) {
  provide("a.txt", "hello");
  ASSERT_EQ(start("a.txt"), succeeded);
  const auto gets = proxy_.requests("GET");
  ASSERT_THAT(gets, SizeIs(2));
  EXPECT_THAT(gets[0], Not(HasSubstr("If-None-Match")));
  EXPECT_THAT(gets[1], HasSubstr("If-None-Match: \""));
  EXPECT_EQ(local("a.txt"), "hello");
  EXPECT_TRUE(nothingHalfDownloaded());
}

TEST_F(Downloads, WhatChangedOnTheServerIsDownloadedAgain) {
  provide("a.txt", "hello");
  server_.write("a.txt", "other");
  ASSERT_EQ(start("a.txt"), succeeded);
  EXPECT_EQ(local("a.txt"), "other");
  EXPECT_EQ(proxy_.requests("PUT").size(), 0U);
}

TEST_F(Downloads, ABrokenDownloadGoesOnWhereItBroke) {
  server_.write("film", longContent());
  cutNextDownload(100'000);
  cutNextDownload(150'000, [this] { EXPECT_FALSE(isHere("film")); });
  proxy_.next({"GET", [this] { EXPECT_FALSE(isHere("film")); }, {}, {}, {}});
  ASSERT_EQ(start("film"), succeeded);
  EXPECT_EQ(local("film"), longContent());
  const auto gets = proxy_.requests("GET");
  ASSERT_THAT(gets, SizeIs(3));
  for (const std::size_t i : {1U, 2U}) {
    EXPECT_THAT(gets[i], HasSubstr("Range: bytes="));
    EXPECT_THAT(gets[i], HasSubstr("If-Range: \""));
  }
  EXPECT_THAT(gets[1], Not(HasSubstr("bytes=0-")));
}

TEST_F(Downloads, ProgressCountsAsAFreshStart) {
  attempts_ = 2;
  server_.write("film", longContent());
  for (int i = 0; i < 6; ++i) cutNextDownload(50'000);
  EXPECT_EQ(start("film"), succeeded);
  EXPECT_EQ(local("film"), longContent());
}

TEST_F(Downloads, OneThatNeverGetsAnywhereIsGivenUp) {
  server_.write("film", longContent());
  // One more: what fails on a connection that was kept is tried on a fresh one before it counts.
  const int requests = attempts_ + 1;
  for (int i = 0; i < requests; ++i) cutNextDownload(0);
  EXPECT_THAT(start("film"), failsWith(ECONNRESET, "GET"));
  EXPECT_FALSE(isHere("film"));
  EXPECT_THAT(proxy_.requests("GET"), SizeIs(requests));
}

TEST_F(Downloads, AnotherProcessGoesOnWithABrokenDownload) {
  attempts_ = 1;
  server_.write("film", longContent());
  cutNextDownload(200'000);
  ASSERT_NE(start("film"), succeeded);
  EXPECT_FALSE(isHere("film"));
  restart();
  ASSERT_EQ(start("film"), succeeded);
  EXPECT_EQ(local("film"), longContent());
  EXPECT_THAT(proxy_.requests("GET").back(), HasSubstr("If-Range: "));
}

TEST_F(Downloads, AHalfThatNobodyRemembersIsDiscardedByTheNextProcess) {
  fs::create_directory(localPath(".incoming"));
  change(".incoming/abc", "half");
  provider();
  EXPECT_TRUE(nothingHalfDownloaded());
}

TEST_F(Downloads, AHalfThatIsNotWhatWasRememberedStartsAnew) {
  attempts_ = 1;
  server_.write("film", longContent());
  cutNextDownload(200'000);
  ASSERT_NE(start("film"), succeeded);
  for (const auto &entry : fs::directory_iterator(localPath(".incoming"))) fs::resize_file(entry.path(), 10);
  ASSERT_EQ(start("film"), succeeded);
  EXPECT_EQ(local("film"), longContent());
  EXPECT_THAT(proxy_.requests("GET").back(), Not(HasSubstr("Range: ")));
}

TEST_F(Downloads, WhatChangesBetweenTwoHalvesIsNotMixed) {
  server_.write("film", longContent('a'));
  cutNextDownload(100'000);
  proxy_.next({"GET", [this] { server_.write("film", longContent('b')); }, {}, {}, {}});
  ASSERT_EQ(start("film"), succeeded);
  EXPECT_EQ(local("film"), longContent('b'));
}

TEST_F(Downloads, PartsOfAnotherVersionAreRefused) {
  attempts_ = 1;
  server_.write("film", longContent());
  cutNextDownload(100'000);
  ASSERT_NE(start("film"), succeeded);
  proxy_.next({"GET",
               {},
               {},
               {},
               "HTTP/1.1 206 Partial Content\r\nETag: \"other\"\r\nContent-Range: bytes 7-9/10\r\nContent-Length: "
               "3\r\nConnection: close\r\n\r\nabc"});
  EXPECT_THAT(start("film"), failsWith(EPROTO, "another part"));
  EXPECT_FALSE(isHere("film"));
  // And what was there is not tried again.
  ASSERT_EQ(start("film"), succeeded);
  EXPECT_EQ(local("film"), longContent());
}

TEST_F(Downloads, AnEncodingThatWasNotAskedForIsRefused) {
  server_.write("a", "x");
  proxy_.next({"GET",
               {},
               {},
               {},
               "HTTP/1.1 200 OK\r\nContent-Encoding: gzip\r\nContent-Length: 3\r\nConnection: close\r\n\r\nabc"});
  EXPECT_THAT(start("a"), failsWith(EPROTO, "gzip"));
  EXPECT_FALSE(isHere("a"));
}

TEST_F(Downloads, WhatDoesNotFitIsDropped) {
  server_.write("film", longContent());
  provider();
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &before), 0);
  const rlimit small{100'000, before.rlim_max};
  const auto handler = ::signal(SIGXFSZ, SIG_IGN);
  ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
  const auto failed = start("film");
  ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &before), 0);
  ::signal(SIGXFSZ, handler);
  EXPECT_THAT(failed, failsWith(EFBIG));
  EXPECT_FALSE(isHere("film"));
  EXPECT_TRUE(nothingHalfDownloaded());
}

TEST_F(Downloads, ASilentServerIsGivenUpAfterAWhile) {
  attempts_ = 1;
  stallTimeout_ = std::chrono::seconds(1);
  server_.write("film", longContent());
  proxy_.next({"GET", {}, {}, 300, {}});
  EXPECT_THAT(start("film"), failsWith(ETIMEDOUT));
  EXPECT_FALSE(isHere("film"));
}

TEST_F(Downloads, WhatIsNotThereIsSaidSo) {
  fs::create_directory(server_.path("folder"));
  EXPECT_THAT(start("missing"), failsWith(ENOENT, "missing"));
  EXPECT_THAT(start("missing/too"), failsWith(ENOENT));
  EXPECT_THAT(start("folder"), failsWith(EISDIR, "folder"));
  EXPECT_FALSE(isHere("missing"));
}

TEST_F(Downloads, ARefusedPasswordNamesTheFileAndNeverThePassword) {
  TestDavServer::configure(folder_.path("group"), proxy_.port(), "wrong secret");
  server_.write("a", "x");
  const auto failed = start("a");
  ASSERT_THAT(failed, failsWith(EACCES, "the server refused the name or password in "));
  EXPECT_THAT(failed->message(), HasSubstr(folder_.path("group/WebDAV Credentials.kvs")));
  EXPECT_THAT(failed->message(), Not(HasSubstr("wrong secret")));
  EXPECT_THAT(proxy_.requests("PROPFIND"), SizeIs(1));
}

TEST_F(Downloads, AMissingPasswordIsAskedFor) {
  fs::remove(folder_.path("group/WebDAV Credentials.kvs"));
  server_.write("a", "x");
  EXPECT_THAT(start("a"), failsWith(EACCES, "wants a name and password"));
}

TEST_F(Downloads, AFailureThatPassesIsTriedAgainAndOneThatStaysIsTold) {
  server_.write("a", "x");
  proxy_.next({"GET", {}, {}, {}, FaultProxy::answerWithStatus(500)});
  proxy_.next({"PROPFIND", {}, {}, {}, FaultProxy::answerWithStatus(503)});
  EXPECT_EQ(start("a"), succeeded);
  server_.write("b", "x");
  for (int i = 0; i < attempts_; ++i) proxy_.next({"GET", {}, {}, {}, FaultProxy::answerWithStatus(500)});
  EXPECT_THAT(start("b"), failsWith(EREMOTEIO, "500"));
  EXPECT_FALSE(isHere("b"));
}

TEST_F(Downloads, EveryStatusHasItsSentence) {
  server_.write("a", "x");
  const std::pair<int, int> errors[] = {{403, EACCES}, {405, ENOTSUP}, {423, EBUSY}, {507, ENOSPC},
                                        {413, EFBIG},  {410, ENOENT},  {418, EPROTO}};
  for (const auto &[status, number] : errors) {
    proxy_.next({"GET", {}, {}, {}, FaultProxy::answerWithStatus(status)});
    EXPECT_THAT(start("a"), failsWith(number, std::to_string(status))) << status;
    EXPECT_FALSE(isHere("a"));
  }
}

TEST_F(Downloads, AServerThatIsGoneIsSaidSoAndWhatIsHereStays) {
  provide("here.txt", "hello");
  server_.write("there.txt", "x");
  proxy_.setGone(true);
  EXPECT_THAT(start("there.txt"), failsWith(ECONNREFUSED));
  EXPECT_EQ(start("here.txt"), succeeded);
  EXPECT_EQ(local("here.txt"), "hello");
  proxy_.setGone(false);
  EXPECT_EQ(start("there.txt"), succeeded);
}

TEST_F(Downloads, OneDocumentAskedForByManyIsDownloadedOnce) {
  server_.write("film", longContent());
  provider();
  std::atomic<int> good{0};
  std::vector<std::thread> readers;
  readers.reserve(6);
  for (int i = 0; i < 6; ++i) readers.emplace_back([&] { good += start("film") ? 0 : 1; });
  for (std::thread &reader : readers) reader.join();
  EXPECT_EQ(good, 6);
  const auto gets = proxy_.requests("GET");
  EXPECT_EQ(std::count_if(gets.begin(), gets.end(),
                          [](const std::string &head) { return head.find("If-None-Match") == std::string::npos; }),
            1);
}

TEST_F(Downloads, ManyDocumentsAreDownloadedAtATime) {
  provider();
  std::vector<std::thread> readers;
  readers.reserve(8);
  for (int i = 0; i < 8; ++i) server_.write("film " + std::to_string(i), longContent(static_cast<char>('a' + i)));
  for (int i = 0; i < 8; ++i)
    readers.emplace_back([this, i] { EXPECT_EQ(start("film " + std::to_string(i)), succeeded); });
  for (std::thread &reader : readers) reader.join();
  for (int i = 0; i < 8; ++i) EXPECT_EQ(local("film " + std::to_string(i)), longContent(static_cast<char>('a' + i)));
}

TEST_F(Downloads, WhatIsChangedHereDuringTheDownloadIsKept) {
  server_.write("a.txt", "server's");
  proxy_.next({"GET", [this] { change("a.txt", "mine"); }, {}, {}, {}});
  ASSERT_EQ(start("a.txt"), succeeded);
  EXPECT_EQ(local("a.txt"), "server's");
  EXPECT_EQ(local("a (conflict).txt"), "mine");
  EXPECT_EQ(server_.read("a (conflict).txt"), "mine");
}

TEST_F(Downloads, NothingOutsideIsTouched) {
  folder_.write("secret", "s");
  for (const std::string path : {"../../secret", "a/../../secret", ".hidden", "a/.b", ".incoming/x"}) {
    EXPECT_NE(start(path), succeeded) << path;
    EXPECT_NE(changed(path), succeeded) << path;
    EXPECT_NE(stop(path), succeeded) << path;
    EXPECT_FALSE(placeholder(path).ok()) << path;
  }
  for (const std::string identifier : {"../x", "/etc/passwd", "", "a//b", ".x"}) {
    EXPECT_FALSE(answer<Result<URL>>([&](auto done) { provider().itemURL(identifier, done); }).ok()) << identifier;
  }
  EXPECT_THAT(proxy_.requests("GET"), SizeIs(0));
}

TEST_F(Downloads, PlaceholdersTellWhatTheServerTells) {
  server_.write("reports/50% \xC3\xA9.txt", "hello");
  const auto made = placeholder("reports/50% \xC3\xA9.txt");
  ASSERT_TRUE(made.ok()) << made.error().message();
  EXPECT_EQ(made.value(), item("reports/.50% \xC3\xA9.txt"));
  const std::string text = local("reports/.50% \xC3\xA9.txt");
  EXPECT_THAT(text, HasSubstr("\"size\":5"));
  EXPECT_THAT(text, HasSubstr("\"etag\":\"\\\"5-"));
  EXPECT_THAT(text, HasSubstr("\"name\":\"50% \xC3\xA9.txt\""));
  EXPECT_THAT(text, HasSubstr("\"modificationTime\":"));
  EXPECT_FALSE(isHere("reports/50% \xC3\xA9.txt"));
  EXPECT_EQ(placeholder("missing").error().code(), ENOENT);
}

TEST_F(Downloads, ThePlaceholderTellsHowFarADownloadIs) {
  progressInterval_ = std::chrono::milliseconds(0);
  server_.write("film", longContent());
  cutNextDownload(100'000);
  std::string during;
  proxy_.next({"GET", [&] { during = local(".film"); }, {}, {}, {}});
  ASSERT_EQ(start("film"), succeeded);
  EXPECT_THAT(during, HasSubstr("\"received\":"));
  EXPECT_THAT(during, HasSubstr("\"size\":" + std::to_string(longContent().size())));
  EXPECT_THAT(local(".film"), HasSubstr("\"size\":"));
  EXPECT_THAT(local(".film"), Not(HasSubstr("received")));
}

TEST_F(Downloads, AnApplicationsCompanionIsNotOverwritten) {
  progressInterval_ = std::chrono::milliseconds(0);
  server_.write("film", longContent());
  for (const std::string companion : {"an application's own", "{}", R"({"size": 1})", ""}) {
    change(".film", companion);
    EXPECT_EQ(placeholder("film").error().code(), EEXIST);
    EXPECT_EQ(local(".film"), companion);
  }
  ASSERT_EQ(start("film"), succeeded);
  EXPECT_EQ(local(".film"), "");
  fs::remove(localPath(".film"));
  fs::create_symlink("elsewhere", localPath(".film"));
  EXPECT_EQ(placeholder("film").error().code(), EEXIST);
  EXPECT_TRUE(fs::is_symlink(localPath(".film")));
  fs::remove(localPath(".film"));
  ASSERT_TRUE(placeholder("film").ok());
  EXPECT_TRUE(placeholder("film").ok()) << "a placeholder may be replaced";
}

TEST_F(Downloads, AFoldersPlaceholderIsWhatIsInIt) {
  server_.write("reports/a.txt", "x");
  server_.write("reports/deep/b.txt", "x");
  server_.write("reports/.hidden", "x");
  server_.write("reports/taken.txt", "x");
  fs::create_directory(localPath("reports"));
  change("reports/.taken.txt", "an application's own");
  const auto made = placeholder("reports");
  ASSERT_TRUE(made.ok()) << made.error().message();
  EXPECT_EQ(local("reports/.taken.txt"), "an application's own");
  EXPECT_TRUE(isHere("reports/.a.txt"));
  EXPECT_FALSE(isHere("reports/a.txt"));
  EXPECT_TRUE(fs::is_directory(localPath("reports/deep")));
  EXPECT_FALSE(isHere("reports/deep/.b.txt"));
  EXPECT_FALSE(isHere("reports/..hidden"));
}

TEST_F(Downloads, ARedirectionIsFollowedAndThePasswordDoesNotGoToAnotherServer) {
  server_.write("a", "x");
  const auto redirectionTo = [](std::uint16_t port) {
    return "HTTP/1.1 302 Found\r\nLocation: http://127.0.0.1:" + std::to_string(port) +
           "/a\r\nContent-Length: 0\r\nConnection: close\r\n\r\n";
  };
  proxy_.next({"GET", {}, {}, {}, redirectionTo(proxy_.port())});
  EXPECT_EQ(start("a"), succeeded);
  ASSERT_EQ(stop("a"), succeeded);

  FaultProxy other(server_.port());
  proxy_.next({"GET", {}, {}, {}, redirectionTo(other.port())});
  EXPECT_THAT(start("a"), failsWith(EACCES));
  ASSERT_THAT(other.requests("GET"), SizeIs(1));
  EXPECT_THAT(other.requests("GET")[0], Not(HasSubstr("Authorization")));
}

TEST_F(Downloads, ARedirectionToWhatIsNotHTTPIsRefused) {
  folder_.write("secret", "s");
  server_.write("a", "x");
  proxy_.next({"GET",
               {},
               {},
               {},
               "HTTP/1.1 302 Found\r\nLocation: file://" + folder_.path("secret") +
                   "\r\nContent-Length: 0\r\nConnection: close\r\n\r\n"});
  EXPECT_THAT(start("a"), failsWith(EPROTO));
  EXPECT_FALSE(isHere("a"));
}

TEST_F(Downloads, BreakingOffEndsAWaitAtOnce) {
  server_.write("film", longContent());
  auto settings = readConfiguration(folder_.path("group"));
  ASSERT_TRUE(settings.ok());
  DavClient client(settings.value());
  proxy_.next({"GET", {}, {}, 0, {}});
  std::stop_source ending;
  std::optional<SXError> failed;
  std::thread reader([&] {
    UniqueFd file(::open(folder_.path("partial").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    PartialDownload partial{file.get(), "", 0, {}};
    const auto downloaded = client.download("film", "", partial, ending.get_token());
    if (!downloaded) failed = downloaded.error();
  });
  proxy_.waitForRequests("GET", 1);
  ending.request_stop();
  reader.join();
  EXPECT_THAT(failed, failsWith(ECANCELED));
}

}  // namespace
}  // namespace storix::example
