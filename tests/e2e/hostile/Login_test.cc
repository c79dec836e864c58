// Attacks with bytes that are no login and no message.

#include <poll.h>
#include <sys/socket.h>

#include <functional>

#include "tests/e2e/hostile/HostileTest.h"

namespace storix::e2e {
namespace {

using namespace std::string_literals;

struct Attack {
  const char *name;
  std::string bytes;
};

void PrintTo(const Attack &attack, std::ostream *out) { *out << attack.name; }

std::string message(const std::function<void(Message &)> &change) {
  Message made = Message::service("WakeUp");
  change(made);
  return std::string(loginBytes()) + made.bytes();
}

/// A connection that was broken is closed, and one line says so.
class BrokenConnection : public HostileTest, public testing::WithParamInterface<Attack> {};

TEST_P(BrokenConnection, IsClosedWithOneLineAndNobodyElseNotices) {
  startWithBystander();
  {
    RawClient client = serviceClient(RawClient::Login::none);
    client.send(GetParam().bytes);
    EXPECT_TRUE(client.isClosed());
    EXPECT_TRUE(daemon->waitForLine("Ended the connection of pid " + std::to_string(::getpid())));
  }
  expectHealthy();
  EXPECT_EQ(1U, daemon->countLines("Ended the connection of pid"));
}

INSTANTIATE_TEST_SUITE_P(
    Hostile, BrokenConnection,
    testing::Values(
        Attack{"JunkBeforeTheLogin", "GET / HTTP/1.1\r\nHost: here\r\n\r\n"},
        Attack{"LoginWithoutItsZeroByte", "AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n"},
        Attack{"JunkInsideTheLogin", "\0AUTH EXTERNAL\r\n\xff\xfe\x01\r\nBEGIN\r\n"s + std::string(64, 'x')},
        Attack{"LoginThatNeverEnds", '\0' + std::string(std::size_t{1} << 17, 'A')},
        Attack{"JunkAfterTheLogin", std::string(loginBytes()) + std::string(64, '\xff')},
        Attack{"UnknownEndianness", message([](Message &made) { made.endianness = 'x'; })},
        Attack{"BigEndianNumbersInALittleEndianMessage", message([](Message &made) { made.bodyLength = 0x10000000U; })},
        Attack{"MessageOfFourGigabytes", message([](Message &made) { made.bodyLength = 0xfffffff0U; })},
        Attack{"HeaderFieldsOfFourGigabytes", message([](Message &made) { made.fieldsLength = 0xfffffff0U; })}),
    [](const auto &attack) { return std::string(attack.param.name); });

/// What is no message that anybody answers is dropped, and the connection goes on or is closed.
class DroppedMessage : public HostileTest, public testing::WithParamInterface<Attack> {};

TEST_P(DroppedMessage, IsNotServedAndNobodyElseNotices) {
  startWithBystander();
  const std::size_t served = daemon->countLines("Serving: wakeUpCompletion:");
  {
    RawClient client = serviceClient();
    client.send(GetParam().bytes);
    // Whatever came of it, the daemon has dealt with it when this is answered or refused.
    const std::string error = client.call(Message::call("/", "org.freedesktop.DBus.Peer", "Ping").numbered(77));
    EXPECT_TRUE(error.empty() || error == "closed") << error;
  }
  EXPECT_EQ(served, daemon->countLines("Serving: wakeUpCompletion:"));
  expectHealthy();
}

std::string alone(const std::function<void(Message &)> &change) {
  Message made = Message::service("WakeUp");
  change(made);
  return made.bytes();
}

INSTANTIATE_TEST_SUITE_P(
    Hostile, DroppedMessage,
    testing::Values(
        Attack{"ReplyToNothing", alone([](Message &made) {
                 made.type = 2;
                 made.fields = {{5, {'u', "4711"}}};
               })},
        Attack{"ErrorReplyToNothing", alone([](Message &made) {
                 made.type = 3;
                 made.fields = {{4, {'s', "org.sample.Error"}}, {5, {'u', "1"}}};
               })},
        Attack{"Signal", alone([](Message &made) { made.type = 4; })},
        Attack{"UnknownMessageType", alone([](Message &made) { made.type = 99; })},
        Attack{"MessageTypeZero", alone([](Message &made) { made.type = 0; })},
        Attack{"SerialZero", alone([](Message &made) { made.serial = 0; })},
        Attack{"CallWithoutMember", alone([](Message &made) { made.fields.pop_back(); })},
        Attack{"PathThatIsNone", alone([](Message &made) { made.fields[0].second.second = "no//path/"; })},
        Attack{"InterfaceThatIsNone", alone([](Message &made) { made.fields[1].second.second = "..\n%s"; })},
        Attack{"MemberWithALineEnd", alone([](Message &made) { made.fields[2].second.second = "Wake\nUp"; })},
        Attack{"PathOfTheWrongType", alone([](Message &made) { made.fields[0].second.first = 's'; })},
        Attack{"TwoPaths", alone([](Message &made) { made.fields.push_back(made.fields[0]); })},
        Attack{"DescriptorsAnnouncedAndNotSent", alone([](Message &made) {
                 made.fields.push_back({9, {'u', "200"}});
               })}),
    [](const auto &attack) { return std::string(attack.param.name); });

class HostileLogin : public HostileTest {};

TEST_F(HostileLogin, HeaderOfTenThousandFieldsIsServedOrRefusedAndNobodyElseNotices) {
  startWithBystander();
  {
    Message many = Message::service("WakeUp");
    for (int i = 0; i < 10000; ++i) many.fields.push_back({200, {'s', "x"}});
    RawClient client = serviceClient();
    const std::string error = client.call(many);
    EXPECT_TRUE(error.empty() || error == "closed") << error;
  }
  expectHealthy();
}

TEST_F(HostileLogin, MessageOfExactlyOneMebibyteIsReadAndTheConnectionGoesOn) {
  startWithBystander();
  {
    Message large = Message::service("WakeUp", "ay");
    // A multiple of 8, so that nothing is added.
    const std::size_t size = (std::size_t{1} << 20) - large.bytes().size() - 4;
    large.body = Body().number(static_cast<std::uint32_t>(size)).raw(std::string(size, 'x')).bytes();
    ASSERT_EQ(std::size_t{1} << 20, large.bytes().size());
    RawClient client = serviceClient();
    // The first one of a connection and a later one are measured in different ways.
    EXPECT_EQ(invalidArgs, client.call(large));
    EXPECT_EQ(invalidArgs, client.call(large.numbered(2)));
    EXPECT_EQ("", client.call(Message::service("WakeUp").numbered(3)));
  }
  expectHealthy();
}

TEST_F(HostileLogin, MessageOfOneByteMoreEndsTheConnectionBeforeItHasCome) {
  startWithBystander();
  {
    RawClient client = serviceClient();
    // From the second answer on the daemon knows where a message begins, and sees its length at once.
    ASSERT_EQ("", client.call(Message::service("WakeUp")));
    ASSERT_EQ("", client.call(Message::service("WakeUp")));
    Message large = Message::service("WakeUp").numbered(2);
    large.bodyLength = static_cast<std::uint32_t>((1U << 20U) + 1 - large.bytes().size());
    ASSERT_TRUE(client.send(large));
    EXPECT_TRUE(client.isClosed());
    EXPECT_TRUE(daemon->waitForLine("a message is larger than 1048576 bytes"));
  }
  expectHealthy();
}

TEST_F(HostileLogin, MessageOfAnotherProtocolVersionEndsTheConnection) {
  startWithBystander();
  std::size_t seen = 0;
  for (const int version : {0, 2, 255}) {
    RawClient client = serviceClient();
    ASSERT_EQ("", client.call(Message::service("WakeUp")));
    ASSERT_EQ("", client.call(Message::service("WakeUp").numbered(2)));
    Message other = Message::service("WakeUp").numbered(3);
    other.version = static_cast<std::uint8_t>(version);
    ASSERT_TRUE(client.send(other));
    EXPECT_TRUE(client.isClosed()) << version;
    const auto line = daemon->waitForLine("a message is not of version 1 of the D-Bus protocol", seen);
    ASSERT_TRUE(line) << version;
    seen = *line + 1;
  }
  EXPECT_EQ(3U, daemon->countLines("Ended the connection of pid"));
  expectHealthy();
}

TEST_F(HostileLogin, LoginAsAnotherUserIsRejectedAndNothingBehindItServed) {
  startWithBystander();
  const std::size_t served = daemon->countLines("Serving: wakeUpCompletion:");
  {
    const RawClient client = serviceClient(RawClient::Login::none);
    ASSERT_TRUE(client.send("\0AUTH EXTERNAL 3939393939\r\nBEGIN\r\n"s + Message::service("WakeUp").bytes()));
    pollfd waited{client.fd(), POLLIN, 0};
    ASSERT_EQ(1, ::poll(&waited, 1, static_cast<int>(std::chrono::milliseconds(deadline).count())));
    std::string answer(64, '\0');
    answer.resize(static_cast<std::size_t>(std::max<ssize_t>(0, ::recv(client.fd(), answer.data(), answer.size(), 0))));
    EXPECT_THAT(answer, testing::StartsWith("REJECTED"));
  }
  EXPECT_EQ(served, daemon->countLines("Serving: wakeUpCompletion:"));
  expectHealthy();
}

TEST_F(HostileLogin, LoginAndMessagesOfSingleBytesAreServedWhileOthersAre) {
  startWithBystander();
  {
    RawClient client = serviceClient(RawClient::Login::none);
    const std::string bytes = std::string(loginBytes()) + Message::service("WakeUp").bytes();
    for (std::size_t i = 0; i < bytes.size(); ++i) {
      ASSERT_TRUE(client.send(bytes.substr(i, 1)));
      if (i % 16 != 0) continue;
      ASSERT_NO_FATAL_FAILURE(serveBystander());
    }
    EXPECT_TRUE(daemon->waitForLine("Serving: wakeUpCompletion:"));
  }
  expectHealthy();
}

TEST_F(HostileLogin, ClientsThatAreGoneInTheMiddleOfTheirLoginAreForgotten) {
  startWithBystander();
  const std::string bytes = std::string(loginBytes()) + Message::service("WakeUp").bytes();
  for (std::size_t length = 0; length < bytes.size(); ++length) {
    const RawClient client = serviceClient(RawClient::Login::none);
    ASSERT_TRUE(client.send(bytes.substr(0, length)));
  }
  expectHealthy();
}

}  // namespace
}  // namespace storix::e2e
