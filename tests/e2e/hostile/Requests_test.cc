// Attacks with well-formed messages that no client of good will would send.

#include <functional>

#include "tests/e2e/hostile/HostileTest.h"

namespace storix::e2e {
namespace {

constexpr const char *unknownObject = "org.freedesktop.DBus.Error.UnknownObject";
constexpr const char *unknownInterface = "org.freedesktop.DBus.Error.UnknownInterface";
constexpr const char *unknownMethod = "org.freedesktop.DBus.Error.UnknownMethod";

struct Attack {
  const char *name;
  Message message;
  const char *error;
};

void PrintTo(const Attack &attack, std::ostream *out) { *out << attack.name; }

Message startRequest(std::string_view url) {
  return Message::service("StartProvidingItemAtURL", "asasas", itemArguments(url, "org.sample.docs", "c"));
}
Message bookmark(const Body &body, std::string_view signature = "as") {
  return Message::service("DocumentURLFromBookmarkableString", signature, body);
}
/// "as" with several texts.
Body texts(std::size_t count, std::string_view text) {
  Body elements;
  for (std::size_t i = 0; i < count; ++i) elements.string(text);
  // Behind the array's length, which is of the same alignment.
  return Body().number(static_cast<std::uint32_t>(elements.bytes().size())).raw(elements.bytes());
}

/// Each is refused with its error, and the same connection is served afterwards.
class RefusedRequest : public HostileTest, public testing::WithParamInterface<Attack> {};

TEST_P(RefusedRequest, HasItsErrorAndTheConnectionGoesOn) {
  startWithBystander();
  {
    RawClient client = serviceClient();
    EXPECT_EQ(GetParam().error, client.call(GetParam().message));
    EXPECT_EQ("", client.call(Message::service("WakeUp").numbered(2)));
  }
  expectHealthy();
}

INSTANTIATE_TEST_SUITE_P(
    Hostile, RefusedRequest,
    testing::Values(Attack{"UnknownObject", Message::call("/x", Message::serviceInterface, "WakeUp"), unknownObject},
                    Attack{"ObjectOfTheOtherSocket",
                           Message::platform("Notifications", "Post", "s", Body().string("x")), unknownObject},
                    Attack{"UnknownInterface", Message::call(Message::servicePath, "org.sample.Other", "WakeUp"),
                           unknownInterface},
                    Attack{"UnknownMethod", Message::service("Fly"), unknownMethod},
                    Attack{"VendorProtocolOnTheServiceSocket",
                           Message::call("/com/tessel/StorixVendor", "com.tessel.StorixVendor", "PerformInitialSetup"),
                           unknownObject},
                    Attack{"ArgumentsWhereNoneStand", Message::service("WakeUp", "s", Body().string("x")), invalidArgs},
                    Attack{"MissingArguments", Message::service("StartProvidingItemAtURL"), invalidArgs},
                    Attack{"TextWhereAnArrayStands", bookmark(Body().string("x"), "s"), invalidArgs},
                    Attack{"TwoTextsWhereOneMayStand", bookmark(texts(2, "storix:a/b")), invalidArgs},
                    Attack{"HundredThousandTextsWhereOneMayStand", bookmark(texts(100000, "x")), invalidArgs},
                    Attack{"TextBeyondTheLimit", bookmark(texts(1, std::string(65537, 'x'))), limitsExceeded},
                    Attack{"URLBeyondTheLimit", startRequest("file:///" + std::string(65536, 'x')), limitsExceeded},
                    Attack{"URLWithAnEscapedZeroByte", startRequest("file:///a%00b"), invalidArgs},
                    Attack{"URLWithAnEscapedSlash", startRequest("file:///a%2F..%2Fb"), invalidArgs},
                    Attack{"URLWithAHost", startRequest("file://host/a"), invalidArgs},
                    Attack{"URLWithAQuery", startRequest("file:///a?b"), invalidArgs},
                    Attack{"URLWithAFragment", startRequest("file:///a#b"), invalidArgs},
                    Attack{"URLOfAnotherScheme", startRequest("https://host/a"), invalidArgs},
                    Attack{"URLWithALineEnd", startRequest("file:///a\nb"), invalidArgs},
                    Attack{"RelativeURL", startRequest("../a"), invalidArgs}),
    [](const auto &attack) { return std::string(attack.param.name); });

/// Texts that D-Bus itself does not permit: the message is dropped, or the connection ended.
class MalformedBody : public HostileTest, public testing::WithParamInterface<Attack> {};

TEST_P(MalformedBody, IsRefusedOrEndsTheConnection) {
  startWithBystander();
  {
    RawClient client = serviceClient();
    const Message ping = Message::call("/", "org.freedesktop.DBus.Peer", "Ping").numbered(2);
    ASSERT_TRUE(client.send(GetParam().message));
    if (client.send(ping)) {
      const std::optional<RawAnswer> answer = client.read();
      if (answer && answer->replyTo == 1) {
        EXPECT_EQ(invalidArgs, answer->errorName);
      }
    }
  }
  EXPECT_EQ(0U, daemon->countLines("Getting URL from bookmarkable string"));
  expectHealthy();
}

INSTANTIATE_TEST_SUITE_P(
    Hostile, MalformedBody,
    testing::Values(
        Attack{"TextThatIsNotUTF8", bookmark(Body().optionalString("storix:\xff\xfe/x")), invalidArgs},
        Attack{"TextWithAZeroByte", bookmark(Body().optionalString(std::string_view("a\0b", 3))), invalidArgs},
        Attack{"TextLongerThanTheMessage", bookmark(Body().number(9).number(1000000).raw("abc")), invalidArgs},
        Attack{"ArrayLongerThanTheMessage", bookmark(Body().number(1U << 19U)), invalidArgs},
        Attack{"SignatureThatIsNone", bookmark(Body().number(0), "a(((("), invalidArgs},
        Attack{"SignatureOfAHundredArrays", bookmark(Body().number(0), std::string(100, 'a') + "s"), invalidArgs}),
    [](const auto &attack) { return std::string(attack.param.name); });

class HostileRequests : public HostileTest {};

TEST_F(HostileRequests, TextsAndURLsAtTheLimitAreTaken) {
  startWithBystander();
  {
    RawClient client = serviceClient();
    EXPECT_EQ("", client.call(bookmark(texts(1, std::string(65536, 'x')))));
    EXPECT_EQ("", client.call(startRequest("file:///" + std::string(65536 - 8, 'x')).numbered(2)));
  }
  expectHealthy();
}

TEST_F(HostileRequests, DescriptorsOnTheServiceSocketEndTheConnection) {
  startWithBystander();
  {
    RawClient client = serviceClient();
    ASSERT_EQ("", client.call(Message::service("WakeUp")));
    Message message = Message::service("WakeUp").numbered(2);
    message.fields.push_back({9, {'u', "200"}});
    ASSERT_TRUE(client.sendWithDescriptors(message.bytes(), client.fd(), 200));
    EXPECT_TRUE(client.isClosed());
  }
  expectHealthy();
}

TEST_F(HostileRequests, ClientWithoutAnEntitlementIsToldSoForEachRequestThatNeedsOne) {
  session.beApplication("org.sample.files", R"({"com.tessel.storix.acl-write": true})");
  startWithBystander();
  // Nothing that its own words may name counts as one: no other type, no other name.
  session.beApplication("org.sample.files",
                        R"({"com.tessel.storix.acl-write": "true", "com.tessel.storix.acl-Write": true,
                            "com.tessel.storix": {"acl-write": true}})");
  const std::string refused =
      "[ERROR] Rejecting request from PID " + std::to_string(::getpid()) + " because it does not have any of these";
  {
    const std::unique_ptr<Client> client = makeClient();
    const auto granted = client->extendSandbox(itemURL(docs, "secret"), docs, "org.sample.files");
    ASSERT_FALSE(granted);
    EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::clientLacksEntitlement), granted.error().code());
    const auto started = client->startProviding(itemURL(docs, "report"), docs, "org.sample.editor");
    ASSERT_TRUE(started);
    EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::clientLacksEntitlement), started->code());
    EXPECT_EQ(2U, daemon->countLines(refused));
  }
  EXPECT_FALSE(std::filesystem::exists(session.storage(docs) / "secret"));
  session.beApplication("org.sample.files", R"({"com.tessel.storix.acl-write": true})");
  bystander = makeClient();
  expectHealthy();
}

}  // namespace
}  // namespace storix::e2e
