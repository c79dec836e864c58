#include "platform/linux/files/Files.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/linux/TestDirectory.h"
#include "platform/linux/TestLog.h"
#include "platform/linux/TestUser.h"
#include "platform/linux/files/KeyedValueFile.h"

namespace storix::linuxhost {
namespace {

using ::testing::ElementsAre;

mode_t modeOf(const std::string &path) {
  struct stat status {};
  EXPECT_EQ(::stat(path.c_str(), &status), 0) << path;
  return status.st_mode & 07777;
}

Result<Value> readBack(Files &files, const std::string &path) {
  const std::unique_ptr<InputStream> stream = files.openFileInputStream(path);
  if (!stream) return posixError(ENOENT, "no stream");
  return files.readKeyedValueStream(*stream, KeyedValueMutability::containersAndLeaves);
}

TEST(Files, AnythingAtThePathExists) {
  const TestDirectory directory;
  EXPECT_TRUE(Files::fileExists(directory.path()));
  EXPECT_TRUE(Files::fileExists(directory.makeFile("a", "")));
  EXPECT_FALSE(Files::fileExists(directory / "b"));
  EXPECT_FALSE(Files::fileExists(directory / "a/b"));
  EXPECT_FALSE(Files::fileExists(""));
}

TEST(Files, NewDirectoriesAreOpenToTheirUserAlone) {
  const TestDirectory directory;
  ASSERT_EQ(Files::createDirectory(directory / "Library/Storix/deep/", true), std::nullopt);
  EXPECT_EQ(modeOf(directory / "Library"), 0700U);
  EXPECT_EQ(modeOf(directory / "Library/Storix"), 0700U);
  EXPECT_EQ(modeOf(directory / "Library/Storix/deep"), 0700U);
  ASSERT_EQ(::chmod((directory / "Library").c_str(), 0755), 0);
  EXPECT_EQ(Files::createDirectory(directory / "Library", true), std::nullopt);
  EXPECT_EQ(modeOf(directory / "Library"), 0755U);
}

TEST(Files, DirectoryThatCannotBeMadeIsAnError) {
  const TestDirectory directory;
  directory.makeFile("file", "");
  EXPECT_EQ(Files::createDirectory(directory / "file", true)->code(), EEXIST);
  EXPECT_EQ(Files::createDirectory(directory / "file/a/b", true)->code(), ENOTDIR);
  EXPECT_EQ(Files::createDirectory(directory / "a/b", false)->code(), ENOENT);
  EXPECT_EQ(Files::createDirectory(directory.path(), false)->code(), EEXIST);
  EXPECT_EQ(Files::createDirectory("", true)->code(), ENOENT);
  EXPECT_EQ(Files::createDirectory(directory / std::string(5000, 'a'), true)->code(), ENAMETOOLONG);
  EXPECT_THAT(directory.names(), ElementsAre("file"));
}

TEST(Files, OnlyRegularFilesGiveAStream) {
  const TestDirectory directory;
  ASSERT_EQ(::mkfifo((directory / "fifo").c_str(), 0600), 0);
  Files files;
  EXPECT_EQ(files.openFileInputStream(directory / "fifo"), nullptr);
  EXPECT_EQ(files.openFileInputStream(directory.path()), nullptr);
  EXPECT_EQ(files.openFileInputStream("/dev/null"), nullptr);
  EXPECT_EQ(files.openFileInputStream(directory / "absent"), nullptr);
  EXPECT_NE(files.openFileInputStream(directory.makeFile("a", "")), nullptr);
}

TEST(Files, WhatWasWrittenIsReadBack) {
  const TestDirectory directory;
  Files files;
  const Dictionary content{{"p", Dictionary{{"c", Dictionary{{"AllowedItemIDs", List{"a/b", "é"}}}}}}};
  ASSERT_TRUE(files.writeKeyedValueFileAtomically(content, directory / "a.kvs"));
  const Result<Value> back = readBack(files, directory / "a.kvs");
  ASSERT_TRUE(back);
  EXPECT_EQ(back.value(), Value(content));
}

TEST(Files, StreamOfAnotherPlatformIsAnError) {
  class OtherStream : public InputStream {};
  OtherStream other;
  Files files;
  EXPECT_EQ(files.readKeyedValueStream(other, KeyedValueMutability::immutable).error().code(), EBADF);
}

TEST(Files, CorruptFileIsReportedLeftInPlaceAndKeptWhenWrittenOver) {
  const TestDirectory directory;
  const std::string path = directory.makeFile("a.kvs", "{corrupt");
  Files files;
  EXPECT_FALSE(readBack(files, path));
  EXPECT_EQ(directory.contentOf("a.kvs"), "{corrupt");
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs"));

  ASSERT_TRUE(files.writeKeyedValueFileAtomically({{"a", 1}}, path));
  EXPECT_EQ(directory.contentOf("a.kvs.corrupt"), "{corrupt");
  ASSERT_TRUE(files.writeKeyedValueFileAtomically({{"a", 2}}, path));
  EXPECT_EQ(directory.contentOf("a.kvs.corrupt"), "{corrupt");
  EXPECT_EQ(directory.contentOf("a.kvs"), "{\"a\":2}\n");
}

TEST(Files, FileThatIsMendedBeforeTheWriteIsNotKept) {
  const TestDirectory directory;
  const std::string path = directory.makeFile("a.kvs", "{corrupt");
  Files files;
  EXPECT_FALSE(readBack(files, path));
  directory.makeFile("a.kvs", "{}");
  EXPECT_TRUE(readBack(files, path));
  ASSERT_TRUE(files.writeKeyedValueFileAtomically({}, path));
  EXPECT_THAT(directory.names(), ElementsAre("a.kvs"));
}

TEST(Files, CorruptFileIsStillKeptByTheWriteAfterAFailedOne) {
  const TestDirectory directory;
  const std::string path = directory.makeFile("a.kvs", "{corrupt");
  Files files;
  EXPECT_FALSE(readBack(files, path));
  EXPECT_FALSE(files.writeKeyedValueFileAtomically({{"a", Data{"x"}}}, path));
  EXPECT_EQ(directory.contentOf("a.kvs"), "{corrupt");
  EXPECT_TRUE(files.writeKeyedValueFileAtomically({}, path));
  EXPECT_EQ(directory.contentOf("a.kvs.corrupt"), "{corrupt");
}

TEST(Files, FileThatMayNotBeReadIsKeptWhenWrittenOver) {
  EXPECT_TRUE(holdsWithoutRoot([] {
    const TestDirectory directory;
    const std::string path = directory.makeFile("a.kvs", "secret");
    Files files;
    bool holds = ::chmod(path.c_str(), 0) == 0 && !files.openFileInputStream(path);
    holds = holds && files.writeKeyedValueFileAtomically({}, path);
    holds = holds && ::chmod((directory / "a.kvs.corrupt").c_str(), 0600) == 0;
    return holds && directory.contentOf("a.kvs.corrupt") == "secret" && directory.contentOf("a.kvs") == "{}\n";
  }));
}

TEST(Files, DirectoryThatMayNotBeWrittenLeavesAllAsItWas) {
  EXPECT_TRUE(holdsWithoutRoot([] {
    const TestDirectory directory;
    const std::string path = directory.makeFile("a.kvs", "{}");
    Files files;
    bool holds = ::chmod(directory.path().c_str(), 0500) == 0;
    holds = holds && !files.writeKeyedValueFileAtomically({{"a", 1}}, path);
    const std::optional<SXError> error = Files::createDirectory(directory / "new", true);
    holds = holds && error && error->code() == EACCES;
    ::chmod(directory.path().c_str(), 0700);
    return holds && directory.names() == std::vector<std::string>{"a.kvs"} && directory.contentOf("a.kvs") == "{}";
  }));
}

TEST(Files, FailedWriteAnswersFalseAndSaysWhy) {
  TestLog log;
  const TestDirectory directory;
  Files files;
  EXPECT_FALSE(files.writeKeyedValueFileAtomically({}, directory / "absent/a.kvs"));
  EXPECT_FALSE(files.writeKeyedValueFileAtomically({{"u", *URL::fromString("file:///a")}}, directory / "a.kvs"));
  EXPECT_TRUE(directory.names().empty());
  EXPECT_THAT(log.take(), ElementsAre("[NOTICE] Cannot open the directory of “" + (directory / "absent/a.kvs") +
                                          "”: No such file or directory",
                                      "[NOTICE] Not keyed-value content: a value of the kind URL cannot be written"));
}

}  // namespace
}  // namespace storix::linuxhost
