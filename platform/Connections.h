#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/AuditToken.h"
#include "platform/Protocol.h"

namespace storix {

/// One accepted connection from a client process. Thread-safe.
///
/// The connection owns its exported object; it ends when the peer goes, and then lets go of it.
class ClientConnection {
 public:
  virtual ~ClientConnection() = default;

  /// The value of that entitlement of the peer, of any kind, or absent.
  virtual std::optional<Value> entitlementValue(std::string_view name) = 0;
  virtual std::int32_t peerProcessIdentifier() = 0;
  virtual AuditToken peerAuditToken() = 0;

  /// Both are set before `resume`.
  virtual void setExportedInterface(LinkInterface interface) = 0;
  virtual void setExportedObject(std::shared_ptr<ExportedObject> object) = 0;

  /// Starts the delivery of requests to the exported object, on the connection's own context: one at
  /// a time per connection, in the order of arrival; different connections side by side.
  virtual void resume() = 0;
};

class ServiceListener;

class ServiceListenerDelegate {
 public:
  virtual ~ServiceListenerDelegate() = default;
  /// Asked for each new connection, possibly for several at once; the connection is kept only when
  /// the answer is true.
  virtual bool listener(ServiceListener &listener, std::shared_ptr<ClientConnection> shouldAcceptNewConnection) = 0;
};

/// Listener on a named inter-process service. Made suspended: until `resume` connections wait.
class ServiceListener {
 public:
  virtual ~ServiceListener() = default;
  /// The listener does not own its delegate. Connections that come when it is gone are dropped.
  virtual void setDelegate(std::weak_ptr<ServiceListenerDelegate> delegate) = 0;
  virtual void resume() = 0;
};

}  // namespace storix
