#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/AuditToken.h"
#include "platform/Result.h"
#include "platform/Value.h"
#include "platform/linux/identity/Confinement.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

class ApplicationManifests;

/// The process at the other end of a connection, pinned by a pidfd so that its identifier cannot come
/// to mean another process. Who it is (bundle identifier, entitlements, confined or not) is settled
/// when the connection is accepted and never changes. Held by its connection. Thread-safe.
class Peer {
 public:
  [[nodiscard]] pid_t processIdentifier() const { return processIdentifier_; }
  [[nodiscard]] const AuditToken &auditToken() const { return auditToken_; }
  [[nodiscard]] bool isAlive() const;

  [[nodiscard]] const std::optional<std::string> &bundleIdentifier() const { return bundleIdentifier_; }
  [[nodiscard]] std::optional<Value> entitlement(std::string_view name) const;
  /// Whether something keeps the process from doing what the user may do. Also true when that could
  /// not be found out.
  [[nodiscard]] bool isConfined() const { return confined_; }

 private:
  friend class PeerTable;
  Peer() = default;

  UniqueFd pidfd_;
  pid_t processIdentifier_ = 0;
  AuditToken auditToken_;
  std::optional<std::string> bundleIdentifier_;
  Dictionary entitlements_;
  bool confined_ = true;
};

/// The peers of all open connections; turns an audit token back into its peer. Owned by the platform
/// object, made before it gives up or takes on any restriction; thread-safe.
class PeerTable {
 public:
  /// `user` is the only one whose processes are admitted.
  explicit PeerTable(std::shared_ptr<ApplicationManifests> manifests, uid_t user = ::geteuid());

  /// Who is at the other end of this connected unix socket: a peer of its own for each connection,
  /// known as long as somebody holds it. An error when it is another user's, or is gone already.
  Result<std::shared_ptr<Peer>> admit(int socket);

  /// Null for the all-zero token and for a peer all of whose connections have ended.
  [[nodiscard]] std::shared_ptr<Peer> find(const AuditToken &token) const;

 private:
  struct State;

  std::shared_ptr<ApplicationManifests> manifests_;
  uid_t user_;
  /// What the daemon itself may do, to measure its peers by.
  std::optional<ProcessRestrictions> own_;
  std::shared_ptr<State> state_;
};

}  // namespace storix::linuxhost
