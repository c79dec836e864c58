#pragma once

#include <functional>
#include <memory>

#include "access/SXAccessControlStore.h"
#include "daemon/SXLinkListenerDelegate.h"
#include "platform/Connections.h"
#include "service/SXLinkServicer.h"

namespace storix {

/// The daemon's one server: brings the named service up and decides when providers may be looked for.
/// `main` owns it. Its fields are written during start-up, on the main thread, and only read after.
class SXServer : public AccessControlSource, public std::enable_shared_from_this<SXServer> {
 public:
  /// Opens the service "com.tessel.Storix". Where the device may be read, providers are looked for
  /// at once, and clients are served when that has brought the registry up; the handler then runs on
  /// the registry's thread. Otherwise clients are served at once, the handler goes to the global
  /// queue, and the first unlock starts the search. The handler may be empty. Called once.
  void startCompletion(std::function<void()> handler);

  [[nodiscard]] std::shared_ptr<SXAccessControlStore> accessControlStore() const override {
    return accessControlStore_.lock();
  }
  void setAccessControlStore(const std::shared_ptr<SXAccessControlStore> &store) { accessControlStore_ = store; }
  [[nodiscard]] const std::shared_ptr<ServiceListener> &listener() const { return listener_; }
  void setListener(std::shared_ptr<ServiceListener> listener) { listener_ = std::move(listener); }
  [[nodiscard]] const std::shared_ptr<SXLinkListenerDelegate> &listenerDelegate() const { return listenerDelegate_; }
  void setListenerDelegate(std::shared_ptr<SXLinkListenerDelegate> delegate) {
    listenerDelegate_ = std::move(delegate);
  }

 private:
  std::weak_ptr<SXAccessControlStore> accessControlStore_;
  std::shared_ptr<ServiceListener> listener_;
  // The listener holds it weakly.
  std::shared_ptr<SXLinkListenerDelegate> listenerDelegate_;
};

}  // namespace storix
