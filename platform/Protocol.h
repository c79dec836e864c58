#pragma once

#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <tuple>
#include <utility>
#include <vector>

#include "platform/Value.h"

namespace storix {

/// One argument of an operation, or of its reply: what it is called and which kind of value it is.
/// Every argument may be absent.
struct ArgumentDescription {
  std::string_view name;
  ValueKind kind;
};

/// One row of a protocol: the operation's own name ("wakeUpCompletion:"), the name of the method
/// that carries it on the wire ("WakeUp"), and what it takes and answers, in order.
struct OperationDescription {
  std::string_view name;
  std::string_view method;
  std::vector<ArgumentDescription> arguments;
  std::vector<ArgumentDescription> replies;
};

/// A protocol that crosses a process border, as a table: the single source of wire signatures,
/// introspection and checks. Descriptions live as long as the process.
struct ProtocolDescription {
  std::string_view name;           ///< "SXDaemon"
  std::string_view interfaceName;  ///< "com.tessel.Storix.Daemon"
  std::string_view objectPath;     ///< "/com/tessel/Storix"
  std::vector<OperationDescription> operations;

  /// The row with that name (or method), or null.
  [[nodiscard]] const OperationDescription *operationNamed(std::string_view name) const;
};

/// Whether everything inside the list or dictionary, at any depth, is of one of those kinds. True for
/// a value that holds no others.
[[nodiscard]] bool holdsOnlyKinds(const Value &value, const std::set<ValueKind> &kinds);

/// A protocol plus what was declared on it for one connection.
class LinkInterface {
 public:
  /// `protocol` must outlive the interface.
  explicit LinkInterface(const ProtocolDescription &protocol) : protocol_(&protocol) {}

  [[nodiscard]] const ProtocolDescription &protocol() const { return *protocol_; }

  /// Declares which kinds of value may stand inside a dictionary argument, at any depth. With
  /// `ofReply` it speaks of the reply's argument of that index, else of the operation's own.
  void setPermittedKinds(std::set<ValueKind> kinds, std::string_view operationName, std::size_t argumentIndex,
                         bool ofReply);

  /// The declared kinds, or null where nothing was declared.
  [[nodiscard]] const std::set<ValueKind> *permittedKinds(std::string_view operationName, std::size_t argumentIndex,
                                                          bool ofReply) const;

 private:
  const ProtocolDescription *protocol_;
  std::map<std::tuple<std::string, std::size_t, bool>, std::set<ValueKind>> permittedKinds_;
};

/// Takes the answer of an operation. Empty where nobody waits for one.
using ReplyHandler = std::function<void(Arguments)>;

/// What a connection exports: receives operations by their index in the protocol, with arguments
/// that fit the protocol's row. May be called from several threads at once.
class ExportedObject {
 public:
  virtual ~ExportedObject() = default;
  /// `reply` may be called on any thread, later or at once; where the operation stays unanswered,
  /// never.
  virtual void invoke(std::size_t operation, Arguments arguments, ReplyHandler reply) = 0;
};

/// What a connection gives for the object at its other end. Thread-safe.
class RemoteObject {
 public:
  virtual ~RemoteObject() = default;
  /// Sends one operation. `reply` runs on a thread of the platform's choosing; when the message
  /// cannot be delivered, or the connection fails before the reply, the error handler that was given
  /// for this object runs instead.
  virtual void send(std::size_t operation, Arguments arguments, ReplyHandler reply) = 0;
};

}  // namespace storix
