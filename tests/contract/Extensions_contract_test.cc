#include <algorithm>
#include <atomic>
#include <thread>

#include "tests/contract/ContractTest.h"

namespace storix::contract {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

using Records = std::vector<std::shared_ptr<ExtensionRecord>>;

std::vector<std::string> identifiersOf(const Records &records) {
  std::vector<std::string> identifiers;
  for (const auto &record : records) identifiers.push_back(record->identifier().value_or("(none)"));
  std::sort(identifiers.begin(), identifiers.end());
  return identifiers;
}

class ExtensionsContract : public ContractTest {
 protected:
  void begin(const char *extensionPoint = "com.tessel.storix-nonui") {
    matching_ = platform().beginMatchingExtensions(
        {{std::string(extensionPointAttribute), extensionPoint}},
        [deliveries = deliveries_](Records records, const std::optional<SXError> &) {
          deliveries->change([&records](std::vector<Records> &all) { all.push_back(std::move(records)); });
        });
  }

  /// Waits for a list that holds just these extensions, and gives it.
  Records awaitList(const std::vector<std::string> &identifiers) {
    EXPECT_TRUE(deliveries_->wait([&identifiers](const std::vector<Records> &all) {
      return !all.empty() && identifiersOf(all.back()) == identifiers;
    }));
    const std::vector<Records> all = deliveries_->value();
    return all.empty() ? Records() : all.back();
  }

  /// Waits until a list that came holds the extension in another state than this record's.
  Records awaitChange(const ExtensionRecord &record) {
    EXPECT_TRUE(deliveries_->wait([&record](const std::vector<Records> &all) {
      return std::any_of(all.back().begin(), all.back().end(), [&record](const auto &other) {
        return other->identifier() == record.identifier() && !other->isEqual(record);
      });
    }));
    return deliveries_->value().back();
  }

  std::shared_ptr<Awaited<std::vector<Records>>> deliveries_ = std::make_shared<Awaited<std::vector<Records>>>();
  std::shared_ptr<ExtensionMatching> matching_;
};

TEST_P(ExtensionsContract, EmptyListIsDeliveredWhereNothingIsInstalled) {
  begin();
  EXPECT_THAT(awaitList({}), IsEmpty());
}

TEST_P(ExtensionsContract, WhatIsInstalledIsDeliveredAtFirst) {
  host().installBundle(describedBundle("org.sample.a"));
  host().installBundle(describedBundle("org.sample.b"));
  begin();
  EXPECT_EQ(awaitList({"org.sample.a", "org.sample.b"}).size(), 2U);
  EXPECT_EQ(deliveries_->value().size(), 1U) << "the first list is complete";
}

TEST_P(ExtensionsContract, CompleteListIsDeliveredAgainWhenOneIsAddedOrRemoved) {
  host().installBundle(describedBundle("org.sample.a"));
  begin();
  awaitList({"org.sample.a"});
  host().installBundle(describedBundle("org.sample.b"));
  awaitList({"org.sample.a", "org.sample.b"});
  host().removeBundle("org.sample.a");
  awaitList({"org.sample.b"});
  host().removeBundle("org.sample.b");
  awaitList({});
}

TEST_P(ExtensionsContract, UntouchedExtensionIsEqualInTheNextList) {
  host().installBundle(describedBundle("org.sample.a"));
  begin();
  const std::shared_ptr<ExtensionRecord> before = awaitList({"org.sample.a"}).front();
  host().installBundle(describedBundle("org.sample.b"));
  for (const auto &record : awaitList({"org.sample.a", "org.sample.b"})) {
    EXPECT_EQ(record->isEqual(*before), record->identifier() == "org.sample.a");
    EXPECT_EQ(before->isEqual(*record), record->identifier() == "org.sample.a");
  }
}

TEST_P(ExtensionsContract, ChangedVersionOrInfoMakesAnotherRecord) {
  BundleDescription bundle = describedBundle("org.sample.a");
  host().installBundle(bundle);
  begin();
  const std::shared_ptr<ExtensionRecord> first = awaitList({"org.sample.a"}).front();
  bundle.version = "2";
  host().installBundle(bundle);
  const std::shared_ptr<ExtensionRecord> second = awaitChange(*first).front();
  EXPECT_FALSE(first->isEqual(*second));
  bundle.info.insert_or_assign("KTExtension", Dictionary{});
  host().installBundle(bundle);
  EXPECT_FALSE(awaitChange(*second).front()->isEqual(*first));
}

TEST_P(ExtensionsContract, ExtensionWithoutIdentifierIsDeliveredWithoutOne) {
  BundleDescription bundle = describedBundle("org.sample.a");
  bundle.identifier.reset();
  host().installBundle(bundle);
  begin();
  const Records records = awaitList({"(none)"});
  ASSERT_EQ(records.size(), 1U);
  EXPECT_FALSE(records.front()->identifier());
  EXPECT_FALSE(records.front()->description().empty());
}

TEST_P(ExtensionsContract, OnlyTheExtensionPointAskedForIsMatched) {
  BundleDescription other = describedBundle("org.sample.other");
  other.extensionPoint = "org.sample.point";
  host().installBundle(other);
  host().installBundle(describedBundle("org.sample.a"));
  begin();
  awaitList({"org.sample.a"});
}

TEST_P(ExtensionsContract, HandlerIsNotCalledInsideTheCallNorTwiceAtATime) {
  struct State {
    std::atomic<bool> inCall{true};
    std::atomic<int> running{0};
    Awaited<int> calls;
  };
  const auto state = std::make_shared<State>();
  const std::thread::id caller = std::this_thread::get_id();
  const auto matching =
      platform().beginMatchingExtensions({{std::string(extensionPointAttribute), "com.tessel.storix-nonui"}},
                                         [state, caller](const Records &, const std::optional<SXError> &) {
                                           EXPECT_NE(std::this_thread::get_id(), caller);
                                           EXPECT_EQ(++state->running, 1);
                                           --state->running;
                                           state->calls.change([](int &count) { ++count; });
                                         });
  ASSERT_TRUE(state->calls.wait([](int count) { return count >= 1; }));
  host().installBundle(describedBundle("org.sample.a"));
  ASSERT_TRUE(state->calls.wait([](int count) { return count >= 2; }));
}

TEST_P(ExtensionsContract, DescriptionNamesTheExtension) {
  host().installBundle(describedBundle("org.sample.a"));
  begin();
  EXPECT_THAT(awaitList({"org.sample.a"}).front()->description(), testing::HasSubstr("org.sample.a"));
}

TEST_P(ExtensionsContract, BundleRecordGivesInfoOfTheKindAskedFor) {
  host().installBundle(describedBundle("org.sample.a"));
  begin();
  awaitList({"org.sample.a"});
  const std::shared_ptr<BundleRecord> record = platform().bundleRecordForIdentifier("org.sample.a");
  ASSERT_TRUE(record);
  EXPECT_EQ(record->infoDictionaryValue("KTExtension", ValueKind::dictionary),
            Value(Dictionary{{"KTExtensionStorixDocumentGroup", "group.org.sample.a"}}));
  EXPECT_FALSE(record->infoDictionaryValue("KTExtension", ValueKind::string));
  EXPECT_FALSE(record->infoDictionaryValue("KTMissing", ValueKind::dictionary));
}

TEST_P(ExtensionsContract, ThereIsNoRecordOfABundleThatIsNotInstalled) {
  host().installBundle(describedBundle("org.sample.a"));
  begin();
  awaitList({"org.sample.a"});
  EXPECT_FALSE(platform().bundleRecordForIdentifier("org.sample.b"));
  EXPECT_FALSE(platform().bundleRecordForIdentifier(""));
  EXPECT_FALSE(platform().bundleRecordForIdentifier(std::nullopt));
}

TEST_P(ExtensionsContract, EachGroupHasAContainerWhichIsADirectoryURL) {
  BundleDescription bundle = describedBundle("org.sample.a");
  bundle.groups = {"group.one", "group.two"};
  host().installBundle(bundle);
  begin();
  awaitList({"org.sample.a"});
  const std::shared_ptr<BundleRecord> record = platform().bundleRecordForIdentifier("org.sample.a");
  ASSERT_TRUE(record);
  const std::map<std::string, URL> containers = record->groupContainerURLs();
  std::vector<std::string> groups;
  for (const auto &[group, url] : containers) {
    groups.push_back(group);
    EXPECT_TRUE(url.hasDirectoryPath());
    EXPECT_TRUE(platform().fileExists(url.path())) << "it is made when the extension is delivered";
  }
  EXPECT_THAT(groups, ElementsAre("group.one", "group.two"));
}

TEST_P(ExtensionsContract, BundleWithoutGroupsHasNoContainers) {
  BundleDescription bundle = describedBundle("org.sample.a");
  bundle.groups.clear();
  host().installBundle(bundle);
  begin();
  awaitList({"org.sample.a"});
  const std::shared_ptr<BundleRecord> record = platform().bundleRecordForIdentifier("org.sample.a");
  ASSERT_TRUE(record);
  EXPECT_THAT(record->groupContainerURLs(), IsEmpty());
}

STORIX_CONTRACT(ExtensionsContract);

}  // namespace
}  // namespace storix::contract
