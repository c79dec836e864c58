// Attacks by way of the file descriptors that a message may carry: the daemon must not collect them,
// whatever becomes of the message.

#include <algorithm>

#include "tests/e2e/hostile/HostileTest.h"

namespace storix::e2e {
namespace {

constexpr std::uint8_t pathField = 1;
constexpr std::uint8_t signatureField = 8;
constexpr std::uint8_t countField = 9;
/// The most that the kernel passes with one message, nearly.
constexpr std::size_t many = 250;
constexpr const char *unwanted = "a message carries a file descriptor that nothing here takes";

Message::Field counting(std::size_t descriptors) { return {countField, {'u', std::to_string(descriptors)}}; }

/// "ProveWriteAccess" with the first of its descriptors.
Message proof(std::size_t descriptors = 1) {
  Message message = Message::platform("Sandbox", "ProveWriteAccess", "h", Body().number(0));
  message.fields.push_back(counting(descriptors));
  return message;
}

Message without(Message message, std::uint8_t code) {
  std::erase_if(message.fields, [code](const Message::Field &field) { return field.first == code; });
  return message;
}

Message with(Message message, const Message::Field &field) {
  message.fields.push_back(field);
  return message;
}

template <class Change>
Message changed(Change change) {
  Message message = proof();
  change(message);
  return message;
}

struct DescriptorCase {
  const char *name;
  Message message;
  std::size_t descriptors = 1;
};

void PrintTo(const DescriptorCase &testCase, std::ostream *stream) { *stream << testCase.name; }

class RefusedDescriptors : public HostileTest, public testing::WithParamInterface<DescriptorCase> {};

TEST_P(RefusedDescriptors, EndTheConnectionAndAreClosed) {
  startWithBystander();
  // More than the process could have open, if it kept them.
  for (int i = 0; i < 40; ++i) {
    RawClient client = platformClient();
    ASSERT_TRUE(client.sendWithDescriptors(GetParam().message.bytes(), client.fd(), GetParam().descriptors));
    ASSERT_TRUE(client.isClosed());
  }
  EXPECT_TRUE(daemon->waitForLine(unwanted));
  expectHealthy();
}

INSTANTIATE_TEST_SUITE_P(
    Hostile, RefusedDescriptors,
    testing::Values(
        DescriptorCase{"ManyOnASoundCall", proof(many), many},
        DescriptorCase{"ManyOnAMessageWithoutANumber", proof(many).numbered(0), many},
        DescriptorCase{"OneOnAMessageWithoutANumber", proof().numbered(0)},
        DescriptorCase{"TwoOnACallOfOne", proof(2), 2},
        DescriptorCase{"OneThatIsNotCounted", without(proof(), countField)},
        DescriptorCase{"OneThatIsCountedAsNone", proof(0)}, DescriptorCase{"OneThatIsCountedAsTwo", proof(2)},
        DescriptorCase{"OneThatIsCountedAsText",
                       with(without(proof(), countField), {countField, {'s', std::string("1")}})},
        DescriptorCase{
            "OneOnACallThatTakesNone",
            with(Message::platform("Notifications", "Post", "s", Body().string("org.sample.x")), counting(1))},
        DescriptorCase{"OneOnAnUnknownCall", with(Message::platform("Sandbox", "NoSuchMethod"), counting(1))},
        DescriptorCase{"OneOnACallWithoutAPath", without(proof(), pathField)},
        DescriptorCase{"OneOnACallWithoutASignature", without(proof(), signatureField)},
        DescriptorCase{"OneOnAnAnswer", changed([](Message &message) { message.type = 2; })},
        DescriptorCase{"OneOnASignal", changed([](Message &message) { message.type = 4; })},
        DescriptorCase{"OneOnAMessageOfNoKind", changed([](Message &message) { message.type = 0; })},
        DescriptorCase{"OneWithAFieldOfAnUnknownNumber", changed([](Message &message) {
                         message.fields.push_back({77, {'u', "1"}});
                       })},
        DescriptorCase{"OneWithFieldsThatAreNone",
                       changed([](Message &message) { message.fields.front().second.first = 'v'; })},
        DescriptorCase{"OneWithFieldsThatAreCutOff", changed([](Message &message) { message.fieldsLength = 20; })}),
    [](const auto &tested) { return std::string(tested.param.name); });

class HostileDescriptors : public HostileTest {
 protected:
  static std::string errorOf(RawClient &client, const Message &message) {
    EXPECT_TRUE(client.sendWithDescriptors(message.bytes(), client.fd(), 1));
    const std::optional<RawAnswer> answer = client.readAnswerTo(message.serial);
    return answer ? answer->errorName : "closed";
  }
};

// What a well-meaning client may send differs: none of it may be lost on the way.
TEST_F(HostileDescriptors, UnusualCallsAreReadAllTheSame) {
  startWithBystander();
  {
    RawClient client = platformClient();
    Message message = proof();
    EXPECT_EQ(noProof, errorOf(client, message.numbered(1)));
    message.fields.push_back({6, {'s', "com.tessel.Platform"}});
    message.fields.push_back({77, {'s', "of a later version"}});
    message.flags = 4;
    EXPECT_EQ(noProof, errorOf(client, message.numbered(2)));
    std::reverse(message.fields.begin(), message.fields.end());
    EXPECT_EQ(noProof, errorOf(client, message.numbered(3)));
    EXPECT_EQ(noProof, errorOf(client, without(message, 2).numbered(4)));
  }
  expectHealthy();
}

TEST_F(HostileDescriptors, AreClosedWhereTheBodyIsWrong) {
  startWithBystander();
  {
    RawClient client = platformClient();
    std::uint32_t serial = 0;
    for (int i = 0; i < 200; ++i) {
      for (const Body &body : {Body(), Body().number(7)}) {
        Message message = proof().numbered(++serial);
        message.body = body.bytes();
        EXPECT_EQ(invalidArgs, errorOf(client, message));
      }
    }
  }
  expectHealthy();
}

TEST_F(HostileDescriptors, OfAMessageThatNeverEndsAreNotCollected) {
  startWithBystander();
  const std::string bytes = proof().bytes();
  {
    RawClient client = platformClient();
    ASSERT_TRUE(client.sendWithDescriptors(bytes.substr(0, 20), client.fd(), 1));
    ASSERT_TRUE(client.sendWithDescriptors(bytes.substr(20, 8), client.fd(), 1));
    EXPECT_TRUE(client.isClosed());
  }
  EXPECT_TRUE(daemon->waitForLine(unwanted));
  expectHealthy();
}

TEST_F(HostileDescriptors, DuringTheLoginEndTheConnection) {
  startWithBystander();
  for (int i = 0; i < 40; ++i) {
    RawClient client(session.platformSocket(), RawClient::Login::none);
    ASSERT_TRUE(client.sendWithDescriptors(loginBytes(), client.fd(), many));
    EXPECT_TRUE(client.isClosed());
  }
  EXPECT_TRUE(daemon->waitForLine(unwanted));
  expectHealthy();
}

TEST_F(HostileDescriptors, OnTheServicesOwnSocketEndTheConnection) {
  startWithBystander();
  for (int i = 0; i < 40; ++i) {
    RawClient client = serviceClient();
    Message message = Message::service("WakeUp");
    message.fields.push_back(counting(many));
    ASSERT_TRUE(client.sendWithDescriptors(message.bytes(), client.fd(), many));
    ASSERT_TRUE(client.isClosed());
  }
  expectHealthy();
}

}  // namespace
}  // namespace storix::e2e
