#include "sdk/src/TestDaemon.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "wire/PlatformInterfaces.h"

namespace storix::sdk {

namespace {

std::vector<std::string> texts(const std::optional<URL> &url, const std::optional<std::string> &first,
                               const std::optional<std::string> &second = std::nullopt) {
  std::vector<std::string> all{url ? url->absoluteString() : "none", first.value_or("none")};
  if (second) all.push_back(*second);
  return all;
}

}  // namespace

void ScriptedDaemon::wakeUp(CompletionHandler<> completion) {
  if (onWakeUp) onWakeUp(std::move(completion));
}
void ScriptedDaemon::extendSandboxForFileURL(std::optional<URL> fileURL, std::optional<std::string> fromProviderID,
                                             std::optional<std::string> toConsumerID, SandboxReply completionHandler) {
  if (onExtendSandbox) onExtendSandbox(texts(fileURL, fromProviderID, toConsumerID), std::move(completionHandler));
}
void ScriptedDaemon::providePlaceholderForItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                                    std::optional<std::string> forConsumerID,
                                                    ErrorReply completionHandler) {
  if (onItemOperation) {
    onItemOperation("placeholder", texts(url, fromProviderID, forConsumerID), std::move(completionHandler));
  }
}
void ScriptedDaemon::startProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                             std::optional<std::string> forConsumerID, ErrorReply completionHandler) {
  if (onItemOperation) {
    onItemOperation("start", texts(url, fromProviderID, forConsumerID), std::move(completionHandler));
  }
}
void ScriptedDaemon::stopProvidingItemAtURL(std::optional<URL> url, std::optional<std::string> fromProviderID,
                                            std::optional<std::string> forConsumerID, ErrorReply completionHandler) {
  if (onItemOperation) {
    onItemOperation("stop", texts(url, fromProviderID, forConsumerID), std::move(completionHandler));
  }
}
void ScriptedDaemon::providers(ProvidersReply completionHandler) {
  if (onProviders) onProviders(std::move(completionHandler));
}
void ScriptedDaemon::extendBookmarkForFileURL(std::optional<URL> fileURL, std::optional<std::string> toConsumerID,
                                              BookmarkReply completionHandler) {
  if (onExtendBookmark) onExtendBookmark(texts(fileURL, toConsumerID), std::move(completionHandler));
}
void ScriptedDaemon::bookmarkableStringFromDocumentURL(std::optional<URL> url, BookmarkReply completion) {
  if (onBookmarkableString) onBookmarkableString(url ? url->absoluteString() : "none", std::move(completion));
}
void ScriptedDaemon::documentURLFromBookmarkableString(std::optional<std::string> bookmarkableString,
                                                       DocumentReply completion) {
  if (onDocumentURL) onDocumentURL(bookmarkableString.value_or("none"), std::move(completion));
}

TestDaemon::TestDaemon() : ended_(::eventfd(0, EFD_CLOEXEC)) {
  std::string name = (std::filesystem::temp_directory_path() / "storix-sdk-XXXXXX").string();
  if (!::mkdtemp(name.data())) std::abort();
  directory_ = name;
  service_ = UniqueFd(listenOn("com.tessel.Storix"));
  platform_ = UniqueFd(listenOn("com.tessel.Platform"));
  loopThread_ = std::thread([this] { loop_.run(); });
  acceptThread_ = std::thread([this] { accept(); });
}

TestDaemon::~TestDaemon() {
  const std::uint64_t one = 1;
  if (::write(ended_.get(), &one, sizeof one) != sizeof one) std::abort();
  acceptThread_.join();
  loop_.stop();
  loopThread_.join();
  std::filesystem::remove_all(directory_);
}

void TestDaemon::closeConnections() {
  const std::lock_guard lock(mutex_);
  for (const auto &weak : std::exchange(connections_, {})) {
    if (const auto connection = weak.lock()) connection->close();
  }
}

int TestDaemon::listenOn(const std::string &name) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const std::string path = directory_ + "/" + name;
  if (path.size() >= sizeof address.sun_path) std::abort();
  std::memcpy(address.sun_path, path.data(), path.size());
  const int socket = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (::bind(socket, reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0 ||
      ::listen(socket, SOMAXCONN) != 0) {
    std::abort();
  }
  return socket;
}

void TestDaemon::accept() {
  for (;;) {
    std::array<pollfd, 3> waited{
        {{ended_.get(), POLLIN, 0}, {service_.get(), POLLIN, 0}, {platform_.get(), POLLIN, 0}}};
    if (::poll(waited.data(), waited.size(), -1) < 0) continue;
    if (waited[0].revents != 0) return;
    for (std::size_t i = 1; i < waited.size(); ++i) {
      if (waited[i].revents == 0) continue;
      UniqueFd socket(::accept4(waited[i].fd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
      if (!socket) continue;
      wire::BusConnection::Options options;
      options.side = wire::BusConnection::Side::server;
      options.peer = "a client under test";
      const bool platform = i == 2;
      if (platform) options.descriptors = wire::BusConnection::Descriptors::passed;
      // A request may be served before `add` returns, and its test may then close all connections.
      const std::lock_guard lock(mutex_);
      auto added = loop_.add(std::move(socket), std::move(options), [this, platform](wire::BusConnection &connection) {
        if (platform) return exportPlatform(connection);
        connection.exportObject(LinkInterface(SXDaemonProtocol().description()),
                                std::make_shared<ProtocolExporter<SXDaemon>>(SXDaemonProtocol(), daemon));
      });
      if (added) connections_.push_back(added.value());
    }
  }
}

void TestDaemon::exportPlatform(wire::BusConnection &connection) const {
  const auto scripted = [](const wire::BusConnection::MethodHandler &handler) {
    return handler ? handler : [](const wire::MethodValues &, const wire::BusConnection::Reply &reply) {
      reply.fail(wire::platformError::unavailable, "not scripted");
    };
  };
  connection.exportMethods(wire::sandboxInterface(), {scripted(onConsume), scripted(onProveWriteAccess)});
  connection.exportMethods(wire::notificationsInterface(), {scripted(onPost)});
  connection.exportMethods(wire::fileCoordinationInterface(),
                           {scripted(onBeginRead), scripted(onEndRead), scripted(onBeginWrite), scripted(onEndWrite)});
  if (onPlatformConnection) onPlatformConnection();
  if (onPlatformConnectionClosed) {
    connection.setClosedHandler([closed = onPlatformConnectionClosed](const SXError &) { closed(); });
  }
}

}  // namespace storix::sdk
