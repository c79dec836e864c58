#include "platform/linux/sockets/PlatformSocket.h"

#include <optional>
#include <string>
#include <utility>
#include <variant>

#include "platform/Log.h"
#include "wire/Codec.h"
#include "wire/PlatformInterfaces.h"

namespace storix::linuxhost {

namespace {

using Reply = wire::BusConnection::Reply;
using wire::MethodValues;

template <class... Values>
void answer(const Reply &reply, Values... values) {
  MethodValues answered;
  (answered.emplace_back(std::move(values)), ...);
  reply.send(std::move(answered));
}

std::string_view errorName(CoordinationFailure::Kind kind) {
  switch (kind) {
    case CoordinationFailure::Kind::noSuchClaim:
      return wire::platformError::noSuchClaim;
    case CoordinationFailure::Kind::busy:
      return wire::platformError::busy;
    case CoordinationFailure::Kind::unavailable:
      break;
  }
  return wire::platformError::unavailable;
}

std::string_view errorName(SandboxFailure::Kind kind) {
  switch (kind) {
    case SandboxFailure::Kind::invalidToken:
      return wire::platformError::invalidToken;
    case SandboxFailure::Kind::notAFile:
      return wire::platformError::notAFile;
    case SandboxFailure::Kind::noProof:
      return wire::platformError::noProof;
    case SandboxFailure::Kind::limitExceeded:
      return wire::busErrorName::limitsExceeded;
    case SandboxFailure::Kind::unavailable:
      break;
  }
  return wire::platformError::unavailable;
}

/// What one connection has claimed and proved, and its requests. The handlers of the connection own it,
/// and are let go of when the connection ends.
class PlatformConnection : public std::enable_shared_from_this<PlatformConnection> {
 public:
  PlatformConnection(const PlatformFacilities &facilities, std::shared_ptr<const Peer> peer)
      : facilities_(facilities),
        peer_(std::move(peer)),
        claims_(facilities.fileCoordination.claimsOf(peer_)),
        proofs_(facilities.sandbox.proofsOf(peer_)) {}

  void exportOn(wire::BusConnection &bus) {
    bus.exportMethods(wire::fileCoordinationInterface(),
                      {handler(&PlatformConnection::beginRead), handler(&PlatformConnection::endRead),
                       handler(&PlatformConnection::beginWrite), handler(&PlatformConnection::endWrite)});
    bus.exportMethods(wire::sandboxInterface(),
                      {handler(&PlatformConnection::consume), handler(&PlatformConnection::proveWriteAccess)});
    bus.exportMethods(wire::notificationsInterface(), {handler(&PlatformConnection::post)});
  }

 private:
  using Method = void (PlatformConnection::*)(MethodValues, const Reply &);

  wire::BusConnection::MethodHandler handler(Method method) {
    return [self = shared_from_this(), method](MethodValues values, const Reply &reply) {
      ((*self).*method)(std::move(values), reply);
    };
  }

  void refuse(const Reply &reply, std::string_view method, std::string_view error, const std::string &text) const {
    sx_default_log().notice("[NOTICE] Refused \"%@\" of pid %d: %@ (%@)", method, peer_->processIdentifier(), text,
                            error);
    reply.fail(error, text);
  }

  template <class Failure>
  void answerNothing(const Reply &reply, std::string_view method, const std::optional<Failure> &failure) const {
    if (failure) {
      refuse(reply, method, errorName(failure->kind), failure->text);
    } else {
      answer(reply);
    }
  }

  /// The URL of a request, or none once it was refused.
  [[nodiscard]] std::optional<URL> urlOf(const MethodValues &values, std::string_view method,
                                         const Reply &reply) const {
    std::string reason;
    std::optional<URL> url = URL::fromString(std::get<std::string>(values[0]), &reason);
    if (!url) refuse(reply, method, wire::busErrorName::invalidArgs, "the argument \"URL\": " + reason);
    return url;
  }

  [[nodiscard]] ClaimHandler answering(const Reply &reply, std::string_view method) {
    return [weak = weak_from_this(), reply, method](ClaimOutcome outcome) {
      const auto self = weak.lock();
      if (!self) return;
      if (const auto *claim = std::get_if<ClaimIdentifier>(&outcome)) {
        answer(reply, std::optional<SXError>(), std::optional<std::uint64_t>(*claim));
      } else if (auto *error = std::get_if<SXError>(&outcome)) {
        answer(reply, std::optional<SXError>(std::move(*error)), std::optional<std::uint64_t>());
      } else {
        const auto &failure = std::get<CoordinationFailure>(outcome);
        self->refuse(reply, method, errorName(failure.kind), failure.text);
      }
    };
  }

  void beginRead(MethodValues values, const Reply &reply) {
    const std::optional<URL> url = urlOf(values, "BeginRead", reply);
    if (!url) return;
    claims_->beginRead(*url, std::move(std::get<std::optional<std::string>>(values[1])), answering(reply, "BeginRead"));
  }
  void beginWrite(MethodValues values, const Reply &reply) {
    const std::optional<URL> url = urlOf(values, "BeginWrite", reply);
    if (!url) return;
    claims_->beginWrite(*url, std::move(std::get<std::optional<std::string>>(values[1])),
                        answering(reply, "BeginWrite"));
  }
  void endRead(MethodValues values, const Reply &reply) {
    answerNothing(reply, "EndRead", claims_->endRead(std::get<std::uint64_t>(values[0])));
  }
  void endWrite(MethodValues values, const Reply &reply) {
    answerNothing(reply, "EndWrite", claims_->endWrite(std::get<std::uint64_t>(values[0])));
  }

  void consume(MethodValues values, const Reply &reply) {
    auto opened = facilities_.sandbox.consume(std::get<Data>(values[0]).bytes);
    if (auto *fd = std::get_if<UniqueFd>(&opened)) {
      answer(reply, std::move(*fd));
    } else {
      const auto &failure = std::get<SandboxFailure>(opened);
      refuse(reply, "Consume", errorName(failure.kind), failure.text);
    }
  }
  void proveWriteAccess(MethodValues values, const Reply &reply) {
    answerNothing(reply, "ProveWriteAccess", proofs_->proveWriteAccess(std::move(std::get<UniqueFd>(values[0]))));
  }

  void post(MethodValues values, const Reply &reply) {
    if (peer_->isConfined()) {
      refuse(reply, "Post", wire::busErrorName::accessDenied, "a confined process posts no notifications");
      return;
    }
    facilities_.notifications.post(std::get<std::string>(values[0]));
    answer(reply);
  }

  const PlatformFacilities facilities_;
  const std::shared_ptr<const Peer> peer_;
  const std::unique_ptr<FileClaims> claims_;
  const std::unique_ptr<WriteProofs> proofs_;
};

}  // namespace

void servePlatformSocket(NamedSocket &socket, const PlatformFacilities &facilities) {
  socket.serve([facilities](const std::shared_ptr<ServedConnection> &connection) {
    std::make_shared<PlatformConnection>(facilities, connection->peer())->exportOn(connection->bus());
    connection->start();
  });
}

}  // namespace storix::linuxhost
