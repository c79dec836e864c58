// The access-control file when it is not as it should be.

#include <filesystem>

#include "tests/e2e/E2ETest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

class AccessControlFile : public E2ETest {
 protected:
  AccessControlFile() {
    session.installProvider("org.sample.docs");
    fs::create_directories(session.accessControlFile().parent_path());
  }

  void grant() {
    const Result<GrantedDocument> granted =
        makeClient()->extendSandbox(itemURL("org.sample.docs", "report"), "org.sample.docs", "org.sample.editor");
    ASSERT_TRUE(granted) << granted.error().message();
  }

  static constexpr const char *grantedContent =
      R"({"org.sample.docs":{"org.sample.editor":{"AllowedItemIDs":["report"]}}})";
};

TEST_F(AccessControlFile, IsMadeByTheFirstGrantForItsUserAlone) {
  fs::remove_all(session.accessControlFile().parent_path());
  start();
  grant();
  EXPECT_EQ(fs::perms::owner_read | fs::perms::owner_write, fs::status(session.accessControlFile()).permissions());
  EXPECT_EQ(fs::perms::owner_all, fs::status(session.accessControlFile().parent_path()).permissions());
  EXPECT_NE(std::string::npos, Session::read(session.accessControlFile()).find("report"));
}

TEST_F(AccessControlFile, CorruptContentIsReportedLeftInPlaceAndKeptAsideByTheFirstGrant) {
  session.write(session.accessControlFile(), "{ this is not");
  start();
  ASSERT_TRUE(daemon->waitForLine("[ERROR] Cannot read access control from disk. Error: "));
  ASSERT_FALSE(makeClient()->wakeUp());
  EXPECT_EQ("{ this is not", Session::read(session.accessControlFile()));
  grant();
  EXPECT_EQ("{ this is not", Session::read(session.accessControlFile().string() + ".corrupt"));
  EXPECT_NE(std::string::npos, Session::read(session.accessControlFile()).find("report"));
}

TEST_F(AccessControlFile, DirectoryInItsPlaceIsReportedAndGrantsCountWhileTheDaemonRuns) {
  fs::create_directory(session.accessControlFile());
  start();
  grant();
  EXPECT_TRUE(daemon->waitForLine("[ERROR] Could not write to " + session.accessControlFile().string()));
  const Client::Outcome outcome =
      makeClient()->startProviding(itemURL("org.sample.docs", "report"), "org.sample.docs", "org.sample.editor");
  EXPECT_FALSE(outcome) << outcome->message();
}

TEST_F(AccessControlFile, DirectoryThatCannotBeMadeIsReportedAndTheDaemonServes) {
  fs::remove_all(session.directory() / "home/Library");
  session.write(session.directory() / "home/Library", "a file where a directory should be");
  start();
  EXPECT_TRUE(daemon->waitForLine("[ERROR] Cannot create access control directory. Error: "));
  grant();
  EXPECT_TRUE(daemon->waitForLine("[ERROR] Could not write to "));
}

TEST_F(AccessControlFile, UnlockReadsItAgain) {
  start();
  const std::unique_ptr<Client> client = makeClient();
  ASSERT_FALSE(client->wakeUp());
  session.write(session.accessControlFile(), grantedContent);
  ASSERT_FALSE(client->postNotification("com.tessel.mobile.vaultkeepd.first_unlock"));
  ASSERT_TRUE(daemon->waitForLine("[INFO] Successfully read access control from disk."));
  const Client::Outcome outcome =
      client->startProviding(itemURL("org.sample.docs", "report"), "org.sample.docs", "org.sample.editor");
  EXPECT_FALSE(outcome) << outcome->message();
}

}  // namespace
}  // namespace storix::e2e
