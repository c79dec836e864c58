#include "platform/linux/extensions/ExtensionDiscovery.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <deque>
#include <mutex>

#include "platform/ProcessScope.h"
#include "platform/fake/FakePlatform.h"
#include "platform/linux/SteppedTime.h"
#include "platform/linux/TestDirectory.h"

namespace storix::linuxhost {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

constexpr std::chrono::milliseconds quiet{100};

class StubRecord : public ExtensionRecord {
 public:
  explicit StubRecord(std::shared_ptr<const ExtensionBundle> bundle) : bundle_(std::move(bundle)) {}
  std::optional<std::string> identifier() const override { return bundle_->identifier; }
  bool isEqual(const ExtensionRecord &other) const override { return &other == this; }
  std::string description() const override { return bundle_->path; }
  void beginExtensionRequest(BeginHandler) override {}
  void cancelExtensionRequest(const RequestIdentifier &) override {}
  std::shared_ptr<ExtensionContext> extensionContextForRequest(const RequestIdentifier &) override { return nullptr; }

 private:
  std::shared_ptr<const ExtensionBundle> bundle_;
};

/// What a matching handler is given.
class Deliveries {
 public:
  struct Delivery {
    std::vector<std::shared_ptr<ExtensionRecord>> records;
    std::optional<SXError> error;
    [[nodiscard]] std::vector<std::string> identifiers() const {
      std::vector<std::string> identifiers;
      for (const auto &record : records) identifiers.push_back(record->identifier().value_or("none"));
      return identifiers;
    }
  };

  ExtensionMatchingHandler handler() {
    return [state = state_](std::vector<std::shared_ptr<ExtensionRecord>> records, std::optional<SXError> error) {
      EXPECT_EQ(state->running.fetch_add(1), 0) << "two calls at a time";
      {
        const std::lock_guard lock(state->mutex);
        state->deliveries.push_back({std::move(records), std::move(error)});
      }
      state->changed.notify_all();
      state->running.fetch_sub(1);
    };
  }

  Delivery next() {
    std::unique_lock lock(state_->mutex);
    if (!state_->changed.wait_for(lock, std::chrono::seconds(60), [this] { return !state_->deliveries.empty(); })) {
      ADD_FAILURE() << "nothing was delivered";
      return {};
    }
    Delivery first = std::move(state_->deliveries.front());
    state_->deliveries.pop_front();
    return first;
  }

  [[nodiscard]] bool isEmpty() {
    const std::lock_guard lock(state_->mutex);
    return state_->deliveries.empty();
  }

 private:
  /// The handler may still be on its way out when the test goes on.
  struct State {
    std::atomic<int> running{0};
    std::mutex mutex;
    std::condition_variable changed;
    std::deque<Delivery> deliveries;
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
};

class ExtensionDiscoveryTest : public ::testing::Test {
 protected:
  void install(const std::string &bundle, const std::string &identifier, const std::string &more = {}) {
    // As an installer should: the bundle appears whole.
    directory_.makeFile("staging/Info.kvs", R"({"KTBundleIdentifier": ")" + identifier +
                                                R"(", "KTExtensionPointIdentifier": "point")" + more + "}");
    std::filesystem::create_directories(std::filesystem::path(directory_ / bundle).parent_path());
    std::filesystem::rename(directory_ / "staging", directory_ / (bundle + ".appdex"));
  }

  std::shared_ptr<ExtensionMatching> begin(Deliveries &deliveries, const std::string &point = "point") {
    return discovery_.beginMatching({{std::string(extensionPointAttribute), point}}, deliveries.handler());
  }

  /// The change that was made is noticed, and time passes until the burst is over.
  Deliveries::Delivery nextAfterChange() {
    EXPECT_TRUE(time_.waitForTaskIn(quiet));
    time_.advance(quiet);
    // An event of the same change that came late starts the quiet time anew.
    while (deliveries_.isEmpty()) {
      time_.advance(quiet);
      std::this_thread::yield();
    }
    return deliveries_.next();
  }

  std::vector<std::string> linesWith(const std::string &text) {
    std::vector<std::string> found;
    for (const std::string &line : platform_->log().texts()) {
      if (line.find(text) != std::string::npos) found.push_back(line);
    }
    return found;
  }

  TestDirectory directory_;
  std::unique_ptr<fake::FakePlatform> platform_ = fake::FakePlatform::create();
  ProcessScope scope_{*platform_};
  ThreadPool pool_;
  SteppedTime time_{pool_};
  IoLoop loop_{pool_};
  Deliveries deliveries_;
  ExtensionPlaces places_{{directory_ / "a", directory_ / "b/c/d"}, directory_ / "groups"};
  ExtensionDiscovery discovery_{places_, time_, loop_, [](std::shared_ptr<const ExtensionBundle> bundle) {
                                  return std::make_shared<StubRecord>(std::move(bundle));
                                }};
};

TEST_F(ExtensionDiscoveryTest, FirstDeliveryHasAllThatIsInstalledAlsoWhenThatIsNothing) {
  const auto matching = begin(deliveries_);
  const Deliveries::Delivery first = deliveries_.next();
  EXPECT_THAT(first.records, IsEmpty());
  EXPECT_FALSE(first.error);
}

TEST_F(ExtensionDiscoveryTest, OnlyTheNamedExtensionPointMatches) {
  install("a/x", "org.x");
  directory_.makeFile("a/y.appdex/Info.kvs",
                      R"({"KTBundleIdentifier": "org.y", "KTExtensionPointIdentifier": "other"})");
  directory_.makeFile("a/z.appdex/Info.kvs", R"({"KTBundleIdentifier": "org.z"})");
  const auto matching = begin(deliveries_);
  EXPECT_THAT(deliveries_.next().identifiers(), ElementsAre("org.x"));
  Deliveries others;
  const auto second = begin(others, "other");
  EXPECT_THAT(others.next().identifiers(), ElementsAre("org.y"));
  Deliveries none;
  const auto third = discovery_.beginMatching({}, none.handler());
  EXPECT_THAT(none.next().identifiers(), IsEmpty());
}

TEST_F(ExtensionDiscoveryTest, RecordWithoutIdentifierIsDelivered) {
  install("a/x", "");
  const auto matching = begin(deliveries_);
  EXPECT_THAT(deliveries_.next().identifiers(), ElementsAre("none"));
}

TEST_F(ExtensionDiscoveryTest, AddedChangedAndRemovedBundlesAreDelivered) {
  install("a/x", "org.x");
  const auto matching = begin(deliveries_);
  const Deliveries::Delivery first = deliveries_.next();
  EXPECT_THAT(first.identifiers(), ElementsAre("org.x"));

  install("a/y", "org.y");
  const Deliveries::Delivery second = nextAfterChange();
  EXPECT_THAT(second.identifiers(), ElementsAre("org.x", "org.y"));
  EXPECT_EQ(second.records[0], first.records[0]) << "an unchanged bundle keeps its record";

  directory_.makeFile("a/x.appdex/Info.kvs",
                      R"({"KTBundleIdentifier": "org.x", "KTExtensionPointIdentifier": "point", "new": 1})");
  const Deliveries::Delivery third = nextAfterChange();
  EXPECT_THAT(third.identifiers(), ElementsAre("org.x", "org.y"));
  EXPECT_NE(third.records[0], second.records[0]);
  EXPECT_EQ(third.records[1], second.records[1]);

  std::filesystem::remove_all(directory_ / "a/x.appdex");
  EXPECT_THAT(nextAfterChange().identifiers(), ElementsAre("org.y"));
}

TEST_F(ExtensionDiscoveryTest, DirectoryThatAppearsLaterIsRead) {
  const auto matching = begin(deliveries_);
  EXPECT_THAT(deliveries_.next().records, IsEmpty());
  install("b/c/d/x", "org.x");
  EXPECT_THAT(nextAfterChange().identifiers(), ElementsAre("org.x"));
  std::filesystem::remove_all(directory_ / "b");
  EXPECT_THAT(nextAfterChange().identifiers(), IsEmpty());
  install("b/c/d/y", "org.y");
  EXPECT_THAT(nextAfterChange().identifiers(), ElementsAre("org.y"));
}

TEST_F(ExtensionDiscoveryTest, FirstDirectoryWinsAlsoWhenItComesLater) {
  install("b/c/d/x", "org.x");
  const auto matching = begin(deliveries_);
  const Deliveries::Delivery first = deliveries_.next();
  install("a/x", "org.x");
  const Deliveries::Delivery second = nextAfterChange();
  EXPECT_THAT(second.identifiers(), ElementsAre("org.x"));
  EXPECT_EQ(second.records[0]->description(), directory_ / "a/x.appdex");
  EXPECT_NE(second.records[0], first.records[0]);
}

TEST_F(ExtensionDiscoveryTest, BurstOfChangesIsOneDelivery) {
  const auto matching = begin(deliveries_);
  EXPECT_THAT(deliveries_.next().records, IsEmpty());
  for (int i = 0; i < 10; ++i) install("a/" + std::to_string(i), "org." + std::to_string(i));
  EXPECT_EQ(nextAfterChange().records.size(), 10U);
  // What comes late of the burst finds nothing new; the next delivery is that of the next change.
  install("a/last", "org.last");
  EXPECT_EQ(nextAfterChange().records.size(), 11U);
}

TEST_F(ExtensionDiscoveryTest, LookThatFindsTheSameDeliversNothing) {
  install("a/x", "org.x");
  const auto matching = begin(deliveries_);
  EXPECT_THAT(deliveries_.next().identifiers(), ElementsAre("org.x"));
  const std::string info = directory_.contentOf("a/x.appdex/Info.kvs");
  directory_.makeFile("a/x.appdex/Info.kvs", info);
  ASSERT_TRUE(time_.waitForTaskIn(quiet));
  time_.advance(quiet);
  install("a/y", "org.y");
  EXPECT_THAT(nextAfterChange().identifiers(), ElementsAre("org.x", "org.y"));
}

TEST_F(ExtensionDiscoveryTest, MalformedBundleIsLoggedOnceAndLeftOut) {
  install("a/x", "org.x");
  directory_.makeFile("a/bad.appdex/Info.kvs", "{\"a\": nonsense}");
  const auto matching = begin(deliveries_);
  EXPECT_THAT(deliveries_.next().identifiers(), ElementsAre("org.x"));
  const std::vector<std::string> lines = linesWith("a/bad.appdex/Info.kvs");
  ASSERT_EQ(lines.size(), 1U);
  EXPECT_THAT(lines[0], HasSubstr("[ERROR] Could not use " + (directory_ / "a/bad.appdex/Info.kvs") + ". Error: "));
  EXPECT_THAT(lines[0], HasSubstr("line 1"));

  install("a/y", "org.y");
  EXPECT_THAT(nextAfterChange().identifiers(), ElementsAre("org.x", "org.y"));
  EXPECT_EQ(linesWith("a/bad.appdex/Info.kvs").size(), 1U) << "the same problem is not told again";

  install("mended", "org.bad");
  std::filesystem::rename(directory_ / "mended.appdex/Info.kvs", directory_ / "a/bad.appdex/Info.kvs");
  EXPECT_THAT(nextAfterChange().identifiers(), ElementsAre("org.bad", "org.x", "org.y"));
}

TEST_F(ExtensionDiscoveryTest, DirectoryThatCannotBeReadIsAnErrorBesideTheRest) {
  install("a/x", "org.x");
  directory_.makeFile("b/c/d", "a file");
  const auto matching = begin(deliveries_);
  const Deliveries::Delivery first = deliveries_.next();
  EXPECT_THAT(first.identifiers(), ElementsAre("org.x"));
  ASSERT_TRUE(first.error);
  EXPECT_EQ(first.error->domain(), posixErrorDomain);
  EXPECT_EQ(linesWith(directory_ / "b/c/d").size(), 1U);
}

TEST_F(ExtensionDiscoveryTest, GroupContainersExistWhenTheRecordIsDelivered) {
  install("a/x", "org.x", R"(, "KTGroupContainers": ["group.x"])");
  directory_.makeFile("a/y.appdex/Info.kvs",
                      R"({"KTExtensionPointIdentifier": "other", "KTGroupContainers": ["group.y"]})");
  Deliveries seen;
  bool existed = false;
  const auto matching =
      discovery_.beginMatching({{std::string(extensionPointAttribute), "point"}},
                               [this, &existed, handler = seen.handler()](const auto &records, const auto &error) {
                                 existed = std::filesystem::is_directory(directory_ / "groups/group.x");
                                 handler(records, error);
                               });
  static_cast<void>(seen.next());
  EXPECT_TRUE(existed);
  EXPECT_FALSE(std::filesystem::exists(directory_ / "groups/group.y")) << "its record was not delivered";
}

TEST_F(ExtensionDiscoveryTest, NothingIsDeliveredAfterTheHandleIsGone) {
  auto matching = begin(deliveries_);
  static_cast<void>(deliveries_.next());
  matching.reset();
  Deliveries others;
  const auto other = begin(others);
  static_cast<void>(others.next());
  install("a/x", "org.x");
  ASSERT_TRUE(time_.waitForTaskIn(quiet));
  time_.advance(quiet);
  EXPECT_THAT(others.next().identifiers(), ElementsAre("org.x"));
  EXPECT_TRUE(deliveries_.isEmpty());
}

TEST_F(ExtensionDiscoveryTest, BundleIsFoundByIdentifierWithAndWithoutMatching) {
  install("a/x", "org.x");
  const auto before = discovery_.bundleForIdentifier("org.x");
  ASSERT_TRUE(before);
  EXPECT_EQ(before->path, directory_ / "a/x.appdex");
  EXPECT_FALSE(discovery_.bundleForIdentifier("org.y"));
  EXPECT_FALSE(discovery_.bundleForIdentifier(""));
  std::shared_ptr<const ExtensionBundle> inside;
  Deliveries seen;
  const auto matching =
      discovery_.beginMatching({{std::string(extensionPointAttribute), "point"}},
                               [this, &inside, handler = seen.handler()](const auto &records, const auto &error) {
                                 inside = discovery_.bundleForIdentifier("org.x");
                                 handler(records, error);
                               });
  static_cast<void>(seen.next());
  EXPECT_EQ(inside, before);
}

}  // namespace
}  // namespace storix::linuxhost
