#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/Result.h"
#include "sdk/src/BusLoop.h"
#include "wire/BusConnection.h"

namespace storix::sdk {

/// The directory of the daemon's sockets: the one given, else what the environment says.
Result<std::string> runtimeDirectory(const std::optional<std::string> &given);

/// Connects to the unix socket at that path. The error is `notReachable`.
Result<UniqueFd> connectToSocket(const std::string &path);

/// A new connection to the daemon's socket of that name. `prepare` is for handlers and the like. Errors
/// are of the client's domain.
Result<std::shared_ptr<wire::BusConnection>> connectTo(BusLoop &loop,
                                                       const std::optional<std::string> &runtimeDirectory,
                                                       const std::string &name, BusLoop::Descriptors descriptors,
                                                       const std::function<void(wire::BusConnection &)> &prepare = {});

/// One of the daemon's sockets, connected to when it is first used and again when the connection was
/// lost. Thread-safe.
class ServiceSocket {
 public:
  /// `loop` must outlive it.
  ServiceSocket(BusLoop &loop, std::string name, BusLoop::Descriptors descriptors)
      : loop_(loop), name_(std::move(name)), descriptors_(descriptors) {}

  /// The open connection. Errors are of the client's domain.
  Result<std::shared_ptr<wire::BusConnection>> connection(const std::optional<std::string> &runtimeDirectory);

 private:
  BusLoop &loop_;
  const std::string name_;
  const BusLoop::Descriptors descriptors_;
  std::mutex mutex_;
  std::shared_ptr<wire::BusConnection> connection_;
};

}  // namespace storix::sdk
