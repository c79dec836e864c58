#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/Result.h"
#include "platform/URL.h"
#include "sdk/src/DaemonStart.h"
#include "sdk/src/Pending.h"
#include "sdk/src/RequestThread.h"
#include "storix/ClientOptions.h"
#include "storix/FileClaim.h"

namespace storix::sdk {

class Claims;

/// The error of a claim whose connection has ended.
SXError claimLostError();

/// One of the connections that claims are made on, and the claims that it has: waiting, held, given up,
/// and those whose end has not been answered. Used on the request thread.
struct ClaimConnection {
  std::shared_ptr<wire::BusConnection> bus;
  std::set<std::shared_ptr<Claim>> claims;
  std::size_t givenUp = 0;
};

/// One claim. A `FileClaim` holds it, and so does its connection until it has ended.
class Claim {
 public:
  enum class Kind { read, write };
  enum class State { waiting, givenUp, held, ending, ended, lost };

  Claim(std::shared_ptr<Claims> claims, Kind kind) : claims_(std::move(claims)), kind_(kind) {}

  [[nodiscard]] const std::shared_ptr<Claims> &claims() const { return claims_; }
  [[nodiscard]] Kind kind() const { return kind_; }
  /// Of a claim that is held its holder says that it ends, and the request thread that it is lost.
  std::atomic<State> state = State::waiting;

  // Used on the request thread.
  std::uint64_t number = 0;
  std::weak_ptr<ClaimConnection> connection;

  static FileClaim makeScope(std::shared_ptr<Claim> claim) { return FileClaim(std::move(claim)); }

 private:
  const std::shared_ptr<Claims> claims_;
  const Kind kind_;
};

/// Makes claims on files, on connections of its own that a request thread drives. Owned by a client or
/// a file coordinator, and by the claims. `begin` and `end` may be called on any thread; handlers run on
/// the request thread, once, and never inside the call.
class Claims : public std::enable_shared_from_this<Claims> {
 public:
  using BeginHandler = std::function<void(Result<FileClaim>)>;
  using EndHandler = std::function<void(std::optional<SXError>)>;

  /// With a `start` nothing is asked of a daemon that has not found its providers yet.
  Claims(std::shared_ptr<RequestThread> thread, ClientOptions options, std::shared_ptr<DaemonStart> start = nullptr)
      : thread_(std::move(thread)), options_(std::move(options)), start_(std::move(start)) {}

  void begin(Claim::Kind kind, const URL &file, ClaimOptions options, BeginHandler handler);

  /// Ends a claim whose state is `ending`. False when there is no thread any more to do it: it is lost.
  [[nodiscard]] bool end(std::shared_ptr<Claim> claim, EndHandler handler);

  [[nodiscard]] const RequestThread &thread() const { return *thread_; }

 private:
  using ConnectionPointer = std::shared_ptr<ClaimConnection>;
  using PendingClaim = PendingPointer<Result<FileClaim>>;

  // On the request thread:
  void ask(const std::shared_ptr<Claim> &claim, const URL &file, std::optional<std::string> identifier,
           const PendingClaim &pending);
  Result<ConnectionPointer> connectionForNext();
  Result<ConnectionPointer> connect();
  void answered(const std::shared_ptr<Claim> &claim, const PendingClaim &pending, wire::MethodResult result);
  void giveUp(const std::shared_ptr<Claim> &claim);
  void endNow(const std::shared_ptr<Claim> &claim, EndHandler handler);
  void release(const std::shared_ptr<Claim> &claim);
  void lose(const ConnectionPointer &connection);
  void drop(const ConnectionPointer &connection);

  const std::shared_ptr<RequestThread> thread_;
  const ClientOptions options_;
  const std::shared_ptr<DaemonStart> start_;
  std::vector<ConnectionPointer> connections_;
};

}  // namespace storix::sdk
