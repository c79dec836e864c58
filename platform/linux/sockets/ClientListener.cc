#include "platform/linux/sockets/ClientListener.h"

#include <utility>

#include "platform/Log.h"

namespace storix::linuxhost {

namespace {

/// What the logic sees of a connection.
class AcceptedClient : public ClientConnection, public std::enable_shared_from_this<AcceptedClient> {
 public:
  explicit AcceptedClient(std::shared_ptr<ServedConnection> served) : served_(std::move(served)) {}

  std::optional<Value> entitlementValue(std::string_view name) override { return served_->peer()->entitlement(name); }
  std::int32_t peerProcessIdentifier() override { return served_->peer()->processIdentifier(); }
  AuditToken peerAuditToken() override { return served_->peer()->auditToken(); }

  void setExportedInterface(LinkInterface interface) override {
    const std::lock_guard lock(mutex_);
    interface_ = std::move(interface);
  }
  void setExportedObject(std::shared_ptr<ExportedObject> object) override {
    const std::lock_guard lock(mutex_);
    object_ = std::move(object);
  }

  void resume() override;

 private:
  /// The exported object together with this connection, which the connection below lets go of at its
  /// end: so both live exactly as long as it.
  class Export : public ExportedObject {
   public:
    Export(std::shared_ptr<AcceptedClient> connection, std::shared_ptr<ExportedObject> object)
        : connection_(std::move(connection)), object_(std::move(object)) {}
    void invoke(std::size_t operation, Arguments arguments, ReplyHandler reply) override {
      object_->invoke(operation, std::move(arguments), std::move(reply));
    }

   private:
    const std::shared_ptr<AcceptedClient> connection_;
    const std::shared_ptr<ExportedObject> object_;
  };

  const std::shared_ptr<ServedConnection> served_;
  std::mutex mutex_;
  std::optional<LinkInterface> interface_;
  std::shared_ptr<ExportedObject> object_;
};

void AcceptedClient::resume() {
  std::optional<LinkInterface> interface;
  std::shared_ptr<ExportedObject> object;
  {
    const std::lock_guard lock(mutex_);
    interface = std::exchange(interface_, std::nullopt);
    object = std::exchange(object_, nullptr);
  }
  if (!interface || !object) return;
  served_->bus().exportObject(std::move(*interface), std::make_shared<Export>(shared_from_this(), std::move(object)));
  served_->start();
}

}  // namespace

void ClientListener::setDelegate(std::weak_ptr<ServiceListenerDelegate> delegate) {
  const std::lock_guard lock(mutex_);
  delegate_ = std::move(delegate);
}

void ClientListener::resume() {
  {
    const std::lock_guard lock(mutex_);
    if (std::exchange(resumed_, true)) return;
  }
  socket_.serve([weak = weak_from_this()](const std::shared_ptr<ServedConnection> &connection) {
    if (const auto self = weak.lock()) self->offer(connection);
  });
}

void ClientListener::offer(const std::shared_ptr<ServedConnection> &connection) {
  std::shared_ptr<ServiceListenerDelegate> delegate;
  {
    const std::lock_guard lock(mutex_);
    delegate = delegate_.lock();
  }
  const bool isKept = delegate && delegate->listener(*this, std::make_shared<AcceptedClient>(connection));
  if (!isKept && connection->isStarted()) connection->end();
}

}  // namespace storix::linuxhost
