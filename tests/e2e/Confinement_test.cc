// What a provider that runs confined can get at, and can hand to others.

#include <poll.h>
#include <sys/syscall.h>

#include <fstream>

#include "tests/e2e/E2ETest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

constexpr const char *provider = "org.sample.prying";
constexpr const char *consumer = "org.sample.editor";

class Confinement : public E2ETest {
 protected:
  Confinement() { session.write(secret_, "secret"); }

  void installPrying(const std::string &script, const std::string &sandbox = "{}") {
    const std::string group = "group." + std::string(provider);
    const fs::path staged = session.directory() / "staged";
    fs::create_directory(staged);
    fs::copy_file(builtProgram("e2e_prying_provider"), staged / "provider");
    session.write(staged / "script", script);
    session.write(staged / "Info.kvs", R"({"KTBundleIdentifier": ")" + std::string(provider) +
                                           R"(", "KTBundleExecutable": "provider", "KTBundleVersion": "1",
        "KTGroupContainers": [")" + group +
                                           R"("], "KTExtensionPointIdentifier": "com.tessel.storix-nonui",
        "KTExtension": {"KTExtensionStorixDocumentGroup": ")" +
                                           group + R"("}, "KTSandbox": )" + sandbox + "}");
    fs::rename(staged, session.extensionsDirectory() / "prying.appdex");
  }

  /// Waits for the provider's words about one of its attempts.
  [[nodiscard]] bool said(const std::string &attempt, const std::string &outcome) {
    return daemon->waitForLine("Extension " + std::string(provider) + ": " + attempt + ": " + outcome).has_value();
  }

  const fs::path secret_ = session.directory() / "home/secret";
};

constexpr const char *absent = "No such file or directory";

TEST_F(Confinement, ProviderReachesNeitherItsUsersFilesNorTheDaemonsNorAnothersContainer) {
  session.installProvider("org.sample.docs");
  start();
  const std::unique_ptr<Client> client = makeClient();
  grantAndStart(*client, "org.sample.docs", "report");
  const std::string document = (session.storage("org.sample.docs") / "report").string();
  ASSERT_TRUE(fs::exists(document));

  const std::string info = (session.extensionsDirectory() / "prying.appdex/Info.kvs").string();
  installPrying("read " + secret_.string() + "\nread " + session.accessControlFile().string() + "\nread " + document +
                "\nread " + (session.runtimeDirectory() / "token-key").string() + "\nconnect " +
                session.serviceSocket().string() + "\nconnect " + session.platformSocket().string() + "\nread " + info +
                "\nwrite " + info + "\n");
  EXPECT_TRUE(said("read " + secret_.string(), absent));
  EXPECT_TRUE(said("read " + session.accessControlFile().string(), absent));
  EXPECT_TRUE(said("read " + document, absent));
  EXPECT_TRUE(said("read " + (session.runtimeDirectory() / "token-key").string(), absent));
  EXPECT_TRUE(said("connect " + session.serviceSocket().string(), absent));
  EXPECT_TRUE(said("connect " + session.platformSocket().string(), absent));
  EXPECT_TRUE(said("read " + info, "done"));
  EXPECT_TRUE(said("write " + info, "Read-only file system"));
  EXPECT_EQ(0U, daemon->countLines("unconfined"));
}

TEST_F(Confinement, ProviderIsNotGivenWhatNoneMayHave) {
  const std::string runtime = session.runtimeDirectory().string();
  installPrying("read " + secret_.string() + "\nconnect " + session.platformSocket().string() + "\n",
                R"({"readOnly": ["~/secret"], "readWrite": ["~/Library", ")" + runtime + R"("]})");
  start();
  const std::string line = "[ERROR] Not granting ";
  const std::string to = " to the extension org.sample.prying: ";
  EXPECT_TRUE(daemon->waitForLine(line + "~/Library" + to + "No extension may see " +
                                  (session.directory() / "home/Library/Storix").string() + "."));
  EXPECT_TRUE(daemon->waitForLine(line + runtime + to + "No extension may see " + runtime + "."));
  EXPECT_TRUE(said("read " + secret_.string(), "done")) << "this it may have";
  EXPECT_TRUE(said("connect " + session.platformSocket().string(), absent));
}

TEST_F(Confinement, WishesThatAreMalformedLeaveTheBundleOutWithALine) {
  installPrying("", R"({"network": "please"})");
  session.installProvider("org.sample.docs");
  start();
  const auto providers = makeClient()->providers();
  ASSERT_TRUE(providers) << providers.error().message();
  ASSERT_EQ(1U, providers.value().size());
  EXPECT_EQ("org.sample.docs", providers.value()[0].identifier);
  EXPECT_EQ(1U, daemon->countLines("prying.appdex"));
  const auto line = daemon->waitForLine("[ERROR] Could not use " +
                                        (session.extensionsDirectory() / "prying.appdex/Info.kvs").string());
  ASSERT_TRUE(line);
  EXPECT_NE(std::string::npos, daemon->errorLines()[*line].find("\"network\" in \"KTSandbox\" must be true or false."))
      << daemon->errorLines()[*line];
}

TEST_F(Confinement, NoTokenIsIssuedForAFileElsewhereThatTheProviderNames) {
  installPrying("answer " + secret_.string() + "\n");
  start();
  const std::unique_ptr<Client> client = makeClient();
  const Result<GrantedDocument> granted =
      client->extendSandbox(itemURL(provider, "report"), provider, "org.sample.files");
  ASSERT_TRUE(granted) << granted.error().message();
  // The test is the consumer, too.
  const Result<GrantedDocument> resolved = client->resolveBookmark("storix:org.sample.prying/report");
  ASSERT_TRUE(resolved) << resolved.error().message();
  EXPECT_EQ(*URL::fileURLWithPath(secret_.string()), resolved.value().url);
  EXPECT_FALSE(resolved.value().token);
  EXPECT_FALSE(resolved.value().companionToken);
  EXPECT_TRUE(daemon->waitForLine("[INFO] No token for " + secret_.string() + ": it is in no group container"));
}

TEST_F(Confinement, TokenDoesNotLeadThroughALinkThatTheProviderPutsInItsPlace) {
  installPrying("link " + secret_.string() + "\n");
  start();
  const std::unique_ptr<Client> client = makeClient();
  const URL url = itemURL(provider, "report");
  const Result<GrantedDocument> before = client->extendSandbox(url, provider, consumer);
  ASSERT_TRUE(before && before.value().token);
  const Client::Outcome started = client->startProviding(url, provider, consumer);
  ASSERT_FALSE(started) << started->message();
  ASSERT_EQ(secret_, fs::read_symlink(session.storage(provider) / "report"));

  const Result<UniqueFd> opened = client->openDocument(before.value());
  ASSERT_FALSE(opened);
  EXPECT_NE(std::string::npos, opened.error().message().find("is not a regular file")) << opened.error().message();
  const Result<GrantedDocument> after = client->extendSandbox(url, provider, consumer);
  ASSERT_TRUE(after) << after.error().message();
  EXPECT_FALSE(after.value().token);
}

TEST_F(Confinement, ProviderEndsWithTheDaemonEvenWhenThatIsKilled) {
  installPrying("");
  start();
  ASSERT_FALSE(makeClient()->wakeUp());
  const auto line = daemon->waitForLine("[INFO] Started process ");
  ASSERT_TRUE(line);
  std::string process = daemon->errorLines()[*line];
  process = std::to_string(std::stoi(process.substr(process.find("process ") + 8)));
  // The extension runs below the first process of its sandbox.
  for (int generation = 0; generation < 2; ++generation) {
    std::ifstream("/proc/" + process + "/task/" + process + "/children") >> process;
  }
  const UniqueFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, std::stoi(process), 0)));
  ASSERT_TRUE(pidfd);
  EXPECT_EQ("provider", fs::read_symlink("/proc/" + process + "/exe").filename());

  daemon->signal(SIGKILL);
  EXPECT_EQ(128 + SIGKILL, daemon->wait());
  pollfd ended{pidfd.get(), POLLIN, 0};
  EXPECT_EQ(1, ::poll(&ended, 1, static_cast<int>(std::chrono::milliseconds(deadline).count())));
}

TEST_F(Confinement, SwitchedOffItIsNotThereAndOneLineSaysSo) {
  session.environment["STORIX_CONFINEMENT"] = "off";
  session.installProvider("org.sample.docs");
  installPrying("read " + secret_.string() + "\n");
  start();
  EXPECT_TRUE(said("read " + secret_.string(), "done"));
  ASSERT_FALSE(makeClient()->wakeUp());
  EXPECT_EQ(1U, daemon->countLines("[NOTICE] Extensions run unconfined"));
}

TEST_F(Confinement, WordThatIsNotUnderstoodIsToldAndRequiresIt) {
  session.environment["STORIX_CONFINEMENT"] = "no";
  installPrying("read " + secret_.string() + "\n");
  start();
  EXPECT_TRUE(daemon->waitForLine("STORIX_CONFINEMENT is “no”"));
  EXPECT_TRUE(said("read " + secret_.string(), absent));
}

}  // namespace
}  // namespace storix::e2e
