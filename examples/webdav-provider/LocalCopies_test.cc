#include "examples/webdav-provider/LocalCopies.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "examples/folder-provider/TemporaryFolder.h"
#include "examples/webdav-provider/ContentHash.h"

namespace storix::example {
namespace {

namespace fs = std::filesystem;
using ::testing::UnorderedElementsAre;

class LocalCopiesTest : public ::testing::Test {
 protected:
  LocalCopiesTest() { fs::create_directory(folder_.path("items")); }
  LocalCopies copies() { return std::move(LocalCopies::open(folder_.path("items")).value()); }
  ItemStates states() { return std::move(ItemStates::open(folder_.root()).value()); }
  std::string read(const std::string &path) { return folder_.read("items/" + path); }
  /// A download of that content.
  UniqueFd partial(const std::string &path, const std::string &content) {
    auto file = copies().openPartial(path, 0);
    EXPECT_TRUE(file.ok());
    EXPECT_EQ(::pwrite(file.value().get(), content.data(), content.size(), 0), static_cast<ssize_t>(content.size()));
    return std::move(file.value());
  }
  TemporaryFolder folder_;
};

TEST_F(LocalCopiesTest, ADownloadGetsTheItemsNameAndTheServersTime) {
  const UniqueFd file = partial("a/b.txt", "hello");
  const auto stamp = copies().place("a/b.txt", file.get(), 1'000'000'000, LocalCopies::Replacing::no);
  ASSERT_TRUE(stamp.ok());
  EXPECT_EQ(read("a/b.txt"), "hello");
  EXPECT_EQ(stamp.value().seconds, 1'000'000'000);
  EXPECT_EQ(copies().find("a/b.txt").value()->stamp, stamp.value());
}

TEST_F(LocalCopiesTest, AFileIsReplacedOnlyWhereThatIsWanted) {
  folder_.write("items/a", "mine");
  const UniqueFd file = partial("a", "theirs");
  const auto refused = copies().place("a", file.get(), {}, LocalCopies::Replacing::no);
  ASSERT_FALSE(refused.ok());
  EXPECT_EQ(refused.error().code(), EEXIST);
  EXPECT_EQ(read("a"), "mine");
  fs::permissions(folder_.path("items/a"), fs::perms(0640));
  EXPECT_TRUE(copies().place("a", file.get(), {}, LocalCopies::Replacing::yes).ok());
  EXPECT_EQ(read("a"), "theirs");
  EXPECT_EQ(fs::status(folder_.path("items/a")).permissions(), fs::perms(0640));
}

TEST_F(LocalCopiesTest, OfAPartOnlyWhatIsGoodIsKept) {
  partial("a", "0123456789");
  EXPECT_EQ(::lseek(copies().openPartial("a", 4).value().get(), 0, SEEK_END), 4);
  EXPECT_EQ(::lseek(copies().openPartial("a", 5).value().get(), 0, SEEK_END), 0);
}

TEST_F(LocalCopiesTest, PartsThatAreRememberedStayWhenOthersAreDiscarded) {
  partial("remembered", "x");
  partial("finished", "x");
  partial("forgotten", "x");
  ItemState state;
  ASSERT_EQ(states().write("finished", state), std::nullopt);
  state.partialLength = 1;
  ASSERT_EQ(states().write("remembered", state), std::nullopt);
  copies().discardForgotten(states());
  const auto is = [this](const std::string &path) {
    return fs::exists(folder_.path("items/.incoming/" + ItemStates::key(path)));
  };
  EXPECT_TRUE(is("remembered"));
  EXPECT_FALSE(is("finished"));
  EXPECT_FALSE(is("forgotten"));
}

TEST_F(LocalCopiesTest, AConflictTakesTheFirstNameThatIsFree) {
  folder_.write("items/a.txt", "mine");
  folder_.write("items/a (conflict).txt", "older");
  EXPECT_EQ(copies().keepUnderConflictName("a.txt").value(), "a (conflict 2).txt");
  EXPECT_EQ(read("a (conflict).txt"), "older");
  EXPECT_EQ(read("a (conflict 2).txt"), "mine");
  EXPECT_EQ(read("a.txt"), "mine");
}

TEST_F(LocalCopiesTest, ItemsAreTheVisibleFiles) {
  fs::create_directories(folder_.path("items/a/b"));
  fs::create_directories(folder_.path("items/.incoming"));
  folder_.write("items/x", "");
  folder_.write("items/.x", "");
  folder_.write("items/a/b/y", "");
  folder_.write("items/.incoming/z", "");
  fs::create_symlink("x", folder_.path("items/link"));
  EXPECT_THAT(copies().items(), UnorderedElementsAre("x", "a/b/y"));
}

TEST_F(LocalCopiesTest, StatesAreReadAsTheyWereWritten) {
  ItemState state;
  state.etag = "W/\"x\"";
  state.version = "\"x\"";
  state.hash = "00ff";
  state.stamp = {1, 2, 3, 4};
  state.partialETag = "\"y\"";
  state.partialLength = std::int64_t{1} << 40;
  const std::string path = "a/50% \xC3\xA9";
  EXPECT_FALSE(states().read(path));
  ASSERT_EQ(states().write(path, state), std::nullopt);
  const auto read = states().read(path);
  ASSERT_TRUE(read);
  EXPECT_EQ(read->etag, state.etag);
  EXPECT_EQ(read->version, state.version);
  EXPECT_EQ(read->hash, state.hash);
  EXPECT_EQ(read->stamp, state.stamp);
  EXPECT_EQ(read->partialETag, state.partialETag);
  EXPECT_EQ(read->partialLength, state.partialLength);
  ASSERT_EQ(states().remove(path), std::nullopt);
  EXPECT_FALSE(states().read(path));
}

TEST(ConflictName, StandsBeforeTheEndingAndCountsOn) {
  EXPECT_EQ(conflictName("a.txt", 1), "a (conflict).txt");
  EXPECT_EQ(conflictName("a.txt", 2), "a (conflict 2).txt");
  EXPECT_EQ(conflictName("a.b/c", 1), "a.b/c (conflict)");
  EXPECT_EQ(conflictName("a.b/c.tar.gz", 1), "a.b/c.tar (conflict).gz");
  EXPECT_EQ(conflictName("a (conflict).txt", 1), "a (conflict 2).txt");
  EXPECT_EQ(conflictName("a (conflict 7).txt", 1), "a (conflict 8).txt");
  EXPECT_EQ(conflictName("a (conflict x).txt", 1), "a (conflict x) (conflict).txt");
  EXPECT_EQ(conflictName("a (conflict 1).txt", 1), "a (conflict 1) (conflict).txt");
  EXPECT_EQ(conflictName("a (conflict 99999999999).txt", 1), "a (conflict 99999999999) (conflict).txt");
}

TEST(ContentHash, TellsContentsApartAndIsTheSameForAFile) {
  TemporaryFolder folder;
  folder.write("a", "hello");
  const UniqueFd file(::open(folder.path("a").c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_EQ(ContentHash::ofFile(file.get()).value(), ContentHash::of("hello"));
  EXPECT_NE(ContentHash::of("hello"), ContentHash::of("Hello"));
  ContentHash hash;
  hash.add("junk");
  hash.reset();
  hash.add("hel");
  hash.add("lo");
  EXPECT_EQ(hash.finish(), ContentHash::of("hello"));
}

}  // namespace
}  // namespace storix::example
