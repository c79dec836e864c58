#include "platform/linux/sockets/NamedSockets.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstring>
#include <thread>

#include "platform/linux/SteppedTime.h"
#include "platform/linux/TestDirectory.h"
#include "platform/linux/TestLog.h"
#include "platform/linux/identity/ApplicationManifests.h"
#include "platform/linux/identity/TestPeers.h"
#include "platform/linux/sockets/ClientListener.h"
#include "service/SXDaemon.h"
#include "wire/TestConnection.h"

namespace storix::linuxhost {
namespace {

using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using wire::OwnedMessage;
using wire::PlainClient;
using wire::Received;

constexpr const char *daemonPath = "/com/tessel/Storix";
constexpr const char *daemonInterface = "com.tessel.Storix.Daemon";

/// Connects like a client; none when there is nobody.
UniqueFd connectTo(const std::string &path) {
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  if (::connect(socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0) socket.reset();
  return socket;
}

/// Waits for the other side to close.
bool isClosedByPeer(const UniqueFd &socket) {
  pollfd waited{socket.get(), POLLIN, 0};
  if (::poll(&waited, 1, 60'000) != 1) return false;
  char byte = 0;
  return ::recv(socket.get(), &byte, 1, MSG_DONTWAIT) <= 0;
}

class SocketTest : public testing::Test {
 protected:
  SocketTest() {
    auto opened = RuntimeDirectory::open(test_ / "run");
    if (!opened) ADD_FAILURE() << opened.error().message();
    directory_ = std::move(opened.value());
  }
  ~SocketTest() override {
    // What still runs asks for the time.
    loop_.end();
    pool_.end();
  }
  SocketTest(const SocketTest &) = delete;
  SocketTest &operator=(const SocketTest &) = delete;

  std::unique_ptr<NamedSocket> openSocket(
      const std::string &name = "com.tessel.Storix",
      wire::BusConnection::Descriptors descriptors = wire::BusConnection::Descriptors::refused) {
    auto opened = NamedSocket::open({time_, loop_, peers_, limit_}, *directory_, activated_, name, descriptors);
    if (opened) return std::move(opened.value());
    refusal_ = opened.error().message();
    return nullptr;
  }
  [[nodiscard]] std::string pathOf(const std::string &name = "com.tessel.Storix") const {
    return directory_->path() + "/" + name;
  }

  TestDirectory test_;
  TestLog log_;
  std::unique_ptr<RuntimeDirectory> directory_;
  ActivatedSockets activated_;
  std::string refusal_;
  ThreadPool pool_;
  SteppedTime time_{pool_};
  IoLoop loop_{pool_};
  PeerTable peers_{std::make_shared<ApplicationManifests>(std::vector<std::string>())};
  ConnectionLimit limit_{3};
};

TEST_F(SocketTest, SocketIsForItsUserAloneAndGoneAtTheEnd) {
  const auto socket = openSocket();
  ASSERT_TRUE(socket) << refusal_;
  struct stat found {};
  ASSERT_EQ(::stat(pathOf().c_str(), &found), 0);
  EXPECT_TRUE(S_ISSOCK(found.st_mode));
  EXPECT_EQ(found.st_mode & 0777, 0600U);
}

TEST_F(SocketTest, SocketIsGoneAtTheEnd) {
  openSocket();
  EXPECT_NE(::access(pathOf().c_str(), F_OK), 0);
}

TEST_F(SocketTest, StaleSocketOfADeadDaemonIsReplaced) {
  {
    const UniqueFd stale(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, pathOf().c_str(), pathOf().size() + 1);
    ASSERT_EQ(::bind(stale.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
  }
  const auto socket = openSocket();
  ASSERT_TRUE(socket) << refusal_;
  EXPECT_TRUE(connectTo(pathOf()));
}

TEST_F(SocketTest, WhatIsNoSocketIsLeftInPlaceAndSaid) {
  test_.makeFile("run/com.tessel.Storix", "somebody's text");
  EXPECT_FALSE(openSocket());
  EXPECT_THAT(refusal_, HasSubstr("something else is there; remove it."));
  EXPECT_EQ(test_.contentOf("run/com.tessel.Storix"), "somebody's text");
}

TEST_F(SocketTest, DirectoryWithALongPathHasItsSocketToo) {
  const std::string longName(150, 'd');
  auto opened = RuntimeDirectory::open(test_ / longName);
  ASSERT_TRUE(opened) << opened.error().message();
  directory_ = std::move(opened.value());
  EXPECT_TRUE(openSocket()) << refusal_;
}

TEST_F(SocketTest, SocketThatWasHandedOverIsUsedAndNotMade) {
  UniqueFd given(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const std::string elsewhere = test_ / "elsewhere";
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, elsewhere.c_str(), elsewhere.size() + 1);
  ASSERT_EQ(::bind(given.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
  ASSERT_EQ(::listen(given.get(), 8), 0);
  activated_.emplace("com.tessel.Storix", std::move(given));
  const auto socket = openSocket();
  ASSERT_TRUE(socket) << refusal_;
  EXPECT_THAT(activated_, IsEmpty());
  EXPECT_NE(::access(pathOf().c_str(), F_OK), 0);
  Received<std::shared_ptr<ServedConnection>> accepted;
  socket->serve([&accepted](const auto &connection) { accepted.put(connection); });
  const UniqueFd client = connectTo(elsewhere);
  EXPECT_TRUE(accepted.take());
}

TEST_F(SocketTest, ConnectionsWaitUntilTheSocketIsServed) {
  const auto socket = openSocket();
  const UniqueFd client = connectTo(pathOf());
  ASSERT_TRUE(client);
  Received<pid_t> accepted;
  socket->serve([&accepted](const std::shared_ptr<ServedConnection> &connection) {
    accepted.put(connection->peer()->processIdentifier());
    connection->start();
  });
  EXPECT_EQ(accepted.take(), ::getpid());
}

TEST_F(SocketTest, ConnectionThatNobodyStartsIsDropped) {
  const auto socket = openSocket();
  socket->serve([](const std::shared_ptr<ServedConnection> &) {});
  EXPECT_TRUE(isClosedByPeer(connectTo(pathOf())));
}

TEST_F(SocketTest, ThoseBeyondTheLimitWaitForAPlace) {
  const auto socket = openSocket();
  Received<std::shared_ptr<ServedConnection>> accepted;
  socket->serve([&accepted](const std::shared_ptr<ServedConnection> &connection) {
    connection->start();
    accepted.put(connection);
  });
  std::vector<UniqueFd> clients;
  clients.reserve(4);
  for (int i = 0; i < 4; ++i) clients.push_back(connectTo(pathOf()));
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(accepted.take());
  EXPECT_EQ(accepted.count(), 0U);
  clients[0].reset();
  EXPECT_TRUE(accepted.take());
}

/// Reads what the other side has to say to a login, until it has said that.
bool hears(const UniqueFd &socket, const std::string &awaited) {
  std::string heard;
  while (heard.find(awaited) == std::string::npos) {
    pollfd waited{socket.get(), POLLIN, 0};
    std::array<char, 256> bytes{};
    const ssize_t count =
        ::poll(&waited, 1, 60'000) == 1 ? ::recv(socket.get(), bytes.data(), bytes.size(), MSG_DONTWAIT) : 0;
    if (count <= 0) return false;
    heard.append(bytes.data(), static_cast<std::size_t>(count));
  }
  return true;
}

TEST_F(SocketTest, LoginsThatAreNotOverInTimeEndTheirConnectionsWithOneLogLineEach) {
  const auto socket = openSocket();
  Received<std::shared_ptr<ServedConnection>> accepted;
  socket->serve([&accepted](const std::shared_ptr<ServedConnection> &connection) {
    connection->start();
    accepted.put(connection);
  });
  const auto letTimePass = [this] {
    ASSERT_TRUE(time_.waitForTaskIn(std::chrono::seconds(5)));
    time_.advance(std::chrono::seconds(5));
  };
  const UniqueFd silent = connectTo(pathOf());
  ASSERT_TRUE(accepted.take());
  const UniqueFd rejected = connectTo(pathOf());
  ASSERT_TRUE(accepted.take());
  ASSERT_EQ(::send(rejected.get(), "", 1, 0), 1);
  const std::string login = "AUTH EXTERNAL 3939\r\n";
  for (int i = 0; i < 5; ++i) {
    ASSERT_EQ(::send(rejected.get(), login.data(), login.size(), 0), static_cast<ssize_t>(login.size()));
    ASSERT_TRUE(hears(rejected, "REJECTED"));
    ASSERT_NO_FATAL_FAILURE(letTimePass());
  }
  // It comes when the time of the others is nearly over, and has its own.
  UniqueFd late = connectTo(pathOf());
  ASSERT_TRUE(accepted.take());
  EXPECT_THAT(log_.take(), IsEmpty());
  ASSERT_NO_FATAL_FAILURE(letTimePass());
  EXPECT_TRUE(isClosedByPeer(silent));
  EXPECT_TRUE(isClosedByPeer(rejected));
  const auto line = HasSubstr("[NOTICE] Ended the connection of pid " + std::to_string(::getpid()) +
                              ": its login took longer than 25 seconds.");
  EXPECT_THAT(log_.take(), ElementsAre(line, line));

  ASSERT_NO_FATAL_FAILURE(letTimePass());
  // Once it has been looked at, the next one's time begins with the next look.
  ASSERT_TRUE(time_.waitForTaskIn(std::chrono::seconds(5)));
  PlainClient client(std::move(late));
  const auto greets = [&client] {
    return client.call(client.message("/org/freedesktop/DBus", "org.freedesktop.DBus", "Hello")) != nullptr;
  };
  ASSERT_TRUE(greets()) << client.errorText;
  const UniqueFd next = connectTo(pathOf());
  ASSERT_TRUE(accepted.take());
  for (int i = 0; i < 6; ++i) ASSERT_NO_FATAL_FAILURE(letTimePass());
  EXPECT_TRUE(isClosedByPeer(next));
  EXPECT_TRUE(greets()) << "who has logged in stays";
}

TEST_F(SocketTest, BothSocketsShareTheLimit) {
  const auto first = openSocket();
  const auto second = openSocket("com.tessel.Platform");
  Received<std::shared_ptr<ServedConnection>> accepted;
  const auto keep = [&accepted](const std::shared_ptr<ServedConnection> &connection) {
    connection->start();
    accepted.put(connection);
  };
  first->serve(keep);
  second->serve(keep);
  std::vector<UniqueFd> clients;
  clients.reserve(3);
  for (int i = 0; i < 3; ++i) clients.push_back(connectTo(pathOf()));
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(accepted.take());
  const UniqueFd other = connectTo(pathOf("com.tessel.Platform"));
  clients.clear();
  EXPECT_TRUE(accepted.take());
}

TEST_F(SocketTest, ConnectionsWaitWhileNoDescriptorIsLeftWithOneLogLine) {
  const auto socket = openSocket();
  Received<std::shared_ptr<ServedConnection>> accepted;
  socket->serve([&accepted](const auto &connection) { accepted.put(connection); });
  // Sanitizers need descriptors to judge what they see for the first time, so all goes its way once before.
  const UniqueFd first = connectTo(pathOf());
  ASSERT_TRUE(accepted.take());
  sx_default_log().fault("[ERROR] %@: %@", pathOf(), posixError(EMFILE, "accept"));
  Received<bool> passed;
  Executor &executor = time_;
  executor.executeAfter(std::chrono::milliseconds(1), [&passed] { passed.put(true); });
  time_.advance(std::chrono::milliseconds(1));
  ASSERT_TRUE(passed.take());
  log_.take();

  const UniqueFd client(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  pathOf().copy(address.sun_path, sizeof address.sun_path - 1);
  rlimit before{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
  rlimit none = before;
  none.rlim_cur = 0;
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  const int connected = ::connect(client.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address);
  std::vector<std::string> lines;
  const auto deadline = std::chrono::steady_clock::now() + wire::generousDeadline;
  while (lines.empty() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::yield();
    lines = log_.take();
  }
  const std::size_t acceptedMeanwhile = accepted.count();
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
  EXPECT_EQ(connected, 0);
  EXPECT_THAT(lines, ElementsAre(HasSubstr("[ERROR] Connections to com.tessel.Storix have to wait: ")));
  EXPECT_EQ(acceptedMeanwhile, 0U);
  ASSERT_TRUE(time_.waitForTaskIn(std::chrono::milliseconds(200)));
  time_.advance(std::chrono::milliseconds(200));
  EXPECT_TRUE(accepted.take());
  EXPECT_THAT(log_.take(), IsEmpty());
}

TEST_F(SocketTest, ForeignUserIsDroppedBeforeAByteIsReadWithOneLogLine) {
  // The daemon of somebody else: to it this process, which may enter the directory, is foreign.
  PeerTable peersOfAnother{std::make_shared<ApplicationManifests>(std::vector<std::string>()), ::geteuid() + 1};
  auto socket = NamedSocket::open({pool_, loop_, peersOfAnother, limit_}, *directory_, activated_, "com.tessel.Storix",
                                  wire::BusConnection::Descriptors::refused);
  ASSERT_TRUE(socket);
  Received<bool> accepted;
  socket.value()->serve([&accepted](const std::shared_ptr<ServedConnection> &) { accepted.put(true); });
  const UniqueFd client = connectTo(pathOf());
  ASSERT_TRUE(client);
  EXPECT_TRUE(isClosedByPeer(client));
  EXPECT_EQ(accepted.count(), 0U);
  EXPECT_THAT(log_.take(),
              ElementsAre(AllOf(HasSubstr("Dropped a connection to com.tessel.Storix: "),
                                HasSubstr("The user " + std::to_string(::geteuid()) + " may not connect"))));
}

TEST(ConnectionLimitTest, DescriptorsAreKeptBack) {
  EXPECT_EQ(ConnectionLimit::connectionsFor(1U << 20), 1024U);
  EXPECT_EQ(ConnectionLimit::connectionsFor(1024), 102U);
  EXPECT_GE(ConnectionLimit::connectionsFor(8), 1U);
}

// --- The service of the logic

/// Answers WakeUp, and tells the test of everything else.
class Waking : public ExportedObject {
 public:
  void invoke(std::size_t operation, Arguments, ReplyHandler reply) override {
    if (operation == 0 && reply) reply({});
  }
};

class TestDelegate : public ServiceListenerDelegate {
 public:
  bool listener(ServiceListener &, std::shared_ptr<ClientConnection> connection) override {
    if (isRefusing) return false;
    connection->setExportedInterface(LinkInterface(SXDaemonProtocol().description()));
    auto object = std::make_shared<Waking>();
    objects.put(object);
    connection->setExportedObject(std::move(object));
    connections.put(connection);
    connection->resume();
    return true;
  }
  bool isRefusing = false;
  Received<std::weak_ptr<ClientConnection>> connections;
  Received<std::weak_ptr<Waking>> objects;
};

class ClientListenerTest : public SocketTest {
 protected:
  ClientListenerTest() { listener_->setDelegate(delegate_); }

  std::unique_ptr<NamedSocket> socket_ = openSocket();
  std::shared_ptr<ClientListener> listener_ = std::make_shared<ClientListener>(*socket_);
  std::shared_ptr<TestDelegate> delegate_ = std::make_shared<TestDelegate>();
};

TEST_F(ClientListenerTest, RequestsWaitWhileTheListenerIsSuspended) {
  PlainClient client(connectTo(pathOf()));
  int answers = 0;
  const auto count = [](sd_bus_message *reply, void *counter, sd_bus_error *) {
    EXPECT_EQ(sd_bus_message_get_error(reply), nullptr);
    ++*static_cast<int *>(counter);
    return 0;
  };
  const OwnedMessage request = client.message(daemonPath, daemonInterface, "WakeUp");
  ASSERT_GE(sd_bus_call_async(client.bus(), nullptr, request.get(), count, &answers, 60'000'000), 0);
  while (sd_bus_process(client.bus(), nullptr) > 0) {
  }
  EXPECT_EQ(delegate_->connections.count(), 0U);
  listener_->resume();
  while (answers == 0) {
    const int result = sd_bus_process(client.bus(), nullptr);
    ASSERT_GE(result, 0);
    if (result == 0) {
      ASSERT_GE(sd_bus_wait(client.bus(), 60'000'000), 0);
    }
  }
}

TEST_F(ClientListenerTest, ConnectionKnowsItsPeer) {
  listener_->resume();
  const UniqueFd client = connectTo(pathOf());
  const auto weak = delegate_->connections.take();
  ASSERT_TRUE(weak);
  const auto connection = weak->lock();
  ASSERT_TRUE(connection);
  EXPECT_EQ(connection->peerProcessIdentifier(), ::getpid());
  EXPECT_NE(connection->peerAuditToken(), AuditToken());
  EXPECT_EQ(connection->entitlementValue("com.tessel.storix.acl-read"), std::nullopt);
}

TEST_F(ClientListenerTest, ConnectionAndItsObjectLiveExactlyAsLongAsThePeerStays) {
  listener_->resume();
  std::optional<PlainClient> client(connectTo(pathOf()));
  ASSERT_NE(client->call(client->message(daemonPath, daemonInterface, "WakeUp")), nullptr);
  const auto connection = delegate_->connections.take();
  const auto object = delegate_->objects.take();
  ASSERT_TRUE(connection && object);
  EXPECT_FALSE(connection->expired());
  EXPECT_FALSE(object->expired());
  client.reset();
  // The places are taken again only when the first connection has gone altogether.
  std::vector<UniqueFd> others;
  for (int i = 0; i < 3; ++i) {
    others.push_back(connectTo(pathOf()));
    EXPECT_TRUE(delegate_->connections.take());
  }
  EXPECT_TRUE(connection->expired());
  EXPECT_TRUE(object->expired());
}

TEST_F(ClientListenerTest, RefusedConnectionIsDropped) {
  delegate_->isRefusing = true;
  listener_->resume();
  EXPECT_TRUE(isClosedByPeer(connectTo(pathOf())));
}

TEST_F(ClientListenerTest, ConnectionIsDroppedWhenTheDelegateIsGone) {
  delegate_.reset();
  listener_->resume();
  EXPECT_TRUE(isClosedByPeer(connectTo(pathOf())));
}

TEST_F(ClientListenerTest, JunkLoginEndsThatConnectionAloneWithOneLogLine) {
  listener_->resume();
  PlainClient client(connectTo(pathOf()));
  ASSERT_NE(client.call(client.message(daemonPath, daemonInterface, "WakeUp")), nullptr);
  EXPECT_TRUE(delegate_->connections.take());
  const UniqueFd junk = connectTo(pathOf());
  EXPECT_TRUE(delegate_->connections.take());
  ASSERT_EQ(::send(junk.get(), "GET / HTTP/1.1\r\n\r\n", 18, MSG_NOSIGNAL), 18);
  EXPECT_TRUE(isClosedByPeer(junk));
  EXPECT_THAT(log_.take(), ElementsAre(HasSubstr("Ended the connection of pid " + std::to_string(::getpid()))));
  EXPECT_NE(client.call(client.message(daemonPath, daemonInterface, "WakeUp")), nullptr);
}

TEST_F(ClientListenerTest, JunkThatWasThereBeforeTheListenerEndsThatConnectionAloneWithOneLogLine) {
  const UniqueFd junk = connectTo(pathOf());
  ASSERT_EQ(::send(junk.get(), "GET / HTTP/1.1\r\n\r\n", 18, MSG_NOSIGNAL), 18);
  listener_->resume();
  EXPECT_TRUE(isClosedByPeer(junk));
  PlainClient client(connectTo(pathOf()));
  EXPECT_NE(client.call(client.message(daemonPath, daemonInterface, "WakeUp")), nullptr);
  socket_.reset();
  EXPECT_THAT(log_.take(), ElementsAre(HasSubstr("Ended the connection of pid " + std::to_string(::getpid()))));
}

TEST_F(ClientListenerTest, FloodOfRequestsOfOneClientIsAnsweredInOrder) {
  listener_->resume();
  PlainClient client(connectTo(pathOf()));
  constexpr int count = 2000;
  std::vector<int> order;
  struct Slot {
    std::vector<int> *order;
    int number;
  };
  std::vector<Slot> slots;
  slots.reserve(count);
  for (int i = 0; i < count; ++i) {
    slots.push_back({&order, i});
    const OwnedMessage request = client.message(daemonPath, daemonInterface, "WakeUp");
    const auto note = [](sd_bus_message *, void *slot, sd_bus_error *) {
      const auto *noted = static_cast<Slot *>(slot);
      noted->order->push_back(noted->number);
      return 0;
    };
    ASSERT_GE(sd_bus_call_async(client.bus(), nullptr, request.get(), note, &slots.back(), 60'000'000), 0);
  }
  while (order.size() < count) {
    const int result = sd_bus_process(client.bus(), nullptr);
    ASSERT_GE(result, 0);
    if (result == 0) {
      ASSERT_GE(sd_bus_wait(client.bus(), 60'000'000), 0);
    }
  }
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST_F(ClientListenerTest, EndOfTheSocketEndsItsConnections) {
  listener_->resume();
  PlainClient client(connectTo(pathOf()));
  ASSERT_NE(client.call(client.message(daemonPath, daemonInterface, "WakeUp")), nullptr);
  listener_.reset();
  socket_.reset();
  EXPECT_EQ(client.call(client.message(daemonPath, daemonInterface, "WakeUp")), nullptr);
  EXPECT_LT(client.lastResult, 0);
}

}  // namespace
}  // namespace storix::linuxhost
