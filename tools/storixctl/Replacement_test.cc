#include "tools/storixctl/Replacement.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>

#include "tools/storixctl/TemporaryDirectory.h"

namespace storix::ctl {
namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::UnorderedElementsAre;

class ReplacementTest : public ::testing::Test {
 protected:
  [[nodiscard]] Result<Replacement> replacementOf(const std::string &name) const {
    return Replacement::of((directory_ / name).string());
  }
  static void fill(const Replacement &replacement, const std::string &content) {
    EXPECT_EQ(::write(replacement.descriptor(), content.data(), content.size()), static_cast<ssize_t>(content.size()));
  }
  [[nodiscard]] mode_t modeOf(const std::string &name) const {
    struct stat status {};
    EXPECT_EQ(::stat((directory_ / name).c_str(), &status), 0);
    return status.st_mode & 07777U;
  }

  TemporaryDirectory directory_;
};

TEST_F(ReplacementTest, TheOldContentStaysUntilThePlaceIsTaken) {
  directory_.write("a", "old");
  auto replacement = replacementOf("a");
  fill(replacement.value(), "new");
  EXPECT_EQ(directory_.read("a"), "old");
  EXPECT_EQ(replacement.value().takePlace(), std::nullopt);
  EXPECT_EQ(directory_.read("a"), "new");
  EXPECT_THAT(directory_.names(), ElementsAre("a"));
}

TEST_F(ReplacementTest, OneThatTakesNoPlaceLeavesNothing) {
  directory_.write("a", "old");
  {
    auto replacement = replacementOf("a");
    fill(replacement.value(), "new");
    EXPECT_EQ(directory_.names().size(), 2U);
  }
  EXPECT_THAT(directory_.names(), ElementsAre("a"));
  EXPECT_EQ(directory_.read("a"), "old");
}

TEST_F(ReplacementTest, PermissionsAreKept) {
  directory_.write("a", "old");
  for (const mode_t mode : {0640U, 0600U, 0755U, 0444U}) {
    fs::permissions(directory_ / "a", fs::perms(mode));
    auto replacement = replacementOf("a");
    struct stat status {};
    ASSERT_EQ(::fstat(replacement.value().descriptor(), &status), 0);
    EXPECT_EQ(status.st_mode & 077U, 0U) << "nobody else sees the new content before";
    EXPECT_EQ(replacement.value().takePlace(), std::nullopt);
    EXPECT_EQ(modeOf("a"), mode);
  }
}

TEST_F(ReplacementTest, ANewFileHasThePermissionsThatTheUmaskLeaves) {
  const mode_t before = ::umask(027);
  auto replacement = replacementOf("a");
  ::umask(before);
  EXPECT_EQ(replacement.value().takePlace(), std::nullopt);
  EXPECT_EQ(modeOf("a"), 0640U);
}

TEST_F(ReplacementTest, ASymbolicLinkStaysAndItsTargetIsReplaced) {
  fs::create_directory(directory_ / "d");
  directory_.write("d/a", "old");
  fs::create_symlink("d/a", directory_ / "link");
  auto replacement = replacementOf("link");
  fill(replacement.value(), "new");
  EXPECT_EQ(replacement.value().takePlace(), std::nullopt);
  EXPECT_TRUE(fs::is_symlink(directory_ / "link"));
  EXPECT_EQ(directory_.read("d/a"), "new");
}

TEST_F(ReplacementTest, WhatIsNoFileCannotBeReplaced) {
  fs::create_directory(directory_ / "d");
  ASSERT_EQ(::mkfifo((directory_ / "pipe").c_str(), 0600), 0);
  fs::create_symlink("nowhere", directory_ / "dangling");
  fs::create_symlink("loop", directory_ / "loop");
  EXPECT_EQ(replacementOf("d").error().code(), EISDIR);
  EXPECT_EQ(replacementOf("d/").error().code(), EISDIR);
  EXPECT_EQ(replacementOf("d/..").error().code(), EISDIR);
  EXPECT_THAT(replacementOf("pipe").error().message(), HasSubstr("not a regular file"));
  EXPECT_EQ(replacementOf("dangling").error().code(), ENOENT);
  EXPECT_EQ(replacementOf("loop").error().code(), ELOOP);
  EXPECT_EQ(replacementOf("missing/a").error().code(), ENOENT);
  EXPECT_EQ(replacementOf(std::string(300, 'a')).error().code(), ENAMETOOLONG);
  EXPECT_THAT(directory_.names(), UnorderedElementsAre("d", "pipe", "dangling", "loop"));
}

TEST_F(ReplacementTest, WhatBecameADirectoryMeanwhileStays) {
  auto replacement = replacementOf("a");
  ASSERT_TRUE(replacement);
  fs::create_directory(directory_ / "a");
  EXPECT_EQ(replacement.value().takePlace()->code(), EISDIR);
}

TEST_F(ReplacementTest, TwoAtATimeDoNotMeet) {
  auto one = replacementOf("a");
  auto other = replacementOf("a");
  fill(one.value(), "one");
  fill(other.value(), "other");
  EXPECT_EQ(one.value().takePlace(), std::nullopt);
  EXPECT_EQ(directory_.read("a"), "one");
  EXPECT_EQ(other.value().takePlace(), std::nullopt);
  EXPECT_EQ(directory_.read("a"), "other");
}

}  // namespace
}  // namespace storix::ctl
