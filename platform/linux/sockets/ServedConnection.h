#pragma once

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>

#include "platform/Executor.h"
#include "platform/Result.h"
#include "platform/linux/identity/Peers.h"
#include "platform/linux/sockets/ConnectionLimit.h"
#include "platform/linux/sockets/IoLoop.h"
#include "wire/BusConnection.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

/// What connections are served with. All of it outlives them.
struct ServingContext {
  Executor &executor;
  IoLoop &loop;
  PeerTable &peers;
  ConnectionLimit &limit;
};

/// One admitted connection of a peer, the daemon's end of it. The loop serves it from `start` on; it is
/// over when the peer goes, when it breaks the protocol, or with `end`. Thread-safe.
///
/// Whoever has accepted it may export objects and handlers that own it: they are let go of at its end.
class ServedConnection : public std::enable_shared_from_this<ServedConnection> {
 public:
  using Ended = std::function<void(const std::shared_ptr<ServedConnection> &)>;

  /// An error when the login fails at once.
  static Result<std::shared_ptr<ServedConnection>> open(const ServingContext &context, UniqueFd socket,
                                                        std::shared_ptr<Peer> peer,
                                                        wire::BusConnection::Descriptors descriptors,
                                                        ConnectionLimit::Place place);
  ~ServedConnection();

  [[nodiscard]] wire::BusConnection &bus() const { return *bus_; }
  [[nodiscard]] const std::shared_ptr<Peer> &peer() const { return peer_; }

  /// Before `start`: runs once, when all is over.
  void setEnded(Ended ended) { ended_ = std::move(ended); }
  /// Once.
  void start();
  [[nodiscard]] bool isStarted() const;
  [[nodiscard]] bool isLoggedIn() const { return loggedIn_; }

  /// Ends it. When this returns no handler of it runs any more; so it is not for those handlers, which
  /// close `bus()` instead.
  void end();

 private:
  ServedConnection(const ServingContext &context, std::shared_ptr<Peer> peer, ConnectionLimit::Place place,
                   std::shared_ptr<wire::BusConnection> bus);
  void serve();
  void follow();
  [[nodiscard]] bool finish();

  const ServingContext context_;
  const std::shared_ptr<Peer> peer_;
  // The place is free when the socket is closed, so it goes last.
  const ConnectionLimit::Place place_;
  const std::shared_ptr<wire::BusConnection> bus_;
  Ended ended_;
  std::atomic<bool> loggedIn_ = false;

  mutable std::mutex mutex_;
  bool started_ = false;
  std::unique_ptr<IoLoop::Watch> watch_;
  bool finishing_ = false;
  bool over_ = false;
  std::condition_variable isOver_;
};

}  // namespace storix::linuxhost
