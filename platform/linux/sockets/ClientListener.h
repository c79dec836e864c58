#pragma once

#include <memory>
#include <mutex>

#include "platform/Connections.h"
#include "platform/linux/sockets/NamedSockets.h"

namespace storix::linuxhost {

/// The listener of a service that the logic serves: offers each connection of the socket to the
/// delegate. Suspended until `resume`. Thread-safe; a connection that was resumed lives on without it.
class ClientListener : public ServiceListener, public std::enable_shared_from_this<ClientListener> {
 public:
  /// `socket` must outlive the listener.
  explicit ClientListener(NamedSocket &socket) : socket_(socket) {}

  void setDelegate(std::weak_ptr<ServiceListenerDelegate> delegate) override;
  /// A second call does nothing.
  void resume() override;

 private:
  void offer(const std::shared_ptr<ServedConnection> &connection);

  NamedSocket &socket_;
  std::mutex mutex_;
  std::weak_ptr<ServiceListenerDelegate> delegate_;
  bool resumed_ = false;
};

}  // namespace storix::linuxhost
