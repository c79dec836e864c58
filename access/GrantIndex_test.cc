#include "access/GrantIndex.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <random>
#include <set>
#include <string>
#include <string_view>
#include <tuple>
#include <unordered_map>
#include <utility>

namespace storix {
namespace {

TEST(GrantIndex, AGrantIsOfOneProviderOneItemAndOneConsumer) {
  GrantIndex index;
  EXPECT_FALSE(index.contains("p", "i", "c"));
  EXPECT_FALSE(index.erase("p", "i", "c"));
  EXPECT_TRUE(index.insert("p", "i", "c"));
  EXPECT_FALSE(index.insert("p", "i", "c"));
  EXPECT_TRUE(index.insert("q", "j", "d"));
  EXPECT_TRUE(index.contains("p", "i", "c"));
  EXPECT_FALSE(index.contains("q", "i", "c"));
  EXPECT_FALSE(index.contains("p", "j", "c"));
  EXPECT_FALSE(index.contains("p", "i", "d"));
  EXPECT_FALSE(index.contains("c", "i", "p"));
  EXPECT_FALSE(index.erase("p", "i", "d"));
  EXPECT_TRUE(index.erase("p", "i", "c"));
  EXPECT_FALSE(index.contains("p", "i", "c"));
  EXPECT_TRUE(index.contains("q", "j", "d"));
}

TEST(GrantIndex, ItemsOfAnyLengthAreToldApartToTheLastByte) {
  GrantIndex index;
  for (std::size_t length = 0; length < 130; ++length) EXPECT_TRUE(index.insert("p", std::string(length, 'x'), "c"));
  for (std::size_t length = 0; length < 130; ++length) {
    std::string item(length, 'x');
    EXPECT_TRUE(index.contains("p", item, "c"));
    if (length == 0) continue;
    item.back() = 'y';
    EXPECT_FALSE(index.contains("p", item, "c"));
    item.back() = '\0';
    EXPECT_FALSE(index.contains("p", item, "c"));
    EXPECT_TRUE(index.insert("p", item, "c"));
    EXPECT_TRUE(index.contains("p", item, "c"));
  }
}

/// Two texts, that long and different only at the end, whose hashes have the same lower half.
std::pair<std::string, std::string> textsOfOneFingerprint(std::size_t length) {
  std::unordered_map<std::uint32_t, std::string> seen;
  for (int number = 1'000'000;; ++number) {
    std::string text = std::string(length - 7, 'x') + std::to_string(number);
    const auto fingerprint = static_cast<std::uint32_t>(std::hash<std::string_view>()(text));
    const auto [other, isNew] = seen.try_emplace(fingerprint, text);
    if (!isNew) return {other->second, text};
  }
}

TEST(GrantIndex, ItemsOfOneFingerprintAreToldApartByTheirText) {
  for (const std::size_t length : {20U, 40U, 60U}) {
    const auto [one, other] = textsOfOneFingerprint(length);
    GrantIndex index;
    EXPECT_TRUE(index.insert("p", one, "c"));
    EXPECT_FALSE(index.contains("p", other, "c"));
    EXPECT_TRUE(index.insert("p", other, "c"));
    EXPECT_TRUE(index.erase("p", one, "c"));
    EXPECT_TRUE(index.contains("p", other, "c"));
  }
}

TEST(GrantIndex, HoldsWhatASetHoldsWhateverComesAndGoes) {
  using Grant = std::tuple<std::string, std::string, std::string>;
  constexpr unsigned names = 4;
  constexpr unsigned items = 40;
  GrantIndex index;
  std::set<Grant> expected;
  std::minstd_rand random(7);
  for (int step = 0; step < 40'000; ++step) {
    const std::string provider = "provider" + std::to_string(random() % names);
    const std::string item = std::string(random() % 2 * 38, '/') + std::to_string(random() % items);
    const std::string consumer = "consumer" + std::to_string(random() % names);
    const Grant grant{provider, item, consumer};
    // First more come than go, then more go.
    const bool comes = random() % 4 < (step < 20'000 ? 3 : 1);
    if (comes) {
      ASSERT_EQ(index.insert(provider, item, consumer), expected.insert(grant).second);
    } else {
      ASSERT_EQ(index.erase(provider, item, consumer), expected.erase(grant) == 1);
    }
    if (step % 1000 != 0) continue;
    for (const auto &[p, i, c] : expected) ASSERT_TRUE(index.contains(p, i, c));
  }
}

}  // namespace
}  // namespace storix
