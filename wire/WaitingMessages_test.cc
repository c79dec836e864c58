// How many messages may wait for a peer that does not answer, or does not read.

#include <future>

#include "wire/BusConnectionTest.h"

namespace storix::wire {
namespace {

using testing::HasSubstr;

class WaitingMessagesTest : public BusConnectionTest {
 protected:
  /// The end whose messages wait, so many at most. Driven from `start` on.
  std::shared_ptr<RemoteObject> remoteWithPlaces(std::size_t places) {
    BusConnection::Options options;
    options.peer = "extension org.sample";
    options.messagesWaitingAtMost = places;
    client_.emplace(pool_, std::move(peerSocket_), std::move(options));
    return remote();
  }

  void send(const std::shared_ptr<RemoteObject> &to, std::string text) {
    to->send(rowOf("DocumentURLFromBookmarkableString"), {Value(std::move(text))}, toReplies());
  }
  void expectHandedOver(const std::string &text) {
    auto request = object_->requests.take();
    ASSERT_TRUE(request);
    EXPECT_EQ(request->arguments[0], Value(text));
    answer_ = request->reply;
  }
  void answerLast() {
    answer_({{}, {}, {}, {}, {}});
    ASSERT_TRUE(replies_.take());
  }
  /// One message was refused, and told so.
  void expectRefused() {
    const auto error = errors_.take();
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), ENOBUFS);
    EXPECT_EQ(error->details().at("busError"), Value("org.freedesktop.DBus.Error.LimitsExceeded"));
  }

  ReplyHandler answer_;
};

TEST_F(WaitingMessagesTest, AsManyAsMayWaitGoAndTheNextFailsUntilOneIsAnswered) {
  exportDaemon(object_);
  const auto remote = remoteWithPlaces(3);
  client_->start();
  for (const char *text : {"1", "2", "3"}) send(remote, text);
  send(remote, "4");
  const auto error = errors_.take();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), posixErrorDomain);
  EXPECT_EQ(error->code(), ENOBUFS);
  EXPECT_EQ(error->message(),
            "\"DocumentURLFromBookmarkableString\" was not answered: extension org.sample has not answered 3 messages "
            "yet; try again when it has, or end it if it hangs");
  for (const char *text : {"1", "2", "3"}) expectHandedOver(text);
  answerLast();
  send(remote, "5");
  expectHandedOver("5");
  send(remote, "6");
  expectRefused();
  EXPECT_EQ(errors_.count(), 0U);
  EXPECT_EQ(object_->requests.count(), 0U);
}

TEST_F(WaitingMessagesTest, MessagesThatWaitForTheLoginCount) {
  const auto remote = remoteWithPlaces(2);
  for (const char *text : {"1", "2", "3"}) send(remote, text);
  expectRefused();
  exportDaemon(object_);
  client_->start();
  for (const char *text : {"1", "2"}) expectHandedOver(text);
  send(remote, "4");
  expectRefused();
  answerLast();
  send(remote, "5");
  expectHandedOver("5");
}

TEST_F(WaitingMessagesTest, EachFourKibibytesOfTextTakeOneMorePlace) {
  exportDaemon(object_);
  const auto remote = remoteWithPlaces(4);
  client_->start();
  const std::string threePlaces(8192, 'x');
  send(remote, threePlaces);
  send(remote, std::string(4096, 'x'));
  expectRefused();
  const std::string onePlace(4095, 'x');
  send(remote, onePlace);
  send(remote, "");
  expectRefused();
  expectHandedOver(threePlaces);
  answerLast();
  expectHandedOver(onePlace);
  send(remote, threePlaces);
  expectHandedOver(threePlaces);
  EXPECT_EQ(errors_.count(), 0U);
}

TEST_F(WaitingMessagesTest, MessageThatCannotBeMadeTakesNoPlace) {
  exportDaemon(object_);
  const auto remote = remoteWithPlaces(20);
  client_->start();
  send(remote, std::string(maximumStringSize + 1, 'x'));
  const auto tooLong = errors_.take();
  ASSERT_TRUE(tooLong);
  EXPECT_THAT(tooLong->message(), HasSubstr("65536"));
  for (int i = 0; i < 20; ++i) send(remote, std::to_string(i));
  for (int i = 0; i < 20; ++i) expectHandedOver(std::to_string(i));
  send(remote, "next");
  expectRefused();
}

/// Takes one request and lets go of it when the test says so.
class SlowObject : public ExportedObject {
 public:
  void invoke(std::size_t, Arguments, ReplyHandler) override {
    taken.put(true);
    mayGoOn.wait();
  }
  Received<bool> taken;
  std::promise<void> goOn;
  std::shared_future<void> mayGoOn = goOn.get_future().share();
};

TEST_F(WaitingMessagesTest, MessagesThatWantNoAnswerWaitForASocketThatIsFull) {
  const auto slow = std::make_shared<SlowObject>();
  exportDaemon(slow);
  const auto remote = remoteWithPlaces(20);
  client_->start();
  // Far more than the system keeps for a connection.
  constexpr std::size_t count = 500;
  const Value text(std::string(60000, 'x'));
  remote->send(rowOf("DocumentURLFromBookmarkableString"), {text}, {});
  ASSERT_TRUE(slow->taken.take());
  // The other end reads nothing meanwhile.
  for (std::size_t i = 0; i < count; ++i) remote->send(rowOf("DocumentURLFromBookmarkableString"), {text}, {});
  expectRefused();
  send(remote, "");
  expectRefused();
  slow->goOn.set_value();
}

}  // namespace
}  // namespace storix::wire
