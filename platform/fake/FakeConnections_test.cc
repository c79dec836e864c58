#include "platform/fake/FakeConnections.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/fake/FakeHostTest.h"
#include "platform/fake/FakeSampleProtocol.h"

namespace storix::fake {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;

constexpr const char *service = "org.sample.Service";

/// Answers at once, unless told to keep the handler.
class Greeter : public Sample {
 public:
  void greet(std::optional<std::string> name, CompletionHandler<std::string> completion) override {
    contexts.push_back(currentContext());
    if (completion) completion("hello " + name.value_or("nobody"));
  }
  void list(CompletionHandler<SXError, Dictionary> completion) override { kept = std::move(completion); }

  std::vector<std::string> contexts;
  CompletionHandler<SXError, Dictionary> kept;
};

class FakeConnectionsTest : public FakeHostTest, public ServiceListenerDelegate {
 protected:
  bool listener(ServiceListener & /*listener*/, std::shared_ptr<ClientConnection> connection) override {
    ++offered_;
    if (!accepts_) return false;
    LinkInterface interface(sampleProtocol().description());
    interface.setPermittedKinds({ValueKind::string, ValueKind::dictionary}, "listCompletion:", 1, true);
    connection->setExportedInterface(std::move(interface));
    connection->setExportedObject(std::make_shared<ProtocolExporter<Sample>>(sampleProtocol(), greeter_));
    connection->resume();
    return true;
  }

  void startListening() {
    listener_ = platform().createServiceListener(service);
    listener_->setDelegate(delegate_);
    listener_->resume();
  }

  std::shared_ptr<FakeClientConnection> connected(FakePeer peer = {}) {
    if (!listener_) startListening();
    std::shared_ptr<FakeClientConnection> connection = platform().connect(service, std::move(peer));
    runUntilIdle();
    return connection;
  }

  bool accepts_ = true;
  int offered_ = 0;
  std::shared_ptr<Greeter> greeter_ = std::make_shared<Greeter>();
  // The test itself, which outlives the listener.
  std::shared_ptr<ServiceListenerDelegate> delegate_{this, [](ServiceListenerDelegate *) {}};
  std::shared_ptr<ServiceListener> listener_;
};

TEST_F(FakeConnectionsTest, ConnectionsWaitUntilTheListenerIsResumed) {
  listener_ = platform().createServiceListener(service);
  listener_->setDelegate(delegate_);
  const std::shared_ptr<FakeClientConnection> early = platform().connect(service, {});
  runUntilIdle();
  EXPECT_EQ(offered_, 0);
  listener_->resume();
  EXPECT_EQ(offered_, 0);  // never inside the call
  runUntilIdle();
  EXPECT_EQ(offered_, 1);
}

TEST_F(FakeConnectionsTest, RefusedConnectionIsClosed) {
  accepts_ = false;
  EXPECT_FALSE(connected()->isOpen());
}

TEST_F(FakeConnectionsTest, ConnectionIsClosedWhenTheDelegateIsGone) {
  startListening();
  delegate_.reset();
  EXPECT_FALSE(connected()->isOpen());
  EXPECT_EQ(offered_, 0);
}

TEST_F(FakeConnectionsTest, RequestIsAnsweredOutsideEveryQueue) {
  const std::shared_ptr<FakeReply> reply = connected()->call("Greet", {"you"});
  EXPECT_FALSE(reply->isAnswered());
  runUntilIdle();
  // The peer was dropped before the request was delivered.
  EXPECT_FALSE(reply->isAnswered());
  const std::shared_ptr<FakeClientConnection> connection = connected();
  const std::shared_ptr<FakeReply> answered = connection->call("greetName:completion:", {"you"});
  runUntilIdle();
  ASSERT_TRUE(answered->isAnswered());
  EXPECT_EQ(answered->answer().values, (Arguments{"hello you"}));
  EXPECT_EQ(answered->answer().context, "platform thread");
  EXPECT_THAT(greeter_->contexts, ElementsAre("platform thread"));
}

TEST_F(FakeConnectionsTest, ReplyTellsOnWhichQueueItRan) {
  const std::shared_ptr<FakeClientConnection> connection = connected();
  const std::shared_ptr<FakeReply> reply = connection->call("List");
  runUntilIdle();
  platform().globalQueue()->async([this] { greeter_->kept(std::nullopt, Dictionary{{"a", "b"}}); });
  runUntilIdle();
  ASSERT_TRUE(reply->isAnswered());
  EXPECT_EQ(reply->answer().context, "queue global queue");
  EXPECT_EQ(platform().trace().lines().back(),
            "reply peer 100 listCompletion: ((null), {a = b}) on queue global queue");
}

TEST_F(FakeConnectionsTest, KindThatTheReplyDoesNotPermitIsRefused) {
  const std::shared_ptr<FakeClientConnection> connection = connected();
  const std::shared_ptr<FakeReply> reply = connection->call("List");
  runUntilIdle();
  greeter_->kept(std::nullopt, Dictionary{{"a", Dictionary{{"b", 1}}}});
  ASSERT_TRUE(reply->isAnswered());
  EXPECT_TRUE(reply->answer().refusal);
  EXPECT_TRUE(reply->answer().values.empty());
}

TEST_F(FakeConnectionsTest, SecondReplyIsRecordedToo) {
  const std::shared_ptr<FakeClientConnection> connection = connected();
  const std::shared_ptr<FakeReply> reply = connection->call("List");
  runUntilIdle();
  greeter_->kept(SXNotPermittedError(), std::nullopt);
  greeter_->kept(std::nullopt, Dictionary{});
  EXPECT_EQ(reply->answers().size(), 2U);
  EXPECT_EQ(reply->error(0), SXNotPermittedError());
  EXPECT_FALSE(reply->error(1));
}

TEST_F(FakeConnectionsTest, RequestThatDoesNotFitItsRowIsRefused) {
  const std::shared_ptr<FakeClientConnection> connection = connected();
  const std::shared_ptr<FakeReply> wrongKind = connection->call("Greet", {7});
  const std::shared_ptr<FakeReply> tooMany = connection->call("Greet", {"a", "b"});
  const std::shared_ptr<FakeReply> unknown = connection->call("Nothing");
  runUntilIdle();
  for (const std::shared_ptr<FakeReply> &reply : {wrongKind, tooMany, unknown}) {
    ASSERT_TRUE(reply->isAnswered());
    EXPECT_TRUE(reply->answer().refusal);
  }
  EXPECT_TRUE(greeter_->contexts.empty());
}

TEST_F(FakeConnectionsTest, RequestWithoutReplyReachesTheObjectWithoutHandler) {
  const std::shared_ptr<FakeClientConnection> connection = connected();
  connection->callWithoutReply("List");
  runUntilIdle();
  EXPECT_FALSE(greeter_->kept);
  EXPECT_EQ(platform().trace().count("request without reply peer 100 listCompletion:"), 1U);
}

TEST_F(FakeConnectionsTest, ClosedConnectionLetsGoOfItsObjectAndDropsReplies) {
  std::shared_ptr<FakeClientConnection> connection = connected();
  const std::weak_ptr<ClientConnection> weakConnection = connection;
  const std::weak_ptr<ExportedObject> object = connection->exportedObject();
  const std::shared_ptr<FakeReply> reply = connection->call("List");
  runUntilIdle();
  connection->close();
  EXPECT_TRUE(object.expired());
  greeter_->kept(std::nullopt, Dictionary{});
  EXPECT_FALSE(reply->isAnswered());
  connection.reset();
  EXPECT_TRUE(weakConnection.expired());
}

TEST_F(FakeConnectionsTest, PeerIsKnownAsLongAsItsConnectionIsOpen) {
  const std::shared_ptr<FakeClientConnection> connection = connected(
      {.processIdentifier = 7, .bundleIdentifier = "org.app", .entitlements = {{"may", "text"}}, .auditToken = {}});
  EXPECT_EQ(connection->peerProcessIdentifier(), 7);
  EXPECT_EQ(connection->peerAuditToken(), auditTokenForProcess(7));
  EXPECT_EQ(connection->entitlementValue("may"), Value("text"));
  EXPECT_FALSE(connection->entitlementValue("may not"));
  EXPECT_EQ(platform().bundleIdentifierForAuditToken(auditTokenForProcess(7)), "org.app");
  EXPECT_FALSE(platform().bundleIdentifierForAuditToken(auditTokenForProcess(8)));
  EXPECT_FALSE(platform().bundleIdentifierForAuditToken(AuditToken{}));
  connection->close();
  EXPECT_FALSE(platform().bundleIdentifierForAuditToken(auditTokenForProcess(7)));
}

TEST_F(FakeConnectionsTest, TraceTellsTheWholeStory) {
  const std::shared_ptr<FakeClientConnection> connection = connected();
  connection->call("Greet", {"you"});
  runUntilIdle();
  EXPECT_THAT(platform().trace().take(),
              ElementsAre("createServiceListener org.sample.Service", "listener org.sample.Service set delegate",
                          "listener org.sample.Service resume", "connect peer 100 to org.sample.Service",
                          HasSubstr("connection peer 100 exports interface Sample reply 1 of listCompletion: permits"),
                          "connection peer 100 exports an object", "connection peer 100 resume",
                          "request peer 100 greetName:completion: (you)",
                          "reply peer 100 greetName:completion: (hello you) on platform thread"));
  EXPECT_TRUE(platform().trace().lines().empty());
}

}  // namespace
}  // namespace storix::fake
