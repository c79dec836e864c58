#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <filesystem>

#include "tests/e2e/E2ETest.h"

namespace storix::e2e {
namespace {

namespace fs = std::filesystem;

constexpr const char *bothNames = "--fdname=com.tessel.Storix:com.tessel.Platform";

/// The address of a unix socket, which the test's directory keeps short enough.
sockaddr_un addressOf(const fs::path &path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.string().copy(address.sun_path, sizeof address.sun_path - 1);
  return address;
}

/// The daemon behind `systemd-socket-activate`, which listens, and becomes the daemon when somebody
/// connects.
class SocketActivation : public E2ETest {
 protected:
  SocketActivation() {
    fs::create_directory(session.runtimeDirectory());
    fs::permissions(session.runtimeDirectory(), fs::perms::owner_all);
  }

  std::unique_ptr<Process> listenOn(const std::vector<fs::path> &sockets, std::vector<std::string> options) const {
    std::vector<std::string> arguments{"systemd-socket-activate"};
    for (const fs::path &socket : sockets) arguments.push_back("--listen=" + socket.string());
    for (std::string &option : options) arguments.push_back(std::move(option));
    // Only what is named here reaches the daemon.
    for (const auto &[name, value] : session.environment) arguments.push_back("--setenv=" + name + "=" + value);
    arguments.push_back(builtProgram("storixd").string());
    auto process = std::make_unique<Process>(std::move(arguments), session.environment);
    for (const fs::path &socket : sockets) process->waitForLine("Listening on " + socket.string());
    return process;
  }

  void listenOnBoth() { daemon = listenOn({session.serviceSocket(), session.platformSocket()}, {bothNames}); }

  /// Somebody comes to the service's socket, and the daemon ends with status 1. Gives its last line.
  std::string complaintOnFirstConnection() {
    EXPECT_TRUE(makeClient()->wakeUp());
    EXPECT_EQ(1, daemon->wait());
    const std::vector<std::string> lines = daemon->errorLines();
    return lines.empty() ? std::string() : lines.back();
  }

  static ino_t inodeOf(const fs::path &path) {
    struct stat status {};
    EXPECT_EQ(0, ::stat(path.c_str(), &status)) << path;
    return status.st_ino;
  }
};

TEST_F(SocketActivation, FirstRequestOfAClientStartsTheDaemonAndIsAnswered) {
  session.installProvider("org.sample.docs");
  listenOnBoth();
  const ino_t service = inodeOf(session.serviceSocket());
  const ino_t platform = inodeOf(session.platformSocket());

  const std::unique_ptr<Client> client = makeClient();
  const auto providers = client->providers();
  ASSERT_TRUE(providers) << providers.error().message();
  ASSERT_EQ(1U, providers.value().size());
  EXPECT_EQ("org.sample.docs", providers.value()[0].identifier);
  grantAndStart(*client, "org.sample.docs", "report");

  // The daemon uses what it was handed.
  EXPECT_EQ(service, inodeOf(session.serviceSocket()));
  EXPECT_EQ(platform, inodeOf(session.platformSocket()));
  EXPECT_EQ(0U, daemon->countLines("The service manager"));
}

TEST_F(SocketActivation, PlatformSocketStartsTheDaemonAsWell) {
  listenOnBoth();
  const Client::Outcome posted = makeClient()->postNotification("org.sample.anything");
  EXPECT_FALSE(posted) << posted->message();
}

TEST_F(SocketActivation, HandedSocketsStayWhenTheDaemonEnds) {
  listenOnBoth();
  ASSERT_FALSE(makeClient()->wakeUp());
  stop();
  EXPECT_TRUE(fs::exists(session.serviceSocket()));
  EXPECT_TRUE(fs::exists(session.platformSocket()));
}

TEST_F(SocketActivation, DaemonHandedOneSocketMakesTheOtherAndSaysSo) {
  daemon = listenOn({session.serviceSocket()}, {"--fdname=com.tessel.Storix"});
  ASSERT_FALSE(makeClient()->wakeUp());
  EXPECT_TRUE(
      daemon->waitForLine("[NOTICE] The service manager hands over no socket with the name "
                          "“com.tessel.Platform”; the daemon makes that one itself."));
  EXPECT_FALSE(makeClient()->postNotification("org.sample.anything"));
  stop();
  EXPECT_TRUE(fs::exists(session.serviceSocket()));
  EXPECT_FALSE(fs::exists(session.platformSocket()));
}

TEST_F(SocketActivation, SocketOfAnUnknownNameIsRefused) {
  daemon =
      listenOn({session.serviceSocket(), session.platformSocket()}, {"--fdname=com.tessel.Storix:com.tessel.Else"});
  const std::string complaint = complaintOnFirstConnection();
  EXPECT_NE(std::string::npos, complaint.find("“com.tessel.Else”, which nothing here serves")) << complaint;
  EXPECT_NE(std::string::npos, complaint.find("FileDescriptorName=com.tessel.Platform")) << complaint;
}

TEST_F(SocketActivation, SocketsWithoutNamesAreRefused) {
  daemon = listenOn({session.serviceSocket(), session.platformSocket()}, {});
  const std::string complaint = complaintOnFirstConnection();
  EXPECT_NE(std::string::npos, complaint.find("two sockets with the name")) << complaint;
}

TEST_F(SocketActivation, DatagramSocketIsRefused) {
  daemon = listenOn({session.serviceSocket()}, {"--datagram", "--fdname=com.tessel.Storix"});
  const UniqueFd sender(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  const sockaddr_un address = addressOf(session.serviceSocket());
  ASSERT_EQ(1, ::sendto(sender.get(), "x", 1, 0, reinterpret_cast<const sockaddr *>(&address), sizeof address));
  EXPECT_EQ(1, daemon->wait());
  EXPECT_EQ(1U, daemon->countLines("“com.tessel.Storix” is no listening unix stream socket"));
}

TEST_F(SocketActivation, SecondDaemonIsRefusedThoughItIsHandedSockets) {
  start();
  const std::unique_ptr<Process> second =
      listenOn({session.directory() / "other.Storix", session.directory() / "other.Platform"}, {bothNames});
  const UniqueFd visitor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  const sockaddr_un address = addressOf(session.directory() / "other.Storix");
  ASSERT_EQ(0, ::connect(visitor.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address));
  EXPECT_EQ(1, second->wait());
  EXPECT_EQ(1U, second->countLines("is in use by another storixd"));
  EXPECT_FALSE(makeClient()->wakeUp());
}

TEST_F(SocketActivation, DaemonThatWasHandedItsSocketsKeepsOthersOut) {
  listenOnBoth();
  ASSERT_FALSE(makeClient()->wakeUp());
  const Finished second = run({builtProgram("storixd").string()}, session.environment);
  EXPECT_EQ(1, second.status);
  EXPECT_NE(std::string::npos, second.errors.find("is in use by another storixd")) << second.errors;
  EXPECT_FALSE(makeClient()->wakeUp());
}

}  // namespace
}  // namespace storix::e2e
