#include "daemon/SXLinkListenerDelegate.h"

#include "daemon/SXServer.h"
#include "providers/ProvidersTest.h"

namespace storix {
namespace {

using ::testing::ElementsAre;

class SXLinkListenerDelegateTest : public ProvidersTest {
 protected:
  void SetUp() override {
    server_ = std::make_shared<SXServer>();
    listener_ = platform().createServiceListener("com.tessel.Storix");
    delegate_ = std::make_shared<SXLinkListenerDelegate>();
    delegate_->setServer(server_);
    trace();
  }

  void TearDown() override {
    delegate_.reset();
    listener_.reset();
    server_.reset();
    ProvidersTest::TearDown();
  }

  std::shared_ptr<fake::FakeClientConnection> accepted(fake::FakePeer peer = {}) {
    std::shared_ptr<fake::FakeClientConnection> connection = platform().connections().makeConnection(std::move(peer));
    EXPECT_TRUE(delegate_->listener(*listener_, connection));
    return connection;
  }

  std::shared_ptr<SXServer> server_;
  std::shared_ptr<ServiceListener> listener_;
  std::shared_ptr<SXLinkListenerDelegate> delegate_;
};

TEST_F(SXLinkListenerDelegateTest, AcceptsExportsResumesAndThenSaysSo) {
  accepted();
  EXPECT_THAT(trace(), ElementsAre("connection peer 100 exports interface SXDaemon reply 1 of "
                                   "providersCompletionHandler: permits string URL dictionary",
                                   "connection peer 100 exports an object", "connection peer 100 resume",
                                   "log info [INFO] New connection accepted."));
}

TEST_F(SXLinkListenerDelegateTest, OnlyTheListReplyHasDeclaredKinds) {
  const std::shared_ptr<fake::FakeClientConnection> connection = accepted();
  const LinkInterface interface = *connection->exportedInterface();
  for (const OperationDescription &operation : interface.protocol().operations) {
    for (std::size_t i = 0; i < 6; ++i) {
      EXPECT_EQ(interface.permittedKinds(operation.name, i, false), nullptr);
      const bool isList = operation.name == SXDaemon::providersName && i == 1;
      EXPECT_EQ(interface.permittedKinds(operation.name, i, true) != nullptr, isList) << operation.name << " " << i;
    }
  }
}

TEST_F(SXLinkListenerDelegateTest, AClientWithoutAnyEntitlementIsAcceptedAndRefusedPerRequest) {
  const std::shared_ptr<fake::FakeClientConnection> connection = accepted();
  const std::shared_ptr<fake::FakeReply> awake = connection->call(SXDaemon::wakeUpName);
  const std::shared_ptr<fake::FakeReply> refused = connection->call(SXDaemon::providersName);
  runUntilIdle();
  EXPECT_TRUE(awake->isAnswered());
  EXPECT_EQ(refused->error(0), SXClientLacksEntitlement());
}

TEST_F(SXLinkListenerDelegateTest, TwoConnectionsOfOneClientHaveTwoServicers) {
  const std::shared_ptr<fake::FakeClientConnection> one = accepted();
  const std::shared_ptr<fake::FakeClientConnection> two = accepted();
  EXPECT_NE(one->exportedObject(), two->exportedObject());
  one->close();
  const std::shared_ptr<fake::FakeReply> awake = two->call(SXDaemon::wakeUpName);
  runUntilIdle();
  EXPECT_TRUE(awake->isAnswered());
}

TEST_F(SXLinkListenerDelegateTest, TheConnectionAloneOwnsItsServicerAndTheServicerNotTheConnection) {
  std::shared_ptr<fake::FakeClientConnection> connection = accepted();
  const std::weak_ptr<ExportedObject> exported = connection->exportedObject();
  const std::weak_ptr<fake::FakeClientConnection> observed = connection;
  connection.reset();
  EXPECT_TRUE(observed.expired());
  EXPECT_TRUE(exported.expired());
}

TEST_F(SXLinkListenerDelegateTest, TheServerIsHeldWeakly) {
  EXPECT_EQ(delegate_->server(), server_);
  EXPECT_EQ(server_.use_count(), 1);
  server_.reset();
  EXPECT_EQ(delegate_->server(), nullptr);
}

TEST_F(SXLinkListenerDelegateTest, AConnectionAcceptedWithoutServerSeesNoStore) {
  startRegistry({"org.a"});
  process("org.a").setAnswer("IdentifierForItemAtURL", fake::VendorAnswer::values({Argument(), Argument("i")}));
  SXAccessControlStore::sharedStore()->allowProviderWithIdentifier("org.a", "i", "org.app");
  server_->setAccessControlStore(SXAccessControlStore::sharedStore());
  fake::FakePeer peer;
  peer.entitlements = {{"com.tessel.storix.acl-read", true}};
  const Arguments arguments{Argument(itemURL("org.a", "x")), Argument("org.a"), Argument("org.app")};

  const std::shared_ptr<fake::FakeClientConnection> before = accepted(peer);
  const std::shared_ptr<fake::FakeReply> provided = before->call(SXDaemon::startProvidingName, arguments);
  runUntilIdle();
  EXPECT_EQ(provided->error(0), std::nullopt);

  server_.reset();
  const std::shared_ptr<fake::FakeClientConnection> after = accepted(peer);
  const std::shared_ptr<fake::FakeReply> refused = after->call(SXDaemon::startProvidingName, arguments);
  runUntilIdle();
  EXPECT_EQ(refused->error(0), SXNotPermittedError());
}

}  // namespace
}  // namespace storix
