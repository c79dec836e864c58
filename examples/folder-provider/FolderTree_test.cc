#include "FolderTree.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "TemporaryFolder.h"

namespace storix::example {
namespace {

namespace fs = std::filesystem;

class FolderTreeTest : public ::testing::Test {
 protected:
  FolderTree tree() { return std::move(FolderTree::open(folder_.path("tree")).value()); }
  /// Puts the file that lies outside the tree into it.
  std::optional<SXError> putFile(const std::string &path, const std::string &from) {
    UniqueFd file(::open(folder_.path(from).c_str(), O_RDONLY | O_CLOEXEC));
    return tree().put(path, file.get());
  }
  bool incomingIsEmpty() { return fs::is_empty(folder_.path("tree/.incoming")); }

  void SetUp() override { fs::create_directory(folder_.path("tree")); }
  TemporaryFolder folder_;
};

TEST_F(FolderTreeTest, MissingDirectoryIsAnError) {
  const auto opened = FolderTree::open(folder_.path("nowhere"));
  ASSERT_FALSE(opened.ok());
  EXPECT_EQ(opened.error().domain(), posixErrorDomain);
  EXPECT_EQ(opened.error().code(), ENOENT);
  EXPECT_NE(opened.error().message().find("nowhere"), std::string::npos);
}

TEST_F(FolderTreeTest, NamesThatLeadAstrayAreRefused) {
  for (const std::string path : {"", "/", "/etc/passwd", "..", "../x", "a/../b", "a/..", "./a", "a//b", "a/", ".hidden",
                                 "a/.b", ".incoming/0"}) {
    EXPECT_TRUE(FolderTree::checkPath(path).has_value()) << path;
    EXPECT_FALSE(tree().openFile(path).ok()) << path;
    EXPECT_FALSE(tree().stateOf(path).ok()) << path;
    EXPECT_TRUE(tree().put(path, STDIN_FILENO).has_value()) << path;
    EXPECT_TRUE(tree().remove(path).has_value()) << path;
    EXPECT_FALSE(tree().putCompanion(path, "x").ok()) << path;
  }
  EXPECT_TRUE(FolderTree::checkPath(std::string("a\0b", 3)).has_value());
  for (const char *path : {"a", "a/b", "a b/100%/\xC3\xA9", "a..b", "a."}) {
    EXPECT_FALSE(FolderTree::checkPath(path).has_value()) << path;
  }
}

TEST_F(FolderTreeTest, SymbolicLinksAreNotFollowed) {
  folder_.write("outside.txt", "secret");
  fs::create_directory(folder_.path("elsewhere"));
  folder_.write("elsewhere/a.txt", "secret");
  fs::create_symlink(folder_.path("outside.txt"), folder_.path("tree/link.txt"));
  fs::create_symlink(folder_.path("elsewhere"), folder_.path("tree/dir"));
  EXPECT_EQ(tree().openFile("link.txt").error().code(), ELOOP);
  EXPECT_EQ(tree().openFile("dir/a.txt").error().code(), ELOOP);
  EXPECT_TRUE(putFile("dir/new.txt", "outside.txt").has_value());
  EXPECT_FALSE(fs::exists(folder_.path("elsewhere/new.txt")));
  EXPECT_TRUE(tree().remove("dir/a.txt").has_value());
  EXPECT_TRUE(fs::exists(folder_.path("elsewhere/a.txt")));
}

TEST_F(FolderTreeTest, OnlyRegularFilesAreOpened) {
  fs::create_directory(folder_.path("tree/directory"));
  ASSERT_EQ(::mkfifo(folder_.path("tree/pipe").c_str(), 0600), 0);
  EXPECT_EQ(tree().openFile("directory").error().code(), EISDIR);
  EXPECT_EQ(tree().openFile("pipe").error().code(), EINVAL);
  EXPECT_EQ(tree().openFile("missing").error().code(), ENOENT);
}

TEST_F(FolderTreeTest, PutCopiesContentAndTimeAndMakesTheDirectories) {
  folder_.write("file", "hello");
  folder_.setModificationTime("file", 1'000'000'000, 123);
  ASSERT_EQ(putFile("a/b c/\xC3\xA9%", "file"), std::nullopt);
  EXPECT_EQ(folder_.read("tree/a/b c/\xC3\xA9%"), "hello");
  const auto state = tree().stateOf("a/b c/\xC3\xA9%");
  ASSERT_TRUE(state.ok());
  EXPECT_EQ(state.value().size, 5);
  EXPECT_EQ(state.value().modificationTime.tv_sec, 1'000'000'000);
  EXPECT_EQ(state.value().modificationTime.tv_nsec, 123);
  EXPECT_EQ(state.value().permissions, 0600U);
  EXPECT_TRUE(incomingIsEmpty());
}

TEST_F(FolderTreeTest, EmptyAndBigFilesAreCopiedWhole) {
  folder_.write("empty", "");
  ASSERT_EQ(putFile("empty", "empty"), std::nullopt);
  EXPECT_EQ(folder_.read("tree/empty"), "");
  std::string big(3'000'001, 'x');
  for (std::size_t i = 0; i < big.size(); i += 997) big[i] = static_cast<char>(i);
  folder_.write("big", big);
  ASSERT_EQ(putFile("big", "big"), std::nullopt);
  EXPECT_EQ(folder_.read("tree/big"), big);
}

TEST_F(FolderTreeTest, FilesWhoseSizeTheKernelDoesNotTellAreCopiedWhole) {
  UniqueFd file(::open("/proc/version", O_RDONLY | O_CLOEXEC));
  ASSERT_TRUE(file);
  ASSERT_EQ(tree().put("version", file.get()), std::nullopt);
  EXPECT_FALSE(folder_.read("tree/version").empty());
}

TEST_F(FolderTreeTest, ReplacingKeepsThePermissionsAndLeavesAnOpenCopyWhole) {
  folder_.write("tree/a", "old");
  fs::permissions(folder_.path("tree/a"), fs::perms(0640));
  auto open = tree().openFile("a");
  ASSERT_TRUE(open.ok());
  folder_.write("new", "newer content");
  ASSERT_EQ(putFile("a", "new"), std::nullopt);
  EXPECT_EQ(folder_.read("tree/a"), "newer content");
  EXPECT_EQ(tree().stateOf("a").value().permissions, 0640U);
  char buffer[8];
  ASSERT_EQ(::read(open.value().get(), buffer, sizeof buffer), 3);
  EXPECT_EQ(std::string(buffer, 3), "old");
}

TEST_F(FolderTreeTest, AFailedPutLeavesNothing) {
  folder_.write("file", "hello");
  fs::create_directories(folder_.path("tree/a/occupied"));
  EXPECT_TRUE(putFile("a", "file").has_value());
  EXPECT_TRUE(fs::is_directory(folder_.path("tree/a/occupied")));
  EXPECT_TRUE(incomingIsEmpty());
}

TEST_F(FolderTreeTest, ACompanionLiesBesideItsFile) {
  EXPECT_EQ(tree().putCompanion("a/report.pages", "x").value(), "a/.report.pages");
  EXPECT_EQ(folder_.read("tree/a/.report.pages"), "x");
  EXPECT_EQ(tree().putCompanion("report.pages", "y").value(), ".report.pages");
  EXPECT_EQ(tree().putCompanion("report.pages", "longer").value(), ".report.pages");
  EXPECT_EQ(folder_.read("tree/.report.pages"), "longer");
  EXPECT_TRUE(incomingIsEmpty());
}

TEST_F(FolderTreeTest, RemovingWhatIsNotThereIsNoError) {
  folder_.write("tree/a", "x");
  EXPECT_EQ(tree().remove("a"), std::nullopt);
  EXPECT_FALSE(fs::exists(folder_.path("tree/a")));
  EXPECT_EQ(tree().remove("a"), std::nullopt);
  EXPECT_EQ(tree().remove("b/c"), std::nullopt);
}

TEST_F(FolderTreeTest, WhatAnEndedProcessLeftIsDiscarded) {
  tree().discardIncoming();
  fs::create_directory(folder_.path("tree/.incoming"));
  folder_.write("tree/.incoming/77-0", "half");
  folder_.write("tree/a", "x");
  tree().discardIncoming();
  EXPECT_TRUE(incomingIsEmpty());
  EXPECT_EQ(folder_.read("tree/a"), "x");
}

TEST(FileState, ContentIsTheSameWhenSizeAndTimeAre) {
  const FileState older{5, {10, 1}, 0600};
  const FileState newer{5, {10, 2}, 0600};
  EXPECT_TRUE(older.sameContentAs(FileState{5, {10, 1}, 0644}));
  EXPECT_FALSE(older.sameContentAs(FileState{6, {10, 1}, 0600}));
  EXPECT_FALSE(older.sameContentAs(newer));
  EXPECT_TRUE(newer.newerThan(older));
  EXPECT_FALSE(older.newerThan(newer));
  EXPECT_FALSE(older.newerThan(older));
}

}  // namespace
}  // namespace storix::example
