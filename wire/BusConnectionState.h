#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "wire/BusConnection.h"
#include "wire/BusTarget.h"
#include "wire/Codec.h"
#include "wire/Framing.h"
#include "wire/SdBus.h"

namespace storix::wire {

inline std::string_view textOrEmpty(const char *text) { return text ? std::string_view(text) : std::string_view(); }

/// Waits for the answer to one message. One of the two functions is called, once; the task that it
/// gives runs without the connection's mutex.
class Waiter {
 public:
  explicit Waiter(std::size_t places) : places_(places) {}
  virtual ~Waiter() = default;
  /// How many of the places for messages that wait the message takes.
  [[nodiscard]] std::size_t places() const { return places_; }
  /// With the connection's mutex held.
  virtual Task answered(sd_bus_message *reply) = 0;
  virtual Task failed(MethodFailure failure) = 0;

 private:
  const std::size_t places_;
};

struct Outgoing {
  OwnedMessage message;
  std::unique_ptr<Waiter> waiter;
  bool expectsReply = false;  ///< Without, the waiter hears only that the message could not be sent.
};

/// How the messages of an exported interface are read and written. Unchanging; a request keeps its share
/// until it has been answered.
struct ExportedInterface {
  const InterfaceDescription &description;
  std::optional<LinkInterface> link;  ///< Of a protocol.

  [[nodiscard]] MessageRow row(std::size_t method, bool ofReply) const {
    const MethodDescription &described = description.methods[method];
    return {*link, link->protocol().operations[method], ofReply ? described.outSignature : described.inSignature,
            ofReply};
  }
};

/// One interface on one object of this end, and who answers. Does not change once the connection runs,
/// and is gone when it has ended, whatever has not been answered then.
struct BusExport {
  std::shared_ptr<const ExportedInterface> interface;
  std::shared_ptr<ExportedObject> object;              ///< Of a protocol.
  std::vector<BusConnection::MethodHandler> handlers;  ///< Of an interface that is described by hand.
};

struct BusMethod {
  std::shared_ptr<const BusExport> exported;
  std::size_t index;
};

/// What the mutex guards, all of it but the options.
struct BusConnection::State {
  Options options;

  std::mutex mutex;
  OwnedBus bus;
  std::unique_ptr<Framing> framing;
  bool begun = false;
  bool loggedIn = false;
  bool ended = false;
  std::vector<std::shared_ptr<const BusExport>> exports;
  std::function<void()> readyHandler;
  ClosedHandler closedHandler;
  std::function<void()> wantedChangedHandler;

  // Messages to the peer: those that wait for the login, and by cookie those that wait for an answer.
  std::deque<Outgoing> unsent;
  std::map<std::uint64_t, std::unique_ptr<Waiter>> waiting;
  std::size_t placesTaken = 0;  ///< By all of these.

  // Requests of the peer.
  std::size_t requestsInFlight = 0;
  /// Those that sd-bus has read beside the writing that was asked of it: one at most whenever the socket
  /// takes a part of a message.
  std::deque<OwnedMessage> held;

  /// An answer that has not been written is in flight too, so that a peer that reads none cannot have them
  /// made for ever.
  [[nodiscard]] bool isFull() const { return requestsInFlight + unwritten() >= options.requestsInFlightAtMost; }

  [[nodiscard]] std::size_t unwritten() const {
    std::uint64_t count = 0;
    return sd_bus_get_n_queued_write(bus.get(), &count) >= 0 ? static_cast<std::size_t>(count) : 0;
  }

  /// A message that wants no answer waits too, where the socket is full.
  [[nodiscard]] bool hasRoomFor(std::size_t places) const {
    return placesTaken + places <= options.messagesWaitingAtMost && unwritten() < options.messagesWaitingAtMost;
  }

  void runLater(Task task) const {
    if (!task) return;
    if (options.runLater) {
      options.runLater(std::move(task));
    } else {
      task();
    }
  }

  /// Sends the message, which has its places, or keeps it until the login has ended. Gives what is to be run without
  /// the mutex when it could not be sent. A waiter that has nothing more to wait for is left behind, and goes without
  /// the mutex too.
  [[nodiscard]] Task transmit(Outgoing &outgoing);

  [[nodiscard]] bool answerByItself(sd_bus_message *request, const BusTarget &target) const;
  [[nodiscard]] std::variant<BusMethod, MethodFailure> find(const BusTarget &target) const;
  /// Whether that is a method of ours which takes one file descriptor.
  [[nodiscard]] bool takesDescriptor(const BusTarget &target, std::string_view signature) const;

  /// Answers a request with a D-Bus error, if it expects an answer.
  static void replyFailure(sd_bus_message *request, const MethodFailure &failure) {
    const std::string text = busText(failure.text);
    const sd_bus_error error = borrowedError(failure.name.c_str(), text.c_str());
    sd_bus_reply_method_error(request, &error);
  }
};

inline MethodFailure disconnected(std::string text) {
  return {std::string(busErrorName::disconnected), std::move(text)};
}

}  // namespace storix::wire
