// What a client that talks nonsense gets, and that nobody else notices.

#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>

#include <cstring>

#include "tests/e2e/E2ETest.h"
#include "wire/UniqueFd.h"

namespace storix::e2e {
namespace {

using namespace std::string_literals;

/// A D-Bus client without any of our code.
class BareClient {
 public:
  explicit BareClient(const std::string &socket) {
    EXPECT_GE(sd_bus_new(&bus_), 0);
    EXPECT_GE(sd_bus_set_address(bus_, ("unix:path=" + socket).c_str()), 0);
    EXPECT_GE(sd_bus_start(bus_), 0);
  }
  ~BareClient() { sd_bus_flush_close_unref(bus_); }
  BareClient(const BareClient &) = delete;
  BareClient &operator=(const BareClient &) = delete;

  /// Calls a method of the service with those arguments; the name of the D-Bus error, or "" for an
  /// answer.
  template <class... Arguments>
  std::string call(const char *method, const char *signature, Arguments... arguments) {
    sd_bus_error error{};
    const int result = sd_bus_call_method(bus_, nullptr, "/com/tessel/Storix", "com.tessel.Storix.Daemon", method,
                                          &error, nullptr, signature, arguments...);
    std::string name = result < 0 ? (error.name ? error.name : std::strerror(-result)) : "";
    sd_bus_error_free(&error);
    return name;
  }

 private:
  sd_bus *bus_ = nullptr;
};

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
