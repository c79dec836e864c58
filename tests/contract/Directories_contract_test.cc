#include "tests/contract/ContractTest.h"

namespace storix::contract {
namespace {

class DirectoriesContract : public ContractTest {
 protected:
  DirectoriesContract() { host().makeDirectory(at("d")); }

  [[nodiscard]] URL directoryURL(const std::string &name) const { return *URL::fileURLWithPath(at(name), true); }
  [[nodiscard]] URL itemURL(const std::string &name) const { return *URL::fileURLWithPath(at(name)); }

  /// How the item lies to the directory, as a word; "error" where there is one.
  std::string relationship(const URL &directory, const URL &item) {
    const Result<DirectoryRelationship> result = platform().directoryRelationship(directory, item);
    if (!result) return "error";
    switch (result.value()) {
      case DirectoryRelationship::contains:
        return "contains";
      case DirectoryRelationship::same:
        return "same";
      case DirectoryRelationship::other:
        return "other";
    }
    return "unknown";
  }
  std::string relationship(const std::string &directory, const std::string &item) {
    return relationship(directoryURL(directory), itemURL(item));
  }
};

TEST_P(DirectoriesContract, ItemInsideAtAnyDepthIsContained) {
  host().makeDirectory(at("d/e"));
  host().writeCorruptFile(at("d/e/file"));
  EXPECT_EQ(relationship("d", "d/e"), "contains");
  EXPECT_EQ(relationship("d", "d/e/file"), "contains");
  EXPECT_EQ(relationship("d/e", "d/e/file"), "contains");
}

TEST_P(DirectoriesContract, DirectoryItselfIsTheSameWithOrWithoutSlash) {
  EXPECT_EQ(relationship(directoryURL("d"), itemURL("d")), "same");
  EXPECT_EQ(relationship(directoryURL("d"), directoryURL("d")), "same");
  EXPECT_EQ(relationship(itemURL("d"), directoryURL("d")), "same");
}

TEST_P(DirectoriesContract, WhatLiesAboveOrBesideIsOther) {
  host().makeDirectory(at("d/e"));
  host().makeDirectory(at("f"));
  EXPECT_EQ(relationship("d/e", "d"), "other");
  EXPECT_EQ(relationship("d", "f"), "other");
  EXPECT_EQ(relationship("d", "f/d"), "other");
}

TEST_P(DirectoriesContract, NamesAreComparedWhole) {
  host().makeDirectory(at("a"));
  host().makeDirectory(at("ab"));
  EXPECT_EQ(relationship("a", "ab"), "other");
  EXPECT_EQ(relationship("a", "ab/c"), "other");
  EXPECT_EQ(relationship("ab", "a"), "other");
  EXPECT_EQ(relationship("a", "a/b"), "contains");
}

TEST_P(DirectoriesContract, RootContainsEverything) {
  EXPECT_EQ(relationship(*URL::fromString("file:///"), itemURL("d")), "contains");
  EXPECT_EQ(relationship(*URL::fromString("file:///"), *URL::fromString("file:///")), "same");
}

TEST_P(DirectoriesContract, ItemNeedNotExist) {
  EXPECT_EQ(relationship("d", "d/missing"), "contains");
  EXPECT_EQ(relationship("d", "d/missing/deeper/still"), "contains");
  EXPECT_EQ(relationship("d", "missing/item"), "other");
}

TEST_P(DirectoriesContract, MissingDirectoryIsFileNotFoundWithItsURL) {
  for (const URL &directory : {directoryURL("missing"), directoryURL("d/missing"), itemURL("missing")}) {
    const Result<DirectoryRelationship> result = platform().directoryRelationship(directory, itemURL("d/item"));
    ASSERT_FALSE(result);
    EXPECT_TRUE(isFileNotFoundForReading(result.error()));
    EXPECT_EQ(result.error().urlDetail("URL"), directory);
  }
}

TEST_P(DirectoriesContract, AbsentURLIsAnotherError) {
  for (const auto &[directory, item] : {std::pair<std::optional<URL>, std::optional<URL>>{std::nullopt, itemURL("d")},
                                        {directoryURL("d"), std::nullopt},
                                        {std::nullopt, std::nullopt}}) {
    const Result<DirectoryRelationship> result = platform().directoryRelationship(directory, item);
    ASSERT_FALSE(result);
    EXPECT_FALSE(isFileNotFoundForReading(result.error()));
    EXPECT_FALSE(result.error().message().empty());
  }
}

TEST_P(DirectoriesContract, DotsAreResolved) {
  host().makeDirectory(at("d/e"));
  EXPECT_EQ(relationship(directoryURL("d"), itemURL("d/e/../x")), "contains");
  EXPECT_EQ(relationship(directoryURL("d"), itemURL("d/../x")), "other");
  EXPECT_EQ(relationship(directoryURL("d"), itemURL("d/e/../../x")), "other");
  EXPECT_EQ(relationship(directoryURL("d"), itemURL("d/./e/..")), "same");
  EXPECT_EQ(relationship(directoryURL("d/e/.."), itemURL("d/x")), "contains");
}

TEST_P(DirectoriesContract, EscapesInTheURLAreDecodedFirst) {
  host().makeDirectory(at("Storix Storage"));
  const URL item = *URL::fromString("file://" + host().directory() + "/Storix%20Storage/%61%C3%A9");
  EXPECT_EQ(relationship(directoryURL("Storix Storage"), item), "contains");
  EXPECT_EQ(relationship(directoryURL("d"), *URL::fromString("file://" + host().directory() + "/d/%2E%2E/x")), "other");
}

TEST_P(DirectoriesContract, LinkOutOfTheDirectoryLeadsOut) {
  host().makeDirectory(at("outside"));
  host().makeSymbolicLink(at("d/out"), at("outside"));
  host().makeSymbolicLink(at("d/relative"), "../outside");
  EXPECT_EQ(relationship("d", "d/out/item"), "other");
  EXPECT_EQ(relationship("d", "d/out"), "other");
  EXPECT_EQ(relationship("d", "d/relative/item"), "other");
  EXPECT_EQ(relationship("outside", "d/out/item"), "contains");
}

TEST_P(DirectoriesContract, LinkIntoTheDirectoryLeadsIn) {
  host().makeDirectory(at("d/e"));
  host().makeSymbolicLink(at("in"), at("d/e"));
  EXPECT_EQ(relationship("d", "in/item"), "contains");
  EXPECT_EQ(relationship("d", "in"), "contains");
  EXPECT_EQ(relationship("d/e", "in"), "same");
  EXPECT_EQ(relationship("d", "in/../item"), "contains") << "what stands above is above the link's target";
}

TEST_P(DirectoriesContract, DirectoryMayBeReachedThroughALink) {
  host().makeSymbolicLink(at("link"), at("d"));
  EXPECT_EQ(relationship("link", "d/item"), "contains");
  EXPECT_EQ(relationship("link", "link"), "same");
  EXPECT_EQ(relationship("link", "link/missing/item"), "contains");
}

STORIX_CONTRACT(DirectoriesContract);

}  // namespace
}  // namespace storix::contract
