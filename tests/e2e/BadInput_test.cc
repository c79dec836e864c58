// What a client that talks nonsense gets, and that nobody else notices.

#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>

#include <cstring>

#include "tests/e2e/BareClient.h"
#include "tests/e2e/E2ETest.h"
#include "wire/UniqueFd.h"

namespace storix::e2e {
namespace {

using namespace std::string_literals;

UniqueFd connectTo(const std::string &path) {
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  EXPECT_EQ(0, ::connect(socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address));
  return socket;
}

/// Whether the daemon closes the connection, after whatever it still has to say.
bool isClosed(const UniqueFd &socket) {
  timeval patience{};
  patience.tv_sec = deadline.count();
  ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  char buffer[256];
  for (;;) {
    const ssize_t count = ::recv(socket.get(), buffer, sizeof buffer, 0);
    if (count <= 0) return count == 0 || errno == ECONNRESET;
  }
}

/// The bytes of a call of the daemon with one text, which an ordinary client would refuse to send.
std::string callWithOneText(const std::string &member, const std::string &text) {
  const auto length = [](std::size_t size) {
    return std::string{static_cast<char>(size), static_cast<char>(size >> 8), 0, 0};
  };
  std::string fields;
  const auto field = [&fields, &length](char code, char type, const std::string &value) {
    fields.resize((fields.size() + 7) / 8 * 8);
    fields += {code, 1, type, 0};
    fields += type == 'g' ? std::string(1, static_cast<char>(value.size())) : length(value.size());
    fields += value + '\0';
  };
  field(1, 'o', "/com/tessel/Storix");
  field(2, 's', "com.tessel.Storix.Daemon");
  field(3, 's', member);
  field(8, 'g', "as");
  const std::string string = length(text.size()) + text + '\0';
  const std::string body = length(string.size()) + string;
  std::string bytes = std::string{'l', 1, 0, 1} + length(body.size()) + length(1) + length(fields.size()) + fields;
  bytes.resize((bytes.size() + 7) / 8 * 8);
  return bytes + body;
}

/// Whether the text is in what the daemon sends, before it closes the connection.
bool receivesText(const UniqueFd &socket, const std::string &text) {
  timeval patience{};
  patience.tv_sec = deadline.count();
  ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
  std::string received;
  while (received.find(text) == std::string::npos) {
    char buffer[1024];
    const ssize_t count = ::recv(socket.get(), buffer, sizeof buffer, 0);
    if (count <= 0) return false;
    received.append(buffer, static_cast<std::size_t>(count));
  }
  return true;
}

constexpr const char *invalidArguments = SD_BUS_ERROR_INVALID_ARGS;
constexpr const char *limitsExceeded = SD_BUS_ERROR_LIMITS_EXCEEDED;

class BadInput : public E2ETest {
 protected:
  BadInput() { session.installProvider("org.sample.docs"); }

  /// Another client is served as if nothing had been.
  void expectOthersUnaffected() {
    const Client::Outcome outcome = bystander->wakeUp();
    EXPECT_FALSE(outcome) << outcome->message();
  }

  /// The daemon wrote that many lines about this process, and no more.
  void expectLines(std::size_t count) {
    const std::string about = "pid " + std::to_string(::getpid());
    std::size_t from = 0;
    for (std::size_t i = 0; i < count; ++i) from = daemon->waitForLine(about, from).value_or(0) + 1;
    expectOthersUnaffected();
    EXPECT_EQ(count, daemon->countLines(about));
  }

  void startWithBystander() {
    start();
    bystander = makeClient();
    ASSERT_FALSE(bystander->wakeUp());
  }

  std::unique_ptr<Client> bystander;
};

TEST_F(BadInput, WrongSignatureIsRefusedAndTheConnectionGoesOn) {
  startWithBystander();
  BareClient client(session.serviceSocket().string());
  EXPECT_EQ(invalidArguments, client.call("WakeUp", "s", "hello"));
  EXPECT_EQ(invalidArguments, client.call("StartProvidingItemAtURL", "sss", "file:///a", "b", "c"));
  EXPECT_EQ(invalidArguments, client.call("StartProvidingItemAtURL", "asas", 1, "file:///a", 1, "b"));
  EXPECT_EQ("", client.call("WakeUp", ""));
  expectLines(3);
}

TEST_F(BadInput, TwoValuesWhereOneMayStandAreRefused) {
  startWithBystander();
  BareClient client(session.serviceSocket().string());
  EXPECT_EQ(invalidArguments,
            client.call("BookmarkableStringFromDocumentURL", "as", 2, "file:///tmp/a", "file:///tmp/b"));
  expectLines(1);
}

TEST_F(BadInput, URLThatIsNoAbsoluteFileURLIsRefused) {
  startWithBystander();
  BareClient client(session.serviceSocket().string());
  for (const char *url : {"", "report", "file:report", "http://host/report", "file://host/report", "file:///a%00b",
                          "file:///a%2", "file:///a b", "file:///a?b", "file:///a#b", "file:///a%2Fb"}) {
    EXPECT_EQ(invalidArguments, client.call("BookmarkableStringFromDocumentURL", "as", 1, url)) << url;
  }
  expectOthersUnaffected();
}

TEST_F(BadInput, TextsPastTheLimitAreRefusedAndThoseAtItAreTaken) {
  startWithBystander();
  BareClient client(session.serviceSocket().string());
  const std::string prefix = "file:///";
  const std::string longest = prefix + std::string(65536 - prefix.size(), 'a');
  EXPECT_EQ("", client.call("BookmarkableStringFromDocumentURL", "as", 1, longest.c_str()));
  EXPECT_EQ(limitsExceeded, client.call("BookmarkableStringFromDocumentURL", "as", 1, (longest + "a").c_str()));
  EXPECT_EQ(limitsExceeded, client.call("DocumentURLFromBookmarkableString", "as", 1, std::string(65537, '/').c_str()));
  expectOthersUnaffected();
}

TEST_F(BadInput, TextThatIsNotUTF8IsRefusedAndNobodyElseNotices) {
  startWithBystander();
  const UniqueFd well = connectTo(session.serviceSocket().string());
  const std::string login = "\0AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n"s;
  const std::string understood = login + callWithOneText("DocumentURLFromBookmarkableString", "caf\xc3\xa9");
  ASSERT_EQ(static_cast<ssize_t>(understood.size()),
            ::send(well.get(), understood.data(), understood.size(), MSG_NOSIGNAL));
  EXPECT_TRUE(receivesText(well, "com.tessel.storix")) << "the domain of the answer's error";
  for (const char *member : {"DocumentURLFromBookmarkableString", "BookmarkableStringFromDocumentURL"}) {
    const UniqueFd socket = connectTo(session.serviceSocket().string());
    const std::string bytes = login + callWithOneText(member, "file:///storix:org.sample.docs/\xc3\x28\xff");
    ASSERT_EQ(static_cast<ssize_t>(bytes.size()), ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL));
    EXPECT_TRUE(receivesText(socket, invalidArguments)) << member;
    expectOthersUnaffected();
  }
}

TEST_F(BadInput, BookmarkableStringThatIsNoneIsRefused) {
  startWithBystander();
  const std::unique_ptr<Client> client = makeClient();
  for (const std::string &string :
       {""s, "storix:"s, "Storix:org.sample.docs/a"s, "STORIX:org.sample.docs/a"s, "  storix:org.sample.docs/a"s,
        "storix://a"s, "storix:/a"s, "storix:org.sample.docs"s, "storix:org.sample.docs/"s,
        "storix:org.sample.docs//a"s, std::string(65536, '/')}) {
    const auto resolved = client->resolveBookmark(string);
    ASSERT_FALSE(resolved) << string;
    EXPECT_EQ(storixErrorDomain, resolved.error().domain()) << resolved.error().message();
    EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::invalidBookmarkableString), resolved.error().code());
  }
  // Well-formed, a "/" at the end included: it is the grant that is missing.
  for (const char *string :
       {"storix:org.sample.docs/a/", "storix:org.sample.docs/a//b", "storix:org.sample.docs/a/b"}) {
    const auto resolved = client->resolveBookmark(string);
    ASSERT_FALSE(resolved) << string;
    EXPECT_EQ(static_cast<std::int64_t>(SXErrorCode::notPermitted), resolved.error().code());
  }
  expectOthersUnaffected();
}

TEST_F(BadInput, UnknownMethodsInterfacesAndObjectsHaveTheirOwnErrors) {
  startWithBystander();
  BareClient client(session.serviceSocket().string());
  EXPECT_EQ(SD_BUS_ERROR_UNKNOWN_METHOD, client.call("Fly", ""));
  expectOthersUnaffected();
}

TEST_F(BadInput, JunkInsteadOfALoginEndsThatConnectionAlone) {
  startWithBystander();
  const UniqueFd socket = connectTo(session.serviceSocket().string());
  const std::string junk = "GET / HTTP/1.1\r\nHost: here\r\n\r\n";
  ASSERT_EQ(static_cast<ssize_t>(junk.size()), ::send(socket.get(), junk.data(), junk.size(), MSG_NOSIGNAL));
  EXPECT_TRUE(isClosed(socket));
  expectLines(1);
}

TEST_F(BadInput, JunkAfterTheLoginEndsThatConnectionAlone) {
  startWithBystander();
  const UniqueFd socket = connectTo(session.serviceSocket().string());
  std::string bytes = "\0AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n"s;
  bytes.append(64, '\xff');
  ASSERT_EQ(static_cast<ssize_t>(bytes.size()), ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL));
  EXPECT_TRUE(isClosed(socket));
  expectLines(1);
}

TEST_F(BadInput, ClientGoneBeforeItsAnswerIsForgotten) {
  startWithBystander();
  for (int i = 0; i < 50; ++i) {
    const std::unique_ptr<Client> client = makeClient();
    client->wakeUp([](const Client::Outcome &) {});
  }
  expectOthersUnaffected();
}

}  // namespace
}  // namespace storix::e2e
