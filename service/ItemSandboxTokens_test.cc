#include "service/ItemSandboxTokens.h"

#include <gmock/gmock.h>

#include "platform/fake/FakeHostTest.h"

namespace storix {
namespace {

using ::testing::ElementsAre;

std::string companionOf(std::string_view text) {
  const std::optional<URL> companion = companionURLForURL(URL::fromString(text));
  return companion ? companion->absoluteString() : "none";
}

TEST(CompanionURL, IsTheHiddenSibling) {
  EXPECT_EQ(companionOf("file:///a/b/report.pages"), "file:///a/b/.report.pages");
  EXPECT_EQ(companionOf("file:///report.pages"), "file:///.report.pages");
  EXPECT_EQ(companionOf("file:///a/.hidden"), "file:///a/..hidden");
}

TEST(CompanionURL, KeepsPercentEscapesAsTheyAre) {
  EXPECT_EQ(companionOf("file:///a%20b/100%25%C3%A9.txt"), "file:///a%20b/.100%25%C3%A9.txt");
}

TEST(CompanionURL, OfADirectoryIsBesideIt) { EXPECT_EQ(companionOf("file:///a/b/"), "file:///a/.b"); }

TEST(CompanionURL, IsAbsentWhereThereIsNone) {
  EXPECT_EQ(companionOf("file:///"), "none");
  EXPECT_EQ(companionURLForURL(std::nullopt), std::nullopt);
}

class ItemSandboxTokensTest : public fake::FakeHostTest {
 protected:
  const std::optional<URL> url_ = URL::fromString("file:///a%20b/r");
  std::optional<Data> tokenData_;
  std::optional<URL> companionURL_;
  std::optional<Data> companionTokenData_;

  bool issue() { return issueItemSandboxTokens(url_, &tokenData_, &companionURL_, &companionTokenData_); }
};

TEST_F(ItemSandboxTokensTest, IssuesOneForTheItemAndOneForItsCompanion) {
  EXPECT_TRUE(issue());
  EXPECT_THAT(platform().trace().lines(), ElementsAre("issueSandboxExtension readWrite /a b/r flags=0",
                                                      "issueSandboxExtension readWrite /a b/.r flags=0"));
  EXPECT_EQ(tokenData_, Data{fake::FakeSandbox::tokenFor("/a b/r")});
  EXPECT_EQ(companionURL_, URL::fromString("file:///a%20b/.r"));
  EXPECT_EQ(companionTokenData_, Data{fake::FakeSandbox::tokenFor("/a b/.r")});
}

TEST_F(ItemSandboxTokensTest, OneFailingDoesNotStopTheOther) {
  platform().sandbox().failExtension("/a b/r");
  EXPECT_TRUE(issue());
  EXPECT_EQ(tokenData_, std::nullopt);
  EXPECT_EQ(companionTokenData_, Data{fake::FakeSandbox::tokenFor("/a b/.r")});
  platform().sandbox().failExtension("/a b/r", false);
  platform().sandbox().failExtension("/a b/.r");
  EXPECT_TRUE(issue());
  EXPECT_EQ(tokenData_, Data{fake::FakeSandbox::tokenFor("/a b/r")});
  EXPECT_EQ(companionURL_, URL::fromString("file:///a%20b/.r"));
  EXPECT_EQ(companionTokenData_, std::nullopt);
}

TEST_F(ItemSandboxTokensTest, WritesOnlyTheOutputsThatAreAskedFor) {
  EXPECT_TRUE(issueItemSandboxTokens(url_, nullptr, nullptr, nullptr));
  EXPECT_EQ(platform().trace().count("issueSandboxExtension"), 2U);
}

TEST_F(ItemSandboxTokensTest, WithoutAURLThereIsNothingAndThatIsSuccessToo) {
  tokenData_ = Data{"before"};
  EXPECT_TRUE(issueItemSandboxTokens(std::nullopt, &tokenData_, &companionURL_, &companionTokenData_));
  EXPECT_EQ(tokenData_, std::nullopt);
  EXPECT_EQ(companionURL_, std::nullopt);
  EXPECT_EQ(companionTokenData_, std::nullopt);
  EXPECT_TRUE(platform().trace().lines().empty());
}

}  // namespace
}  // namespace storix
