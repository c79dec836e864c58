#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Result.h"
#include "platform/linux/RuntimeDirectory.h"
#include "platform/linux/sockets/ServedConnection.h"

namespace storix::linuxhost {

/// A listening unix socket of the runtime directory and its connections. It exists from the beginning,
/// and until `serve` whoever connects waits. Owned by the platform object; thread-safe.
///
/// A peer of another user is dropped before a byte is read. At the limit of connections, and when the
/// system has no descriptors left, those who come wait until there is room again. A connection whose login
/// is not over in time is ended, so that it does not keep its place.
class NamedSocket {
 public:
  using Accepted = std::function<void(const std::shared_ptr<ServedConnection> &)>;

  /// Takes the socket of that name out of `activated`, or makes it in the directory. One that a dead
  /// daemon has left is replaced, since whoever holds the directory is the only one alive. The
  /// directory must outlive the socket. The error says what to do.
  static Result<std::unique_ptr<NamedSocket>> open(const ServingContext &context, const RuntimeDirectory &directory,
                                                   ActivatedSockets &activated, std::string name,
                                                   wire::BusConnection::Descriptors descriptors);

  /// Ends all connections, and takes the socket away if it was made here.
  ~NamedSocket();
  NamedSocket(const NamedSocket &) = delete;
  NamedSocket &operator=(const NamedSocket &) = delete;

  /// Begins to accept, once. `accepted` gets each admitted connection, on a thread of the loop, and
  /// starts it; one that it does not start is dropped.
  void serve(Accepted accepted);

  [[nodiscard]] const std::string &name() const;

 private:
  struct State;
  explicit NamedSocket(std::shared_ptr<State> state) : state_(std::move(state)) {}

  std::shared_ptr<State> state_;
};

}  // namespace storix::linuxhost
