#include "platform/linux/identity/ApplicationManifests.h"

#include <gmock/gmock.h>

#include <cerrno>

#include "platform/linux/TestDirectory.h"
#include "platform/linux/TestLog.h"
#include "platform/linux/TestUser.h"

namespace storix::linuxhost {
namespace {

using ::testing::ElementsAre;
using ::testing::StartsWith;

class ApplicationManifestsTest : public ::testing::Test {
 protected:
  [[nodiscard]] std::string identifierFor(const std::string &program) {
    struct stat status {};
    EXPECT_EQ(::stat(program.c_str(), &status), 0) << program;
    const std::optional<ApplicationManifest> manifest = manifests_.manifestForExecutable(status.st_dev, status.st_ino);
    return manifest ? manifest->bundleIdentifier : "none";
  }
  void write(const std::string &name, const std::string &program, const std::string &more = "") const {
    test_.makeFile(name, R"({"Executable": ")" + program + "\"" + more + "}");
  }

  TestDirectory test_;
  std::string first_ = test_.makeDirectory("first");
  std::string second_ = test_ / "second";
  std::string program_ = test_.makeFile("bin/editor", "program");
  ApplicationManifests manifests_{{first_, second_, test_ / "absent"}};
};

TEST_F(ApplicationManifestsTest, ProgramIsFoundByWhatItIsAndNotByItsName) {
  write("first/org.sample.Editor.kvs", test_.makeLink("link", program_));
  EXPECT_EQ(identifierFor(program_), "org.sample.Editor");
  const std::string other = test_.makeFile("bin/other", "program");
  EXPECT_EQ(identifierFor(other), "none");
  std::filesystem::create_hard_link(program_, test_ / "bin/same");
  EXPECT_EQ(identifierFor(test_ / "bin/same"), "org.sample.Editor");
}

TEST_F(ApplicationManifestsTest, FirstInTheOrderOfDirectoriesThenNamesWins) {
  write("second/a.kvs", program_);
  EXPECT_EQ(identifierFor(program_), "a");
  write("first/c.kvs", program_);
  EXPECT_EQ(identifierFor(program_), "c");
  write("first/b.kvs", program_);
  EXPECT_EQ(identifierFor(program_), "b");
  std::filesystem::remove(test_ / "first/b.kvs");
  EXPECT_EQ(identifierFor(program_), "c");
}

TEST_F(ApplicationManifestsTest, ProgramThatWasReplacedIsFoundAgain) {
  write("first/a.kvs", program_);
  EXPECT_EQ(identifierFor(program_), "a");
  test_.makeFile("bin/editor.new", "newer program");
  std::filesystem::rename(test_ / "bin/editor.new", program_);
  EXPECT_EQ(identifierFor(program_), "a");
}

TEST_F(ApplicationManifestsTest, ChangedManifestIsSeenAtOnce) {
  for (int i = 0; i < 20; ++i) {
    write("first/a.kvs", program_, R"(, "Entitlements": {"x": )" + std::to_string(i % 10) + "}");
    EXPECT_EQ(manifests_.manifestForIdentifier("a")->entitlements, Dictionary({{"x", i % 10}}));
  }
  std::filesystem::remove(test_ / "first/a.kvs");
  EXPECT_EQ(manifests_.manifestForIdentifier("a"), std::nullopt);
}

TEST_F(ApplicationManifestsTest, DirectoryThatComesLaterIsSeen) {
  EXPECT_EQ(manifests_.manifestForIdentifier("a"), std::nullopt);
  write("second/a.kvs", program_);
  EXPECT_EQ(identifierFor(program_), "a");
  std::filesystem::remove_all(second_);
  EXPECT_EQ(identifierFor(program_), "none");
}

TEST_F(ApplicationManifestsTest, IdentifierGivesTheFirstManifestOfThatName) {
  write("second/a.kvs", program_, R"(, "Entitlements": {"from": "second"})");
  EXPECT_EQ(manifests_.manifestForIdentifier("a")->entitlements, Dictionary({{"from", "second"}}));
  test_.makeFile("first/a.kvs", "{}");
  EXPECT_EQ(manifests_.manifestForIdentifier("a")->entitlements, Dictionary());
  EXPECT_EQ(manifests_.manifestForIdentifier("a.kvs"), std::nullopt);
  EXPECT_EQ(manifests_.manifestForIdentifier(""), std::nullopt);
}

TEST_F(ApplicationManifestsTest, EntitlementsAreOfTheManifestThatMatched) {
  write("first/a.kvs", test_.makeFile("bin/other", ""), R"(, "Entitlements": {"strong": true})");
  write("second/a.kvs", program_, R"(, "Entitlements": {"weak": true})");
  struct stat status {};
  ASSERT_EQ(::stat(program_.c_str(), &status), 0);
  EXPECT_EQ(manifests_.manifestForExecutable(status.st_dev, status.st_ino)->entitlements, Dictionary({{"weak", true}}));
}

TEST_F(ApplicationManifestsTest, UnusableManifestIsLeftOutAndTheOthersStay) {
  test_.makeFile("first/a.kvs", "{");
  test_.makeFile("first/b.kvs", R"({"Executable": 1})");
  test_.makeFile("first/c.kvs", R"({"Executable": "editor"})");
  write("first/d.kvs", program_, R"(, "Entitlements": [])");
  test_.makeDirectory("first/e.kvs");
  ASSERT_EQ(::mkfifo((test_ / "first/f.kvs").c_str(), 0600), 0);
  test_.makeLink("first/g.kvs", "absent");
  write("first/.h.kvs", program_);
  write("first/.kvs", program_);
  write("first/i.txt", program_);
  write("first/j.kvs", test_ / "absent");
  for (const char *name : {"a", "b", "c", "d", "e", "f", "g", ".h", "", "i"}) {
    EXPECT_EQ(manifests_.manifestForIdentifier(name), std::nullopt) << name;
  }
  EXPECT_EQ(identifierFor(program_), "none");
  write("first/z.kvs", program_);
  EXPECT_EQ(identifierFor(program_), "z");
  write("first/a.kvs", program_);
  EXPECT_EQ(identifierFor(program_), "a");
}

TEST_F(ApplicationManifestsTest, UnusableManifestIsLoggedOnceForEachState) {
  TestLog log;
  const std::string path = test_.makeFile("first/a.kvs", "{");
  for (int i = 0; i < 3; ++i) EXPECT_EQ(manifests_.manifestForIdentifier("a"), std::nullopt);
  EXPECT_THAT(log.take(), ElementsAre(StartsWith("[NOTICE] Leaving out the application manifest " + path + ": " + path +
                                                 ": line 1, column 2 (byte 2): ")));
  test_.makeFile("first/a.kvs", R"({"Executable": "editor"})");
  for (int i = 0; i < 3; ++i) EXPECT_EQ(manifests_.manifestForIdentifier("a"), std::nullopt);
  EXPECT_THAT(log.take(), ElementsAre("[NOTICE] Leaving out the application manifest " + path +
                                      ": \"Executable\" is not an absolute path"));
  test_.makeFile("first/a.kvs", R"({"Entitlements": ["x"]})");
  EXPECT_EQ(manifests_.manifestForIdentifier("a"), std::nullopt);
  EXPECT_THAT(log.take(), ElementsAre("[NOTICE] Leaving out the application manifest " + path +
                                      ": \"Entitlements\" is not a dictionary"));
}

TEST_F(ApplicationManifestsTest, DirectoryThatCannotBeReadIsLoggedOnceAndReadWhenItCan) {
  EXPECT_TRUE(holdsWithoutRoot([] {
    TestLog log;
    const TestDirectory own;
    own.makeFile("applications/a.kvs", "{}");
    ApplicationManifests manifests({own / "applications"});
    bool holds = ::chmod((own / "applications").c_str(), 0300) == 0;
    for (int i = 0; i < 3; ++i) holds = holds && !manifests.manifestForIdentifier("a");
    const std::vector<std::string> lines = log.take();
    holds = holds && lines.size() == 1 && lines.front().starts_with("[NOTICE] Application manifests are left out. ");
    holds = holds && ::chmod((own / "applications").c_str(), 0700) == 0;
    return holds && manifests.manifestForIdentifier("a");
  }));
}

TEST_F(ApplicationManifestsTest, ManifestNeedNotNameAProgram) {
  test_.makeFile("first/a.kvs", R"({"Entitlements": {"x": true}})");
  EXPECT_EQ(manifests_.manifestForIdentifier("a")->entitlements, Dictionary({{"x", true}}));
}

}  // namespace
}  // namespace storix::linuxhost
