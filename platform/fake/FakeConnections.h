#pragma once

#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Connections.h"
#include "platform/fake/FakeThreads.h"
#include "platform/fake/FakeTrace.h"

namespace storix::fake {

/// A client process as a test describes it.
struct FakePeer {
  std::int32_t processIdentifier = 100;
  std::optional<std::string> bundleIdentifier;
  Dictionary entitlements;
  /// None: the one that `auditTokenForProcess` gives.
  std::optional<AuditToken> auditToken;
};

/// What became of one request. Thread-safe.
class FakeReply {
 public:
  struct Answer {
    Arguments values;
    /// Where the reply ran (`currentContext`).
    std::string context;
    /// Why the connection let the values not through, or the request not in; then there are none.
    std::optional<std::string> refusal;
  };

  [[nodiscard]] std::vector<Answer> answers() const;
  [[nodiscard]] bool isAnswered() const { return !answers().empty(); }
  /// The first answer. Only where `isAnswered`.
  [[nodiscard]] Answer answer() const { return answers().front(); }
  /// The error at that place of the first answer; none when it is absent or no error.
  [[nodiscard]] std::optional<SXError> error(std::size_t index) const;

 private:
  friend class FakeClientConnection;
  void add(Answer answer);

  mutable std::mutex mutex_;
  std::vector<Answer> answers_;
};

/// The connection of one scripted peer. The test that holds it is the peer: its connection is there
/// until the test closes it or lets go of it. Thread-safe.
class FakeClientConnection : public ClientConnection, public std::enable_shared_from_this<FakeClientConnection> {
 public:
  FakeClientConnection(FakeExecutor &executor, Trace &trace, FakePeer peer);

  // --- The daemon's side
  std::optional<Value> entitlementValue(std::string_view name) override;
  std::int32_t peerProcessIdentifier() override;
  AuditToken peerAuditToken() override;
  void setExportedInterface(LinkInterface interface) override;
  void setExportedObject(std::shared_ptr<ExportedObject> object) override;
  void resume() override;

  // --- The peer's side

  /// Sends a request by its name ("wakeUpCompletion:") or method ("WakeUp"). It is delivered when
  /// the connection is resumed and the requests before it have been, as a callback of the platform's.
  /// What does not fit the protocol's row is refused as on the wire, and so is a reply with a kind
  /// that the interface does not permit.
  std::shared_ptr<FakeReply> call(std::string_view operation, Arguments arguments = {});
  /// A request without a reply handler.
  void callWithoutReply(std::string_view operation, Arguments arguments = {});

  /// The peer goes: the exported object is let go of and what was not delivered yet is dropped.
  void close();

  [[nodiscard]] const FakePeer &peer() const { return peer_; }
  [[nodiscard]] AuditToken auditToken() const;
  [[nodiscard]] bool isOpen() const;
  [[nodiscard]] bool isResumed() const;
  [[nodiscard]] std::optional<LinkInterface> exportedInterface() const;
  [[nodiscard]] std::shared_ptr<ExportedObject> exportedObject() const;

 private:
  struct Request {
    std::string operation;
    Arguments arguments;
    std::shared_ptr<FakeReply> reply;  // null for a request without a handler
  };

  void send(Request request);
  void deliver(const Request &request);
  void answer(const std::shared_ptr<FakeReply> &reply, const LinkInterface &interface,
              const OperationDescription &operation, Arguments values);
  void refuse(const Request &request, std::string why);

  Trace &trace_;
  const FakePeer peer_;
  PlatformLane lane_;

  mutable std::mutex mutex_;
  bool open_ = true;
  bool resumed_ = false;
  std::optional<LinkInterface> interface_;
  std::shared_ptr<ExportedObject> object_;
  std::deque<Request> waiting_;
};

/// The named services and their clients. Thread-safe.
class FakeConnections {
 public:
  FakeConnections(FakeExecutor &executor, Trace &trace);
  ~FakeConnections();

  /// A peer connects to that service: its connection is offered to the listener's delegate as soon as
  /// there is one that was resumed.
  std::shared_ptr<FakeClientConnection> connect(std::string_view serviceName, FakePeer peer);

  /// A connection that no listener was offered, for tests of what is exported on one.
  std::shared_ptr<FakeClientConnection> makeConnection(FakePeer peer);

  /// Closes every connection.
  void closeAll();

  // --- The platform's operations
  std::shared_ptr<ServiceListener> createServiceListener(std::string_view serviceName);
  /// The identifier of the open connection's peer that has this token.
  [[nodiscard]] std::optional<std::string> bundleIdentifierForAuditToken(const AuditToken &token) const;

 private:
  class Listener;
  struct Services;

  std::shared_ptr<Services> services_;
};

}  // namespace storix::fake
