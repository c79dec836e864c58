#include "platform/linux/files/DirectoryRelationship.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/linux/TestDirectory.h"
#include "platform/linux/TestUser.h"
#include "platform/linux/files/ResolvedPath.h"

namespace storix::linuxhost {
namespace {

constexpr auto contains = DirectoryRelationship::contains;
constexpr auto same = DirectoryRelationship::same;
constexpr auto other = DirectoryRelationship::other;

class DirectoryRelationshipTest : public ::testing::Test {
 protected:
  DirectoryRelationshipTest() { directory_ = test_.makeDirectory("provider/Storix Storage"); }

  [[nodiscard]] std::optional<DirectoryRelationship> relationshipTo(const std::string &directory,
                                                                    const std::string &item) const {
    const Result<DirectoryRelationship> result =
        directoryRelationship(URL::fileURLWithPath(directory, true), URL::fileURLWithPath(item));
    if (result) return result.value();
    ADD_FAILURE() << result.error().message();
    return std::nullopt;
  }
  [[nodiscard]] std::optional<DirectoryRelationship> relationshipOf(const std::string &item) const {
    return relationshipTo(directory_, item);
  }

  TestDirectory test_;
  std::string directory_;
};

TEST_F(DirectoryRelationshipTest, DirectoryItselfIsTheSame) {
  EXPECT_EQ(relationshipOf(directory_), same);
  EXPECT_EQ(relationshipOf(directory_ + "/"), same);
  EXPECT_EQ(relationshipOf(directory_ + "/."), same);
  EXPECT_EQ(relationshipOf(directory_ + "/../Storix Storage"), same);
  EXPECT_EQ(relationshipOf("//" + directory_ + "//"), same);
  EXPECT_EQ(relationshipTo("/", "/"), same);
}

TEST_F(DirectoryRelationshipTest, WhatIsInItIsContained) {
  test_.makeFile("provider/Storix Storage/sub/a b%é", "");
  EXPECT_EQ(relationshipOf(directory_ + "/sub/a b%é"), contains);
  EXPECT_EQ(relationshipOf(directory_ + "/sub/"), contains);
  EXPECT_EQ(relationshipTo("/", directory_), contains);
}

TEST_F(DirectoryRelationshipTest, WholeComponentsDecide) {
  test_.makeFile("provider/Storix Storage 2/a", "");
  EXPECT_EQ(relationshipOf(directory_ + " 2/a"), other);
  EXPECT_EQ(relationshipOf(directory_ + "x"), other);
  EXPECT_EQ(relationshipOf(test_ / "provider"), other);
  EXPECT_EQ(relationshipOf("/"), other);
}

TEST_F(DirectoryRelationshipTest, ItemNeedNotExist) {
  EXPECT_EQ(relationshipOf(directory_ + "/absent"), contains);
  EXPECT_EQ(relationshipOf(directory_ + "/absent/deep/a"), contains);
  EXPECT_EQ(relationshipOf(test_ / "absent/a"), other);
  EXPECT_EQ(relationshipOf("/absent/a"), other);
  EXPECT_EQ(relationshipOf(directory_ + "/" + std::string(300, 'a')), contains);
  test_.makeFile("provider/Storix Storage/file", "");
  EXPECT_EQ(relationshipOf(directory_ + "/file/below"), contains);
}

TEST_F(DirectoryRelationshipTest, GoingUpIsResolved) {
  test_.makeDirectory("provider/Storix Storage/sub");
  EXPECT_EQ(relationshipOf(directory_ + "/sub/../../outside"), other);
  EXPECT_EQ(relationshipOf(directory_ + "/sub/../a"), contains);
  EXPECT_EQ(relationshipOf(directory_ + "/absent/../a"), contains);
  EXPECT_EQ(relationshipOf(directory_ + "/absent/../../outside"), other);
  EXPECT_EQ(relationshipOf(directory_ + "/absent/.."), same);
  EXPECT_EQ(relationshipOf(directory_ + "/absent/../../../../../../../../../.." + directory_ + "/a"), contains);
  EXPECT_EQ(relationshipOf(test_ / "provider/absent/../Storix Storage/a"), contains);
}

TEST_F(DirectoryRelationshipTest, LinkLeadsOutAndIn) {
  test_.makeDirectory("outside/sub");
  test_.makeLink("provider/Storix Storage/out", test_ / "outside");
  test_.makeLink("outside/in", directory_);
  EXPECT_EQ(relationshipOf(directory_ + "/out"), other);
  EXPECT_EQ(relationshipOf(directory_ + "/out/absent"), other);
  EXPECT_EQ(relationshipOf(test_ / "outside/in"), same);
  EXPECT_EQ(relationshipOf(test_ / "outside/in/absent"), contains);
  // Up from where the link leads, not from where it stands.
  test_.makeLink("provider/Storix Storage/deep", test_ / "outside/sub");
  EXPECT_EQ(relationshipOf(directory_ + "/deep/../a"), other);
  // Existing again after a part that does not exist.
  EXPECT_EQ(relationshipOf(directory_ + "/absent/../out/a"), other);
}

TEST_F(DirectoryRelationshipTest, LinkToWhatIsAbsentCountsAsWhereItLeads) {
  test_.makeLink("provider/Storix Storage/dangling", test_ / "absent");
  test_.makeLink("provider/Storix Storage/relative", "../absent");
  test_.makeLink("provider/Storix Storage/inside", "absent");
  EXPECT_EQ(relationshipOf(directory_ + "/dangling"), other);
  EXPECT_EQ(relationshipOf(directory_ + "/dangling/a"), other);
  EXPECT_EQ(relationshipOf(directory_ + "/relative"), other);
  EXPECT_EQ(relationshipOf(directory_ + "/inside"), contains);
}

TEST_F(DirectoryRelationshipTest, DirectoryGivenByALinkIsResolved) {
  test_.makeLink("link", directory_);
  EXPECT_EQ(relationshipTo(test_ / "link", directory_ + "/a"), contains);
  EXPECT_EQ(relationshipTo(test_ / "link", test_ / "link"), same);
  EXPECT_EQ(relationshipTo(test_ / "link", test_ / "link/../link/a"), other) << "up from the link's end";
}

TEST_F(DirectoryRelationshipTest, DirectoryThatIsAFileIsComparedAllTheSame) {
  const std::string file = test_.makeFile("file", "");
  EXPECT_EQ(directoryRelationship(URL::fileURLWithPath(file), URL::fileURLWithPath(file)).value(), same);
  EXPECT_EQ(directoryRelationship(URL::fileURLWithPath(file), URL::fileURLWithPath(directory_)).value(), other);
}

TEST_F(DirectoryRelationshipTest, AbsentDirectoryIsFileNotFoundWithItsUrl) {
  for (const std::string &path : {test_ / "absent", test_.makeFile("file", "") + "/below"}) {
    const URL url = *URL::fileURLWithPath(path, true);
    const Result<DirectoryRelationship> result = directoryRelationship(url, URL::fileURLWithPath(directory_));
    ASSERT_FALSE(result);
    EXPECT_TRUE(isFileNotFoundForReading(result.error()));
    EXPECT_EQ(result.error().urlDetail("URL"), url);
  }
  test_.makeLink("dangling", test_ / "absent");
  EXPECT_TRUE(isFileNotFoundForReading(
      directoryRelationship(URL::fileURLWithPath(test_ / "dangling"), URL::fileURLWithPath(directory_)).error()));
}

TEST_F(DirectoryRelationshipTest, WhatCannotBeLookedAtIsAnErrorOfItsOwn) {
  test_.makeLink("loop", "loop");
  const auto toLoop = directoryRelationship(URL::fileURLWithPath(directory_), URL::fileURLWithPath(test_ / "loop/a"));
  ASSERT_FALSE(toLoop);
  EXPECT_EQ(toLoop.error().code(), ELOOP);
  const auto ofLoop = directoryRelationship(URL::fileURLWithPath(test_ / "loop"), URL::fileURLWithPath(directory_));
  ASSERT_FALSE(ofLoop);
  EXPECT_FALSE(isFileNotFoundForReading(ofLoop.error()));
  std::string longPath;
  while (longPath.size() < 5000) longPath += "/component";
  EXPECT_EQ(directoryRelationship(URL::fileURLWithPath(directory_), URL::fileURLWithPath(longPath)).error().code(),
            ENAMETOOLONG);
}

TEST_F(DirectoryRelationshipTest, ForbiddenDirectoryIsNotAnAbsentOne) {
  EXPECT_TRUE(holdsWithoutRoot([] {
    const TestDirectory own;
    const std::string inside = own.makeDirectory("closed/inside");
    if (::chmod((own / "closed").c_str(), 0) != 0) return false;
    const auto ofDirectory = directoryRelationship(URL::fileURLWithPath(inside), URL::fileURLWithPath(own.path()));
    const auto ofItem = directoryRelationship(URL::fileURLWithPath(own.path()), URL::fileURLWithPath(inside + "/a"));
    ::chmod((own / "closed").c_str(), 0700);
    return !ofDirectory && ofDirectory.error().code() == EACCES && !ofItem && ofItem.error().code() == EACCES;
  }));
}

TEST_F(DirectoryRelationshipTest, AbsentArgumentIsAnError) {
  EXPECT_FALSE(directoryRelationship(std::nullopt, URL::fileURLWithPath(directory_)));
  EXPECT_FALSE(directoryRelationship(URL::fileURLWithPath(directory_), std::nullopt));
}

TEST_F(DirectoryRelationshipTest, NameThatLooksDeletedIsAName) {
  const std::string odd = test_.makeDirectory("odd (deleted)");
  EXPECT_EQ(relationshipTo(odd, odd + "/a"), contains);
}

TEST_F(DirectoryRelationshipTest, ChangedLinkIsSeenAtOnce) {
  const std::string elsewhere = test_.makeDirectory("elsewhere");
  test_.makeLink("link", directory_);
  EXPECT_EQ(relationshipOf(test_ / "link/a"), contains);
  std::filesystem::remove(test_ / "link");
  test_.makeLink("link", elsewhere);
  EXPECT_EQ(relationshipOf(test_ / "link/a"), other);
}

TEST_F(DirectoryRelationshipTest, LookupOverManyDirectoriesFindsTheOneThatHoldsTheItem) {
  test_.makeFile("provider/Storix Storage/sub/a", "");
  test_.makeLink("link", directory_ + "/sub");
  const std::string second = test_.makeDirectory("second");
  const std::string third = test_.makeDirectory("third");
  for (const std::string &item : {directory_ + "/sub/a", directory_ + "/absent/a", test_ / "link/a",
                                  test_ / "link/absent", test_ / "third/../link/a"}) {
    EXPECT_EQ(relationshipTo(second, item), other) << item;
    EXPECT_EQ(relationshipTo(third, item), other) << item;
    EXPECT_EQ(relationshipTo(test_ / "link/..", item), contains) << item;
    EXPECT_EQ(relationshipTo(third, item), other) << item;
    EXPECT_EQ(relationshipTo(directory_, item), contains) << item;
    EXPECT_EQ(relationshipTo(third, item), other) << item;
    EXPECT_EQ(relationshipTo("/", item), contains) << item;
  }
}

TEST_F(DirectoryRelationshipTest, LookupFindsTheItemToBeADirectoryItself) {
  const std::string second = test_.makeDirectory("second");
  test_.makeLink("link", directory_);
  EXPECT_EQ(relationshipTo(second, test_ / "link"), other);
  EXPECT_EQ(relationshipTo(test_ / "provider/../second", test_ / "link"), other);
  EXPECT_EQ(relationshipTo(directory_, test_ / "link"), same);
}

TEST_F(DirectoryRelationshipTest, WhatALookupKnowsNeverMakesADirectoryHoldWhatLeftIt) {
  const std::string second = test_.makeDirectory("second");
  test_.makeFile("provider/Storix Storage/a", "");
  test_.makeLink("link", directory_);
  EXPECT_EQ(relationshipTo(second, test_ / "link/a"), other);
  std::filesystem::remove(test_ / "link");
  test_.makeLink("link", test_ / "elsewhere");
  EXPECT_EQ(relationshipTo(directory_, test_ / "link/a"), other);
}

TEST_F(DirectoryRelationshipTest, NextLookupSeesWhereTheItemIsNow) {
  const std::string second = test_.makeDirectory("second");
  test_.makeLink("link", test_ / "elsewhere");
  EXPECT_EQ(relationshipTo(second, test_ / "link/a"), other);
  EXPECT_EQ(relationshipTo(directory_, test_ / "link/a"), other);
  std::filesystem::remove(test_ / "link");
  test_.makeLink("link", directory_);
  EXPECT_EQ(relationshipTo(second, test_ / "link/a"), other);
  EXPECT_EQ(relationshipTo(directory_, test_ / "link/a"), contains);
}

TEST_F(DirectoryRelationshipTest, DirectoryThatMovedIsFoundWhereItIs) {
  const std::string second = test_.makeDirectory("second");
  const std::string third = test_.makeDirectory("third");
  test_.makeFile("third/a", "");
  EXPECT_EQ(relationshipTo(second, test_ / "third/a"), other);
  EXPECT_EQ(relationshipTo(directory_, test_ / "third/a"), other);
  std::filesystem::remove(directory_);
  test_.makeLink("provider/Storix Storage", third);
  EXPECT_EQ(relationshipTo(directory_, test_ / "third/a"), contains);
}

TEST(ResolvedPath, RelativePathAndZeroByteAreRefused) {
  EXPECT_FALSE(resolvePath("a/b"));
  EXPECT_FALSE(resolvePath(""));
  EXPECT_FALSE(resolvePath(std::string("/a\0b", 4)));
  EXPECT_FALSE(resolveExistingPath("."));
}

TEST(ResolvedPath, PathBelowCountsWholeComponents) {
  EXPECT_EQ(pathBelow("/a", "/a"), "");
  EXPECT_EQ(pathBelow("/a", "/a/b/c"), "b/c");
  EXPECT_EQ(pathBelow("/a", "/ab"), std::nullopt);
  EXPECT_EQ(pathBelow("/a/b", "/a"), std::nullopt);
  EXPECT_EQ(pathBelow("/", "/a"), "a");
  EXPECT_EQ(pathBelow("/", "/"), "");
}

}  // namespace
}  // namespace storix::linuxhost
