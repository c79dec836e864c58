#include "sdk/src/ServiceSocket.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <system_error>

#include "sdk/src/ClientErrors.h"

namespace storix::sdk {

Result<std::string> runtimeDirectory(const std::optional<std::string> &given) {
  if (given) return *given;
  if (const char *directory = std::getenv("STORIX_RUNTIME_DIR"); directory && *directory) return std::string(directory);
  if (const char *directory = std::getenv("XDG_RUNTIME_DIR"); directory && *directory) {
    return std::string(directory) + "/storix";
  }
  return clientError(ClientErrorCode::notReachable,
                     "The document broker cannot be found: neither STORIX_RUNTIME_DIR nor XDG_RUNTIME_DIR is set.");
}

Result<UniqueFd> connectToSocket(const std::string &path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) {
    return clientError(ClientErrorCode::notReachable, "The path of the socket is too long: " + path);
  }
  std::memcpy(address.sun_path, path.data(), path.size());
  // Not blocking: while the daemon waits for its time, a full backlog would hold us up for ever.
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (socket && ::connect(socket.get(), reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0) {
    return socket;
  }
  const int error = errno;
  if (error == ENOENT || error == ECONNREFUSED) {
    return clientError(ClientErrorCode::notReachable, "The document broker is not running: nobody listens on " + path);
  }
  if (error == EAGAIN) {
    return clientError(ClientErrorCode::notReachable,
                       "The document broker is not taking connections; too many are waiting already at " + path);
  }
  return clientError(ClientErrorCode::notReachable, "The document broker cannot be reached at " + path + ": " +
                                                        std::generic_category().message(error));
}

Result<std::shared_ptr<wire::BusConnection>> connectTo(BusLoop &loop, const std::optional<std::string> &given,
                                                       const std::string &name, BusLoop::Descriptors descriptors,
                                                       const std::function<void(wire::BusConnection &)> &prepare) {
  auto directory = runtimeDirectory(given);
  if (!directory) return directory.error();
  auto socket = connectToSocket(directory.value() + "/" + name);
  if (!socket) return socket.error();
  wire::BusConnection::Options options;
  options.descriptors = descriptors;
  options.peer = name;
  auto added = loop.add(std::move(socket.value()), std::move(options), prepare);
  if (!added) {
    // The loop ends with whoever wanted to connect.
    if (added.error().code() == ESHUTDOWN) return connectionLostError();
    return clientError(ClientErrorCode::notReachable,
                       "The connection to the document broker failed: " + added.error().message());
  }
  return added;
}

Result<std::shared_ptr<wire::BusConnection>> ServiceSocket::connection(const std::optional<std::string> &given) {
  const std::lock_guard lock(mutex_);
  if (connection_ && connection_->isOpen()) return connection_;
  auto connected = connectTo(loop_, given, name_, descriptors_);
  if (connected) connection_ = connected.value();
  return connected;
}

}  // namespace storix::sdk
