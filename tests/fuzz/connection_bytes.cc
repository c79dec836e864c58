// What arrives on a socket, byte for byte: the login, the framing and its limit, and messages that nobody
// made with a library. The first byte says who is talked to, where the bytes begin, and whether a file
// descriptor comes with them.

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>

#include "providers/_KTStorixVendor.h"
#include "service/SXDaemon.h"
#include "tests/fuzz/Target.h"
#include "wire/BusConnection.h"
#include "wire/PlatformInterfaces.h"
#include "wire/SendBytes.h"

using storix::Arguments;
using storix::LinkInterface;
using storix::SXError;
using storix::Task;
using storix::fuzz::require;
using namespace storix::wire;
using namespace std::string_literals;

namespace {

class AbsentAnswers : public storix::ExportedObject {
 public:
  void invoke(std::size_t operation, Arguments /*arguments*/, storix::ReplyHandler reply) override {
    const auto &operations = storix::SXDaemonProtocol().description().operations;
    require(operation < operations.size(), "an operation that is none was asked for");
    if (reply) reply(Arguments(operations[operation].replies.size()));
  }
};

void exportPlatform(BusConnection &connection) {
  for (const InterfaceDescription *interface :
       {&fileCoordinationInterface(), &sandboxInterface(), &notificationsInterface()}) {
    std::vector<BusConnection::MethodHandler> handlers;
    for (std::size_t i = 0; i < interface->methods.size(); ++i) {
      handlers.emplace_back([](MethodValues, const BusConnection::Reply &reply) {
        reply.fail(platformError::unavailable, "nothing is there");
      });
    }
    connection.exportMethods(*interface, std::move(handlers));
  }
}

/// Calls of the vendor protocol, which the bytes may answer. Counts those who have heard.
struct Calls {
  std::size_t made = 0;
  std::size_t heard = 0;
  std::shared_ptr<storix::RemoteObject> object;
};

void callExtension(BusConnection &connection, Calls &calls) {
  const auto &protocol = storix::_KTStorixVendorProtocol().description();
  calls.object = connection.remoteObject(LinkInterface(protocol), [&calls](const SXError &) { ++calls.heard; });
  for (std::size_t i = 0; i < protocol.operations.size(); ++i) {
    ++calls.made;
    calls.object->send(i, Arguments(protocol.operations[i].arguments.size()), [&calls, i, &protocol](Arguments values) {
      require(values.size() == protocol.operations[i].replies.size(), "a reply has other values");
      ++calls.heard;
    });
  }
}

/// Of the lowest numbers, which the next ones get.
int openDescriptors() {
  constexpr int highest = 48;
  int count = 0;
  for (int fd = 0; fd < highest; ++fd) {
    if (::fcntl(fd, F_GETFD) >= 0) ++count;
  }
  return count;
}

void runAll(std::vector<Task> &later) {
  for (std::size_t i = 0; i < later.size(); ++i) {
    const Task task = std::move(later[i]);
    task();
  }
  later.clear();
}

}  // namespace

int LLVMFuzzerTestOneInput(const std::uint8_t *bytes, std::size_t size) {
  if (size == 0) return 0;
  const std::uint8_t mode = bytes[0];
  std::string sent = mode % 2 == 1 ? "\0AUTH EXTERNAL\r\nDATA\r\nNEGOTIATE_UNIX_FD\r\nBEGIN\r\n"s : std::string();
  const std::size_t loginSize = sent.size();
  sent += storix::fuzz::textOf(bytes + 1, size - 1);

  const int openBefore = openDescriptors();
  std::array<int, 2> ends{-1, -1};
  require(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()) == 0, "no socket pair");
  const storix::UniqueFd peer(ends[1]);
  std::vector<Task> later;
  Calls calls;
  bool closed = false;
  {
    BusConnection::Options options;
    options.side = BusConnection::Side::server;
    options.descriptors = mode / 8 % 2 == 1 ? BusConnection::Descriptors::passed : BusConnection::Descriptors::refused;
    options.peer = "pid 42";
    options.requestsInFlightAtMost = 4;
    options.runLater = [&later](Task task) { later.push_back(std::move(task)); };
    auto opened = BusConnection::open(storix::UniqueFd(ends[0]), std::move(options));
    require(opened.ok(), "the connection does not begin");
    const std::shared_ptr<BusConnection> connection = opened.value();
    connection->setClosedHandler([&closed](const SXError &) { closed = true; });
    switch (mode / 2 % 4) {
      case 0:
        callExtension(*connection, calls);
        break;
      case 1:
        exportPlatform(*connection);
        break;
      default:
        connection->exportObject(LinkInterface(storix::SXDaemonProtocol().description()),
                                 std::make_shared<AbsentAnswers>());
    }
    std::string_view unsent = sent;
    bool finished = false;
    bool passesDescriptor = mode / 16 % 2 == 1;
    // Every turn takes bytes from one side or the other; far more of them than any input needs.
    for (int turn = 0; connection->isOpen(); ++turn) {
      require(turn < 100'000, "the connection comes to no end");
      const std::size_t sentBefore = sent.size() - unsent.size();
      const bool isLogin = sentBefore < loginSize;
      const std::array<int, 1> descriptor{peer.get()};
      const ssize_t count = sendBytes(peer.get(), isLogin ? unsent.substr(0, loginSize - sentBefore) : unsent,
                                      std::span(descriptor).first(passesDescriptor && !isLogin ? 1 : 0));
      if (count > 0 && !isLogin) passesDescriptor = false;
      if (count > 0) unsent.remove_prefix(static_cast<std::size_t>(count));
      if (unsent.empty() && !finished) {
        finished = true;
        ::shutdown(peer.get(), SHUT_WR);
      }
      connection->process();
      runAll(later);
      static std::array<char, 65536> answers;
      while (::recv(peer.get(), answers.data(), answers.size(), MSG_DONTWAIT) > 0) {
      }
    }
    connection->releaseSocket();
  }
  runAll(later);
  // The peer is still there.
  require(openDescriptors() == openBefore + 1, "a descriptor is left open");
  require(closed, "nobody heard of the end");
  require(calls.heard == calls.made, "a caller never heard, or twice");
  return 0;
}
