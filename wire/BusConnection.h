#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <limits>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/Executor.h"
#include "platform/Extensions.h"
#include "platform/Protocol.h"
#include "platform/Result.h"
#include "wire/SdBus.h"
#include "wire/Signature.h"
#include "wire/UniqueFd.h"

namespace storix::wire {

class Waiter;
struct BusMethod;

/// One peer-to-peer D-Bus connection over a connected socket, either end of it.
///
/// Whoever owns it also drives it: waits until `fd` has one of `wanted().events` or the deadline has
/// passed, calls `process`, and again; `process` is called by one thread at a time. Everything else may
/// be called from any thread. Underneath stands one sd-bus object, which belongs to one thread at a
/// time, its messages included: one mutex guards it, and no handler ever runs while it is held.
///
///  1. Requests are handed to what was exported one at a time, in the order of arrival, inside `process`.
///  2. A reply is written at once by the thread that has it. Where the socket is full the rest waits for
///     EPOLLOUT, and the wanted-changed handler says so to the driver.
///  3. A request gets at most one reply. One that comes after the end is dropped, and a request whose
///     reply handler is destroyed unused stays unanswered.
///  4. With as many requests in flight as the options permit nothing is read until one of them has ended.
///  5. Of each message that is sent away, exactly one handler hears, once: inside `process`, or through
///     `runLater`; never inside the call that took it.
///  6. The closed handler runs once, after the handlers of all messages in flight.
class BusConnection : public std::enable_shared_from_this<BusConnection> {
 public:
  enum class Side { server, client };
  enum class Descriptors { refused, passed };

  struct Options {
    Side side = Side::client;
    /// Whether messages of this connection may carry file descriptors.
    Descriptors descriptors = Descriptors::refused;
    /// Who the peer is, for log lines: "pid 4711".
    std::string peer;
    /// Requests of the peer that may be in flight before nothing more is read.
    std::size_t requestsInFlightAtMost = 256;
    /// Messages to the peer that may wait for the login, for the socket or for their answers. A further one
    /// fails at once. Each 4 KiB of text in a message count as one more.
    std::size_t messagesWaitingAtMost = std::numeric_limits<std::size_t>::max();
    /// Runs a task soon, not inside this call: `ThreadPool::execute`, or the driving thread's own list.
    std::function<void(Task)> runLater;
  };

  using ClosedHandler = std::function<void(const SXError &)>;

  struct Request;

  /// Answers one request of an interface that is described by hand: at most once, on any thread.
  /// Copies answer the same request.
  class Reply {
   public:
    void send(MethodValues values) const;
    void fail(std::string_view errorName, std::string_view text) const;

   private:
    friend class BusConnection;
    explicit Reply(std::shared_ptr<Request> request) : request_(std::move(request)) {}
    std::shared_ptr<Request> request_;
  };
  using MethodHandler = std::function<void(MethodValues, Reply)>;

  /// Starts the login, which `process` goes on with. An error when it fails at once: the peer is gone,
  /// or what it sent already is no login. That is logged then, and the socket closed.
  static Result<std::shared_ptr<BusConnection>> open(UniqueFd socket, Options options);
  ~BusConnection();
  BusConnection(const BusConnection &) = delete;
  BusConnection &operator=(const BusConnection &) = delete;

  // --- Before the first `process`

  /// The object stands at the path that the protocol names, and is let go of when the connection ends.
  void exportObject(LinkInterface interface, std::shared_ptr<ExportedObject> object);
  /// One handler for each method of the interface, in its order.
  void exportMethods(const InterfaceDescription &interface, std::vector<MethodHandler> handlers);
  /// Runs once, when the login has succeeded.
  void setReadyHandler(std::function<void()> handler);
  void setClosedHandler(ClosedHandler handler);

  // --- Messages to the peer; they may be sent before the login has ended

  /// The object of that protocol at the other end. The error handler (it may be empty) hears of each
  /// message that could not be delivered, was answered by a D-Bus error or by something that does not
  /// fit the protocol, or whose answer the connection did not live to see. There is no time-out.
  std::shared_ptr<RemoteObject> remoteObject(LinkInterface interface, ConnectionErrorHandler errorHandler);

  /// Calls a method of an interface that is described by hand. A connection that ends is the failure
  /// "org.freedesktop.DBus.Error.Disconnected". An empty handler asks for no reply.
  void call(const InterfaceDescription &interface, std::size_t method, MethodValues values,
            MethodResultHandler handler);

  /// Ends the connection, if it has not ended: the peer sees it closed, and nothing more comes or goes.
  void close();
  [[nodiscard]] bool isOpen() const;

  // --- The driver

  struct Wanted {
    short events = 0;  ///< POLLIN and POLLOUT, whose values are those of EPOLLIN and EPOLLOUT.
    std::optional<std::chrono::steady_clock::time_point> deadline;
  };

  /// Stays the same number until `releaseSocket`.
  [[nodiscard]] int fd() const { return fd_; }
  [[nodiscard]] Wanted wanted();
  /// Runs on any thread, after `wanted` may have changed outside `process`.
  void setWantedChangedHandler(std::function<void()> handler);
  void process();
  /// Closes the descriptor of a connection that has ended, once nobody waits for it any more.
  void releaseSocket();

 private:
  struct State;
  struct Remains;
  struct Remote;
  using Lock = std::unique_lock<std::mutex>;

  explicit BusConnection(std::unique_ptr<State> state, int fd);

  using Append = std::function<std::optional<MethodFailure>(sd_bus_message *message)>;
  void sendCall(const InterfaceDescription &interface, std::size_t method, const Append &append,
                std::unique_ptr<Waiter> waiter, bool expectsReply);

  // These take the state's lock held and give it back held; handlers run between, without it.
  bool step(Lock &lock);
  void loggedIn(Lock &lock);
  void dispatch(Lock &lock, OwnedMessage message);
  void dispatchRequest(Lock &lock, OwnedMessage message);
  void refuse(OwnedMessage message, const MethodFailure &failure) const;
  void handOver(Lock &lock, OwnedMessage message, BusMethod method, std::variant<Arguments, MethodValues> content);
  void dispatchReply(Lock &lock, OwnedMessage message);
  void end(Lock &lock, const SXError &reason, bool later);

  std::unique_ptr<State> state_;
  const int fd_;
};

}  // namespace storix::wire
