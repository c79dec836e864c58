#pragma once

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/AuditToken.h"
#include "platform/Result.h"
#include "platform/Value.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {

class ApplicationManifests;

/// The process at the other end of a connection, pinned by a pidfd so that its identifier cannot come
/// to mean another process. Who it is (bundle identifier, entitlements, confined or not) is settled
/// when the connection is accepted and never changes. Thread-safe.
class Peer {
 public:
  ~Peer();

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

/// The peers of all open connections; turns an audit token back into its peer. Thread-safe.
class PeerTable {
 public:
  explicit PeerTable(std::shared_ptr<ApplicationManifests> manifests);

  /// Who is at the other end of this connected unix socket. An error when it is not the daemon's own
  /// user, or is gone already.
  Result<std::shared_ptr<Peer>> admit(int socket);

  /// Null for the all-zero token and for a peer all of whose connections have ended.
  [[nodiscard]] std::shared_ptr<Peer> find(const AuditToken &token) const;

 private:
  std::shared_ptr<ApplicationManifests> manifests_;
  mutable std::mutex mutex_;
  std::uint64_t nextSerial_ = 1;
  std::map<std::uint64_t, std::weak_ptr<Peer>> peers_;
};

}  // namespace storix::linuxhost
