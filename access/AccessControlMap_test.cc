#include "access/AccessControlMap.h"

#include <gmock/gmock.h>

#include <string>

#include "platform/Log.h"

namespace storix {
namespace {

using ::testing::HasSubstr;

Dictionary entry(List items) { return {{"AllowedItemIDs", std::move(items)}}; }

std::string reasonFor(Value content) {
  const Result<AccessControlMap> map = AccessControlMap::fromValue(std::move(content));
  return map.ok() ? "no error" : map.error().message();
}

TEST(AccessControlMap, KeepsOrderDuplicatesEmptyLevelsAndUnknownKeysOfAFile) {
  const Dictionary content{
      {"p", Dictionary{{"c", Dictionary{{"AllowedItemIDs", List{"z", "a", "z"}}, {"Note", List{1, true}}}},
                       {"empty", Dictionary()},
                       {"emptyList", entry({})}}},
      {"emptyProvider", Dictionary()},
  };
  Result<AccessControlMap> map = AccessControlMap::fromValue(content);
  ASSERT_TRUE(map.ok());
  EXPECT_EQ(map.value().dictionary(), content);
  EXPECT_TRUE(map.value().contains("p", "a", "c"));
  EXPECT_FALSE(map.value().contains("p", "a", "empty"));
}

TEST(AccessControlMap, AppendsAtTheEndOfTheListAndKeepsUnknownKeys) {
  Result<AccessControlMap> map = AccessControlMap::fromValue(
      Dictionary{{"p", Dictionary{{"c", Dictionary{{"AllowedItemIDs", List{"z"}}, {"Note", "n"}}}}}});
  ASSERT_TRUE(map.ok());
  EXPECT_TRUE(map.value().add("p", "a", "c"));
  EXPECT_FALSE(map.value().add("p", "z", "c"));
  EXPECT_EQ(map.value().dictionary(),
            (Dictionary{{"p", Dictionary{{"c", Dictionary{{"AllowedItemIDs", List{"z", "a"}}, {"Note", "n"}}}}}}));
}

TEST(AccessControlMap, RemovesEveryOccurrenceAndTheLevelsThatThisEmptied) {
  Result<AccessControlMap> map =
      AccessControlMap::fromValue(Dictionary{{"p", Dictionary{{"c", entry({"i", "j", "i"})}}}});
  ASSERT_TRUE(map.ok());
  EXPECT_TRUE(map.value().remove("p", "i", "c"));
  EXPECT_FALSE(map.value().contains("p", "i", "c"));
  EXPECT_EQ(map.value().dictionary(), (Dictionary{{"p", Dictionary{{"c", entry({"j"})}}}}));
  EXPECT_FALSE(map.value().remove("p", "i", "c"));
  EXPECT_TRUE(map.value().remove("p", "j", "c"));
  EXPECT_TRUE(map.value().dictionary().empty());
}

TEST(AccessControlMap, AConsumerEntryWithAnUnknownKeyOutlivesItsList) {
  Result<AccessControlMap> map = AccessControlMap::fromValue(
      Dictionary{{"p", Dictionary{{"c", Dictionary{{"AllowedItemIDs", List{"i"}}, {"Note", "n"}}}}}});
  ASSERT_TRUE(map.ok());
  EXPECT_TRUE(map.value().remove("p", "i", "c"));
  EXPECT_EQ(map.value().dictionary(), (Dictionary{{"p", Dictionary{{"c", Dictionary{{"Note", "n"}}}}}}));
}

TEST(AccessControlMap, AProviderWithAnotherConsumerStays) {
  AccessControlMap map;
  map.add("p", "i", "c1");
  map.add("p", "i", "c2");
  EXPECT_TRUE(map.remove("p", "i", "c1"));
  EXPECT_EQ(map.dictionary(), (Dictionary{{"p", Dictionary{{"c2", entry({"i"})}}}}));
}

TEST(AccessControlMap, TextsThatJoinToTheSameTextAreDifferentGrants) {
  AccessControlMap map;
  map.add("ab", "ef", "cd");
  EXPECT_TRUE(map.contains("ab", "ef", "cd"));
  EXPECT_FALSE(map.contains("a", "ef", "bcd"));
  EXPECT_FALSE(map.contains("ab", "f", "cde"));
  EXPECT_FALSE(map.contains("cd", "ef", "ab"));
  EXPECT_FALSE(map.contains("abcdef", "", ""));
  map.add("", "", "");
  EXPECT_TRUE(map.contains("", "", ""));
}

TEST(AccessControlMap, FindsEachOfManyGrants) {
  AccessControlMap map;
  for (int i = 0; i < 2000; ++i) map.add("p" + std::to_string(i % 7), "i" + std::to_string(i), "c");
  for (int i = 0; i < 2000; ++i) {
    EXPECT_TRUE(map.contains("p" + std::to_string(i % 7), "i" + std::to_string(i), "c"));
    EXPECT_FALSE(map.contains("p" + std::to_string((i + 1) % 7), "i" + std::to_string(i), "c"));
  }
}

TEST(AccessControlMap, FindsTheOthersAfterARemoval) {
  AccessControlMap map;
  for (int i = 0; i < 100; ++i) map.add("p", "i" + std::to_string(i), "c");
  EXPECT_TRUE(map.remove("p", "i50", "c"));
  for (int i = 0; i < 100; ++i) EXPECT_EQ(map.contains("p", "i" + std::to_string(i), "c"), i != 50) << i;
  EXPECT_TRUE(map.add("p", "i50", "c"));
  EXPECT_TRUE(map.contains("p", "i50", "c"));
}

TEST(AccessControlMap, ContentOfAnotherShapeIsAnErrorThatSaysWhere) {
  EXPECT_EQ(reasonFor(List{}), "The access control file has a list at the top where a dictionary should be.");
  EXPECT_THAT(reasonFor(Dictionary{{"p", "x"}}), HasSubstr("a string for provider “p” where a dictionary"));
  EXPECT_THAT(reasonFor(Dictionary{{"p", Dictionary{{"c", List{}}}}}),
              HasSubstr("a list for consumer “c” of provider “p” where a dictionary"));
  EXPECT_THAT(reasonFor(Dictionary{{"p", Dictionary{{"c", Dictionary{{"AllowedItemIDs", Dictionary()}}}}}}),
              HasSubstr("a dictionary as AllowedItemIDs for consumer “c” of provider “p” where a list"));
  EXPECT_THAT(reasonFor(Dictionary{{"p", Dictionary{{"c", entry({"i", 5})}}}}),
              HasSubstr("a number as item 1 of AllowedItemIDs for consumer “c” of provider “p” where a string"));
  const SXError error = AccessControlMap::fromValue(List{}).error();
  EXPECT_EQ(error.domain(), filesErrorDomain);
  EXPECT_EQ(error.code(), 1);
}

}  // namespace
}  // namespace storix
