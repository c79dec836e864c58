// Documents of a real WebDAV server, through the daemon and the provider as an application meets them.

#include <filesystem>

#include "examples/webdav-provider/TestDavServer.h"
#include "storix/FileCoordinator.h"
#include "tests/e2e/E2ETest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

constexpr const char *provider = "org.sample.webdav";
constexpr const char *self = "org.sample.ctl";

class WebDav : public E2ETest {
 protected:
  WebDav() {
    const fs::path container = session.storage(provider).parent_path();
    fs::create_directories(container);
    example::TestDavServer::configure(container.string(), server.port());
    const fs::path staged = session.directory() / "staged";
    fs::create_directory(staged);
    fs::copy_file(fs::path(STORIX_SOURCE_DIR) / "examples/webdav-provider/Info.kvs", staged / "Info.kvs");
    fs::copy_file(builtProgram("webdav-provider"), staged / "webdav-provider");
    fs::rename(staged, session.extensionsDirectory() / "webdav.appdex");
  }

  [[nodiscard]] FileCoordinator makeCoordinator() const {
    ClientOptions options;
    options.runtimeDirectory = session.runtimeDirectory().string();
    options.timeout = deadline;
    return FileCoordinator(options);
  }

  /// Starts the daemon, and waits until the provider is registered.
  void serve() {
    start();
    const Client::Outcome outcome = makeClient()->wakeUp();
    ASSERT_FALSE(outcome) << outcome->message();
  }

  [[nodiscard]] std::string local(const std::string &item) const {
    return Session::read(session.storage(provider) / item);
  }

  static void end(FileClaim &claim) {
    const auto error = claim.end();
    EXPECT_FALSE(error) << error->message();
  }

  example::TestDavServer server;
};

TEST_F(WebDav, ACoordinatedReadBringsTheDocumentAndAWriteTakesItBack) {
  const std::string name = "reports/50% \xC3\xA9.txt";
  server.write(name, "first\n");
  serve();
  EXPECT_FALSE(fs::exists(session.storage(provider) / name));
  FileCoordinator coordinator = makeCoordinator();
  {
    Result<FileClaim> reading = coordinator.read(itemURL(provider, name));
    ASSERT_TRUE(reading) << reading.error().message();
    EXPECT_EQ("first\n", local(name));
    end(reading.value());
  }
  {
    Result<FileClaim> writing = coordinator.write(itemURL(provider, name));
    ASSERT_TRUE(writing) << writing.error().message();
    session.write(session.storage(provider) / name, "second\n");
    end(writing.value());
  }
  // Who reads afterwards comes after the upload: a change is never passed over.
  Result<FileClaim> reading = coordinator.read(itemURL(provider, name));
  ASSERT_TRUE(reading) << reading.error().message();
  EXPECT_EQ("second\n", local(name));
  EXPECT_EQ("second\n", server.read(name));
}

TEST_F(WebDav, ADocumentIsReadAndChangedByItsBookmarkWithTheTool) {
  server.write("notes.txt", "first\n");
  session.write(session.directory() / "new", "second\n");
  const fs::path tool =
      session.installApplication(self, builtProgram("storixctl"), R"({"com.tessel.storix.acl-write": true})");
  serve();
  const auto ctl = [&](std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), tool.string());
    return run(std::move(arguments), session.environment);
  };
  const Finished shared = ctl({"extend", (session.storage(provider) / "notes.txt").string(), provider, self});
  ASSERT_EQ(0, shared.status) << shared.errors;
  const std::string bookmark = "storix:" + std::string(provider) + "/notes.txt";
  const Finished read = ctl({"cat", bookmark});
  EXPECT_EQ("first\n", read.output) << read.errors;
  const Finished written = ctl({"write", bookmark, "--input", (session.directory() / "new").string()});
  EXPECT_EQ(0, written.status) << written.errors;
  EXPECT_EQ("second\n", ctl({"cat", bookmark}).output);
  EXPECT_EQ("second\n", server.read("notes.txt"));
}

TEST_F(WebDav, ADocumentThatIsNotOnTheServerIsAnErrorForTheReader) {
  serve();
  FileCoordinator coordinator = makeCoordinator();
  const Result<FileClaim> reading = coordinator.read(itemURL(provider, "missing.txt"));
  ASSERT_FALSE(reading);
  ASSERT_TRUE(reading.error().underlyingError()) << reading.error().message();
  EXPECT_EQ(ENOENT, reading.error().underlyingError()->code());
  EXPECT_FALSE(fs::exists(session.storage(provider) / "missing.txt"));
}

TEST_F(WebDav, CredentialsThatOthersMayReadKeepTheProviderOutAndTheLogSaysWhatToDo) {
  const fs::path credentials = session.storage(provider).parent_path() / "WebDAV Credentials.kvs";
  fs::permissions(credentials, fs::perms(0644));
  start();
  EXPECT_TRUE(daemon->waitForLine("close it with: chmod 600"));
  EXPECT_EQ(0U, daemon->countLines("open sesame"));
}

}  // namespace
}  // namespace storix::e2e
