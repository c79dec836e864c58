#pragma once

#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <variant>

#include "sdk/src/BusLoop.h"
#include "sdk/src/Claims.h"
#include "sdk/src/ClientErrors.h"
#include "sdk/src/Pending.h"
#include "sdk/src/RequestThread.h"
#include "sdk/src/ServiceSocket.h"
#include "service/SXDaemon.h"
#include "storix/Client.h"

namespace storix {

/// What a client's requests have in common. Owned by the client, and by requests on their way.
class Client::Implementation : public std::enable_shared_from_this<Client::Implementation> {
 public:
  using Time = sdk::BusLoop::Clock::time_point;

  explicit Implementation(ClientOptions options)
      : options_(std::move(options)),
        thread_(sdk::RequestThread::start()),
        daemon_(thread_->loop(), "com.tessel.Storix", sdk::BusLoop::Descriptors::refused),
        platform_(thread_->loop(), "com.tessel.Platform", sdk::BusLoop::Descriptors::passed),
        claims_(std::make_shared<sdk::Claims>(thread_, options_)) {}

  [[nodiscard]] sdk::RequestThread &thread() const { return *thread_; }

  [[nodiscard]] Time deadline() const { return sdk::BusLoop::Clock::now() + options_.timeout; }

  /// Sends one request of the daemon's protocol. `send` gives the proxy's operation a handler that
  /// finishes the pending request.
  template <class Answer>
  void request(std::function<void(Answer)> handler, Time deadline,
               const std::function<void(SXDaemon &, sdk::PendingPointer<Answer>)> &send) {
    const auto pending = thread_->begin(std::move(handler), deadline);
    auto connection = daemon_.connection(options_.runtimeDirectory);
    if (!connection) return thread_->failLater(pending, connection.error());
    SXDaemonProxy proxy(connection.value()->remoteObject(
        LinkInterface(SXDaemonProtocol().description()),
        [pending](const SXError &error) { pending->finish(sdk::clientErrorOf(error)); }));
    send(proxy, pending);
  }

  /// The same for an operation that answers an error alone.
  void requestOutcome(OutcomeHandler handler, const std::function<void(SXDaemon &, SXDaemon::ErrorReply)> &send) {
    request<Outcome>(std::move(handler), deadline(), [&send](SXDaemon &daemon, sdk::PendingPointer<Outcome> pending) {
      send(daemon, [pending = std::move(pending)](Outcome error) { pending->finish(std::move(error)); });
    });
  }

  /// Calls a method of the platform socket. `convert` makes the answer of the values that came back.
  template <class Answer>
  void callPlatform(const wire::InterfaceDescription &interface, std::size_t method, wire::MethodValues values,
                    Time deadline, std::function<void(Answer)> handler,
                    std::function<Answer(wire::MethodValues &)> convert) {
    const auto pending = thread_->begin(std::move(handler), deadline);
    auto connection = platform_.connection(options_.runtimeDirectory);
    if (!connection) return thread_->failLater(pending, connection.error());
    connection.value()->call(interface, method, std::move(values),
                             [pending, convert = std::move(convert)](wire::MethodResult result) {
                               if (const auto *failure = std::get_if<wire::MethodFailure>(&result)) {
                                 pending->finish(sdk::clientErrorOf(*failure));
                               } else {
                                 pending->finish(convert(std::get<wire::MethodValues>(result)));
                               }
                             });
  }

  void proveWriteAccess(UniqueFd descriptor, Time deadline, OutcomeHandler handler);
  void extendBookmark(const URL &document, const std::string &consumerID, Time deadline, Handler<std::string> handler);
  void resolveBookmark(const std::string &bookmarkableString, Time deadline, Handler<GrantedDocument> handler);
  void open(const Data &token, Time deadline, Handler<UniqueFd> handler);
  void openDocument(const std::string &bookmarkableString, sdk::Claim::Kind kind, ClaimOptions options,
                    Handler<OpenedDocument> handler);

 private:
  class Opening;

  const ClientOptions options_;
  const std::shared_ptr<sdk::RequestThread> thread_;
  sdk::ServiceSocket daemon_;
  sdk::ServiceSocket platform_;
  const std::shared_ptr<sdk::Claims> claims_;
};

}  // namespace storix
