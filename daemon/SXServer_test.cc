#include "daemon/SXServer.h"

#include "providers/ProvidersTest.h"

namespace storix {
namespace {

using fake::FakeExecutor;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

constexpr const char *service = "com.tessel.Storix";
constexpr const char *firstUnlock = "com.tessel.mobile.vaultkeepd.first_unlock";

class SXServerTest : public ProvidersTest {
 protected:
  using ProvidersTest::ProvidersTest;

  void SetUp() override {
    server_ = std::make_shared<SXServer>();
    server_->setAccessControlStore(SXAccessControlStore::sharedStore());
    trace();
  }

  void TearDown() override {
    server_.reset();
    ProvidersTest::TearDown();
  }

  void lock() {
    platform().setDeviceLockState(0);
    platform().setDeviceUnlockedSinceBoot(false);
  }

  static std::vector<std::string> startLines() {
    return {"log info [INFO] Server starting.", "createServiceListener com.tessel.Storix",
            "listener com.tessel.Storix set delegate", std::string("addSystemNotificationObserver ") + firstUnlock,
            "deviceLockState"};
  }
  static std::vector<std::string> followedBy(std::vector<std::string> first, const std::vector<std::string> &rest) {
    first.insert(first.end(), rest.begin(), rest.end());
    return first;
  }
  static std::vector<std::string> discoveryLines() {
    return {"createSerialQueue SXExtensionStorix refresh operations queue",
            "createConcurrentQueue SXExtensionStorix concurrent queue",
            "beginMatchingExtensions {KTExtensionPointIdentifier = com.tessel.storix-nonui}"};
  }
  static constexpr const char *resumed = "listener com.tessel.Storix resume";

  std::shared_ptr<SXServer> server_;
};

TEST_F(SXServerTest, AllFieldsStartAbsent) {
  const auto server = std::make_shared<SXServer>();
  EXPECT_EQ(server->accessControlStore(), nullptr);
  EXPECT_EQ(server->listener(), nullptr);
  EXPECT_EQ(server->listenerDelegate(), nullptr);
}

TEST_F(SXServerTest, TheStoreIsHeldWeaklyAndTheDelegateIsOwned) {
  std::shared_ptr<SXAccessControlStore> store = SXAccessControlStore::init();
  const auto server = std::make_shared<SXServer>();
  server->setAccessControlStore(store);
  EXPECT_EQ(server->accessControlStore(), store);
  store.reset();
  EXPECT_EQ(server->accessControlStore(), nullptr);
  server_->startCompletion({});
  EXPECT_EQ(server_->listenerDelegate().use_count(), 1);
  EXPECT_EQ(server_->listenerDelegate()->server(), server_);
}

TEST_F(SXServerTest, WithoutAPasscodeProvidersComeFirstAndThenTheListener) {
  platform().setDeviceUnlockedSinceBoot(false);
  server_->startCompletion(recording<>("started"));
  // Whether it was unlocked is not even asked.
  EXPECT_THAT(trace(), ElementsAreArray(followedBy(startLines(), discoveryLines())));
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAre("deliver extensions ()", "log info [INFO] Updating provider list.", resumed,
                                   "started () on queue global queue"));
}

TEST_F(SXServerTest, UnlockedSinceBootIsAsGoodAsNoPasscode) {
  for (int state : {0, 1, 2, 4, -1}) {
    platform().setDeviceLockState(state);
    const auto server = std::make_shared<SXServer>();
    server->startCompletion(recording<>("started"));
    runUntilIdle();
    const std::vector<std::string> lines = trace();
    EXPECT_THAT(lines, Contains("deviceUnlockedSinceBoot"));
    EXPECT_THAT(lines, Contains(resumed));
    EXPECT_EQ(lines.back(), "started () on queue global queue");
    EXPECT_FALSE(
        platform().log().contains(LogSeverity::info, "[INFO] Not instantiating storix providers until first unlock."));
  }
}

TEST_F(SXServerTest, BeforeTheFirstUnlockClientsAreServedAtOnceAndProvidersWait) {
  lock();
  platform().extensions().install(fake::completeProvider("org.a"));
  server_->startCompletion(recording<>("started"));
  EXPECT_THAT(trace(),
              ElementsAreArray(followedBy(
                  startLines(), {"deviceUnlockedSinceBoot",
                                 "log info [INFO] Not instantiating storix providers until first unlock.", resumed})));
  runUntilIdle();
  EXPECT_THAT(trace(), ElementsAre("started () on queue global queue"));
  EXPECT_THAT(SXExtensionStorix::providersInfo(), IsEmpty());

  platform().postNotification(firstUnlock);
  runUntilIdle();
  EXPECT_EQ(platform().trace().count("beginMatchingExtensions"), 1U);
  EXPECT_EQ(SXExtensionStorix::providersInfo().size(), 1U);
}

TEST_F(SXServerTest, AFirstUnlockAfterStartUpStartsNoSecondDiscovery) {
  server_->startCompletion({});
  runUntilIdle();
  for (int i = 0; i < 2; ++i) {
    platform().postNotification(firstUnlock);
    runUntilIdle();
  }
  EXPECT_EQ(platform().trace().count("beginMatchingExtensions"), 1U);
  EXPECT_EQ(platform().trace().count(resumed), 1U);
}

TEST_F(SXServerTest, ASecondFirstUnlockChangesNothing) {
  lock();
  server_->startCompletion({});
  platform().postNotification(firstUnlock);
  runUntilIdle();
  trace();
  platform().postNotification(firstUnlock);
  runUntilIdle();
  // The store reads its file again; the registry does nothing.
  EXPECT_THAT(trace(), ElementsAre(std::string("notification ") + firstUnlock,
                                   "fileExists /home/u/Library/Storix/AccessControl.kvs"));
}

TEST_F(SXServerTest, WithoutAHandlerNothingIsCalled) {
  lock();
  server_->startCompletion({});
  EXPECT_FALSE(platform().runOne());
}

TEST_F(SXServerTest, NoClientIsServedBeforeTheRegistryHasCalledBack) {
  platform().extensions().install(fake::completeProvider("org.a"));
  process("org.a").setHoldsBegins(true);
  server_->startCompletion({});
  const std::shared_ptr<fake::FakeClientConnection> client = platform().connect(service, {});
  const std::shared_ptr<fake::FakeReply> answered = client->call(SXDaemon::wakeUpName);
  runUntilIdle();
  EXPECT_FALSE(answered->isAnswered());
  process("org.a").releaseBegins();
  runUntilIdle();
  EXPECT_TRUE(answered->isAnswered());
}

TEST_F(SXServerTest, BeforeTheFirstUnlockAClientIsAnswered) {
  lock();
  server_->startCompletion({});
  const std::shared_ptr<fake::FakeClientConnection> client = platform().connect(service, {});
  const std::shared_ptr<fake::FakeReply> answered = client->call(SXDaemon::wakeUpName);
  runUntilIdle();
  EXPECT_TRUE(answered->isAnswered());
}

TEST_F(SXServerTest, ThePendingStartKeepsTheServer) {
  platform().extensions().setDeliversAtFirst(false);
  const std::weak_ptr<SXServer> observed = server_;
  server_->startCompletion({});
  server_.reset();
  runUntilIdle();
  EXPECT_FALSE(observed.expired());
  platform().extensions().deliver();
  runUntilIdle();
  EXPECT_EQ(platform().trace().count(resumed), 1U);
  EXPECT_TRUE(observed.expired());
}

TEST_F(SXServerTest, AnotherStartDropsThePreviousListener) {
  server_->startCompletion({});
  const std::weak_ptr<ServiceListener> first = server_->listener();
  server_->startCompletion({});
  EXPECT_TRUE(first.expired());
}

class ThreadedServerTest : public SXServerTest {
 protected:
  ThreadedServerTest() : SXServerTest({FakeExecutor::Kind::threads, "/home/u"}) {}
};

TEST_F(ThreadedServerTest, AClientIsServedOnThreads) {
  platform().extensions().install(fake::completeProvider("org.a"));
  platform().files().makeDirectory(storagePath("org.a"));
  process("org.a").setAnswer("IdentifierForItemAtURL", fake::VendorAnswer::values({Argument(), Argument("i")}));
  server_->startCompletion({});
  fake::FakePeer peer;
  peer.entitlements = {{"com.tessel.storix.acl-write", true}};
  const std::shared_ptr<fake::FakeClientConnection> client = platform().connect(service, peer);
  const Arguments arguments{Argument(itemURL("org.a", "x")), Argument("org.a"), Argument("org.app")};
  const std::shared_ptr<fake::FakeReply> granted = client->call(SXDaemon::extendSandboxName, arguments);
  runUntilIdle();
  const std::shared_ptr<fake::FakeReply> started = client->call(SXDaemon::startProvidingName, arguments);
  runUntilIdle();
  ASSERT_TRUE(granted->isAnswered());
  EXPECT_EQ(granted->error(0), std::nullopt);
  ASSERT_TRUE(started->isAnswered());
  EXPECT_EQ(started->error(0), std::nullopt);
}

}  // namespace
}  // namespace storix
