#include "wire/BusConnectionTest.h"

namespace storix::wire {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;

class BadInputTest : public EachFramingTest {
 protected:
  /// Sends one request to the daemon's interface and gives the name of the error that it got.
  template <class... Content>
  std::string refused(const char *member, const char *types, Content... content) {
    if (!plain_) plain_.emplace(std::move(peerSocket_));
    const OwnedMessage request = plain_->message(daemonPath, daemonInterface, member);
    EXPECT_GE(sd_bus_message_append(request.get(), types, content...), 0);
    EXPECT_EQ(plain_->call(request), nullptr);
    return plain_->errorName;
  }
  void expectStillServed() {
    EXPECT_EQ(object_->requests.count(), 0U);
    const OwnedMessage request = plain_->message(daemonPath, daemonInterface, "WakeUp");
    ASSERT_GE(sd_bus_message_set_expect_reply(request.get(), 0), 0);
    ASSERT_GE(sd_bus_send(plain_->bus(), request.get(), nullptr), 0);
    EXPECT_TRUE(object_->requests.take());
  }

  void sendRaw(const std::string &bytes) const {
    ASSERT_EQ(write(peerSocket_.get(), bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
  }
  /// Those that were sent and that the connection has not taken yet.
  [[nodiscard]] int bytesLeft() const {
    int count = 0;
    EXPECT_EQ(ioctl(peerSocket_.get(), TIOCOUTQ, &count), 0);
    return count;
  }

  /// What a client sends to log in, all of it at once.
  static std::string loginBytes() {
    std::string hex;
    for (char digit : std::to_string(getuid())) hex += std::string("3") + digit;
    return std::string(1, '\0') + "AUTH EXTERNAL " + hex + "\r\nBEGIN\r\n";
  }

  /// A call of WakeUp that asks for no reply.
  static std::string wakeUpBytes(char serial) {
    std::string fields;
    const auto field = [&fields](char code, char type, const std::string &text) {
      fields.resize((fields.size() + 7) / 8 * 8);
      fields += {code, 1, type, 0, static_cast<char>(text.size()), 0, 0, 0};
      fields += text + '\0';
    };
    field(1, 'o', daemonPath);
    field(2, 's', daemonInterface);
    field(3, 's', "WakeUp");
    std::string bytes{'l', 1, 1, 1, 0, 0, 0, 0, serial, 0, 0, 0, static_cast<char>(fields.size()), 0, 0, 0};
    bytes += fields;
    bytes.resize((bytes.size() + 7) / 8 * 8);
    return bytes;
  }

  std::optional<PlainClient> plain_;
};

TEST_P(BadInputTest, WrongSignatureIsRefusedWithOneLogLine) {
  exportDaemon(object_);
  EXPECT_EQ(refused("WakeUp", "s", "x"), busErrorName::invalidArgs);
  EXPECT_EQ(plain_->errorText, "the message must have the signature \"\", not \"s\"");
  EXPECT_THAT(logTexts(),
              ElementsAre("[NOTICE] Refused \"WakeUp\" of pid 42: the message must have the signature \"\", not \"s\" "
                          "(org.freedesktop.DBus.Error.InvalidArgs)"));
  expectStillServed();
}

TEST_P(BadInputTest, TwoValuesWhereOneMayStandAreRefused) {
  exportDaemon(object_);
  EXPECT_EQ(refused("StartProvidingItemAtURL", "asasas", 0, 2, "a", "b", 0), busErrorName::invalidArgs);
  EXPECT_EQ(plain_->errorText, "the argument \"providerID\" may have one value at most");
  expectStillServed();
}

TEST_P(BadInputTest, TextThatIsNoFileURLIsRefusedWithTheReason) {
  exportDaemon(object_);
  EXPECT_EQ(refused("StartProvidingItemAtURL", "asasas", 1, "http://a/b", 0, 0), busErrorName::invalidArgs);
  EXPECT_THAT(plain_->errorText, HasSubstr("the argument \"URL\": "));
  EXPECT_EQ(refused("StartProvidingItemAtURL", "asasas", 1, "file:///a%00b", 0, 0), busErrorName::invalidArgs);
  EXPECT_EQ(refused("StartProvidingItemAtURL", "asasas", 1, "", 0, 0), busErrorName::invalidArgs);
  expectStillServed();
}

TEST_P(BadInputTest, StringsAndURLsBeyondTheLimitAreRefused) {
  exportDaemon(object_);
  const std::string fits(maximumStringSize, 'x');
  const std::string tooLong = fits + "x";
  EXPECT_EQ(refused("StartProvidingItemAtURL", "asasas", 0, 1, tooLong.c_str(), 0), busErrorName::limitsExceeded);
  const std::string url = "file:///" + fits;
  EXPECT_EQ(refused("StartProvidingItemAtURL", "asasas", 1, url.c_str(), 0, 0), busErrorName::limitsExceeded);
  expectStillServed();
}

TEST_P(BadInputTest, UnknownNamesHaveTheErrorsOfDBus) {
  exportDaemon(object_);
  EXPECT_EQ(refused("NoSuchMethod", ""), "org.freedesktop.DBus.Error.UnknownMethod");
  const auto call = [this](const char *path, const char *interface) {
    EXPECT_EQ(plain_->call(plain_->message(path, interface, "WakeUp")), nullptr);
    return plain_->errorName;
  };
  EXPECT_EQ(call(daemonPath, "org.sample.Other"), "org.freedesktop.DBus.Error.UnknownInterface");
  EXPECT_EQ(call("/org/sample", daemonInterface), "org.freedesktop.DBus.Error.UnknownObject");
  expectStillServed();
}

TEST_P(BadInputTest, MessageBeyondTheLimitEndsTheConnectionWithOneLogLine) {
  exportDaemon(object_);
  plain_.emplace(std::move(peerSocket_));
  ASSERT_NE(plain_->call(plain_->message(daemonPath, "org.freedesktop.DBus.Peer", "Ping")), nullptr);
  const std::string large(2 * maximumMessageSize, 'x');
  const OwnedMessage request = plain_->message(daemonPath, daemonInterface, "WakeUp");
  ASSERT_GE(sd_bus_message_append(request.get(), "s", large.c_str()), 0);
  EXPECT_EQ(plain_->call(request), nullptr);
  EXPECT_LT(plain_->lastResult, 0);
  auto error = closed_.take();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), EMSGSIZE);
  EXPECT_THAT(logTexts(), ElementsAre(HasSubstr("Ended the connection of pid 42")));
}

TEST_P(BadInputTest, FirstMessageBeyondTheLimitEndsTheConnection) {
  exportDaemon(object_);
  plain_.emplace(std::move(peerSocket_));
  const std::string large(8 * maximumMessageSize, 'x');
  const OwnedMessage request = plain_->message(daemonPath, daemonInterface, "WakeUp");
  ASSERT_GE(sd_bus_message_append(request.get(), "s", large.c_str()), 0);
  EXPECT_EQ(plain_->call(request), nullptr);
  auto error = closed_.take();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), EMSGSIZE);
}

TEST_P(BadInputTest, MessageJustBelowTheLimitIsRead) {
  exportDaemon(object_);
  plain_.emplace(std::move(peerSocket_));
  ASSERT_NE(plain_->call(plain_->message(daemonPath, "org.freedesktop.DBus.Peer", "Ping")), nullptr);
  const std::string large(maximumMessageSize - 256, 'x');
  EXPECT_EQ(refused("WakeUp", "s", large.c_str()), busErrorName::invalidArgs);
  expectStillServed();
}

TEST_P(BadInputTest, JunkInsteadOfALoginEndsTheConnectionWithOneLogLine) {
  exportDaemon(object_);
  ASSERT_EQ(write(peerSocket_.get(), "GET / HTTP/1.1\r\n\r\n", 18), 18);
  EXPECT_TRUE(closed_.take());
  EXPECT_THAT(logTexts(), ElementsAre(HasSubstr("Ended the connection of pid 42: ")));
}

TEST_P(BadInputTest, JunkAfterTheLoginEndsTheConnectionWithOneLogLine) {
  exportDaemon(object_);
  sendRaw(loginBytes() + "this is no message, see");
  EXPECT_TRUE(closed_.take());
  EXPECT_THAT(logTexts(), ElementsAre(HasSubstr("Ended the connection of pid 42: ")));
}

TEST_P(BadInputTest, MessagesThatComeWithTheEndOfTheLoginAreServed) {
  exportDaemon(object_);
  sendRaw(loginBytes() + wakeUpBytes(1) + wakeUpBytes(2));
  EXPECT_TRUE(object_->requests.take());
  EXPECT_TRUE(object_->requests.take());
  sendRaw(wakeUpBytes(3));
  EXPECT_TRUE(object_->requests.take());
}

TEST_P(BadInputTest, MessageInPiecesIsServed) {
  exportDaemon(object_);
  const std::string message = wakeUpBytes(1);
  sendRaw(loginBytes() + message);
  EXPECT_TRUE(object_->requests.take());
  for (const std::size_t cut :
       {std::size_t{1}, std::size_t{15}, std::size_t{16}, std::size_t{17}, message.size() - 1}) {
    sendRaw(message.substr(0, cut));
    while (bytesLeft() > 0) std::this_thread::yield();
    sendRaw(message.substr(cut));
    EXPECT_TRUE(object_->requests.take());
  }
}

INSTANTIATE_TEST_SUITE_P(Wire, BadInputTest, EachFramingTest::each(), EachFramingTest::name);

}  // namespace
}  // namespace storix::wire
