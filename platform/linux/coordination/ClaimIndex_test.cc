#include "platform/linux/coordination/ClaimIndex.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <random>
#include <string>

namespace storix::linuxhost {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using enum ClaimIndex::Kind;

TEST(ClaimIndexTest, SharedClaimsStandSideBySideAndAnExclusiveOneAlone) {
  ClaimIndex index;
  const auto first = index.add("/a/b", shared);
  const auto second = index.add("/a/b", shared);
  const auto writer = index.add("/a/b", exclusive);
  EXPECT_TRUE(index.isHeld(first));
  EXPECT_TRUE(index.isHeld(second));
  EXPECT_FALSE(index.isHeld(writer));
  EXPECT_THAT(index.remove(first), IsEmpty());
  EXPECT_THAT(index.remove(second), ElementsAre(writer));
  EXPECT_TRUE(index.isHeld(writer));
}

TEST(ClaimIndexTest, ClaimsConflictAboveAndBelowAndNotBeside) {
  ClaimIndex index;
  const auto writer = index.add("/a/b", exclusive);
  const auto above = index.add("/a", shared);
  const auto root = index.add("/", shared);
  const auto below = index.add("/a/b/c/d", shared);
  const auto beside = index.add("/a/bc", exclusive);
  EXPECT_FALSE(index.isHeld(above));
  EXPECT_FALSE(index.isHeld(root));
  EXPECT_FALSE(index.isHeld(below));
  EXPECT_FALSE(index.isHeld(beside));  // Behind the readers of what it lies in.
  EXPECT_TRUE(index.isHeld(index.add("/other", shared)));
  EXPECT_THAT(index.remove(writer), ElementsAre(above, root, below));
  EXPECT_THAT(index.remove(above), IsEmpty());
  EXPECT_THAT(index.remove(root), ElementsAre(beside));
}

TEST(ClaimIndexTest, NobodyOvertakesOneThatWaits) {
  ClaimIndex index;
  const auto reader = index.add("/a/b", shared);
  const auto writer = index.add("/a/b", exclusive);
  const auto later = index.add("/a/b", shared);
  EXPECT_FALSE(index.isHeld(later));
  EXPECT_THAT(index.remove(reader), ElementsAre(writer));
  EXPECT_THAT(index.remove(writer), ElementsAre(later));
}

TEST(ClaimIndexTest, OneThatGivesUpWaitingLetsThoseBehindItIn) {
  ClaimIndex index;
  const auto reader = index.add("/a", shared);
  const auto writer = index.add("/a/b", exclusive);
  const auto later = index.add("/a/b/c", shared);
  EXPECT_FALSE(index.isHeld(later));
  EXPECT_THAT(index.remove(writer), ElementsAre(later));
  EXPECT_TRUE(index.isHeld(reader));
}

TEST(ClaimIndexTest, UnknownClaimIsIgnored) {
  ClaimIndex index;
  EXPECT_THAT(index.remove(1), IsEmpty());
  const auto claim = index.add("/a", exclusive);
  EXPECT_THAT(index.remove(claim), IsEmpty());
  EXPECT_THAT(index.remove(claim), IsEmpty());
  EXPECT_FALSE(index.isHeld(claim));
  EXPECT_EQ(index.size(), 0U);
}

TEST(ClaimIndexTest, ComponentsAreCounted) {
  EXPECT_EQ(ClaimIndex::componentsOf("/"), 1U);
  EXPECT_EQ(ClaimIndex::componentsOf("/a"), 2U);
  EXPECT_EQ(ClaimIndex::componentsOf("/a/b"), 3U);
}

/// The rule itself, written plainly.
struct PlainRule {
  struct Claim {
    std::string path;
    ClaimIndex::Kind kind;
  };
  std::map<ClaimIndex::Number, Claim> claims;

  static bool contains(const std::string &directory, const std::string &path) {
    return directory == "/" || path == directory || path.starts_with(directory + "/");
  }
  [[nodiscard]] bool isHeld(ClaimIndex::Number number) const {
    const Claim &claim = claims.at(number);
    for (const auto &[earlier, other] : claims) {
      if (earlier >= number) break;
      const bool related = contains(other.path, claim.path) || contains(claim.path, other.path);
      if (related && (other.kind == exclusive || claim.kind == exclusive)) return false;
    }
    return true;
  }
};

TEST(ClaimIndexTest, AgreesWithThePlainRuleOnRandomClaims) {
  std::mt19937 random(4711);
  const auto below = [&random](std::size_t limit) { return static_cast<std::size_t>(random() % limit); };
  for (int round = 0; round < 30; ++round) {
    ClaimIndex index;
    PlainRule rule;
    for (int step = 0; step < 300; ++step) {
      std::map<ClaimIndex::Number, bool> before;
      for (const auto &[number, claim] : rule.claims) before[number] = rule.isHeld(number);
      if (rule.claims.size() < 12 || (below(2) == 0 && rule.claims.size() < 40)) {
        std::string path;
        for (std::size_t depth = below(4); depth > 0; --depth) path += std::string("/") + "abc"[below(3)];
        if (path.empty()) path = "/";
        const ClaimIndex::Kind kind = below(3) == 0 ? exclusive : shared;
        const ClaimIndex::Number number = index.add(path, kind);
        rule.claims[number] = {path, kind};
        ASSERT_EQ(index.isHeld(number), rule.isHeld(number)) << path;
      } else {
        const auto gone = std::next(rule.claims.begin(), static_cast<std::ptrdiff_t>(below(rule.claims.size())));
        const ClaimIndex::Number number = gone->first;
        rule.claims.erase(gone);
        std::vector<ClaimIndex::Number> expected;
        for (const auto &[other, claim] : rule.claims) {
          if (!before[other] && rule.isHeld(other)) expected.push_back(other);
        }
        ASSERT_EQ(index.remove(number), expected);
      }
      for (const auto &[number, claim] : rule.claims) ASSERT_EQ(index.isHeld(number), rule.isHeld(number));
    }
    ASSERT_EQ(index.size(), rule.claims.size());
  }
}

TEST(ClaimIndexTest, ManyThousandClaimsOnOnePathAreServedOneAfterAnother) {
  ClaimIndex index;
  std::vector<ClaimIndex::Number> writers;
  writers.reserve(20000);
  for (int i = 0; i < 20000; ++i) writers.push_back(index.add("/home/ada/groups/one/Storix Storage/file", exclusive));
  for (std::size_t i = 0; i + 1 < writers.size(); ++i) {
    ASSERT_THAT(index.remove(writers[i]), ElementsAre(writers[i + 1]));
  }
}

TEST(ClaimIndexTest, WritersBelowADirectoryWaitForItsManyReadersWithoutBeingLookedAtForEachOfThem) {
  constexpr std::size_t count = 20000;
  ClaimIndex index;
  std::vector<ClaimIndex::Number> readers;
  std::vector<ClaimIndex::Number> writers;
  for (std::size_t i = 0; i < count; ++i) readers.push_back(index.add("/home/ada", shared));
  for (std::size_t i = 0; i < count; ++i) writers.push_back(index.add("/home/ada/" + std::to_string(i), exclusive));
  for (std::size_t i = 0; i + 1 < count; ++i) ASSERT_THAT(index.remove(readers[i]), IsEmpty());
  EXPECT_EQ(index.remove(readers.back()), writers);
}

TEST(ClaimIndexTest, ReadersBelowADirectoryAreLookedAtOnlyAsFarAsItsNextWriter) {
  constexpr std::size_t count = 20000;
  ClaimIndex index;
  std::vector<ClaimIndex::Number> writers;
  std::vector<ClaimIndex::Number> readers;
  for (std::size_t i = 0; i < count; ++i) {
    writers.push_back(index.add("/home/ada", exclusive));
    readers.push_back(index.add("/home/ada/" + std::to_string(i), shared));
  }
  for (std::size_t i = 0; i < count; ++i) {
    ASSERT_THAT(index.remove(writers[i]), ElementsAre(readers[i]));
    const auto next = index.remove(readers[i]);
    ASSERT_EQ(next.size(), i + 1 < count ? 1U : 0U);
  }
}

TEST(ClaimIndexTest, ADeepPathIsEnded) {
  std::string path;
  for (int i = 0; i < 30000; ++i) path += "/a";
  ClaimIndex index;
  index.add(path, exclusive);
}

}  // namespace
}  // namespace storix::linuxhost
