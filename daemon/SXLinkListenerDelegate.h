#pragma once

#include <memory>

#include "platform/Connections.h"

namespace storix {

class SXServer;

/// Accepts every client connection and gives it a servicer of its own; what a client may do is
/// decided with each request. The server owns it. Thread-safe once the server is set: it remembers
/// nothing about the connections it has accepted.
class SXLinkListenerDelegate : public ServiceListenerDelegate {
 public:
  [[nodiscard]] std::shared_ptr<SXServer> server() const { return server_.lock(); }
  void setServer(const std::shared_ptr<SXServer> &server) { server_ = server; }

  /// True, always.
  bool listener(ServiceListener &listener, std::shared_ptr<ClientConnection> shouldAcceptNewConnection) override;

 private:
  std::weak_ptr<SXServer> server_;
};

}  // namespace storix
