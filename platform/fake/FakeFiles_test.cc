#include "platform/fake/FakeFiles.h"

#include <gtest/gtest.h>

#include "platform/fake/FakeHostTest.h"

namespace storix::fake {
namespace {

// What every host promises is tested in the contract suite; here stand the faults that tests put in.

class FakeFilesTest : public FakeHostTest {
 protected:
  FakeFiles &files() { return platform().files(); }
};

const SXError failure("org.test", 5);

TEST_F(FakeFilesTest, HomeDirectoryIsThere) {
  EXPECT_EQ(platform().homeDirectory(), "/home/u");
  EXPECT_TRUE(platform().fileExists("/home/u"));
}

TEST_F(FakeFilesTest, UnopenableFileIsThereButGivesNoStream) {
  files().writeFile("/a", Dictionary{});
  files().setUnopenable("/a");
  EXPECT_TRUE(platform().fileExists("/a"));
  EXPECT_FALSE(platform().openFileInputStream("/a"));
  files().setUnopenable("/a", false);
  EXPECT_TRUE(platform().openFileInputStream("/a"));
}

TEST_F(FakeFilesTest, ReadErrorIsTheOneGiven) {
  files().writeFile("/a", Dictionary{});
  files().setReadError("/a", failure);
  const auto stream = platform().openFileInputStream("/a");
  ASSERT_TRUE(stream);
  const Result<Value> read = platform().readKeyedValueStream(*stream, KeyedValueMutability::containersAndLeaves);
  ASSERT_FALSE(read);
  EXPECT_EQ(read.error(), failure);
}

TEST_F(FakeFilesTest, StreamOfAnotherHostIsAnError) {
  InputStream stream;
  EXPECT_FALSE(platform().readKeyedValueStream(stream, KeyedValueMutability::immutable));
}

TEST_F(FakeFilesTest, UnwritableFileKeepsItsContent) {
  files().writeFile("/a", Dictionary{{"k", 1}});
  files().setUnwritable("/a");
  EXPECT_FALSE(platform().writeKeyedValueFileAtomically({}, "/a"));
  EXPECT_EQ(files().content("/a"), Value(Dictionary{{"k", 1}}));
  EXPECT_EQ(files().writeCount("/a"), 0U);
  files().setUnwritable("/a", false);
  EXPECT_TRUE(platform().writeKeyedValueFileAtomically({}, "/a"));
  EXPECT_EQ(files().writeCount("/a"), 1U);
}

TEST_F(FakeFilesTest, CorruptFileKeepsItsBytesUntilItIsWritten) {
  files().writeCorruptFile("/a", "{ broken");
  EXPECT_EQ(files().corruptBytes("/a"), "{ broken");
  EXPECT_FALSE(files().content("/a"));
  EXPECT_TRUE(platform().writeKeyedValueFileAtomically({{"k", 1}}, "/a"));
  EXPECT_FALSE(files().corruptBytes("/a"));
  EXPECT_EQ(files().content("/a"), Value(Dictionary{{"k", 1}}));
}

TEST_F(FakeFilesTest, DirectoryThatCannotBeMadeGivesTheErrorGiven) {
  files().setCreateDirectoryError("/home/u/d", failure);
  EXPECT_EQ(platform().createDirectory("/home/u/d", true), failure);
  EXPECT_FALSE(files().exists("/home/u/d"));
}

TEST_F(FakeFilesTest, ComparisonWithADirectoryGivesTheErrorGiven) {
  files().makeDirectory("/d");
  files().setRelationshipError("/d", failure);
  const auto result = platform().directoryRelationship(URL::fileURLWithPath("/d", true), URL::fileURLWithPath("/d/a"));
  ASSERT_FALSE(result);
  EXPECT_EQ(result.error(), failure);
}

TEST_F(FakeFilesTest, EndlessLinksEndTheComparisonAndNothingElse) {
  files().makeSymbolicLink("/d/loop", "/d/loop");
  EXPECT_FALSE(platform().fileExists("/d/loop"));
  const auto result =
      platform().directoryRelationship(URL::fileURLWithPath("/d/loop", true), URL::fileURLWithPath("/d/a"));
  ASSERT_FALSE(result);
  EXPECT_TRUE(isFileNotFoundForReading(result.error()));
}

TEST_F(FakeFilesTest, RemovedDirectoryTakesItsContentAlong) {
  files().writeFile("/d/e/f", "x");
  files().writeFile("/dx", "x");
  files().remove("/d");
  EXPECT_FALSE(files().exists("/d/e/f"));
  EXPECT_FALSE(files().exists("/d"));
  EXPECT_TRUE(files().exists("/dx"));
}

TEST_F(FakeFilesTest, CallsAreTraced) {
  files().writeFile("/a", Dictionary{});
  (void)platform().fileExists("/a");
  const auto stream = platform().openFileInputStream("/a");
  (void)platform().readKeyedValueStream(*stream, KeyedValueMutability::containersAndLeaves);
  (void)platform().createDirectory("/b", true);
  (void)platform().writeKeyedValueFileAtomically({{"k", "v"}}, "/b/c");
  (void)platform().directoryRelationship(URL::fileURLWithPath("/b", true), std::nullopt);
  EXPECT_EQ(platform().trace().take(),
            (std::vector<std::string>{
                "fileExists /a", "openFileInputStream /a", "readKeyedValueStream /a containersAndLeaves",
                "createDirectory /b with intermediates", "writeKeyedValueFileAtomically /b/c {k = v}",
                "directoryRelationship file:///b/ (null)"}));
}

}  // namespace
}  // namespace storix::fake
