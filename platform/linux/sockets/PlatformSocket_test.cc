#include "platform/linux/sockets/PlatformSocket.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <cstring>
#include <utility>

#include "platform/linux/TestDescriptors.h"
#include "platform/linux/TestDirectory.h"
#include "platform/linux/TestLog.h"
#include "platform/linux/identity/ApplicationManifests.h"
#include "platform/linux/identity/TestPeers.h"
#include "wire/Codec.h"
#include "wire/PlatformInterfaces.h"
#include "wire/SendBytes.h"
#include "wire/TestConnection.h"

namespace storix::linuxhost {
namespace {

using testing::HasSubstr;
using wire::MethodFailure;
using wire::MethodResult;
using wire::MethodValues;
using wire::Received;

UniqueFd connectTo(const std::string &path) {
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  EXPECT_EQ(::connect(socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
  return socket;
}

template <class... Values>
MethodValues valuesOf(Values... values) {
  MethodValues made;
  (made.emplace_back(std::move(values)), ...);
  return made;
}

/// One client of the platform socket.
class PlatformClient {
 public:
  PlatformClient(ThreadPool &pool, UniqueFd socket) : connection_(pool, std::move(socket), options()) {
    connection_.start();
  }

  /// Sends a call; its result comes to `take`.
  void send(const wire::InterfaceDescription &interface, std::size_t method, MethodValues values) {
    connection_->call(interface, method, std::move(values),
                      [this](MethodResult result) { results_.put(std::make_shared<MethodResult>(std::move(result))); });
  }
  std::shared_ptr<MethodResult> take() { return results_.take().value_or(nullptr); }
  std::shared_ptr<MethodResult> call(const wire::InterfaceDescription &interface, std::size_t method,
                                     MethodValues values) {
    send(interface, method, std::move(values));
    return take();
  }
  /// The name of the D-Bus error that the call got; empty on success.
  std::string errorOf(const wire::InterfaceDescription &interface, std::size_t method, MethodValues values) {
    const auto result = call(interface, method, std::move(values));
    const auto *failure = result ? std::get_if<MethodFailure>(result.get()) : nullptr;
    return failure ? failure->name : "";
  }
  void close() { connection_->close(); }

 private:
  static wire::BusConnection::Options options() {
    wire::BusConnection::Options options;
    options.descriptors = wire::BusConnection::Descriptors::passed;
    options.peer = "the host";
    return options;
  }
  Received<std::shared_ptr<MethodResult>> results_;
  wire::TestConnection connection_;
};

class PlatformSocketTest : public testing::Test {
 protected:
  PlatformSocketTest() {
    auto directory = RuntimeDirectory::open(test_ / "run");
    if (!directory) ADD_FAILURE() << directory.error().message();
    directory_ = std::move(directory.value());
    auto sandbox = Sandbox::create(peers_, directory_->path(), test_.makeDirectory("groups"));
    if (!sandbox) ADD_FAILURE() << sandbox.error().message();
    sandbox_ = std::move(sandbox.value());
    auto socket = NamedSocket::open({pool_, loop_, *peers_, limit_}, *directory_, activated_, "com.tessel.Platform",
                                    wire::BusConnection::Descriptors::passed);
    if (!socket) ADD_FAILURE() << socket.error().message();
    socket_ = std::move(socket.value());
    servePlatformSocket(*socket_, {coordination_, *sandbox_, notifications_});
  }

  std::unique_ptr<PlatformClient> newClient() {
    return std::make_unique<PlatformClient>(pool_, connectTo(directory_->path() + "/com.tessel.Platform"));
  }

  static std::optional<std::uint64_t> claimOf(const std::shared_ptr<MethodResult> &result) {
    const auto *values = result ? std::get_if<MethodValues>(result.get()) : nullptr;
    if (!values) return std::nullopt;
    EXPECT_EQ(std::get<std::optional<SXError>>((*values)[0]), std::nullopt);
    return std::get<std::optional<std::uint64_t>>((*values)[1]);
  }

  // Signals are the loop's before any thread starts.
  std::unique_ptr<EventLoop> events_ = std::move(EventLoop::create().value());
  TestDirectory test_;
  TestLog log_;
  std::unique_ptr<RuntimeDirectory> directory_;
  ActivatedSockets activated_;
  ThreadPool pool_;
  IoLoop loop_{pool_};
  std::shared_ptr<PeerTable> peers_ =
      std::make_shared<PeerTable>(std::make_shared<ApplicationManifests>(std::vector<std::string>()));
  ConnectionLimit limit_{8};
  FileCoordination coordination_{pool_, [](const std::string &, pid_t) { return false; }};
  std::unique_ptr<Sandbox> sandbox_;
  Notifications notifications_{*events_};
  std::unique_ptr<NamedSocket> socket_;
  const wire::InterfaceDescription &files_ = wire::fileCoordinationInterface();
  const std::string url_ = "file:///nowhere/a";
};

TEST_F(PlatformSocketTest, ClaimIsGivenAndEnded) {
  const auto client = newClient();
  const auto claim =
      claimOf(client->call(files_, wire::beginWriteMethod, valuesOf(url_, std::optional<std::string>("writer"))));
  ASSERT_TRUE(claim);
  EXPECT_EQ(client->errorOf(files_, wire::endReadMethod, valuesOf(*claim)), wire::platformError::noSuchClaim);
  EXPECT_EQ(client->errorOf(files_, wire::endWriteMethod, valuesOf(*claim)), "");
  EXPECT_EQ(client->errorOf(files_, wire::endWriteMethod, valuesOf(*claim)), wire::platformError::noSuchClaim);
}

TEST_F(PlatformSocketTest, ClaimsOfAConnectionEndWithItWaitingOnesToo) {
  const auto holder = newClient();
  const auto waiter = newClient();
  const auto last = newClient();
  ASSERT_TRUE(claimOf(holder->call(files_, wire::beginWriteMethod, valuesOf(url_, std::optional<std::string>()))));
  waiter->send(files_, wire::beginWriteMethod, valuesOf(url_, std::optional<std::string>()));
  // Its second call is answered when the first has begun to wait.
  EXPECT_EQ(waiter->errorOf(files_, wire::endReadMethod, valuesOf(std::uint64_t{7})), wire::platformError::noSuchClaim);
  last->send(files_, wire::beginReadMethod, valuesOf(url_, std::optional<std::string>()));
  waiter->close();
  const auto ended = waiter->take();
  ASSERT_TRUE(ended);
  EXPECT_EQ(std::get<MethodFailure>(*ended).name, wire::busErrorName::disconnected);
  holder->close();
  EXPECT_TRUE(claimOf(last->take()));
}

TEST_F(PlatformSocketTest, TextThatIsNoFileURLIsRefusedWithOneLogLine) {
  const auto client = newClient();
  EXPECT_EQ(
      client->errorOf(files_, wire::beginReadMethod, valuesOf(std::string("http://a"), std::optional<std::string>())),
      wire::busErrorName::invalidArgs);
  EXPECT_THAT(log_.take(),
              testing::ElementsAre(HasSubstr("Refused \"BeginRead\" of pid " + std::to_string(::getpid()))));
}

TEST_F(PlatformSocketTest, ForgedTokenIsRefused) {
  const auto client = newClient();
  EXPECT_EQ(client->errorOf(wire::sandboxInterface(), wire::consumeMethod, valuesOf(Data{"forged"})),
            wire::platformError::invalidToken);
}

TEST_F(PlatformSocketTest, TokenOpensItsDocument) {
  const std::string path = test_.makeFile("groups/group.a/doc", "content");
  const auto token = sandbox_->issueExtension(SandboxExtensionClass::readWrite, path, 0);
  ASSERT_TRUE(token);
  const auto client = newClient();
  const auto result = client->call(wire::sandboxInterface(), wire::consumeMethod, valuesOf(Data{*token}));
  ASSERT_TRUE(result && std::holds_alternative<MethodValues>(*result)) << std::get<MethodFailure>(*result).text;
  const UniqueFd &file = std::get<UniqueFd>(std::get<MethodValues>(*result)[0]);
  std::array<char, 16> content{};
  EXPECT_EQ(::read(file.get(), content.data(), content.size()), 7);
}

TEST_F(PlatformSocketTest, ProofCountsUntilItsConnectionEnds) {
  const std::string path = test_.makeFile("doc", "content");
  const auto client = newClient();
  EXPECT_EQ(client->errorOf(wire::sandboxInterface(), wire::proveWriteAccessMethod,
                            valuesOf(UniqueFd(::open(path.c_str(), O_RDONLY | O_CLOEXEC)))),
            wire::platformError::noProof);
  EXPECT_EQ(client->errorOf(wire::sandboxInterface(), wire::proveWriteAccessMethod,
                            valuesOf(UniqueFd(::open(path.c_str(), O_RDWR | O_CLOEXEC)))),
            "");
}

TEST_F(PlatformSocketTest, NotificationReachesItsObserversOnTheEventLoop) {
  int delivered = 0;
  notifications_.addObserver("org.sample.wanted", [&delivered] {
    ++delivered;
    ::kill(::getpid(), SIGTERM);
  });
  notifications_.addObserver("org.sample.other", [] { ADD_FAILURE() << "not posted"; });
  const auto client = newClient();
  EXPECT_EQ(
      client->errorOf(wire::notificationsInterface(), wire::postMethod, valuesOf(std::string("org.sample.wanted"))),
      "");
  events_->run();
  EXPECT_EQ(delivered, 1);
}

TEST_F(PlatformSocketTest, ConfinedProcessPostsNothing) {
  std::array<int, 2> pipe{};
  ASSERT_EQ(::pipe2(pipe.data(), O_CLOEXEC), 0);
  UniqueFd waiting(pipe[0]);
  UniqueFd letGo(pipe[1]);
  auto [ours, theirs] = wire::makeSocketPair();
  const std::string path = directory_->path() + "/com.tessel.Platform";
  const pid_t child = ::fork();
  if (child == 0) {
    letGo.reset();
    const bool prepared = giveUpNewPrivileges();
    const UniqueFd connection = prepared ? connectTo(path) : UniqueFd();
    // Hands its connection over, and stays alive, so that the connection goes on being its own.
    char byte = 'x';
    const std::array<int, 1> handedOver{connection.get()};
    const bool sent = wire::sendBytes(theirs.get(), std::string_view(&byte, 1), handedOver) == 1;
    const ssize_t ended = ::read(waiting.get(), &byte, 1);
    ::_exit(sent && ended == 0 ? 0 : 1);
  }
  waiting.reset();
  theirs.reset();
  pollfd handed{ours.get(), POLLIN, 0};
  ASSERT_EQ(::poll(&handed, 1, 60'000), 1);
  ReceivedByte received = receiveByte(ours.get());
  ASSERT_TRUE(received.isThere && received.descriptor);

  PlatformClient client(pool_, std::move(received.descriptor));
  EXPECT_EQ(
      client.errorOf(wire::notificationsInterface(), wire::postMethod, valuesOf(std::string("org.sample.wanted"))),
      wire::busErrorName::accessDenied);
  letGo.reset();
  int status = -1;
  ::waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
}

}  // namespace
}  // namespace storix::linuxhost
