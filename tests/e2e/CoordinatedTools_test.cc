// storixctl as people use it: reading and writing documents of a provider through coordination.

#include <sys/inotify.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "storix/FileCoordinator.h"
#include "tests/e2e/E2ETest.h"
#include "tools/storixctl/Terminal.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

constexpr const char *provider = "org.sample.docs";
constexpr const char *self = "org.sample.ctl";

class CoordinatedTools : public E2ETest {
 protected:
  CoordinatedTools() {
    fs::create_directory(source());
    ctl_ = session.installApplication(self, builtProgram("storixctl"), R"({"com.tessel.storix.acl-write": true})");
  }

  [[nodiscard]] fs::path source() const { return session.directory() / "source"; }

  /// The provider that serves the source folder.
  void installFolderProvider() {
    const std::string group = "group." + std::string(provider);
    session.installBundle(provider,
                          R"({"KTBundleIdentifier": ")" + std::string(provider) +
                              R"(", "KTBundleExecutable": "provider", "KTBundleVersion": "1",
                                 "KTGroupContainers": [")" +
                              group + R"("], "KTExtensionPointIdentifier": "com.tessel.storix-nonui",
                                 "KTExtension": {"KTExtensionStorixDocumentGroup": ")" +
                              group + R"("}, "KTSandbox": {"readWrite": [")" + source().string() +
                              R"("]}, "FolderProviderSource": ")" + source().string() + "\"}",
                          builtProgram("folder-provider"));
  }

  [[nodiscard]] fs::path item(const std::string &name) const { return session.storage(provider) / name; }

  [[nodiscard]] std::vector<std::string> command(std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), ctl_.string());
    return arguments;
  }
  [[nodiscard]] Finished ctl(std::vector<std::string> arguments) const {
    return run(command(std::move(arguments)), session.environment);
  }
  /// The program in a shell's command line, where "$0" stands for it and "$1" and so on for the arguments.
  [[nodiscard]] std::vector<std::string> inShell(const std::string &line, std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), {"bash", "-c", line, ctl_.string()});
    return arguments;
  }

  /// Waits until the file, which is always replaced as a whole, holds that.
  static void waitForContent(const fs::path &file, const std::string &content) {
    const UniqueFd changes(::inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
    ASSERT_GE(::inotify_add_watch(changes.get(), file.parent_path().c_str(), IN_MOVED_TO | IN_CLOSE_WRITE), 0);
    while (Session::read(file) != content) {
      pollfd changed{changes.get(), POLLIN, 0};
      ASSERT_EQ(::poll(&changed, 1, 60'000), 1) << file << " still holds " << Session::read(file);
      char ignored[4096];
      ASSERT_GT(::read(changes.get(), ignored, sizeof ignored), 0);
    }
  }

  fs::path ctl_;
};

TEST_F(CoordinatedTools, ADocumentIsReadEditedAndWrittenBackToItsProvider) {
  session.write(source() / "report.txt", "first\n");
  installFolderProvider();
  start();
  const std::string document = item("report.txt").string();
  EXPECT_FALSE(fs::exists(document));
  const Finished read = ctl({"read", document});
  EXPECT_EQ(0, read.status) << read.errors;
  EXPECT_EQ("first\n", read.output);
  EXPECT_EQ("", read.errors);
  fs::permissions(document, fs::perms(0640));

  const Finished written =
      run(inShell("sed s/first/second/ \"$1\" | \"$0\" write \"$1\"", {document}), session.environment);
  EXPECT_EQ(0, written.status) << written.errors;
  EXPECT_EQ("", written.output);
  waitForContent(source() / "report.txt", "second\n");
  EXPECT_EQ(fs::perms(0640), fs::status(document).permissions());
  EXPECT_EQ("second\n", ctl({"read", itemURL(provider, "report.txt").absoluteString()}).output);
}

TEST_F(CoordinatedTools, ADocumentIsReadAndWrittenByItsBookmark) {
  session.write(source() / "50% é.txt", "first\n");
  session.write(session.directory() / "new", "second\n");
  installFolderProvider();
  start();
  const std::string bookmark = "storix:" + std::string(provider) + "/50% é.txt";
  const Finished refused = ctl({"cat", bookmark});
  EXPECT_EQ(1, refused.status);
  EXPECT_NE(std::string::npos, refused.errors.find("\"storixctl extend DOCUMENT org.sample.docs CONSUMER\""))
      << refused.errors;

  EXPECT_EQ(0, ctl({"extend", item("50% é.txt").string(), provider, self}).status);
  EXPECT_EQ("org.sample.docs\torg.sample.ctl\t50% é.txt\n", ctl({"grants"}).output);
  const Finished read = ctl({"cat", bookmark});
  EXPECT_EQ("first\n", read.output) << read.errors;
  const Finished written = ctl({"write", bookmark, "--input", (session.directory() / "new").string()});
  EXPECT_EQ(0, written.status) << written.errors;
  waitForContent(source() / "50% é.txt", "second\n");
  EXPECT_EQ("second\n", ctl({"cat", bookmark}).output);
}

TEST_F(CoordinatedTools, ALargeDocumentPassesWhole) {
  std::string content;
  content.resize(20'000'003, 'x');
  for (std::size_t i = 0; i < content.size(); i += 101) content[i] = static_cast<char>(i);
  session.write(source() / "film", content);
  installFolderProvider();
  start();
  const std::string document = item("film").string();
  EXPECT_EQ(0, ctl({"read", document, "--output", (session.directory() / "copy").string()}).status);
  EXPECT_TRUE(Session::read(session.directory() / "copy") == content);
  const Finished passed = run(inShell("\"$0\" read \"$1\" | \"$0\" write \"$2\"", {document, item("film 2").string()}),
                              session.environment);
  EXPECT_EQ(0, passed.status) << passed.errors;
  EXPECT_TRUE(Session::read(item("film 2")) == content);
}

TEST_F(CoordinatedTools, AReaderThatStopsEarlyEndsItQuietly) {
  session.write(source() / "film", std::string(5'000'000, 'x'));
  installFolderProvider();
  start();
  const Finished cut =
      run(inShell("\"$0\" read \"$1\" | head -c 3; echo \" ${PIPESTATUS[0]}\"", {item("film").string()}),
          session.environment);
  EXPECT_EQ("xxx 141\n", cut.output);
  EXPECT_EQ("", cut.errors);
}

TEST_F(CoordinatedTools, WritersWaitForTheClaimAndComeOneAfterTheOther) {
  session.write(source() / "a", "old");
  installFolderProvider();
  start();
  ASSERT_EQ("old\n", ctl({"read", item("a").string()}).output);
  const std::vector<std::string> contents{std::string(300'000, '1'), std::string(300'000, '2')};
  for (const std::string &content : contents) session.write(session.directory() / content.substr(0, 1), content);

  FileCoordinator coordinator({.runtimeDirectory = session.runtimeDirectory().string()});
  auto claim = coordinator.write(itemURL(provider, "a"), {.deadline = deadline});
  ASSERT_TRUE(claim) << claim.error().message();
  Process one(command({"write", item("a").string(), "-i", (session.directory() / "1").string()}), session.environment);
  Process two(command({"write", item("a").string(), "-i", (session.directory() / "2").string()}), session.environment);
  const Finished late = ctl({"read", item("a").string(), "--timeout", "0.2"});
  EXPECT_EQ(3, late.status);
  EXPECT_NE(std::string::npos, late.errors.find("somebody is still writing it")) << late.errors;
  EXPECT_EQ("old", Session::read(item("a")));
  EXPECT_FALSE(one.hasEnded());
  EXPECT_FALSE(two.hasEnded());
  EXPECT_FALSE(claim.value().end());

  EXPECT_EQ(0, one.wait());
  EXPECT_EQ(0, two.wait());
  const std::string last = Session::read(item("a"));
  EXPECT_TRUE(last == contents[0] || last == contents[1]);
  waitForContent(source() / "a", last);
}

TEST_F(CoordinatedTools, AnInterruptedReadEndsAtOnceAndWithdrawsItsClaim) {
  session.installProvider(provider, "start never\n");
  start();
  Process reading(command({"read", item("a").string(), "--output", (session.directory() / "copy").string()}),
                  session.environment);
  daemon->waitForLine("called start");
  reading.signal(SIGINT);
  EXPECT_EQ(130, reading.wait());
  EXPECT_EQ("", reading.output());
  EXPECT_TRUE(reading.errorLines().empty());
  EXPECT_FALSE(fs::exists(session.directory() / "copy"));

  session.write(session.directory() / "new", "new");
  const Finished written = ctl({"write", item("a").string(), "-i", (session.directory() / "new").string()});
  EXPECT_EQ(0, written.status) << written.errors;
}

TEST_F(CoordinatedTools, AnInterruptedWriteKeepsTheOldContent) {
  session.installProvider(provider);
  start();
  ASSERT_EQ(0, ctl({"read", item("a").string()}).status);
  // Its input never ends.
  const fs::path pipe = session.directory() / "pipe";
  ASSERT_EQ(0, ::mkfifo(pipe.c_str(), 0600));
  Process writing(inShell("exec \"$0\" write \"$1\" <\"$2\"", {item("a").string(), pipe.string()}),
                  session.environment);
  std::ofstream input(pipe);  // Opens when the other side has.
  input << "half" << std::flush;
  writing.signal(SIGTERM);
  EXPECT_EQ(143, writing.wait());
  EXPECT_EQ("contents of a", Session::read(item("a")));
  for (const auto &entry : fs::directory_iterator(session.storage(provider))) {
    EXPECT_EQ("a", entry.path().filename()) << "nothing is left behind";
  }
}

TEST_F(CoordinatedTools, WaitingIsShownOnATerminal) {
  // Where a confined extension sees it.
  const fs::path container = session.storage(provider).parent_path();
  fs::create_directories(container);
  const fs::path pipe = container / "pipe";
  ASSERT_EQ(0, ::mkfifo(pipe.c_str(), 0600));
  session.installProvider(provider, "start hold " + pipe.string() + "\n");
  start();
  fs::create_directories(session.storage(provider));
  session.write(session.storage(provider) / ".a", R"({"name": "a", "size": 13})");
  ctl::Terminal terminal;
  Process reading(inShell("exec \"$0\" read \"$1\" 2>\"$2\"", {item("a").string(), ::ttyname(terminal.descriptor())}),
                  session.environment);
  terminal.waitFor("a: waiting, 13 B, 0:0");
  std::ofstream(pipe) << "go on";
  EXPECT_EQ(0, reading.wait());
  EXPECT_EQ("contents of a\n", reading.output());
  EXPECT_TRUE(terminal.shown().ends_with("\r\033[K")) << terminal.shown();
}

TEST_F(CoordinatedTools, ErrorsSayWhatToDo) {
  session.write(session.directory() / "new", "new");
  const std::string input = (session.directory() / "new").string();
  for (const std::vector<std::string> &arguments : {std::vector<std::string>{"read", "/tmp/a"},
                                                    {"cat", "storix:p/a"},
                                                    {"write", item("a").string(), "-i", input}}) {
    fs::create_directories(session.storage(provider));
    const Finished finished = ctl(arguments);
    EXPECT_EQ(3, finished.status) << arguments[0];
    EXPECT_NE(std::string::npos, finished.errors.find("is not running")) << finished.errors;
    EXPECT_NE(std::string::npos, finished.errors.find("Start storixd")) << finished.errors;
  }
  installFolderProvider();
  start();
  const Finished missing = ctl({"read", item("missing").string()});
  EXPECT_EQ(1, missing.status);
  EXPECT_NE(std::string::npos, missing.errors.find("No such file")) << missing.errors;
  const Finished nowhere = ctl({"write", item("missing/a").string(), "-i", input});
  EXPECT_EQ(1, nowhere.status);
  EXPECT_NE(std::string::npos, nowhere.errors.find("opening the directory")) << nowhere.errors;
}

TEST_F(CoordinatedTools, ABookmarkOfAProviderThatWasRemovedSaysSo) {
  session.installProvider(provider);
  start();
  ASSERT_EQ(0, ctl({"extend", item("a").string(), provider, self}).status);
  stop();
  session.removeBundle(provider);
  start();
  const Finished unanswered = ctl({"cat", "storix:org.sample.docs/a", "--timeout", "0.5"});
  EXPECT_EQ(3, unanswered.status);
  EXPECT_NE(std::string::npos, unanswered.errors.find("\"storixctl providers\" must list “org.sample.docs”"))
      << unanswered.errors;
}

TEST_F(CoordinatedTools, AClosedStandardOutputIsAnError) {
  session.write(source() / "a", "content");
  installFolderProvider();
  start();
  const Finished closed = run(inShell("exec \"$0\" read \"$1\" >&-", {item("a").string()}), session.environment);
  EXPECT_EQ(1, closed.status);
  EXPECT_NE(std::string::npos, closed.errors.find("writing standard output")) << closed.errors;
}

}  // namespace
}  // namespace storix::e2e
