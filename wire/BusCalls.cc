// What a connection sends to its peer, and who waits for the answers.
#include <cerrno>
#include <utility>

#include "platform/Log.h"
#include "wire/BusConnectionState.h"

namespace storix::wire {

namespace {

/// So much text costs no more than the message itself.
constexpr std::size_t textPerPlace = 4096;

std::size_t textSize(const Value &value) {
  if (const std::string *text = value.string()) return text->size();
  if (const URL *url = value.url()) return url->absoluteString().size();
  if (const Data *data = value.data()) return data->bytes.size();
  return 0;
}

/// The places that a message with these arguments takes while it waits: whoever waits for its answer most
/// often keeps copies of them.
std::size_t placesFor(const Arguments &arguments) {
  std::size_t size = 0;
  for (const Argument &argument : arguments) size += argument ? textSize(*argument) : 0;
  return 1 + size / textPerPlace;
}

/// What a D-Bus error reply says, or none when the reply is none.
std::optional<MethodFailure> errorOf(sd_bus_message *reply) {
  const sd_bus_error *error = sd_bus_message_get_error(reply);
  if (!error) return std::nullopt;
  return MethodFailure{std::string(textOrEmpty(error->name)), std::string(textOrEmpty(error->message))};
}

/// The error value of a message that did not get its answer.
SXError deliveryError(std::string_view method, const MethodFailure &failure) {
  const sd_bus_error error = borrowedError(failure.name.c_str(), failure.text.c_str());
  std::string description = "\"" + std::string(method) + "\" was not answered: " + failure.text;
  return SXError(std::string(posixErrorDomain), sd_bus_error_get_errno(&error),
                 {{"description", Value(std::move(description))}, {"busError", Value(failure.name)}});
}

void logRefusedReply(std::string_view method, const std::string &peer, const MethodFailure &failure) {
  sx_default_log().notice("[NOTICE] Refused the reply to \"%@\" from %@: %@", method, peer, failure.text);
}

class OperationWaiter : public Waiter {
 public:
  OperationWaiter(LinkInterface interface, std::size_t operation, std::string peer, ReplyHandler reply,
                  ConnectionErrorHandler errorHandler, std::size_t places)
      : Waiter(places),
        interface_(std::move(interface)),
        operation_(operation),
        peer_(std::move(peer)),
        reply_(std::move(reply)),
        errorHandler_(std::move(errorHandler)) {}

  Task answered(sd_bus_message *reply) override {
    if (std::optional<MethodFailure> error = errorOf(reply)) return failed(std::move(*error));
    const MethodDescription &method = interfaceOf(interface_.protocol()).methods[operation_];
    auto read = readArguments(reply, {interface_, row(), method.outSignature, true});
    if (Arguments *values = std::get_if<Arguments>(&read)) {
      return [handler = std::move(reply_), values = std::move(*values)]() mutable { handler(std::move(values)); };
    }
    MethodFailure refused = std::move(std::get<MethodFailure>(read));
    refused.text = "the answer cannot be read: " + refused.text;
    return [task = failed(refused), method = row().method, peer = peer_, refused] {
      logRefusedReply(method, peer, refused);
      if (task) task();
    };
  }

  Task failed(MethodFailure failure) override {
    if (!errorHandler_) return {};
    return [handler = std::move(errorHandler_), error = deliveryError(row().method, failure)] { handler(error); };
  }

 private:
  [[nodiscard]] const OperationDescription &row() const { return interface_.protocol().operations[operation_]; }

  const LinkInterface interface_;
  const std::size_t operation_;
  const std::string peer_;
  ReplyHandler reply_;
  ConnectionErrorHandler errorHandler_;
};

class MethodWaiter : public Waiter {
 public:
  MethodWaiter(const MethodDescription &method, std::string peer, MethodResultHandler handler)
      : Waiter(1), method_(method), peer_(std::move(peer)), handler_(std::move(handler)) {}

  Task answered(sd_bus_message *reply) override {
    if (std::optional<MethodFailure> error = errorOf(reply)) return failed(std::move(*error));
    auto read = readValues(reply, method_.out, method_.outSignature);
    // Values may hold descriptors, which a task cannot copy.
    auto values = std::make_shared<MethodResult>(MethodFailure{});
    std::visit([&values](auto &content) { *values = std::move(content); }, read);
    const auto *refused = std::get_if<MethodFailure>(values.get());
    return [handler = std::move(handler_), values, refused, name = method_.name, peer = peer_] {
      if (refused) logRefusedReply(name, peer, *refused);
      handler(std::move(*values));
    };
  }

  Task failed(MethodFailure failure) override {
    if (!handler_) return {};
    return [handler = std::move(handler_), failure = std::move(failure)] { handler(failure); };
  }

 private:
  const MethodDescription &method_;
  const std::string peer_;
  MethodResultHandler handler_;
};

}  // namespace

Task BusConnection::State::transmit(Outgoing &outgoing) {
  OwnedMessage message = std::move(outgoing.message);
  if (!loggedIn) {
    unsent.push_back({std::move(message), std::move(outgoing.waiter), outgoing.expectsReply});
    return {};
  }
  std::uint64_t cookie = 0;
  const int sent = sd_bus_send(bus.get(), message.get(), outgoing.expectsReply ? &cookie : nullptr);
  if (sent >= 0 && outgoing.expectsReply) {
    waiting.emplace(cookie, std::move(outgoing.waiter));
    return {};
  }
  placesTaken -= outgoing.waiter->places();
  if (sent >= 0) return {};
  std::string why = busError(sent, "send").message();
  if (sent == -ECONNRESET || sent == -ENOTCONN || sent == -EPIPE) {
    return outgoing.waiter->failed(disconnected(std::move(why)));
  }
  return outgoing.waiter->failed({std::string(busErrorName::limitsExceeded), std::move(why)});
}

/// Sends one call, which `append` fills with the mutex held.
void BusConnection::sendCall(const InterfaceDescription &interface, std::size_t method, const Append &append,
                             std::unique_ptr<Waiter> waiter, bool expectsReply) {
  Outgoing outgoing{nullptr, std::move(waiter), expectsReply};
  Task failed;
  std::function<void()> wantedChanged;
  {
    const std::lock_guard lock(state_->mutex);
    sd_bus_message *raw = nullptr;
    const int made =
        state_->ended ? 0
                      : sd_bus_message_new_method_call(
                            state_->bus.get(), &raw, nullptr, std::string(interface.objectPath).c_str(),
                            std::string(interface.name).c_str(), std::string(interface.methods[method].name).c_str());
    outgoing.message.reset(raw);
    std::optional<MethodFailure> refused;
    if (state_->ended) {
      refused = disconnected("the connection has ended");
    } else if (!state_->hasRoomFor(outgoing.waiter->places())) {
      refused = {std::string(busErrorName::limitsExceeded),
                 state_->options.peer + " has not answered " + std::to_string(state_->options.messagesWaitingAtMost) +
                     " messages yet; try again when it has, or end it if it hangs"};
    } else if (made < 0) {
      refused = {std::string(busErrorName::limitsExceeded), busError(made, "make a message").message()};
    } else {
      refused = append(raw);
    }
    if (refused) {
      failed = outgoing.waiter->failed(std::move(*refused));
    } else {
      state_->placesTaken += outgoing.waiter->places();
      failed = state_->transmit(outgoing);
    }
    outgoing.message.reset();
    if (!state_->ended && state_->unwritten() > 0) wantedChanged = state_->wantedChangedHandler;
  }
  if (wantedChanged) wantedChanged();
  state_->runLater(std::move(failed));
}

/// The object of a protocol at the other end.
struct BusConnection::Remote : RemoteObject {
  Remote(std::shared_ptr<BusConnection> to, LinkInterface linkInterface, ConnectionErrorHandler handler)
      : connection(std::move(to)), interface(std::move(linkInterface)), errorHandler(std::move(handler)) {}

  void send(std::size_t operation, Arguments arguments, ReplyHandler reply) override {
    const InterfaceDescription &description = interfaceOf(interface.protocol());
    if (operation >= description.methods.size()) {
      endProcessForProgrammingError("An operation was sent that its protocol does not have.");
    }
    const MessageRow row{interface, interface.protocol().operations[operation],
                         description.methods[operation].inSignature, false};
    const bool expectsReply = reply != nullptr;
    connection->sendCall(
        description, operation,
        [&row, &arguments](sd_bus_message *message) { return appendArguments(message, row, arguments); },
        std::make_unique<OperationWaiter>(interface, operation, connection->state_->options.peer, std::move(reply),
                                          errorHandler, placesFor(arguments)),
        expectsReply);
  }

  const std::shared_ptr<BusConnection> connection;
  const LinkInterface interface;
  const ConnectionErrorHandler errorHandler;
};

std::shared_ptr<RemoteObject> BusConnection::remoteObject(LinkInterface interface,
                                                          ConnectionErrorHandler errorHandler) {
  return std::make_shared<Remote>(shared_from_this(), std::move(interface), std::move(errorHandler));
}

void BusConnection::call(const InterfaceDescription &interface, std::size_t method, MethodValues values,
                         MethodResultHandler handler) {
  const MethodDescription &description = interface.methods[method];
  const bool expectsReply = handler != nullptr;
  sendCall(
      interface, method,
      [&description, &values](sd_bus_message *message) { return appendValues(message, description.in, values); },
      std::make_unique<MethodWaiter>(description, state_->options.peer, std::move(handler)), expectsReply);
}

void BusConnection::dispatchReply(Lock &lock, OwnedMessage message) {
  std::uint64_t cookie = 0;
  sd_bus_message_get_reply_cookie(message.get(), &cookie);
  const auto found = state_->waiting.find(cookie);
  if (found == state_->waiting.end()) return;
  std::unique_ptr<Waiter> waiter = std::move(found->second);
  state_->waiting.erase(found);
  state_->placesTaken -= waiter->places();
  Task task = waiter->answered(message.get());
  message.reset();
  lock.unlock();
  if (task) task();
  // What they hold may be the last of something that asks for this connection.
  task = nullptr;
  waiter.reset();
  lock.lock();
}

}  // namespace storix::wire
