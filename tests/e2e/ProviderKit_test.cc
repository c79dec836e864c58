// What authors of providers are given: the examples, and the check that tells them what is wrong.

#include <gmock/gmock.h>

#include <filesystem>
#include <fstream>

#include "tests/e2e/E2ETest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;

const fs::path examples = fs::path(STORIX_SOURCE_DIR) / "examples";

class ProviderKit : public E2ETest {
 protected:
  /// The template, as its author would put it into a bundle.
  void installTemplate() const {
    const fs::path staged = session.directory() / "template";
    fs::create_directory(staged);
    fs::copy_file(builtProgram("template-provider"), staged / "template-provider");
    fs::copy_file(examples / "template-provider/Info.kvs", staged / "Info.kvs");
    fs::rename(staged, session.extensionsDirectory() / "template.appdex");
  }

  [[nodiscard]] Finished check(const std::string &bundle, const std::vector<std::string> &more) const {
    std::vector<std::string> command{builtProgram("storixctl").string(), "check-extension",
                                     (session.extensionsDirectory() / bundle).string()};
    command.insert(command.end(), more.begin(), more.end());
    return run(command, session.environment);
  }
};

TEST_F(ProviderKit, TheTemplateProviderIsFitToShip) {
  installTemplate();
  const Finished checked = check("template.appdex", {"--file", "anne.txt", "--item", "otto \xc3\xa9 100%.txt"});
  EXPECT_EQ(0, checked.status) << checked.errors;
  EXPECT_EQ("0 errors, 0 pieces of advice\n", checked.output);
}

TEST_F(ProviderKit, TheFolderProviderIsFitToShip) {
  const std::string source = (session.directory() / "source").string();
  fs::create_directories(session.directory() / "source/reports");
  session.write(session.directory() / "source/reports/may 100%.txt", "Sold out.");
  session.write(session.directory() / "source/large.bin", std::string(8U << 20, 'x'));
  session.installBundle("folder",
                        R"({"KTBundleIdentifier": "org.sample.docs", "KTBundleExecutable": "provider",
                            "KTBundleVersion": "1", "KTGroupContainers": ["group.org.sample.docs"],
                            "KTExtensionPointIdentifier": "com.tessel.storix-nonui",
                            "KTExtension": {"KTExtensionStorixDocumentGroup": "group.org.sample.docs"},
                            "KTSandbox": {"readWrite": [")" +
                            source + R"("]}, "FolderProviderSource": ")" + source + "\"}",
                        builtProgram("folder-provider"));
  const Finished checked =
      check("folder.appdex", {"--file", "reports/may 100%.txt", "--item=large.bin", "--file=large.bin"});
  EXPECT_EQ(0, checked.status) << checked.errors;
  EXPECT_EQ("0 errors, 0 pieces of advice\n", checked.output);
  EXPECT_EQ("Sold out.", Session::read(session.directory() / "source/reports/may 100%.txt"));
}

TEST_F(ProviderKit, ABundleThatIsNotFitToShipIsToldApart) {
  session.installBundle("broken", R"({"KTBundleIdentifier": "org.sample.docs"})");
  const Finished checked = check("broken.appdex", {});
  EXPECT_EQ(1, checked.status);
  EXPECT_THAT(checked.output, HasSubstr("names no KTBundleExecutable"));
}

TEST_F(ProviderKit, TheTemplateProviderServesTheDaemon) {
  installTemplate();
  start();
  const auto client = makeClient();
  const fs::path document = session.storage("org.sample.template") / "anne.txt";
  const URL url = *URL::fileURLWithPath(document.string());
  const auto granted = client->extendSandbox(url, "org.sample.template", "org.sample.editor");
  ASSERT_TRUE(granted) << granted.error().message();
  EXPECT_EQ(client->startProviding(url, "org.sample.template", "org.sample.editor"), std::nullopt);
  EXPECT_EQ("Good morning, anne.\n", Session::read(document));
  EXPECT_EQ(client->providePlaceholder(url, "org.sample.template", "org.sample.editor"), std::nullopt);
  EXPECT_EQ("{\"size\":20}", Session::read(document.parent_path() / ".anne.txt"));
  EXPECT_EQ(client->stopProviding(url, "org.sample.template", "org.sample.editor"), std::nullopt);
  EXPECT_FALSE(fs::exists(document));

  // What somebody has written is kept.
  session.write(document, "Good evening.");
  EXPECT_EQ(client->startProviding(url, "org.sample.template", "org.sample.editor"), std::nullopt);
  EXPECT_EQ(client->stopProviding(url, "org.sample.template", "org.sample.editor"), std::nullopt);
  EXPECT_EQ("Good evening.", Session::read(document));
  stop();
}

}  // namespace
}  // namespace storix::e2e
