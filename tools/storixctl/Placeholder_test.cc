#include "tools/storixctl/Placeholder.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "tools/storixctl/TemporaryDirectory.h"

namespace storix::ctl {
namespace {

namespace fs = std::filesystem;

class PlaceholderTest : public ::testing::Test {
 protected:
  [[nodiscard]] Placeholder placeholder() const {
    return readPlaceholder(*URL::fileURLWithPath((directory_ / "a b%").string()));
  }
  [[nodiscard]] Placeholder placeholderWith(const std::string &text) const {
    directory_.write(".a b%", text);
    return placeholder();
  }

  TemporaryDirectory directory_;
};

TEST_F(PlaceholderTest, TellsTheSizeAndWhatHasCome) {
  EXPECT_EQ(placeholderWith(R"({"name": "a b%", "size": 5000000000, "modificationTime": 1.5})").size, 5'000'000'000U);
  EXPECT_EQ(placeholder().received, std::nullopt);
  EXPECT_EQ(placeholderWith(R"({"received": 7, "size": 9})").received, 7U);
}

TEST_F(PlaceholderTest, WhatIsNonsenseTellsNothing) {
  EXPECT_EQ(placeholder().size, std::nullopt);
  for (const char *text : {"", "{", "[]", "{}", R"({"size": "9"})", R"({"size": -1})", R"({"size": 1.5})",
                           R"({"size": 99999999999999999999})", R"({"size": 1} x)"}) {
    EXPECT_EQ(placeholderWith(text).size, std::nullopt) << text;
  }
  EXPECT_EQ(placeholderWith(R"({"size": 1, "more": ")" + std::string(70'000, 'x') + "\"}").size, std::nullopt);
}

TEST_F(PlaceholderTest, OnlyARegularFileIsRead) {
  directory_.write("elsewhere", R"({"size": 9})");
  fs::create_symlink("elsewhere", directory_ / ".a b%");
  EXPECT_EQ(placeholder().size, std::nullopt);
  fs::remove(directory_ / ".a b%");
  ASSERT_EQ(::mkfifo((directory_ / ".a b%").c_str(), 0600), 0);
  EXPECT_EQ(placeholder().size, std::nullopt);
}

}  // namespace
}  // namespace storix::ctl
