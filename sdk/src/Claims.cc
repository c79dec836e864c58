#include "sdk/src/Claims.h"

#include <algorithm>
#include <utility>
#include <variant>

#include "sdk/src/ClientErrors.h"
#include "sdk/src/ServiceSocket.h"
#include "storix/FileCoordinator.h"
#include "wire/Codec.h"
#include "wire/PlatformInterfaces.h"

namespace storix::sdk {

namespace {

/// How many connections without claims are kept for the next.
constexpr std::size_t idleConnections = 4;

std::size_t methodToEnd(Claim::Kind kind) {
  return kind == Claim::Kind::read ? wire::endReadMethod : wire::endWriteMethod;
}

}  // namespace

SXError claimLostError() {
  return clientError(ClientErrorCode::connectionLost,
                     "The connection to the document broker ended, and the claim on the file with it.");
}

void Claims::begin(Claim::Kind kind, const URL &file, ClaimOptions options, BeginHandler handler) {
  // A thread that has ended belongs to an owner that is gone, and nobody asks one.
  (void)thread_->post(
      [self = shared_from_this(), kind, file, options = std::move(options), handler = std::move(handler)] {
        std::optional<Deadline::Clock::time_point> deadline;
        if (options.deadline) deadline = options.deadline->time();
        const auto pending = std::make_shared<Pending<Result<FileClaim>>>(self->thread_->loop(), deadline, handler);
        pending->start(options.cancellation);
        const auto ask = [self, kind, file, identifier = options.identifier, pending] {
          if (!pending->isFinished()) self->ask(std::make_shared<Claim>(self, kind), file, identifier, pending);
        };
        if (self->start_ && !pending->isFinished()) return self->start_->then(ask);
        ask();
      });
}

void Claims::ask(const std::shared_ptr<Claim> &claim, const URL &file, std::optional<std::string> identifier,
                 const PendingClaim &pending) {
  auto found = connectionForNext();
  if (!found) return pending->finish(found.error());
  const ConnectionPointer connection = found.value();
  connection->claims.insert(claim);
  claim->connection = connection;
  pending->setGivenUpHandler([self = shared_from_this(), claim] { self->giveUp(claim); });
  wire::MethodValues values;
  values.emplace_back(file.absoluteString());
  values.emplace_back(std::move(identifier));
  const auto method = claim->kind() == Claim::Kind::read ? wire::beginReadMethod : wire::beginWriteMethod;
  connection->bus->call(wire::fileCoordinationInterface(), method, std::move(values),
                        [self = shared_from_this(), claim, pending](wire::MethodResult result) {
                          self->answered(claim, pending, std::move(result));
                        });
}

Result<Claims::ConnectionPointer> Claims::connectionForNext() {
  const auto fewest =
      std::min_element(connections_.begin(), connections_.end(),
                       [](const auto &one, const auto &other) { return one->claims.size() < other->claims.size(); });
  const bool isIdle = fewest != connections_.end() && (*fewest)->claims.empty();
  if (!isIdle && connections_.size() < FileCoordinator::connectionsAtMost) {
    auto connected = connect();
    // Where no more can be had, for want of descriptors for instance, those that are there will do.
    if (connected || fewest == connections_.end()) return connected;
  }
  if ((*fewest)->claims.size() >= FileCoordinator::claimsAtMost / FileCoordinator::connectionsAtMost) {
    return clientError(ClientErrorCode::tooManyClaims, "This process has " +
                                                           std::to_string(FileCoordinator::claimsAtMost) +
                                                           " claims on files already; end some of them first.");
  }
  return *fewest;
}

Result<Claims::ConnectionPointer> Claims::connect() {
  const auto connection = std::make_shared<ClaimConnection>();
  auto opened =
      connectTo(thread_->loop(), options_.runtimeDirectory, "com.tessel.Platform", BusLoop::Descriptors::refused,
                [weak = weak_from_this(), added = std::weak_ptr(connection)](wire::BusConnection &bus) {
                  bus.setClosedHandler([weak, added](const SXError &) {
                    const auto self = weak.lock();
                    const auto closed = added.lock();
                    if (self && closed) self->lose(closed);
                  });
                });
  if (!opened) return opened.error();
  connection->bus = opened.value();
  connections_.push_back(connection);
  return connection;
}

void Claims::answered(const std::shared_ptr<Claim> &claim, const PendingClaim &pending, wire::MethodResult result) {
  auto *values = std::get_if<wire::MethodValues>(&result);
  const auto *number = values ? std::get_if<std::optional<std::uint64_t>>(&values->at(1)) : nullptr;
  if (number && *number) {
    claim->number = **number;
    if (claim->state == Claim::State::givenUp) return endNow(claim, {});
    claim->state = Claim::State::held;
    return pending->finish(Claim::makeScope(claim));
  }
  release(claim);
  if (!values) return pending->finish(clientErrorOf(std::get<wire::MethodFailure>(result)));
  auto *error = std::get_if<std::optional<SXError>>(&values->at(0));
  if (error && *error) return pending->finish(std::move(**error));
  pending->finish(incompleteAnswer("The answer holds no claim."));
}

void Claims::giveUp(const std::shared_ptr<Claim> &claim) {
  claim->state = Claim::State::givenUp;
  const ConnectionPointer connection = claim->connection.lock();
  if (!connection) return;
  ++connection->givenUp;
  if (connection->givenUp == connection->claims.size()) drop(connection);
}

bool Claims::end(std::shared_ptr<Claim> claim, EndHandler handler) {
  return thread_->post([self = shared_from_this(), claim = std::move(claim), handler = std::move(handler)] {
    self->endNow(claim, handler);
  });
}

void Claims::endNow(const std::shared_ptr<Claim> &claim, EndHandler handler) {
  const auto pending =
      thread_->begin<std::optional<SXError>>(std::move(handler), BusLoop::Clock::now() + options_.timeout);
  const ConnectionPointer connection = claim->connection.lock();
  if (!connection || claim->state == Claim::State::lost) return pending->finish(claimLostError());
  wire::MethodValues values;
  values.emplace_back(claim->number);
  connection->bus->call(wire::fileCoordinationInterface(), methodToEnd(claim->kind()), std::move(values),
                        [self = shared_from_this(), claim, pending](const wire::MethodResult &result) {
                          const auto *failure = std::get_if<wire::MethodFailure>(&result);
                          if (failure && failure->name == wire::busErrorName::disconnected) {
                            // All of its claims are lost, this one among them.
                            if (const auto closed = claim->connection.lock()) self->lose(closed);
                            return pending->finish(claimLostError());
                          }
                          if (claim->state == Claim::State::ending) claim->state = Claim::State::ended;
                          self->release(claim);
                          if (failure) return pending->finish(clientErrorOf(*failure));
                          pending->finish(std::nullopt);
                        });
}

/// The claim is over; its connection goes too when no other claim on it is wanted.
void Claims::release(const std::shared_ptr<Claim> &claim) {
  const ConnectionPointer connection = claim->connection.lock();
  claim->connection.reset();
  if (!connection || connection->claims.erase(claim) == 0) return;
  if (claim->state == Claim::State::givenUp) --connection->givenUp;
  const auto isIdle = [](const ConnectionPointer &one) { return one->claims.empty(); };
  const bool enough = isIdle(connection) &&
                      std::count_if(connections_.begin(), connections_.end(), isIdle) > std::ptrdiff_t{idleConnections};
  const bool unwanted = connection->givenUp > 0 && connection->givenUp == connection->claims.size();
  if (enough || unwanted) drop(connection);
}

/// The daemon has ended it. A message that cannot be sent may tell before the connection itself does.
void Claims::lose(const ConnectionPointer &connection) {
  if (start_) start_->forget();
  drop(connection);
}

void Claims::drop(const ConnectionPointer &connection) {
  std::erase(connections_, connection);
  for (const auto &claim : std::exchange(connection->claims, {})) {
    claim->connection.reset();
    if (claim->state == Claim::State::held || claim->state == Claim::State::ending) claim->state = Claim::State::lost;
  }
  connection->bus->close();
}

}  // namespace storix::sdk
