// What comes in on a connection and is answered: the objects that it exports, and their replies.
#include <algorithm>
#include <atomic>
#include <cstdint>
#include <utility>

#include "platform/Log.h"
#include "wire/BusConnectionState.h"
#include "wire/Introspection.h"

namespace storix::wire {

namespace {

constexpr std::string_view busPath = "/org/freedesktop/DBus";
constexpr std::string_view busInterface = "org.freedesktop.DBus";
constexpr std::string_view introspectableInterface = "org.freedesktop.DBus.Introspectable";

/// What a tool that greets a bus first is called here.
std::string nextGreetedName() {
  static std::atomic<std::uint64_t> count = 0;
  return ":1." + std::to_string(++count);
}

}  // namespace

/// A request that was handed over and expects a reply.
struct BusConnection::Request {
  Request(std::shared_ptr<BusConnection> from, std::shared_ptr<const ExportedInterface> to, std::size_t methodIndex,
          OwnedMessage request)
      : connection(std::move(from)), interface(std::move(to)), method(methodIndex), message(std::move(request)) {}
  ~Request() { finish({}); }

  /// Sends the reply that `append` fills, the first time, or the D-Bus error that `append` gives instead. Nothing is
  /// sent when `append` is empty.
  void finish(const Append &append);

  void finishWithValues(const Append &append) {
    finish([this, &append](sd_bus_message *reply) {
      std::optional<MethodFailure> withheld = append(reply);
      if (withheld) {
        sx_default_log().notice("[NOTICE] Withheld the reply to \"%@\" of %@: %@",
                                interface->description.methods[method].name, connection->state_->options.peer,
                                withheld->text);
      }
      return withheld;
    });
  }

  const std::shared_ptr<BusConnection> connection;
  const std::shared_ptr<const ExportedInterface> interface;
  const std::size_t method;
  /// Guarded by the connection's mutex; null once the request has ended.
  OwnedMessage message;
};

void BusConnection::Request::finish(const Append &append) {
  State &state = *connection->state_;
  std::function<void()> wantedChanged;
  {
    const std::lock_guard lock(state.mutex);
    if (!message) return;
    const bool wasFull = state.isFull();
    --state.requestsInFlight;
    if (append && !state.ended) {
      sd_bus_message *raw = nullptr;
      const int made = sd_bus_message_new_method_return(message.get(), &raw);
      const OwnedMessage reply(raw);
      if (made >= 0) {
        if (const std::optional<MethodFailure> failure = append(raw)) {
          State::replyFailure(message.get(), *failure);
        } else {
          // A connection that breaks here is found out by `process`.
          sd_bus_send(state.bus.get(), raw, nullptr);
        }
      }
    }
    message.reset();
    if (!state.ended && (wasFull || state.unwritten() > 0)) wantedChanged = state.wantedChangedHandler;
  }
  if (wantedChanged) wantedChanged();
}

void BusConnection::Reply::send(MethodValues values) const {
  if (!request_) return;
  const auto &types = request_->interface->description.methods[request_->method].out;
  request_->finishWithValues([&types, &values](sd_bus_message *reply) { return appendValues(reply, types, values); });
}

void BusConnection::Reply::fail(std::string_view errorName, std::string_view text) const {
  if (!request_) return;
  const MethodFailure failure{std::string(errorName), std::string(text)};
  request_->finish([&failure](sd_bus_message *) { return std::optional(failure); });
}

void BusConnection::exportObject(LinkInterface interface, std::shared_ptr<ExportedObject> object) {
  const InterfaceDescription &description = interfaceOf(interface.protocol());
  auto exported = std::make_shared<const ExportedInterface>(ExportedInterface{description, std::move(interface)});
  const std::lock_guard lock(state_->mutex);
  state_->exports.push_back(std::make_shared<const BusExport>(BusExport{std::move(exported), std::move(object), {}}));
}

void BusConnection::exportMethods(const InterfaceDescription &interface, std::vector<MethodHandler> handlers) {
  if (handlers.size() != interface.methods.size()) {
    endProcessForProgrammingError("An interface is exported without a handler for each of its methods.");
  }
  auto exported = std::make_shared<const ExportedInterface>(ExportedInterface{interface, std::nullopt});
  const std::lock_guard lock(state_->mutex);
  state_->exports.push_back(
      std::make_shared<const BusExport>(BusExport{std::move(exported), nullptr, std::move(handlers)}));
}

/// What every object has, and the greeting of bus tools. True when the request was one of these.
bool BusConnection::State::answerByItself(sd_bus_message *request, const BusTarget &target) const {
  if (target.path == busPath && target.names(busInterface, "Hello")) {
    sd_bus_reply_method_return(request, "s", nextGreetedName().c_str());
    return true;
  }
  if (!target.names(introspectableInterface, "Introspect")) return false;
  std::vector<std::string_view> paths;
  std::vector<const InterfaceDescription *> interfaces;
  for (const auto &candidate : exports) {
    paths.push_back(candidate->interface->description.objectPath);
    if (candidate->interface->description.objectPath == target.path)
      interfaces.push_back(&candidate->interface->description);
  }
  const std::vector<std::string> children = childrenOf(target.path, paths);
  if (interfaces.empty() && children.empty() && target.path != "/") return false;
  sd_bus_reply_method_return(request, "s", introspectionXML(interfaces, children).c_str());
  return true;
}

/// Which of the exports has the method, and its position there; else the D-Bus error that says what is
/// missing.
std::variant<BusMethod, MethodFailure> BusConnection::State::find(const BusTarget &target) const {
  bool objectFound = target.path == "/";
  bool interfaceFound = target.interface.empty() || target.interface == introspectableInterface;
  for (const auto &candidate : exports) {
    const InterfaceDescription &interface = candidate->interface->description;
    if (interface.objectPath != target.path) continue;
    objectFound = true;
    if (!target.interface.empty() && interface.name != target.interface) continue;
    interfaceFound = true;
    if (const std::optional<std::size_t> method = interface.indexOf(target.member)) {
      return BusMethod{candidate, *method};
    }
  }
  if (!objectFound) {
    return MethodFailure{SD_BUS_ERROR_UNKNOWN_OBJECT, "there is no object \"" + std::string(target.path) + "\""};
  }
  if (!interfaceFound) {
    return MethodFailure{SD_BUS_ERROR_UNKNOWN_INTERFACE, "\"" + std::string(target.path) + "\" has no interface \"" +
                                                             std::string(target.interface) + "\""};
  }
  return MethodFailure{SD_BUS_ERROR_UNKNOWN_METHOD, "there is no method \"" + std::string(target.member) + "\""};
}

bool BusConnection::State::takesDescriptor(const BusTarget &target, std::string_view signature) const {
  const auto found = find(target);
  const BusMethod *method = std::get_if<BusMethod>(&found);
  if (!method) return false;
  const std::string &taken = method->exported->interface->description.methods[method->index].inSignature;
  return taken == signature && std::ranges::count(taken, 'h') == 1;
}

void BusConnection::refuse(OwnedMessage message, const MethodFailure &failure) const {
  sx_default_log().notice("[NOTICE] Refused \"%@\" of %@: %@ (%@)",
                          textOrEmpty(sd_bus_message_get_member(message.get())), state_->options.peer, failure.text,
                          failure.name);
  State::replyFailure(message.get(), failure);
}

void BusConnection::dispatchRequest(Lock &lock, OwnedMessage message) {
  sd_bus_message *const raw = message.get();
  const BusTarget target{textOrEmpty(sd_bus_message_get_path(raw)), textOrEmpty(sd_bus_message_get_interface(raw)),
                         textOrEmpty(sd_bus_message_get_member(raw))};
  auto found = state_->find(target);
  if (const MethodFailure *missing = std::get_if<MethodFailure>(&found)) {
    if (!state_->answerByItself(raw, target)) refuse(std::move(message), *missing);
    return;
  }
  BusMethod &method = std::get<BusMethod>(found);
  if (method.exported->object) {
    auto read = readArguments(raw, method.exported->interface->row(method.index, false));
    if (const MethodFailure *wrong = std::get_if<MethodFailure>(&read)) {
      return refuse(std::move(message), *wrong);
    }
    handOver(lock, std::move(message), std::move(method), std::move(std::get<Arguments>(read)));
  } else {
    const MethodDescription &description = method.exported->interface->description.methods[method.index];
    auto read = readValues(raw, description.in, description.inSignature);
    if (const MethodFailure *wrong = std::get_if<MethodFailure>(&read)) {
      return refuse(std::move(message), *wrong);
    }
    handOver(lock, std::move(message), std::move(method), std::move(std::get<MethodValues>(read)));
  }
}

/// Runs the request without the mutex. All that it was made of is gone before the mutex is taken again,
/// since the last owner of something that asks for this connection may be among it.
void BusConnection::handOver(Lock &lock, OwnedMessage message, BusMethod method,
                             std::variant<Arguments, MethodValues> content) {
  std::shared_ptr<Request> request;
  if (sd_bus_message_get_expect_reply(message.get()) > 0) {
    ++state_->requestsInFlight;
    request =
        std::make_shared<Request>(shared_from_this(), method.exported->interface, method.index, std::move(message));
  }
  message.reset();
  lock.unlock();
  if (MethodValues *values = std::get_if<MethodValues>(&content)) {
    method.exported->handlers[method.index](std::move(*values), Reply(std::move(request)));
  } else {
    ReplyHandler reply;
    if (request) {
      reply = [request = std::move(request)](const Arguments &answer) {
        request->finishWithValues([&request, &answer](sd_bus_message *filled) {
          return appendArguments(filled, request->interface->row(request->method, true), answer);
        });
      };
    }
    method.exported->object->invoke(method.index, std::move(std::get<Arguments>(content)), std::move(reply));
  }
  method.exported.reset();
  lock.lock();
}

}  // namespace storix::wire
