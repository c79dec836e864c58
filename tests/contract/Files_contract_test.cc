#include <set>

#include "tests/contract/ContractTest.h"

namespace storix::contract {
namespace {

class FilesContract : public ContractTest {
 protected:
  Result<Value> read(const std::string &path) {
    const std::unique_ptr<InputStream> stream = platform().openFileInputStream(path);
    if (!stream) return SXError("test", 0, {{"description", "There is no stream."}});
    return platform().readKeyedValueStream(*stream, KeyedValueMutability::containersAndLeaves);
  }
  bool write(const Dictionary &content, const std::string &path) {
    return platform().writeKeyedValueFileAtomically(content, path);
  }
};

const Dictionary nested{
    {"text", "“é” 漢字 😀 \n \" \\ /"},
    {"empty text", ""},
    {"", "empty key"},
    {"numbers", List{0, -1, std::int64_t{9007199254740993}, 0.5, -1e300}},
    {"flags", List{true, false}},
    {"org.a", Dictionary{{"org.app", Dictionary{{"AllowedItemIDs", List{"a/b", "c"}}}}, {"empty", Dictionary{}}}},
    {"empty list", List{}},
};

TEST_P(FilesContract, HomeDirectoryIsAnAbsolutePath) { EXPECT_TRUE(platform().homeDirectory().starts_with("/")); }

TEST_P(FilesContract, AnythingAtThePathExists) {
  EXPECT_FALSE(platform().fileExists(at("a")));
  host().makeDirectory(at("a"));
  EXPECT_TRUE(platform().fileExists(at("a")));
  host().writeCorruptFile(at("b"));
  EXPECT_TRUE(platform().fileExists(at("b")));
  EXPECT_FALSE(platform().fileExists(at("b/c")));
  host().removeFile(at("b"));
  EXPECT_FALSE(platform().fileExists(at("b")));
}

TEST_P(FilesContract, DirectoryIsMadeWithThoseAboveIt) {
  EXPECT_FALSE(platform().createDirectory(at("Library/Storix"), true));
  EXPECT_TRUE(platform().fileExists(at("Library/Storix")));
  EXPECT_FALSE(platform().createDirectory(at("Library/Storix"), true)) << "one that is there is a success";
}

TEST_P(FilesContract, DirectoryWhoseParentIsMissingIsAnErrorUnlessAskedFor) {
  const std::optional<SXError> error = platform().createDirectory(at("missing/d"), false);
  ASSERT_TRUE(error);
  EXPECT_FALSE(error->message().empty());
  EXPECT_FALSE(platform().fileExists(at("missing")));
  EXPECT_FALSE(platform().createDirectory(at("d"), false));
  EXPECT_TRUE(platform().createDirectory(at("d"), false)) << "it is there already";
}

TEST_P(FilesContract, DirectoryInThePlaceOfAFileIsAnError) {
  host().writeCorruptFile(at("file"));
  EXPECT_TRUE(platform().createDirectory(at("file"), true));
  EXPECT_TRUE(platform().createDirectory(at("file/d"), true));
}

TEST_P(FilesContract, WhatWasWrittenIsReadBack) {
  ASSERT_TRUE(write(nested, at("a.kvs")));
  const Result<Value> content = read(at("a.kvs"));
  ASSERT_TRUE(content) << content.error().message();
  EXPECT_EQ(content.value(), Value(nested));
}

TEST_P(FilesContract, EmptyDictionaryIsReadBack) {
  ASSERT_TRUE(write({}, at("a.kvs")));
  const Result<Value> content = read(at("a.kvs"));
  ASSERT_TRUE(content);
  EXPECT_EQ(content.value(), Value(Dictionary{}));
}

TEST_P(FilesContract, WritingReplacesTheWholeFile) {
  ASSERT_TRUE(write(nested, at("a.kvs")));
  ASSERT_TRUE(write({{"k", "v"}}, at("a.kvs")));
  const Result<Value> content = read(at("a.kvs"));
  ASSERT_TRUE(content);
  EXPECT_EQ(content.value(), Value(Dictionary{{"k", "v"}}));
}

TEST_P(FilesContract, StreamThatWasOpenedBeforeAWriteGivesTheOldContentWhole) {
  ASSERT_TRUE(write({{"k", "old"}}, at("a.kvs")));
  const std::unique_ptr<InputStream> stream = platform().openFileInputStream(at("a.kvs"));
  ASSERT_TRUE(stream);
  ASSERT_TRUE(write({{"k", "new"}}, at("a.kvs")));
  const Result<Value> content = platform().readKeyedValueStream(*stream, KeyedValueMutability::containersAndLeaves);
  ASSERT_TRUE(content);
  EXPECT_EQ(content.value(), Value(Dictionary{{"k", "old"}}));
}

TEST_P(FilesContract, CorruptFileOpensAndReadsAsAnErrorAndCanBeWrittenOver) {
  host().writeCorruptFile(at("a.kvs"));
  ASSERT_TRUE(platform().openFileInputStream(at("a.kvs")));
  const Result<Value> corrupt = read(at("a.kvs"));
  ASSERT_FALSE(corrupt);
  EXPECT_FALSE(corrupt.error().message().empty());
  EXPECT_TRUE(platform().fileExists(at("a.kvs"))) << "reading leaves it in its place";
  ASSERT_TRUE(write({{"k", "v"}}, at("a.kvs")));
  const Result<Value> content = read(at("a.kvs"));
  ASSERT_TRUE(content);
  EXPECT_EQ(content.value(), Value(Dictionary{{"k", "v"}}));
}

TEST_P(FilesContract, MissingFileGivesNoStream) {
  EXPECT_FALSE(platform().openFileInputStream(at("missing.kvs")));
  host().makeDirectory(at("d"));
  EXPECT_FALSE(platform().openFileInputStream(at("d")));
}

TEST_P(FilesContract, FileThatCannotBeWrittenIsReportedAndNothingIsLeft) {
  EXPECT_FALSE(write({}, at("missing/a.kvs")));
  EXPECT_FALSE(platform().fileExists(at("missing")));
  host().writeCorruptFile(at("file"));
  EXPECT_FALSE(write({}, at("file/a.kvs")));
  host().makeDirectory(at("d/content"));
  EXPECT_FALSE(write({}, at("d")));
  EXPECT_TRUE(platform().fileExists(at("d/content")));
}

TEST_P(FilesContract, KindThatTheTextCannotCarryIsNotWritten) {
  ASSERT_TRUE(write({{"k", "v"}}, at("a.kvs")));
  for (const Value &value :
       {Value(*URL::fromString("file:///a")), Value(Data{"bytes"}), Value(SXNotPermittedError())}) {
    EXPECT_FALSE(write({{"k", value}}, at("a.kvs")));
    EXPECT_FALSE(write({{"k", List{Dictionary{{"deep", value}}}}}, at("a.kvs")));
  }
  const Result<Value> content = read(at("a.kvs"));
  ASSERT_TRUE(content);
  EXPECT_EQ(content.value(), Value(Dictionary{{"k", "v"}}));
}

STORIX_CONTRACT(FilesContract);

}  // namespace
}  // namespace storix::contract
