#include "providers/ProviderRegistry.h"

#include <atomic>
#include <chrono>
#include <thread>

#include "providers/ProvidersTest.h"

namespace storix {
namespace {

using fake::completeProvider;
using fake::FakeExecutor;
using fake::FakeExtension;
using fake::LogLine;
using fake::VendorAnswer;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

using namespace std::chrono_literals;

constexpr const char *setup = "_performInitialSetupWithCompletion:";

class ProviderRegistryTest : public ProvidersTest {
 protected:
  std::function<void()> recordingCompletion(std::string name) { return recording<>(std::move(name)); }

  void install(const std::string &identifier, const std::string &version = "1") {
    platform().extensions().install(completeProvider(identifier, version));
  }

  void deliver() {
    platform().extensions().deliver();
    runUntilIdle();
  }

  static std::shared_ptr<SXExtensionStorix> provider(const std::string &identifier) {
    return SXExtensionStorix::providerWithIdentifier(identifier);
  }

  /// Looks a URL up and says what came of it: "org.a", "none", "none, excluded".
  std::string lookUp(const std::optional<URL> &url) {
    bool excluded = true;
    const std::shared_ptr<SXExtensionStorix> found = SXExtensionStorix::providerForURL(url, &excluded);
    EXPECT_EQ(SXExtensionStorix::providerForURL(url), found);
    return (found ? found->identifier().value_or("") : "none") + std::string(excluded ? ", excluded" : "");
  }

  static std::vector<std::string> construction(const std::string &identifier) {
    return {"createOperationQueue Operation queue for " + identifier,
            "createConcurrentQueue SXExtensionStorix concurrent member queue for " + identifier,
            "bundleRecordForIdentifier " + identifier, "infoDictionaryValue " + identifier + " KTExtension dictionary",
            "groupContainerURLs " + identifier};
  }
  static std::vector<std::string> registration(const std::string &identifier, const std::string &request,
                                               const std::string &version = "1") {
    const std::string record = identifier + " version " + version + " ";
    return {
        "log debug [DEBUG] -[SXExtensionStorix registerWithFileCoordinatorRetryCount:completion:]",
        "beginExtensionRequest " + record + request,
        "begun " + request,
        "log debug [DEBUG] Beginning extension request.",
        "extensionContextForRequest " + record + request,
        "remoteProxyWithErrorHandler " + request,
        "send " + request + " " + setup + " ()",
        "answer " + request + " " + setup + " ()",
        "cancelExtensionRequest " + record + request,
        "addProvider " + identifier,
        "log info [INFO] Registered storix provider extension " + identifier + " for path " + storageText(identifier)};
  }
  static constexpr const char *refresh = "log info [INFO] Updating provider list.";
};

TEST_F(ProviderRegistryTest, TheFirstRefreshMakesAndRegistersEachProviderAndThenCompletes) {
  install("org.b");
  install("org.a");
  SXExtensionStorix::createInstancesCompletion(recordingCompletion("started"));
  EXPECT_THAT(trace(), ElementsAre("createSerialQueue SXExtensionStorix refresh operations queue",
                                   "createConcurrentQueue SXExtensionStorix concurrent queue",
                                   "beginMatchingExtensions {KTExtensionPointIdentifier = com.tessel.storix-nonui}"));
  runUntilIdle();
  // In the order of the list.
  EXPECT_THAT(trace(), ElementsAreArray(joined({{"deliver extensions (org.b version 1, org.a version 1)", refresh},
                                                construction("org.b"),
                                                construction("org.a"),
                                                registration("org.b", "request-1"),
                                                registration("org.a", "request-2"),
                                                {"started () on queue global queue"}})));
}

TEST_F(ProviderRegistryTest, WithoutAHandlerDiscoveryStartsAllTheSame) {
  install("org.a");
  SXExtensionStorix::createInstancesCompletion({});
  runUntilIdle();
  EXPECT_NE(provider("org.a"), nullptr);
}

TEST_F(ProviderRegistryTest, AnEmptyListStillCompletesTheStart) {
  SXExtensionStorix::createInstancesCompletion(recordingCompletion("started"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("started () on queue global queue"), 1U);
  EXPECT_EQ(platform().trace().count("beginExtensionRequest"), 0U);
}

TEST_F(ProviderRegistryTest, ASecondCallStartsNothingAndIsAnsweredWhileTheFirstRefreshRuns) {
  install("org.a");
  process("org.a").setHoldsBegins(true);
  SXExtensionStorix::createInstancesCompletion(recordingCompletion("first"));
  runUntilIdle();
  trace();
  SXExtensionStorix::createInstancesCompletion(recordingCompletion("second"));
  EXPECT_THAT(trace(), IsEmpty());
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAre("second () on queue global queue"));
  SXExtensionStorix::createInstancesCompletion({});
  runUntilIdle();
  EXPECT_THAT(trace(), IsEmpty());
  process("org.a").setHoldsBegins(false);
  process("org.a").releaseBegins();
  runUntilIdle();
  EXPECT_EQ(trace().back(), "first () on queue global queue");
}

TEST_F(ProviderRegistryTest, OnlyTheFirstRefreshCompletesTheStart) {
  SXExtensionStorix::createInstancesCompletion(recordingCompletion("started"));
  runUntilIdle();
  deliver();
  EXPECT_EQ(platform().trace().count("started"), 1U);
}

TEST_F(ProviderRegistryTest, ARecordWithoutIdentifierIsPassedOver) {
  FakeExtension nameless = completeProvider("org.nameless");
  nameless.identifier = std::nullopt;
  nameless.description = "a nameless bundle";
  FakeExtension empty = nameless;
  empty.identifier = "";
  empty.description = "an empty name";
  platform().extensions().install(nameless);
  platform().extensions().install(empty);
  install("org.a");
  SXExtensionStorix::createInstancesCompletion({});
  runUntilIdle();
  EXPECT_TRUE(platform().log().contains(
      LogSeverity::standard, "[NOTICE] Storix provider extension a nameless bundle has no identifier. Ignoring."));
  EXPECT_TRUE(platform().log().contains(
      LogSeverity::standard, "[NOTICE] Storix provider extension an empty name has no identifier. Ignoring."));
  EXPECT_EQ(SXExtensionStorix::providersInfo().size(), 1U);
}

TEST_F(ProviderRegistryTest, TheSameListAgainChangesNothing) {
  startRegistry({"org.a"});
  const std::shared_ptr<SXExtensionStorix> before = provider("org.a");
  deliver();
  EXPECT_THAT(trace(), ElementsAre("deliver extensions (org.a version 1)", refresh));
  EXPECT_EQ(provider("org.a"), before);
}

TEST_F(ProviderRegistryTest, AChangedRecordIsANewProviderAndTheOldOneIsWithdrawn) {
  startRegistry({"org.a"});
  const std::shared_ptr<SXExtensionStorix> before = provider("org.a");
  install("org.a", "2");
  deliver();
  EXPECT_THAT(trace(), ElementsAreArray(joined({{"deliver extensions (org.a version 2)", refresh},
                                                construction("org.a"),
                                                {"removeProvider org.a"},
                                                registration("org.a", "request-2", "2")})));
  EXPECT_NE(provider("org.a"), before);
  EXPECT_THAT(platform().fileCoordination().providers(), ElementsAre(provider("org.a")));
}

TEST_F(ProviderRegistryTest, AVanishedProviderIsWithdrawnAndForgotten) {
  startRegistry({"org.a", "org.b"});
  platform().extensions().remove("org.a");
  deliver();
  EXPECT_THAT(trace(), ElementsAre("deliver extensions (org.b version 1)", refresh, "removeProvider org.a"));
  EXPECT_EQ(provider("org.a"), nullptr);
  EXPECT_NE(provider("org.b"), nullptr);
}

TEST_F(ProviderRegistryTest, TheErrorOfADeliveryIsIgnoredAndItsEmptyListRemovesEveryone) {
  startRegistry({"org.a", "org.b"});
  platform().extensions().remove("org.a");
  platform().extensions().remove("org.b");
  platform().extensions().deliver(someError("cannot look"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("removeProvider"), 2U);
  EXPECT_THAT(SXExtensionStorix::providersInfo(), IsEmpty());
  EXPECT_THAT(logTexts(), ElementsAre("[INFO] Updating provider list."));
}

TEST_F(ProviderRegistryTest, OfTwoRecordsWithOneIdentifierTheLaterOneCounts) {
  install("org.a");
  platform().extensions().installBeside(completeProvider("org.a", "2"));
  SXExtensionStorix::createInstancesCompletion({});
  runUntilIdle();
  EXPECT_EQ(provider("org.a")->extension()->description(), "org.a version 2");
  // Both are new, so both are registered.
  EXPECT_EQ(platform().fileCoordination().providers().size(), 2U);
  EXPECT_EQ(SXExtensionStorix::providersInfo().size(), 1U);
}

TEST_F(ProviderRegistryTest, AFailedRegistrationIsLoggedAndTheOthersGoOn) {
  for (const char *identifier : {"org.a", "org.b", "org.c"}) install(identifier);
  const SXError error = someError("broken");
  process("org.b").setAnswer(setup, VendorAnswer::values({Argument(), Argument(), Argument(error)}));
  SXExtensionStorix::createInstancesCompletion(recordingCompletion("started"));
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.c"), 0U);
  for (int i = 0; i < 2; ++i) {
    EXPECT_EQ(platform().trace().count("started"), 0U);
    platform().advance(2s);
    runUntilIdle();
  }
  const std::string line = "log fault [ERROR] Could not register storix provider org.b. Error: " + text(error);
  EXPECT_EQ(platform().trace().count(line), 1U);
  EXPECT_EQ(platform().trace().count("beginExtensionRequest org.b"), 3U);
  EXPECT_EQ(platform().trace().count("addProvider org.c"), 1U);
  EXPECT_EQ(trace().back(), "started () on queue global queue");
  EXPECT_EQ(SXExtensionStorix::providersInfo().size(), 3U);
}

TEST_F(ProviderRegistryTest, ADeliveryDuringARefreshWaitsForItsEnd) {
  install("org.a");
  process("org.a").setHoldsBegins(true);
  SXExtensionStorix::createInstancesCompletion(recordingCompletion("started"));
  runUntilIdle();
  install("org.b");
  platform().extensions().deliver();
  platform().extensions().deliver();
  runUntilIdle();
  EXPECT_EQ(platform().trace().count(refresh), 1U);
  EXPECT_EQ(provider("org.b"), nullptr);
  process("org.a").setHoldsBegins(false);
  process("org.a").releaseBegins();
  trace();
  runUntilIdle();
  const std::vector<std::string> lines = trace();
  const auto at = [&lines](const std::string &line) { return std::find(lines.begin(), lines.end(), line); };
  ASSERT_NE(at(refresh), lines.end());
  EXPECT_LT(at("addProvider org.a"), at(refresh));
  EXPECT_EQ(std::count(lines.begin(), lines.end(), refresh), 2);
  EXPECT_NE(provider("org.b"), nullptr);
}

TEST_F(ProviderRegistryTest, ProvidersOfAListAreRegisteredEvenByHand) {
  const std::shared_ptr<SXExtensionStorix> one = makeProvider("org.a");
  const std::shared_ptr<SXExtensionStorix> two = makeProvider("org.b");
  SXExtensionStorix::refreshOperationsQueueRegisterProviders({one, two}, recordingCompletion("registered"));
  runUntilIdle();
  EXPECT_THAT(platform().fileCoordination().providers(), ElementsAre(one, two));
  EXPECT_EQ(trace().back(), "registered () on queue global queue");
  SXExtensionStorix::refreshOperationsQueueRegisterProviders({}, {});
  EXPECT_FALSE(platform().runOne());
}

TEST_F(ProviderRegistryTest, AnEmptyListIsCompletedLaterOnTheGlobalQueue) {
  SXExtensionStorix::refreshOperationsQueueRegisterProviders({}, {});
  trace();
  SXExtensionStorix::refreshOperationsQueueRegisterProviders({}, recordingCompletion("registered"));
  EXPECT_THAT(trace(), IsEmpty());
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAre("registered () on queue global queue"));
}

TEST_F(ProviderRegistryTest, AURLBelowAProvidersDirectoryIsItsOwn) {
  startRegistry({"org.a", "org.b"});
  EXPECT_EQ(lookUp(itemURL("org.b", "x")), "org.b");
  EXPECT_EQ(SXExtensionStorix::providerForURL(itemURL("org.b", "x")), provider("org.b"));
}

TEST_F(ProviderRegistryTest, ALookupThatFindsSaysWho) {
  startRegistry({"org.a"});
  const URL item = itemURL("org.a", "x");
  SXExtensionStorix::providerForURL(item);
  EXPECT_THAT(trace(), ElementsAre("directoryRelationship " + storageText("org.a") + " " + item.absoluteString(),
                                   "log info [INFO] Resolved URL to provider org.a."));
}

TEST_F(ProviderRegistryTest, AProvidersDirectoryItselfIsExcludedAndEndsTheSearch) {
  startRegistry({"org.a", "org.b"});
  EXPECT_EQ(lookUp(storageURL("org.a")), "none, excluded");
  trace();
  SXExtensionStorix::providerForURL(storageURL("org.a"));
  EXPECT_THAT(trace(), ElementsAre("directoryRelationship " + storageText("org.a") + " " + storageText("org.a"),
                                   "log debug [DEBUG] Ignoring URLs that exactly match the document container folder"));
}

TEST_F(ProviderRegistryTest, AURLOutsideEveryDirectoryIsNobodysAndNotLogged) {
  startRegistry({"org.a", "org.b"});
  EXPECT_EQ(lookUp(URL::fromString("file:///elsewhere")), "none");
  EXPECT_THAT(logTexts(), IsEmpty());
}

TEST_F(ProviderRegistryTest, WithoutProvidersNothingIsFound) {
  EXPECT_EQ(lookUp(itemURL("org.a", "x")), "none");
  EXPECT_EQ(provider("org.a"), nullptr);
  EXPECT_EQ(SXExtensionStorix::providerWithIdentifier(std::nullopt), nullptr);
  EXPECT_THAT(SXExtensionStorix::providersInfo(), IsEmpty());
}

TEST_F(ProviderRegistryTest, AProviderThatHasNotRunYetIsSkippedWithADebugLine) {
  startRegistry({"org.a", "org.b"});
  platform().files().remove(storagePath("org.a"));
  EXPECT_EQ(SXExtensionStorix::providerForURL(itemURL("org.b", "x")), provider("org.b"));
  EXPECT_THAT(platform().log().take(),
              ElementsAre(LogLine{LogSeverity::debug,
                                  "[DEBUG] Storix provider org.a doesn't have a provided items "
                                  "directory; it may not have run so far."},
                          LogLine{LogSeverity::info, "[INFO] Resolved URL to provider org.b."}));
}

TEST_F(ProviderRegistryTest, AnotherFailureOfTheComparisonIsAnErrorLine) {
  startRegistry({"org.a", "org.b"});
  const SXError error = someError("no permission");
  platform().files().setRelationshipError(storagePath("org.a"), error);
  const URL item = itemURL("org.b", "x");
  EXPECT_EQ(SXExtensionStorix::providerForURL(item), provider("org.b"));
  EXPECT_EQ(platform().log().lines().front(),
            (LogLine{LogSeverity::fault, "[ERROR] Cannot get the relationship between URL " + storageText("org.a") +
                                             " and " + item.absoluteString() + ". Error: " + text(error)}));
}

TEST_F(ProviderRegistryTest, AMissingFileOtherThanTheDirectoryIsAnErrorLine) {
  startRegistry({"org.a"});
  const SXError error = fileNotFoundForReading(itemURL("org.a", "x"));
  platform().files().setRelationshipError(storagePath("org.a"), error);
  EXPECT_EQ(lookUp(itemURL("org.a", "x")), "none");
  EXPECT_EQ(platform().log().lines().front().severity, LogSeverity::fault);
}

TEST_F(ProviderRegistryTest, AProviderWithoutADirectoryEndsInTheErrorLineAndAnEmptyRecord) {
  FakeExtension extension = completeProvider("org.a");
  extension.bundle->groupContainers.clear();
  platform().extensions().install(extension);
  SXExtensionStorix::createInstancesCompletion({});
  runUntilIdle();
  platform().log().take();
  const URL item = itemURL("org.a", "x");
  EXPECT_EQ(SXExtensionStorix::providerForURL(item), nullptr);
  ASSERT_EQ(platform().log().lines().size(), 1U);
  EXPECT_THAT(platform().log().lines().front().text,
              ::testing::StartsWith("[ERROR] Cannot get the relationship between URL (null) and " +
                                    item.absoluteString() + ". Error: "));
  EXPECT_EQ(SXExtensionStorix::providersInfo(), (Dictionary{{"org.a", Dictionary()}}));
}

TEST_F(ProviderRegistryTest, AnAbsentURLIsNobodys) {
  startRegistry({"org.a"});
  EXPECT_EQ(lookUp(std::nullopt), "none");
}

TEST_F(ProviderRegistryTest, TheListHoldsARecordPerProvider) {
  startRegistry({"org.a", "org.b"});
  const auto record = [](const std::string &identifier) {
    return Dictionary{{"documentStorageURL", storageURL(identifier)}, {"providerIdentifier", identifier}};
  };
  EXPECT_EQ(SXExtensionStorix::providersInfo(), (Dictionary{{"org.a", record("org.a")}, {"org.b", record("org.b")}}));
}

TEST_F(ProviderRegistryTest, AnUnsetAccessControlReferenceIsHeldWeakly) {
  class Refusing : public SXAccessControl {
    bool isProviderWithIdentifier(const std::optional<std::string> &, const std::optional<std::string> &,
                                  const std::optional<std::string> &) override {
      return false;
    }
  };
  auto accessControl = std::make_shared<Refusing>();
  SXExtensionStorix::setStorixAccessControl(accessControl);
  EXPECT_EQ(accessControl.use_count(), 1);
}

class ThreadedProviderRegistryTest : public ProvidersTest {
 protected:
  ThreadedProviderRegistryTest() : ProvidersTest({FakeExecutor::Kind::threads, "/home/u"}) {}
};

TEST_F(ThreadedProviderRegistryTest, LookupsNeverSeeAHalfRewrittenMap) {
  startRegistry({"org.a", "org.b"});
  std::atomic<bool> done = false;
  std::vector<std::thread> readers;
  readers.reserve(2);
  for (int i = 0; i < 2; ++i) {
    readers.emplace_back([&done] {
      while (!done) {
        // Each is always there, in one version or another.
        EXPECT_EQ(SXExtensionStorix::providersInfo().size(), 2U);
        EXPECT_NE(SXExtensionStorix::providerForURL(itemURL("org.b", "x")), nullptr);
        EXPECT_NE(SXExtensionStorix::providerWithIdentifier("org.a"), nullptr);
      }
    });
  }
  for (int version = 2; version < 22; ++version) {
    platform().extensions().install(completeProvider("org.a", std::to_string(version)));
    platform().extensions().deliver();
  }
  runUntilIdle();
  done = true;
  for (std::thread &reader : readers) reader.join();
  // A rewrite that waited for a reader goes on now.
  runUntilIdle();
  EXPECT_EQ(platform().fileCoordination().providers().size(), 2U);
}

TEST_F(ThreadedProviderRegistryTest, ConcurrentFirstCallsStartOneDiscovery) {
  std::atomic<int> completed = 0;
  std::vector<std::thread> callers;
  callers.reserve(4);
  for (int i = 0; i < 4; ++i) {
    callers.emplace_back([&completed] { SXExtensionStorix::createInstancesCompletion([&completed] { ++completed; }); });
  }
  for (std::thread &caller : callers) caller.join();
  runUntilIdle();
  EXPECT_EQ(completed, 4);
  EXPECT_EQ(platform().trace().count("beginMatchingExtensions"), 1U);
}

}  // namespace
}  // namespace storix
