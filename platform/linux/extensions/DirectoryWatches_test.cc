#include "platform/linux/extensions/DirectoryWatches.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/inotify.h>

#include <cstring>
#include <filesystem>

#include "platform/linux/TestDirectory.h"

namespace storix::linuxhost {
namespace {

using ::testing::IsEmpty;

// The kernel reports a change before the call that made it returns, so nothing here waits.
class DirectoryWatchesTest : public ::testing::Test {
 protected:
  void watch(const std::string &directory, const std::string &name) {
    watches_.beginRound();
    watches_.watch(directory, name);
    EXPECT_THAT(watches_.endRound(), IsEmpty());
  }

  static std::vector<std::byte> event(int watch, std::uint32_t mask, const std::string &name = {}) {
    inotify_event header{};
    header.wd = watch;
    header.mask = mask;
    header.len = name.empty() ? 0 : 16;
    std::vector<std::byte> bytes(sizeof(header) + header.len);
    std::memcpy(bytes.data(), &header, sizeof(header));
    std::memcpy(bytes.data() + sizeof(header), name.data(), name.size());
    return bytes;
  }

  TestDirectory directory_;
  DirectoryWatches watches_;
};

TEST_F(DirectoryWatchesTest, NamesOfInterestCountAndOthersDoNot) {
  directory_.makeDirectory("d");
  watch(directory_ / "d", "*.appdex");
  EXPECT_FALSE(watches_.readChanges());
  directory_.makeFile("d/other", "x");
  EXPECT_FALSE(watches_.readChanges());
  directory_.makeDirectory("d/x.appdex");
  EXPECT_TRUE(watches_.readChanges());
  std::filesystem::rename(directory_ / "d/x.appdex", directory_ / "d/y");
  EXPECT_TRUE(watches_.readChanges());
  std::filesystem::rename(directory_ / "d/y", directory_ / "d/x.appdex");
  EXPECT_TRUE(watches_.readChanges());
  std::filesystem::remove(directory_ / "d/x.appdex");
  EXPECT_TRUE(watches_.readChanges());
}

TEST_F(DirectoryWatchesTest, WrittenAndReplacedFilesAndTheirPermissionsCount) {
  directory_.makeFile("d/Info.kvs", "1");
  watch(directory_ / "d", "Info.kvs");
  directory_.makeFile("d/Info.kvs", "2");
  EXPECT_TRUE(watches_.readChanges());
  directory_.makeFile("d/temporary", "3");
  EXPECT_FALSE(watches_.readChanges());
  std::filesystem::rename(directory_ / "d/temporary", directory_ / "d/Info.kvs");
  EXPECT_TRUE(watches_.readChanges());
  std::filesystem::permissions(directory_ / "d/Info.kvs", std::filesystem::perms::none);
  EXPECT_TRUE(watches_.readChanges());
}

TEST_F(DirectoryWatchesTest, MissingDirectoryIsWatchedByItsNearestExistingParent) {
  watch(directory_ / "a/b/c", "*.appdex");
  directory_.makeDirectory("other");
  EXPECT_FALSE(watches_.readChanges());
  directory_.makeDirectory("a");
  EXPECT_TRUE(watches_.readChanges());
  watch(directory_ / "a/b/c", "*.appdex");
  directory_.makeDirectory("a/b/c");
  EXPECT_TRUE(watches_.readChanges());
  watch(directory_ / "a/b/c", "*.appdex");
  directory_.makeDirectory("a/b/c/x.appdex");
  EXPECT_TRUE(watches_.readChanges());
}

TEST_F(DirectoryWatchesTest, FileInPlaceOfADirectoryIsWatchedByItsParent) {
  directory_.makeFile("d", "x");
  watch(directory_ / "d", "Info.kvs");
  std::filesystem::remove(directory_ / "d");
  EXPECT_TRUE(watches_.readChanges());
}

TEST_F(DirectoryWatchesTest, LinkToItselfInPlaceOfADirectoryIsWatchedByItsParent) {
  std::filesystem::create_directory_symlink("d", directory_ / "d");
  watch(directory_ / "d", "Info.kvs");
  std::filesystem::remove(directory_ / "d");
  EXPECT_TRUE(watches_.readChanges());
}

TEST_F(DirectoryWatchesTest, TheDirectoryItselfCountsWhenItGoes) {
  directory_.makeDirectory("d");
  watch(directory_ / "d", "*.appdex");
  std::filesystem::remove(directory_ / "d");
  EXPECT_TRUE(watches_.readChanges());
  directory_.makeDirectory("d");
  watch(directory_ / "d", "*.appdex");
  std::filesystem::rename(directory_ / "d", directory_ / "e");
  EXPECT_TRUE(watches_.readChanges());
}

TEST_F(DirectoryWatchesTest, WhatIsNotNamedInARoundIsForgotten) {
  directory_.makeDirectory("d");
  directory_.makeDirectory("e");
  watch(directory_ / "d", "*.appdex");
  watch(directory_ / "e", "*.appdex");
  EXPECT_FALSE(watches_.readChanges());
  directory_.makeDirectory("d/x.appdex");
  EXPECT_FALSE(watches_.readChanges());
  directory_.makeDirectory("e/x.appdex");
  EXPECT_TRUE(watches_.readChanges());
}

TEST_F(DirectoryWatchesTest, ChangesDuringARoundCount) {
  directory_.makeDirectory("d");
  watches_.beginRound();
  watches_.watch(directory_ / "d", "*.appdex");
  directory_.makeDirectory("d/x.appdex");
  EXPECT_TRUE(watches_.readChanges());
  EXPECT_THAT(watches_.endRound(), IsEmpty());
}

TEST_F(DirectoryWatchesTest, TwoMissingDirectoriesCanShareAParent) {
  watches_.beginRound();
  watches_.watch(directory_ / "a", "*.appdex");
  watches_.watch(directory_ / "b", "*.appdex");
  EXPECT_THAT(watches_.endRound(), IsEmpty());
  directory_.makeDirectory("a");
  EXPECT_TRUE(watches_.readChanges());
  directory_.makeDirectory("b");
  EXPECT_TRUE(watches_.readChanges());
}

TEST_F(DirectoryWatchesTest, LostEventsCountAsAChange) {
  watch(directory_.path(), "*.appdex");
  EXPECT_FALSE(watches_.wantsLook(event(4711, IN_CREATE, "x.appdex")));
  EXPECT_TRUE(watches_.wantsLook(event(-1, IN_Q_OVERFLOW)));
}

TEST_F(DirectoryWatchesTest, TruncatedEventIsLeftAlone) {
  std::vector<std::byte> bytes = event(1, IN_CREATE, "x.appdex");
  bytes.pop_back();
  EXPECT_FALSE(watches_.wantsLook(bytes));
  EXPECT_FALSE(watches_.wantsLook({}));
}

}  // namespace
}  // namespace storix::linuxhost
