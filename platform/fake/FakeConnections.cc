#include "platform/fake/FakeConnections.h"

#include <algorithm>
#include <utility>

#include "platform/Log.h"

namespace storix::fake {
namespace {

std::string nameOf(const FakePeer &peer) { return "peer " + std::to_string(peer.processIdentifier); }

/// The interface's protocol and what was declared on it.
std::string traced(const LinkInterface &interface) {
  std::string text(interface.protocol().name);
  for (const OperationDescription &operation : interface.protocol().operations) {
    for (std::size_t i = 0; i < operation.replies.size(); ++i) {
      const std::set<ValueKind> *kinds = interface.permittedKinds(operation.name, i, true);
      if (!kinds) continue;
      text += " reply " + std::to_string(i) + " of " + std::string(operation.name) + " permits";
      for (ValueKind kind : *kinds) text += " " + std::string(valueKindName(kind));
    }
  }
  return text;
}

/// Why values do not fit a row of a protocol; none when they do.
std::optional<std::string> whyUnfit(const Arguments &values, const std::vector<ArgumentDescription> &row) {
  if (values.size() > row.size()) return "more values than the operation has";
  for (std::size_t i = 0; i < values.size(); ++i) {
    if (!values[i] || values[i]->kind() == row[i].kind) continue;
    return std::string(row[i].name) + " takes a " + std::string(valueKindName(row[i].kind)) + ", not a " +
           std::string(valueKindName(values[i]->kind()));
  }
  return std::nullopt;
}

}  // namespace

std::vector<FakeReply::Answer> FakeReply::answers() const {
  const std::lock_guard lock(mutex_);
  return answers_;
}

std::optional<SXError> FakeReply::error(std::size_t index) const {
  const std::vector<Answer> all = answers();
  if (all.empty() || index >= all.front().values.size() || !all.front().values[index]) return std::nullopt;
  const SXError *error = all.front().values[index]->error();
  return error ? std::optional(*error) : std::nullopt;
}

void FakeReply::add(Answer answer) {
  const std::lock_guard lock(mutex_);
  answers_.push_back(std::move(answer));
}

FakeClientConnection::FakeClientConnection(FakeExecutor &executor, Trace &trace, FakePeer peer)
    : trace_(trace), peer_(std::move(peer)), lane_(executor) {}

std::optional<Value> FakeClientConnection::entitlementValue(std::string_view name) {
  trace_.add("entitlementValue " + nameOf(peer_) + " " + std::string(name));
  const auto found = peer_.entitlements.find(name);
  return found == peer_.entitlements.end() ? std::nullopt : std::optional(found->second);
}

std::int32_t FakeClientConnection::peerProcessIdentifier() {
  trace_.add("peerProcessIdentifier " + nameOf(peer_));
  return peer_.processIdentifier;
}

AuditToken FakeClientConnection::peerAuditToken() {
  trace_.add("peerAuditToken " + nameOf(peer_));
  return auditToken();
}

AuditToken FakeClientConnection::auditToken() const {
  return peer_.auditToken.value_or(auditTokenForProcess(peer_.processIdentifier));
}

void FakeClientConnection::setExportedInterface(LinkInterface interface) {
  trace_.add("connection " + nameOf(peer_) + " exports interface " + traced(interface));
  const std::lock_guard lock(mutex_);
  interface_ = std::move(interface);
}

void FakeClientConnection::setExportedObject(std::shared_ptr<ExportedObject> object) {
  trace_.add("connection " + nameOf(peer_) + " exports " + (object ? "an object" : "no object"));
  const std::lock_guard lock(mutex_);
  object_.swap(object);
}

void FakeClientConnection::resume() {
  trace_.add("connection " + nameOf(peer_) + " resume");
  std::deque<Request> waiting;
  {
    const std::lock_guard lock(mutex_);
    resumed_ = true;
    waiting.swap(waiting_);
  }
  for (Request &request : waiting) send(std::move(request));
}

std::shared_ptr<FakeReply> FakeClientConnection::call(std::string_view operation, Arguments arguments) {
  auto reply = std::make_shared<FakeReply>();
  send({std::string(operation), std::move(arguments), reply});
  return reply;
}

void FakeClientConnection::callWithoutReply(std::string_view operation, Arguments arguments) {
  send({std::string(operation), std::move(arguments), nullptr});
}

void FakeClientConnection::send(Request request) {
  const std::lock_guard lock(mutex_);
  if (!open_) return;
  if (!resumed_) {
    waiting_.push_back(std::move(request));
    return;
  }
  lane_.submit([weakSelf = weak_from_this(), request = std::move(request)] {
    if (const std::shared_ptr<FakeClientConnection> self = weakSelf.lock()) self->deliver(request);
  });
}

void FakeClientConnection::deliver(const Request &request) {
  std::optional<LinkInterface> interface;
  std::shared_ptr<ExportedObject> object;
  {
    const std::lock_guard lock(mutex_);
    if (!open_) return;
    interface = interface_;
    object = object_;
  }
  const OperationDescription *operation = interface ? interface->protocol().operationNamed(request.operation) : nullptr;
  if (!operation || !object) {
    refuse(request, "nothing here answers it");
    return;
  }
  if (std::optional<std::string> why = whyUnfit(request.arguments, operation->arguments)) {
    refuse(request, *std::move(why));
    return;
  }
  trace_.add((request.reply ? "request " : "request without reply ") + nameOf(peer_) + " " +
             std::string(operation->name) + " " + fake::traced(request.arguments));
  ReplyHandler reply;
  if (request.reply) {
    // A reply that is still on its way does not keep the connection.
    reply = [weakSelf = weak_from_this(), record = request.reply, interface = *interface, operation](Arguments values) {
      const std::shared_ptr<FakeClientConnection> self = weakSelf.lock();
      if (self && self->isOpen()) self->answer(record, interface, *operation, std::move(values));
    };
  }
  Arguments arguments = request.arguments;
  arguments.resize(operation->arguments.size());
  const auto index = static_cast<std::size_t>(operation - interface->protocol().operations.data());
  object->invoke(index, std::move(arguments), std::move(reply));
}

void FakeClientConnection::answer(const std::shared_ptr<FakeReply> &reply, const LinkInterface &interface,
                                  const OperationDescription &operation, Arguments values) {
  std::optional<std::string> refusal = whyUnfit(values, operation.replies);
  for (std::size_t i = 0; i < values.size() && !refusal; ++i) {
    const std::set<ValueKind> *kinds = interface.permittedKinds(operation.name, i, true);
    if (kinds && values[i] && !holdsOnlyKinds(*values[i], *kinds)) {
      refusal = std::string(operation.replies[i].name) + " holds a kind of value that the reply does not permit";
    }
  }
  const std::string context = currentContext();
  trace_.add((refusal ? "reply refused " : "reply ") + nameOf(peer_) + " " + std::string(operation.name) + " " +
             fake::traced(values) + " on " + context);
  if (refusal) values.clear();
  reply->add({std::move(values), context, std::move(refusal)});
}

void FakeClientConnection::refuse(const Request &request, std::string why) {
  trace_.add("request refused " + nameOf(peer_) + " " + escapedForLog(request.operation) + ": " + why);
  if (request.reply) request.reply->add({{}, currentContext(), std::move(why)});
}

void FakeClientConnection::close() {
  std::shared_ptr<ExportedObject> dropped;
  std::deque<Request> waiting;
  const std::lock_guard lock(mutex_);
  if (!std::exchange(open_, false)) return;
  trace_.add("connection " + nameOf(peer_) + " closed");
  dropped.swap(object_);
  waiting.swap(waiting_);
}

bool FakeClientConnection::isOpen() const {
  const std::lock_guard lock(mutex_);
  return open_;
}

bool FakeClientConnection::isResumed() const {
  const std::lock_guard lock(mutex_);
  return resumed_;
}

std::optional<LinkInterface> FakeClientConnection::exportedInterface() const {
  const std::lock_guard lock(mutex_);
  return interface_;
}

std::shared_ptr<ExportedObject> FakeClientConnection::exportedObject() const {
  const std::lock_guard lock(mutex_);
  return object_;
}

struct FakeConnections::Services {
  Services(FakeExecutor &e, Trace &t) : executor(e), trace(t) {}

  /// Offers what waits for that service, if a listener was resumed for it.
  void offerWaiting(const std::string &serviceName);

  FakeExecutor &executor;
  Trace &trace;
  std::mutex mutex;
  std::map<std::string, std::weak_ptr<Listener>, std::less<>> listeners;
  std::map<std::string, std::deque<std::weak_ptr<FakeClientConnection>>, std::less<>> waiting;
  std::vector<std::weak_ptr<FakeClientConnection>> connections;
};

class FakeConnections::Listener : public ServiceListener, public std::enable_shared_from_this<Listener> {
 public:
  Listener(std::string serviceName, std::weak_ptr<Services> services, Trace &trace)
      : serviceName_(std::move(serviceName)), services_(std::move(services)), trace_(trace) {}

  void setDelegate(std::weak_ptr<ServiceListenerDelegate> delegate) override {
    trace_.add("listener " + serviceName_ + " set delegate");
    const std::lock_guard lock(mutex_);
    delegate_ = std::move(delegate);
  }

  void resume() override {
    trace_.add("listener " + serviceName_ + " resume");
    {
      const std::lock_guard lock(mutex_);
      resumed_ = true;
    }
    if (const std::shared_ptr<Services> services = services_.lock()) services->offerWaiting(serviceName_);
  }

  bool isResumed() const {
    const std::lock_guard lock(mutex_);
    return resumed_;
  }

  void offer(const std::shared_ptr<FakeClientConnection> &connection) {
    std::shared_ptr<ServiceListenerDelegate> delegate;
    {
      const std::lock_guard lock(mutex_);
      delegate = delegate_.lock();
    }
    if (!delegate || !delegate->listener(*this, connection)) connection->close();
  }

 private:
  const std::string serviceName_;
  const std::weak_ptr<Services> services_;
  Trace &trace_;
  mutable std::mutex mutex_;
  std::weak_ptr<ServiceListenerDelegate> delegate_;
  bool resumed_ = false;
};

void FakeConnections::Services::offerWaiting(const std::string &serviceName) {
  std::deque<std::weak_ptr<FakeClientConnection>> offered;
  std::shared_ptr<Listener> listener;
  {
    const std::lock_guard lock(mutex);
    listener = listeners[serviceName].lock();
    if (!listener || !listener->isResumed()) return;
    offered.swap(waiting[serviceName]);
  }
  for (const std::weak_ptr<FakeClientConnection> &weakConnection : offered) {
    executor.runOnPlatformThread([listener, weakConnection] {
      if (const std::shared_ptr<FakeClientConnection> connection = weakConnection.lock()) listener->offer(connection);
    });
  }
}

FakeConnections::FakeConnections(FakeExecutor &executor, Trace &trace)
    : services_(std::make_shared<Services>(executor, trace)) {}

FakeConnections::~FakeConnections() = default;

std::shared_ptr<FakeClientConnection> FakeConnections::makeConnection(FakePeer peer) {
  auto connection = std::make_shared<FakeClientConnection>(services_->executor, services_->trace, std::move(peer));
  const std::lock_guard lock(services_->mutex);
  services_->connections.push_back(connection);
  return connection;
}

std::shared_ptr<FakeClientConnection> FakeConnections::connect(std::string_view serviceName, FakePeer peer) {
  std::shared_ptr<FakeClientConnection> connection = makeConnection(std::move(peer));
  services_->trace.add("connect " + nameOf(connection->peer()) + " to " + std::string(serviceName));
  {
    const std::lock_guard lock(services_->mutex);
    services_->waiting[std::string(serviceName)].push_back(connection);
  }
  services_->offerWaiting(std::string(serviceName));
  return connection;
}

void FakeConnections::closeAll() {
  std::vector<std::weak_ptr<FakeClientConnection>> closing;
  {
    const std::lock_guard lock(services_->mutex);
    closing.swap(services_->connections);
  }
  for (const std::weak_ptr<FakeClientConnection> &weakConnection : closing) {
    if (const std::shared_ptr<FakeClientConnection> connection = weakConnection.lock()) connection->close();
  }
}

std::shared_ptr<ServiceListener> FakeConnections::createServiceListener(std::string_view serviceName) {
  services_->trace.add("createServiceListener " + std::string(serviceName));
  auto listener = std::make_shared<Listener>(std::string(serviceName), services_, services_->trace);
  const std::lock_guard lock(services_->mutex);
  services_->listeners[std::string(serviceName)] = listener;
  return listener;
}

std::optional<std::string> FakeConnections::bundleIdentifierForAuditToken(const AuditToken &token) const {
  services_->trace.add("bundleIdentifierForAuditToken " + fake::traced(token));
  const std::lock_guard lock(services_->mutex);
  for (const std::weak_ptr<FakeClientConnection> &weakConnection : services_->connections) {
    const std::shared_ptr<FakeClientConnection> connection = weakConnection.lock();
    if (connection && connection->isOpen() && connection->auditToken() == token) {
      return connection->peer().bundleIdentifier;
    }
  }
  return std::nullopt;
}

}  // namespace storix::fake
