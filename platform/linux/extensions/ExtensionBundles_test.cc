#include "platform/linux/extensions/ExtensionBundles.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include "platform/linux/HostErrors.h"
#include "platform/linux/TestDirectory.h"

namespace storix::linuxhost {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

class NoObserver : public DirectoryReadingObserver {
 public:
  void willReadExtensionDirectory(const std::string &) override {}
  void willReadBundle(const std::string &) override {}
};

class ExtensionBundlesTest : public ::testing::Test {
 protected:
  void install(const std::string &bundle, const std::string &info) {
    directory_.makeFile(bundle + ".appdex/Info.kvs", info);
  }

  BundleScan scan() {
    NoObserver observer;
    return scanExtensionBundles(places_, observer);
  }

  std::vector<std::string> namesOf(const BundleScan &scan) {
    std::vector<std::string> names;
    for (const auto &bundle : scan.bundles) names.push_back(bundle->path.substr(directory_.path().size() + 1));
    return names;
  }

  std::string problemOf(const std::string &info) {
    install("a/x", info);
    const BundleScan found = scan();
    EXPECT_THAT(found.bundles, IsEmpty());
    if (found.bundleProblems.size() != 1) return "not one problem";
    EXPECT_EQ(found.bundleProblems[0].path, directory_ / "a/x.appdex/Info.kvs");
    return found.bundleProblems[0].error.message();
  }

  ExtensionBundle bundleWith(const std::string &executable) {
    ExtensionBundle bundle;
    bundle.path = "/x.appdex";
    bundle.info.emplace("KTBundleExecutable", executable);
    return bundle;
  }

  TestDirectory directory_;
  ExtensionPlaces places_{{directory_ / "a", directory_ / "b"}, directory_ / "data/groups"};
};

TEST_F(ExtensionBundlesTest, EveryFieldOfABundleIsRead) {
  install("a/docs", R"({"KTBundleIdentifier": "org.sample.docs", "KTBundleExecutable": "run", "KTBundleVersion": "7",
                        "KTGroupContainers": ["group.a", "group.b"], "KTExtensionPointIdentifier": "point",
                        "KTExtension": {"KTExtensionStorixDocumentGroup": "group.b"}})");
  const BundleScan found = scan();
  ASSERT_EQ(found.bundles.size(), 1U);
  const ExtensionBundle &bundle = *found.bundles[0];
  EXPECT_EQ(bundle.path, directory_ / "a/docs.appdex");
  EXPECT_EQ(bundle.identifier, "org.sample.docs");
  EXPECT_EQ(bundle.version, "7");
  EXPECT_EQ(bundle.extensionPoint, "point");
  EXPECT_THAT(bundle.groups, ElementsAre("group.a", "group.b"));
  EXPECT_EQ(bundle.documentGroup(), "group.b");
  EXPECT_EQ(bundle.executablePath().value(), directory_ / "a/docs.appdex/run");
}

TEST_F(ExtensionBundlesTest, WishesForTheSandboxAreReadAndOnesThatAreMalformedLeaveTheBundleOut) {
  install("b/good", R"({"KTSandbox": {"network": true, "readOnly": ["~/Music"]}})");
  EXPECT_EQ(scan().bundles.at(0)->wishes, (ConfinementWishes{true, {"~/Music"}, {}}));
  std::filesystem::remove_all(directory_ / "b");
  EXPECT_EQ(problemOf(R"({"KTSandbox": {"network": 1}})"), "\"network\" in \"KTSandbox\" must be true or false.");
}

TEST_F(ExtensionBundlesTest, BundlesComeInTheOrderOfDirectoriesThenOfNames) {
  install("b/a", R"({"KTBundleIdentifier": "1"})");
  install("a/z", R"({"KTBundleIdentifier": "2"})");
  install("a/c", R"({"KTBundleIdentifier": "3"})");
  EXPECT_THAT(namesOf(scan()), ElementsAre("a/c.appdex", "a/z.appdex", "b/a.appdex"));
}

TEST_F(ExtensionBundlesTest, FirstBundleWithAnIdentifierWins) {
  install("b/a", R"({"KTBundleIdentifier": "same"})");
  install("a/z", R"({"KTBundleIdentifier": "same"})");
  const BundleScan found = scan();
  EXPECT_THAT(namesOf(found), ElementsAre("a/z.appdex"));
  EXPECT_THAT(found.bundleProblems, IsEmpty());
}

TEST_F(ExtensionBundlesTest, MissingAndEmptyIdentifiersAreAbsentAndDoNotCollide) {
  install("a/x", R"({})");
  install("a/y", R"({"KTBundleIdentifier": ""})");
  install("a/z", R"({"KTBundleIdentifier": ""})");
  const BundleScan found = scan();
  ASSERT_EQ(found.bundles.size(), 3U);
  for (const auto &bundle : found.bundles) EXPECT_EQ(bundle->identifier, std::nullopt);
}

TEST_F(ExtensionBundlesTest, OtherNamesInTheDirectoryAreNoBundles) {
  directory_.makeFile("a/readme", "x");
  directory_.makeDirectory("a/other");
  directory_.makeDirectory("a/.appdex");
  const BundleScan found = scan();
  EXPECT_THAT(found.bundles, IsEmpty());
  EXPECT_THAT(found.bundleProblems, IsEmpty());
}

TEST_F(ExtensionBundlesTest, MissingDirectoryIsNoProblemAndAFileInItsPlaceIsOne) {
  EXPECT_THAT(scan().directoryProblems, IsEmpty());
  directory_.makeFile("b", "x");
  const BundleScan found = scan();
  ASSERT_EQ(found.directoryProblems.size(), 1U);
  EXPECT_EQ(found.directoryProblems[0].path, directory_ / "b");
  EXPECT_EQ(found.directoryProblems[0].error.domain(), posixErrorDomain);
}

TEST_F(ExtensionBundlesTest, MalformedInfoIsLeftOutWithFileAndReasonAndOthersStay) {
  install("a/bad", "{");
  install("a/good", R"({"KTBundleIdentifier": "good"})");
  directory_.makeDirectory("a/none.appdex");
  directory_.makeFile("a/file.appdex", "x");
  const BundleScan found = scan();
  EXPECT_THAT(namesOf(found), ElementsAre("a/good.appdex"));
  ASSERT_EQ(found.bundleProblems.size(), 3U);
  EXPECT_EQ(found.bundleProblems[0].path, directory_ / "a/bad.appdex/Info.kvs");
  EXPECT_EQ(found.bundleProblems[1].path, directory_ / "a/file.appdex/Info.kvs");
  EXPECT_EQ(found.bundleProblems[1].error.code(), ENOTDIR);
  EXPECT_EQ(found.bundleProblems[2].path, directory_ / "a/none.appdex/Info.kvs");
  EXPECT_EQ(found.bundleProblems[2].error.code(), ENOENT);
}

TEST_F(ExtensionBundlesTest, ValuesOfTheWrongKindAreMalformed) {
  EXPECT_THAT(problemOf(R"({"KTBundleIdentifier": 1})"), HasSubstr("KTBundleIdentifier"));
  EXPECT_THAT(problemOf(R"({"KTBundleVersion": 1})"), HasSubstr("KTBundleVersion"));
  EXPECT_THAT(problemOf(R"({"KTExtensionPointIdentifier": []})"), HasSubstr("KTExtensionPointIdentifier"));
  EXPECT_THAT(problemOf(R"({"KTGroupContainers": "group"})"), HasSubstr("KTGroupContainers"));
  EXPECT_THAT(problemOf(R"({"KTGroupContainers": [1]})"), HasSubstr("KTGroupContainers"));
}

TEST_F(ExtensionBundlesTest, GroupIdentifiersThatLeadElsewhereAreMalformed) {
  for (const char *group : {"", ".", "..", "a/b", "/a", "a\\u0000b"}) {
    EXPECT_THAT(problemOf(R"({"KTGroupContainers": [")" + std::string(group) + R"("]})"),
                HasSubstr("KTGroupContainers"))
        << group;
  }
}

TEST_F(ExtensionBundlesTest, BundlesAreEqualOnlyWithTheSamePathAndTheSameInfo) {
  install("a/x", R"({"KTBundleIdentifier": "id", "KTExtension": {"k": 1}})");
  const auto first = scan().bundles.at(0);
  EXPECT_EQ(*first, *scan().bundles.at(0));
  install("a/x", R"({"KTBundleIdentifier": "id", "KTExtension": {"k": 2}})");
  EXPECT_NE(*first, *scan().bundles.at(0));
  std::filesystem::remove_all(directory_ / "a");
  install("b/x", R"({"KTBundleIdentifier": "id", "KTExtension": {"k": 1}})");
  EXPECT_NE(*first, *scan().bundles.at(0));
}

TEST_F(ExtensionBundlesTest, ExecutableIsANameInsideTheBundle) {
  EXPECT_EQ(bundleWith("run").executablePath().value(), "/x.appdex/run");
  EXPECT_EQ(bundleWith("bin/a..b").executablePath().value(), "/x.appdex/bin/a..b");
  for (const std::string &name : {std::string(), std::string("/bin/sh"), std::string(".."), std::string("../run"),
                                  std::string("bin/../../run"), std::string("bin/.."), std::string("a\0b", 3)}) {
    const Result<std::string> path = bundleWith(name).executablePath();
    ASSERT_FALSE(path.ok()) << name;
    EXPECT_EQ(path.error().domain(), platformErrorDomain);
    EXPECT_EQ(path.error().code(), static_cast<std::int64_t>(HostErrorCode::noExecutable));
    EXPECT_THAT(path.error().message(), HasSubstr("KTBundleExecutable"));
  }
}

TEST_F(ExtensionBundlesTest, DocumentGroupMustBeAGroupOfTheBundle) {
  ExtensionBundle bundle;
  EXPECT_EQ(bundle.documentGroup(), std::nullopt);
  bundle.info.emplace("KTExtension", Dictionary{{"KTExtensionStorixDocumentGroup", "theirs"}});
  bundle.groups = {"ours"};
  EXPECT_EQ(bundle.documentGroup(), std::nullopt);
  bundle.groups.emplace_back("theirs");
  EXPECT_EQ(bundle.documentGroup(), "theirs");
}

TEST_F(ExtensionBundlesTest, GroupContainersAreMadeForTheirOwnerAlone) {
  ExtensionBundle bundle;
  bundle.groups = {"group.a", "group.b"};
  EXPECT_THAT(makeGroupContainers(places_, bundle), IsEmpty());
  for (const char *path : {"data", "data/groups", "data/groups/group.a", "data/groups/group.b"}) {
    struct stat status {};
    ASSERT_EQ(::stat((directory_ / path).c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777U, 0700U) << path;
  }
  EXPECT_THAT(makeGroupContainers(places_, bundle), IsEmpty());
}

TEST_F(ExtensionBundlesTest, GroupContainerThatCannotBeMadeIsReported) {
  directory_.makeFile("data/groups/group.a", "in the way");
  ExtensionBundle bundle;
  bundle.groups = {"group.a", "group.b"};
  const std::vector<BundleProblem> problems = makeGroupContainers(places_, bundle);
  ASSERT_EQ(problems.size(), 1U);
  EXPECT_EQ(problems[0].path, directory_ / "data/groups/group.a");
  EXPECT_TRUE(std::filesystem::is_directory(directory_ / "data/groups/group.b"));
}

TEST_F(ExtensionBundlesTest, BundleRecordGivesValuesOfTheExpectedKindAndTheContainers) {
  install("a/x", R"({"KTExtension": {"k": "v"}, "KTBundleVersion": "1", "KTGroupContainers": ["group.a"]})");
  const std::shared_ptr<BundleRecord> record = makeBundleRecord(scan().bundles.at(0), places_);
  const std::optional<Value> extension = record->infoDictionaryValue("KTExtension", ValueKind::dictionary);
  ASSERT_TRUE(extension);
  EXPECT_EQ(*extension, Value(Dictionary{{"k", "v"}}));
  EXPECT_FALSE(record->infoDictionaryValue("KTExtension", ValueKind::string));
  EXPECT_FALSE(record->infoDictionaryValue("missing", ValueKind::string));
  const std::map<std::string, URL> containers = record->groupContainerURLs();
  ASSERT_EQ(containers.size(), 1U);
  EXPECT_EQ(containers.at("group.a"), *URL::fileURLWithPath(directory_ / "data/groups/group.a", true));
}

TEST_F(ExtensionBundlesTest, ObserverHearsOfEachDirectoryBeforeItIsRead) {
  // Puts a bundle into each directory at the last moment: it must be found.
  class LateInstaller : public DirectoryReadingObserver {
   public:
    explicit LateInstaller(TestDirectory &directory) : directory_(directory) {}
    void willReadExtensionDirectory(const std::string &path) override {
      directory_.makeDirectory(path.substr(directory_.path().size() + 1) + "/late.appdex");
    }
    void willReadBundle(const std::string &path) override {
      directory_.makeFile(path.substr(directory_.path().size() + 1) + "/Info.kvs", "{}");
    }

   private:
    TestDirectory &directory_;
  };
  LateInstaller installer(directory_);
  EXPECT_THAT(namesOf(scanExtensionBundles(places_, installer)), ElementsAre("a/late.appdex", "b/late.appdex"));
}

TEST_F(ExtensionBundlesTest, OnlyTheLackOfResourcesIsTransient) {
  EXPECT_TRUE((BundleProblem{"x", posixError(EMFILE, "x")}.isTransient()));
  EXPECT_TRUE((BundleProblem{"x", posixError(ENFILE, "x")}.isTransient()));
  EXPECT_FALSE((BundleProblem{"x", posixError(EACCES, "x")}.isTransient()));
  EXPECT_FALSE((BundleProblem{"x", SXError("other", EMFILE)}.isTransient()));
}

}  // namespace
}  // namespace storix::linuxhost
